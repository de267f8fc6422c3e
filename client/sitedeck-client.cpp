// Connection set-up: the socket path, connect() with its failures told apart,
// the service's greeting within the connect time-out, and the connection's
// own state. A second client of a service that serves one connection at a
// time gets connected (it waits in the socket's backlog) but no greeting,
// which is how "busy" is told from a service that is not there at all.
#include "sitedeck-client.h"

#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "sitedeck-client-internal.h"

namespace {

int __sds_client_set_send_timeout(int fd, int milliseconds) {
  struct timeval timeout {};
  timeout.tv_sec = milliseconds / 1000;
  timeout.tv_usec = (milliseconds % 1000) * 1000;
  return setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof timeout);
}

// The code for a connect() that failed with `error`.
int __sds_client_connect_failure(int error) {
  switch (error) {
    case ENOENT:
    case ENOTDIR:
      return SDS_CLIENT_ERROR_NO_SOCKET;
    case ECONNREFUSED:
      return SDS_CLIENT_ERROR_NOT_LISTENING;
    case EACCES:
    case EPERM:
      return SDS_CLIENT_ERROR_PERMISSION_DENIED;
    // A blocking connect() to a full backlog waits for the send time-out
    // and then gives EAGAIN.
    case EAGAIN:
    case ETIMEDOUT:
      return SDS_CLIENT_ERROR_TIMED_OUT;
    default:
      return SDS_CLIENT_ERROR_CONNECT_FAILED;
  }
}

int __sds_client_connect_socket(int fd, const struct sockaddr_un& address) {
  int result = 0;
  do {
    result = connect(fd, reinterpret_cast<const struct sockaddr*>(&address), sizeof address);
  } while (result != 0 && errno == EINTR);
  return result;
}

// Reads the greeting's `length` bytes into `buffer` by `deadline`,
// `received` counting what arrived so far across calls. SDS_ERROR_NONE, or
// the client code for what went wrong, with its errno in `*error`.
int __sds_client_read_greeting(int fd, void* buffer, size_t length, int64_t deadline,
                               size_t* received, int* error) {
  auto* bytes = static_cast<unsigned char*>(buffer);
  size_t done = 0;
  while (done < length) {
    int ready = __sds_client_wait_readable(fd, deadline);
    if (ready == 0) {
      *error = ETIMEDOUT;
      // Nothing at all: the service has not taken the connection yet.
      return *received == 0 ? SDS_CLIENT_ERROR_BUSY : SDS_CLIENT_ERROR_TIMED_OUT;
    }
    ssize_t n = ready < 0 ? -1 : read(fd, bytes + done, length - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      *error = n < 0 ? errno : 0;
      return SDS_CLIENT_ERROR_CLOSED_BEFORE_GREETING;
    }
    done += static_cast<size_t>(n);
    *received += static_cast<size_t>(n);
  }
  return SDS_ERROR_NONE;
}

}  // namespace

void SdsConnectionAccess::adopt_shm(SdsConnection& c, const unsigned char* address, size_t size,
                                    ino_t inode) {
  drop_shm(c);
  c.shm_address_ = address;
  c.shm_size_ = size;
  c.shm_inode_ = inode;
}

void SdsConnectionAccess::drop_shm(SdsConnection& c) {
  if (c.shm_address_ != nullptr) (void)munmap(const_cast<unsigned char*>(c.shm_address_), c.shm_size_);
  c.shm_address_ = nullptr;
  c.shm_size_ = 0;
  c.shm_inode_ = 0;
}

SdsConnection& SdsConnection::operator=(SdsConnection&& other) noexcept {
  if (this != &other) {
    close();
    fd_ = std::exchange(other.fd_, -1);
    cid_ = std::exchange(other.cid_, 0);
    error_number_ = std::exchange(other.error_number_, 0);
    timeouts_ = other.timeouts_;
    shm_address_ = std::exchange(other.shm_address_, nullptr);
    shm_size_ = std::exchange(other.shm_size_, 0);
    shm_inode_ = std::exchange(other.shm_inode_, 0);
  }
  return *this;
}

