// Connection set-up and the request steps every command shares, built on the
// wire primitives of the service itself so that both ends agree on the bytes.
#include "sitedeck-client.h"

#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"

namespace {

int __sds_client_set_timeout(int fd, int milliseconds) {
  struct timeval timeout {};
  timeout.tv_sec = milliseconds / 1000;
  timeout.tv_usec = (milliseconds % 1000) * 1000;
  return setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
}

int __sds_client_connect_socket(int fd, const struct sockaddr_un& address) {
  int result = 0;
  do {
    result = connect(fd, reinterpret_cast<const struct sockaddr*>(&address), sizeof address);
  } while (result != 0 && errno == EINTR);
  return result;
}

}  // namespace

SdsShmView& SdsShmView::operator=(SdsShmView&& other) noexcept {
  if (this != &other) {
    reset();
    address_ = std::exchange(other.address_, nullptr);
    size_ = std::exchange(other.size_, 0);
    inode_ = std::exchange(other.inode_, 0);
  }
  return *this;
}

void SdsShmView::adopt(const unsigned char* address, size_t size, ino_t inode) {
  reset();
  address_ = address;
  size_ = size;
  inode_ = inode;
}

void SdsShmView::reset() {
  if (address_ != nullptr) (void)munmap(const_cast<unsigned char*>(address_), size_);
  address_ = nullptr;
  size_ = 0;
  inode_ = 0;
}

int sds_client_connect(const std::string& socket_path, SdsConnection* out, int read_timeout_ms) {
  if (out == nullptr || read_timeout_ms < 0) return SDS_ERROR_INVALID_PARAMETER;
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (socket_path.empty() || socket_path.size() >= sizeof address.sun_path) {
    SDS_LOGE("[ERROR] socket path length:%d", static_cast<int>(socket_path.size()));
    return SDS_ERROR_INVALID_PARAMETER;
  }
  std::memcpy(address.sun_path, socket_path.c_str(), socket_path.size() + 1);

  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) {
    SDS_LOGE("[ERROR] socket [%s]", strerror(errno));
    return SDS_ERROR_IO_ERROR;
  }
  if (__sds_client_connect_socket(fd.get(), address) != 0) {
    SDS_LOGE("[ERROR] connect %s [%s]", socket_path.c_str(), strerror(errno));
    return SDS_ERROR_IO_ERROR;
  }
  if (read_timeout_ms > 0 && __sds_client_set_timeout(fd.get(), read_timeout_ms) != 0) {
    return SDS_ERROR_IO_ERROR;
  }
  // The service answers the connection with a status, and with the client id
  // only when that status is 0.
  int status = sds_ipc_read_errorcode(fd.get());
  if (status != SDS_ERROR_NONE) return status;
  int32_t cid = 0;
  if (sds_ipc_read_blob(fd.get(), &cid, sizeof cid) != 0) return SDS_ERROR_IO_ERROR;
  out->fd_ = std::move(fd);
  out->cid_ = cid;
  out->shm_view_.reset();
  return SDS_ERROR_NONE;
}

int sds_client_set_timeout(const SdsConnection& connection, int milliseconds) {
  if (milliseconds < 0) return SDS_ERROR_INVALID_PARAMETER;
  return __sds_client_set_timeout(connection.fd(), milliseconds) == 0 ? SDS_ERROR_NONE
                                                                      : SDS_ERROR_IO_ERROR;
}

sds_command sds_client_header(const SdsConnection& connection, int32_t cmd, int32_t item_id) {
  sds_command header;
  header.cmd = cmd;
  header.cid = connection.cid();
  header.item_id = item_id;
  return header;
}

int sds_client_send_header(const SdsConnection& connection, int32_t cmd, int32_t item_id) {
  sds_command header = sds_client_header(connection, cmd, item_id);
  return sds_ipc_send_command(connection.fd(), &header) == 0 ? SDS_ERROR_NONE : SDS_ERROR_IO_ERROR;
}

int sds_client_read_status(const SdsConnection& connection) {
  if (!connection.is_open()) return SDS_ERROR_IO_ERROR;
  // The whole word: a status split over two reads must not be taken for a
  // small number.
  int32_t status = 0;
  if (sds_ipc_read_blob(connection.fd(), &status, sizeof status) != 0) return SDS_ERROR_IO_ERROR;
  return status;
}

int sds_client_request(const SdsConnection& connection, int32_t cmd, int32_t item_id) {
  if (cmd == 0) return SDS_ERROR_INVALID_PARAMETER;
  if (!connection.is_open()) return SDS_ERROR_IO_ERROR;
  int result = sds_client_send_header(connection, cmd, item_id);
  if (result != SDS_ERROR_NONE) return result;
  return sds_client_read_status(connection);
}
