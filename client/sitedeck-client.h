// The client end of the site-deck service's socket protocol (docs/protocol.md)
// for programs that want the deck: connect and handshake, then one call per
// request. Every call returns an SDS code, the same numbers the service sends
// as statuses, and never throws. A connection serves one client at a time:
// the protocol is strictly request, then reply.
#pragma once

#include <cstdint>
#include <string>

#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"

// One connection as the handshake set it up: the socket and the client id the
// service issued. Move-only; closing it ends the service process behind it.
class SdsConnection {
 public:
  SdsConnection() = default;

  int fd() const { return fd_.get(); }
  int32_t cid() const { return cid_; }
  bool is_open() const { return static_cast<bool>(fd_); }
  void close() {
    fd_.reset();
    cid_ = 0;
  }

 private:
  friend int sds_client_connect(const std::string& socket_path, SdsConnection* out,
                                int read_timeout_ms);
  UniqueFd fd_;
  int32_t cid_ = 0;
};

// Connects to the service's socket and reads the handshake {status 0, client
// id}. Returns SDS_ERROR_NONE with `out` set up; the status the service sent
// instead (SDS_ERROR_SHM_FAILED, SDS_ERROR_OUT_OF_MEMORY); SDS_ERROR_IO_ERROR
// when the socket can't be reached or the handshake is cut short; or
// SDS_ERROR_INVALID_PARAMETER for a path too long for a socket address.
// A `read_timeout_ms` above 0 bounds every read, the handshake's included (see
// sds_client_set_timeout). `out` is left as it was on failure.
int sds_client_connect(const std::string& socket_path, SdsConnection* out, int read_timeout_ms = 0);

// Makes a read that waits longer than `milliseconds` fail (0: wait forever).
// The primitives try a read three times, so a silent service is given up on
// after about three times that. SDS_ERROR_NONE or SDS_ERROR_IO_ERROR.
int sds_client_set_timeout(const SdsConnection& connection, int milliseconds);

// The header of a request on this connection.
sds_command sds_client_header(const SdsConnection& connection, int32_t cmd, int32_t item_id);

// Sends the header of a request; SDS_ERROR_NONE or SDS_ERROR_IO_ERROR.
int sds_client_send_header(const SdsConnection& connection, int32_t cmd, int32_t item_id);

// Reads the status that opens every reply. A connection that ended or failed
// gives SDS_ERROR_IO_ERROR, which a status of 1 cannot be told apart from.
int sds_client_read_status(const SdsConnection& connection);

// Sends the header and reads the reply's status: the first step of every
// command. SDS_ERROR_INVALID_PARAMETER for command 0, without sending.
int sds_client_request(const SdsConnection& connection, int32_t cmd, int32_t item_id);