void SdsConnection::close() {
  if (fd_ >= 0) (void)::close(fd_);
  fd_ = -1;
  cid_ = 0;
  SdsConnectionAccess::drop_shm(*this);
}

std::string sds_client_socket_path() {
  const char* root = std::getenv("SITEDECK_ROOT");
  std::string path;
  if (root != nullptr && root[0] != '\0') path = root;
  return path + SDS_CLIENT_SOCKET_PATH;
}

int sds_client_set_timeouts(SdsConnection& connection, sds_client_timeouts timeouts) {
  if (timeouts.connect_ms < 0 || timeouts.reply_ms < 0 || timeouts.pull_ms < 0) {
    return SDS_ERROR_INVALID_PARAMETER;
  }
  SdsConnectionAccess::set_timeouts(connection, timeouts);
  if (connection.is_open()) (void)__sds_client_set_send_timeout(connection.fd(), timeouts.reply_ms);
  return SDS_ERROR_NONE;
}

int sds_client_connect(const std::string& socket_path, SdsConnection& connection,
                       sds_client_timeouts timeouts) {
  connection.close();
  SdsConnectionAccess::set_error(connection, 0);
  if (sds_client_set_timeouts(connection, timeouts) != SDS_ERROR_NONE) {
    return SDS_ERROR_INVALID_PARAMETER;
  }
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (socket_path.empty() || socket_path.size() >= sizeof address.sun_path) {
    SdsConnectionAccess::set_error(connection, ENAMETOOLONG);
    __sds_client_log("socket path of %zu bytes does not fit a socket address", socket_path.size());
    return SDS_ERROR_INVALID_PARAMETER;
  }
  std::memcpy(address.sun_path, socket_path.c_str(), socket_path.size() + 1);

  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    SdsConnectionAccess::set_error(connection, errno);
    __sds_client_log("socket: %s", std::strerror(errno));
    return SDS_CLIENT_ERROR_CONNECT_FAILED;
  }
  // Adopted at once, so that every early return below closes it.
  SdsConnectionAccess::adopt(connection, fd, 0);
  (void)__sds_client_set_send_timeout(fd, timeouts.connect_ms);
  if (__sds_client_connect_socket(fd, address) != 0) {
    int error = errno;
    connection.close();
    SdsConnectionAccess::set_error(connection, error);
    __sds_client_log("connect %s: %s", socket_path.c_str(), std::strerror(error));
    return __sds_client_connect_failure(error);
  }
  (void)__sds_client_set_send_timeout(fd, timeouts.reply_ms);

  // The service answers the connection with a status, and with the client id
  // only when that status is 0.
  const int64_t deadline = __sds_client_deadline(timeouts.connect_ms);
  int32_t greeting[2] = {0, 0};
  size_t received = 0;
  int error = 0;
  int result = __sds_client_read_greeting(fd, &greeting[0], sizeof greeting[0], deadline,
                                          &received, &error);
  if (result == SDS_ERROR_NONE && greeting[0] == SDS_ERROR_NONE) {
    result = __sds_client_read_greeting(fd, &greeting[1], sizeof greeting[1], deadline,
                                        &received, &error);
  }
  if (result == SDS_ERROR_NONE && greeting[0] != SDS_ERROR_NONE) result = greeting[0];
  if (result != SDS_ERROR_NONE) {
    connection.close();
    SdsConnectionAccess::set_error(connection, error);
    __sds_client_log("no greeting from %s: %s (%s)", socket_path.c_str(),
                     sds_client_status_name(result), error != 0 ? std::strerror(error) : "-");
    return result;
  }
  SdsConnectionAccess::adopt(connection, fd, greeting[1]);
  return SDS_ERROR_NONE;
}
