// What the files of the client library share and a client never sees: the
// wire steps every command is made of (bounded reads of exact lengths, whole
// writes, the request header), the connection's private fields, and the
// library's one way to log. The command numbers and limits come from the
// service's own types, so that both ends agree on them.
#pragma once

#include <cstddef>
#include <cstdint>

#include "sitedeck-client.h"
#include "sitedeck-service-types.h"

// The library's access to the private state of a connection.
struct SdsConnectionAccess {
  static void adopt(SdsConnection& connection, int fd, int32_t cid) {
    connection.fd_ = fd;
    connection.cid_ = cid;
  }
  static void set_error(SdsConnection& connection, int error) {
    connection.error_number_ = error;
  }
  static void set_timeouts(SdsConnection& connection, const sds_client_timeouts& timeouts) {
    connection.timeouts_ = timeouts;
  }
  // The icon memory view: address, length and the inode it was mapped from.
  static const unsigned char* shm_address(const SdsConnection& c) { return c.shm_address_; }
  static size_t shm_size(const SdsConnection& c) { return c.shm_size_; }
  static ino_t shm_inode(const SdsConnection& c) { return c.shm_inode_; }
  static void adopt_shm(SdsConnection& c, const unsigned char* address, size_t size, ino_t inode);
  static void drop_shm(SdsConnection& c);
};

// Hands one line to the installed log callback, if any; keeps errno.
void __sds_client_log(const char* format, ...) __attribute__((format(printf, 1, 2)));

// The monotonic time in milliseconds `timeout_ms` from now; -1 (no
// deadline) for a time-out of 0.
int64_t __sds_client_deadline(int timeout_ms);
// Waits until `fd` is readable or `deadline` passes: 1 readable (or at its
// end), 0 timed out, -1 failed (errno set). Retries EINTR itself.
int __sds_client_wait_readable(int fd, int64_t deadline);

// Closes the connection when `status` means the service is ending it (an
// I/O failure on either side, or its allocation failing); returns `status`.
int __sds_client_status_ends(SdsConnection& connection, int status);

// Reads exactly `length` bytes within `timeout_ms` (0: no bound). A reply
// that breaks off or times out leaves unknown bytes in the stream: the
// connection is closed and SDS_ERROR_IO_ERROR returned.
int __sds_client_read_exact(SdsConnection& connection, void* buffer, size_t length,
                            int timeout_ms);
// The same with the connection's reply time-out.
int __sds_client_read_reply(SdsConnection& connection, void* buffer, size_t length);

// Reads a string item (length 1 to 4096, then its bytes) into a malloc'ed
// NUL-terminated text; on failure closes the connection, SDS_ERROR_IO_ERROR.
int __sds_client_read_string(SdsConnection& connection, SdsClientText* text);

// Sends `length` bytes whole; on failure closes the connection and returns
// SDS_ERROR_IO_ERROR. Never raises SIGPIPE in the calling program.
int __sds_client_send(SdsConnection& connection, const void* buffer, size_t length);

// The header of a request on this connection.
sds_command sds_client_header(const SdsConnection& connection, int32_t cmd, int32_t item_id);
// Sends the header of a request; SDS_ERROR_NONE or SDS_ERROR_IO_ERROR.
int sds_client_send_header(SdsConnection& connection, int32_t cmd, int32_t item_id);
// Reads the status that opens every reply, all four bytes of it; a
// connection that ended, failed or timed out gives SDS_ERROR_IO_ERROR.
int sds_client_read_status(SdsConnection& connection);
// Sends the header and reads the reply's status: the first step of every
// command. SDS_ERROR_INVALID_PARAMETER for command 0, without sending.
int sds_client_request(SdsConnection& connection, int32_t cmd, int32_t item_id);
