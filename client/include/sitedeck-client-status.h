// The statuses of the site-deck protocol, one enumeration shared by the
// service (which sends them) and its clients (which receive them), and the
// codes only the client library gives, for failures that happen before the
// service can say anything. Words for each, for programs that show a status
// to a person. Plain data and two lookups; nothing here blocks or allocates.
#pragma once

#ifndef SDS_CLIENT_API
#define SDS_CLIENT_API __attribute__((visibility("default")))
#endif

// The statuses the service sends (docs/protocol.md). The numbers are part of
// the wire protocol: never renumber them. 9, 10, 11 and 13 are not used.
enum sds_error_e : int {
  SDS_ERROR_NONE = 0,
  SDS_ERROR_IO_ERROR = 1,
  SDS_ERROR_SHM_FAILED = 2,
  SDS_ERROR_IO_EAGAIN = 3,
  SDS_ERROR_IO_EINTR = 4,
  SDS_ERROR_INVALID_PARAMETER = 5,
  SDS_ERROR_NO_DATA = 6,
  SDS_ERROR_OUT_OF_MEMORY = 7,
  SDS_ERROR_ID_NOT_FOUND = 8,
  SDS_ERROR_DISK_BUSY = 12,
  SDS_ERROR_NO_SPACE = 14,
  SDS_ERROR_DB_OPEN_FAILED = 15,
  SDS_ERROR_HTTP_OK = 16,
  SDS_ERROR_HTTP_NOT_MODIFIED = 17,
  SDS_ERROR_SERVER_REQUEST_FAILED = 18,
  SDS_ERROR_HTTP_MOVED_PERMANENTLY = 19,
  SDS_ERROR_HTTP_FOUND = 20,
  SDS_ERROR_DATA_PULL_FAILED = 21,
};

// Why sds_client_connect could not set up a connection. The service never
// sends these: they start at 100, far from its statuses. The errno behind
// each is kept in the connection (SdsConnection::error_number).
enum sds_client_error_e : int {
  SDS_CLIENT_ERROR_NO_SOCKET = 100,          // no socket file at the path (ENOENT, ENOTDIR)
  SDS_CLIENT_ERROR_NOT_LISTENING = 101,      // a socket file nobody listens on (ECONNREFUSED)
  SDS_CLIENT_ERROR_PERMISSION_DENIED = 102,  // the socket or its directory is closed to us
  SDS_CLIENT_ERROR_BUSY = 103,         // connected, but no greeting: another connection is served
  SDS_CLIENT_ERROR_TIMED_OUT = 104,    // connect() or a started greeting did not finish in time
  SDS_CLIENT_ERROR_CLOSED_BEFORE_GREETING = 105,  // the service ended the connection at once
  SDS_CLIENT_ERROR_CONNECT_FAILED = 106,          // any other reason; see the errno
};

// "SDS_ERROR_SHM_FAILED" for 2, "SDS_CLIENT_ERROR_BUSY" for 103 and so on;
// "SDS_ERROR_UNKNOWN" for a number nobody uses. Constant text, never null.
// (The service's own log names some statuses SDS_ERROR_UNKNOWN; this does not.)
SDS_CLIENT_API const char* sds_client_status_name(int status);

// What `status` means, as one lower-case line without a full stop; for an
// unused number, that the service never sends it. Constant text, never null.
SDS_CLIENT_API const char* sds_client_status_meaning(int status);
