// The client end of the site-deck service's socket protocol (docs/protocol.md)
// for programs that want the deck: connect and handshake, then one call per
// request (sitedeck-client-commands.h). Every call returns an SDS code, the
// same numbers the service sends as statuses, and never throws. A connection
// serves one client at a time: the protocol is strictly request, then reply.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <utility>

#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"

// The read-only view of the service's shared-memory object that a connection
// keeps between icon requests, so that an icon costs no open and map of its
// own. `inode` tells whether the name still leads to the mapped object.
class SdsShmView {
 public:
  SdsShmView() = default;
  SdsShmView(const SdsShmView&) = delete;
  SdsShmView& operator=(const SdsShmView&) = delete;
  SdsShmView(SdsShmView&& other) noexcept { *this = std::move(other); }
  SdsShmView& operator=(SdsShmView&& other) noexcept;
  ~SdsShmView() { reset(); }

  const unsigned char* data() const { return address_; }
  size_t size() const { return size_; }
  ino_t inode() const { return inode_; }
  // Takes over a mapping of `size` bytes of the object with `inode`.
  void adopt(const unsigned char* address, size_t size, ino_t inode);
  void reset();

 private:
  const unsigned char* address_ = nullptr;
  size_t size_ = 0;
  ino_t inode_ = 0;
};

// One connection as the handshake set it up: the socket and the client id the
// service issued, plus the shared-memory view of its icon requests.
// Move-only; closing it ends the service process behind it.
class SdsConnection {
 public:
  SdsConnection() = default;

  int fd() const { return fd_.get(); }
  int32_t cid() const { return cid_; }
  bool is_open() const { return static_cast<bool>(fd_); }
  // The icon calls keep their mapping here; it goes with the connection.
  SdsShmView& shm_view() { return shm_view_; }
  void close() {
    fd_.reset();
    cid_ = 0;
    shm_view_.reset();
  }

 private:
  friend int sds_client_connect(const std::string& socket_path, SdsConnection* out,
                                int read_timeout_ms);
  UniqueFd fd_;
  int32_t cid_ = 0;
  SdsShmView shm_view_;
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

// Reads the status that opens every reply, all four bytes of it. A connection
// that ended, failed or timed out gives SDS_ERROR_IO_ERROR, which a status of
// 1 cannot be told apart from.
int sds_client_read_status(const SdsConnection& connection);

// Sends the header and reads the reply's status: the first step of every
// command. SDS_ERROR_INVALID_PARAMETER for command 0, without sending.
int sds_client_request(const SdsConnection& connection, int32_t cmd, int32_t item_id);
