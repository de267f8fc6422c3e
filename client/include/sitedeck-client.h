// The client library of the site-deck service: connect to the service's
// socket, then one call per request (sitedeck-client-commands.h), or one call
// per tile (sitedeck-client-deck.h). docs/protocol.md describes the bytes;
// docs/client-library.md shows a whole program. Needs C++17 and libc only.
//
// - Results: every call returns a status (sitedeck-client-status.h): 0, a
//   status the service sent, or a code of the library's own. Nothing throws.
// - Calling convention: the connection is passed by reference to every call;
//   outputs are pointers, written only when the call returns SDS_ERROR_NONE.
// - Ownership: outputs own what they hold (SdsClientText, SdsClientBuffer);
//   the connection owns its socket and its view of the icon memory.
// - Blocking: every call blocks until its reply is complete, each wait bounded
//   by the connection's time-outs (sds_client_timeouts); none spins.
// - Threads: a connection belongs to one thread at a time; different
//   connections may be used on different threads. sds_client_set_log and the
//   status texts may be called from any thread.
// - One connection at a time: the service serves exactly one connection
//   (one process per connection, started by socket activation). A second
//   client waits until the first closes; connect reports that as
//   SDS_CLIENT_ERROR_BUSY once its time-out has passed. Keep a connection
//   only as long as you read.
// - Silence: the library writes nothing to standard output or error; install
//   a log callback to see why a call failed.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <utility>

#include "sitedeck-client-status.h"

// The service's socket; sds_client_socket_path() applies $SITEDECK_ROOT.
#define SDS_CLIENT_SOCKET_PATH "/opt/data/browser-sitedeck-service/browser-sitedeck-service.sock"

// Owners of what the library hands over (allocated with malloc).
struct SdsClientFree {
  void operator()(void* p) const noexcept { std::free(p); }
};
using SdsClientText = std::unique_ptr<char, SdsClientFree>;
template <typename T>
using SdsClientBuffer = std::unique_ptr<T, SdsClientFree>;

// How long the library waits, in milliseconds; 0 waits without end.
struct sds_client_timeouts {
  // connect() and the service's greeting: a service busy with another
  // connection sends no greeting until that one ends.
  int connect_ms = 5000;
  // Each reply, from the request to its last byte.
  int reply_ms = 10000;
  // The result of a data pull (initialize), which runs retries and downloads.
  int pull_ms = 15 * 60 * 1000;
};

// Where the library's diagnostics go: one line of text without a line end,
// valid only during the call. Called on the thread of the failing call.
using sds_client_log_fn = void (*)(void* user, const char* line);
// Installs `log` (null: none, the default) for the whole process.
SDS_CLIENT_API void sds_client_set_log(sds_client_log_fn log, void* user);

// The socket path: $SITEDECK_ROOT (when set and not empty) in front of
// SDS_CLIENT_SOCKET_PATH, the same rule the service applies to all its files.
SDS_CLIENT_API std::string sds_client_socket_path();

// One connection to the service, set up by sds_client_connect. Move-only;
// closing it (or destroying it) ends the service process behind it.
class SDS_CLIENT_API SdsConnection {
 public:
  SdsConnection() = default;
  ~SdsConnection() { close(); }
  SdsConnection(SdsConnection&& other) noexcept { *this = std::move(other); }
  SdsConnection& operator=(SdsConnection&& other) noexcept;
  SdsConnection(const SdsConnection&) = delete;
  SdsConnection& operator=(const SdsConnection&) = delete;

  bool is_open() const { return fd_ >= 0; }
  // The client id of the service's greeting (above 0 while open).
  int32_t cid() const { return cid_; }
  // The socket, owned by the connection: for poll(), not for reading.
  int fd() const { return fd_; }
  // The errno of the last failure of a call on this connection (connect's
  // included), 0 when that failure had none (a status from the service).
  int error_number() const { return error_number_; }
  const sds_client_timeouts& timeouts() const { return timeouts_; }
  // Closes the socket and drops the icon memory view; safe to repeat.
  void close();

 private:
  friend struct SdsConnectionAccess;
  int fd_ = -1;
  int32_t cid_ = 0;
  int error_number_ = 0;
  sds_client_timeouts timeouts_;
  // The read-only mapping of the service's icon memory, kept between icon
  // requests; `shm_inode_` tells whether the name still leads to it.
  const unsigned char* shm_address_ = nullptr;
  size_t shm_size_ = 0;
  ino_t shm_inode_ = 0;
};

// Connects to the socket at `socket_path` and reads the greeting {status 0,
// client id}. Closes whatever `connection` held first. Returns
// SDS_ERROR_NONE with `connection` open; SDS_CLIENT_ERROR_* for a socket that
// cannot be reached or a service that does not greet (the errno in
// connection.error_number()); the status of a service that refuses
// (SDS_ERROR_SHM_FAILED, SDS_ERROR_OUT_OF_MEMORY); or
// SDS_ERROR_INVALID_PARAMETER for a path too long for a socket address.
// Blocks up to timeouts.connect_ms.
SDS_CLIENT_API int sds_client_connect(const std::string& socket_path, SdsConnection& connection,
                                      sds_client_timeouts timeouts = {});

// Changes the time-outs of an open or closed connection; a negative value
// gives SDS_ERROR_INVALID_PARAMETER and changes nothing.
SDS_CLIENT_API int sds_client_set_timeouts(SdsConnection& connection,
                                           sds_client_timeouts timeouts);
