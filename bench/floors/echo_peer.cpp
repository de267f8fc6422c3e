#include "echo_peer.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <vector>

#include "sitedeck-service-types.h"

namespace {

bool read_exact(int fd, void* buffer, size_t length) {
  auto* out = static_cast<unsigned char*>(buffer);
  while (length > 0) {
    ssize_t n = read(fd, out, length);
    if (n <= 0) return false;
    out += n;
    length -= static_cast<size_t>(n);
  }
  return true;
}

bool write_exact(int fd, const void* buffer, size_t length) {
  return send(fd, buffer, length, MSG_NOSIGNAL) == static_cast<ssize_t>(length);
}

// The peer process: serves one connection until it ends.
[[noreturn]] void serve(int listen_fd, unsigned char* mapping, size_t url_reply_bytes,
                        size_t icon_bytes) {
  // Descriptors inherited from the benchmark (a connection to the service
  // above all) would keep their peers from seeing the benchmark close them.
  if (listen_fd > 3) (void)close_range(3, static_cast<unsigned>(listen_fd) - 1, 0);
  (void)close_range(static_cast<unsigned>(listen_fd) + 1, ~0U, 0);
  int fd = accept(listen_fd, nullptr, nullptr);
  std::vector<unsigned char> url_reply(url_reply_bytes, 'u');
  const int32_t url_head[2] = {0, static_cast<int32_t>(url_reply_bytes - 8)};
  std::memcpy(url_reply.data(), url_head, sizeof url_head);
  std::vector<unsigned char> pixels(icon_bytes, 0x5A);
  const int32_t icon_reply[4] = {0, static_cast<int32_t>(icon_bytes), 192, 192};
  sds_command header;
  while (fd >= 0 && read_exact(fd, &header, sizeof header)) {
    bool ok = false;
    if (header.cmd == SDS_CMD_GET_URL) {
      ok = write_exact(fd, url_reply.data(), url_reply.size());
    } else if (header.cmd == SDS_CMD_GET_ICON) {
      std::memcpy(mapping, pixels.data(), pixels.size());
      ok = write_exact(fd, icon_reply, sizeof icon_reply);
    }
    if (!ok) break;
  }
  _exit(0);
}

}  // namespace

BenchEchoPeer::~BenchEchoPeer() {
  connection_.reset();
  if (pid_ > 0) (void)waitpid(pid_, nullptr, 0);
  if (mapping_ != nullptr) (void)munmap(mapping_, SDS_SHM_SIZE);
  (void)shm_unlink(kBenchFloorShmName);
  if (!socket_path_.empty()) (void)unlink(socket_path_.c_str());
}

bool BenchEchoPeer::start(const std::string& socket_path, size_t url_reply_bytes,
                          size_t icon_bytes) {
  if (url_reply_bytes < 8 || icon_bytes > SDS_SHM_SIZE) return false;
  url_reply_bytes_ = url_reply_bytes;
  icon_bytes_ = icon_bytes;
  UniqueFd shm(shm_open(kBenchFloorShmName, O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  if (!shm || ftruncate(shm.get(), static_cast<off_t>(SDS_SHM_SIZE)) != 0) return false;
  void* address = mmap(nullptr, SDS_SHM_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, shm.get(), 0);
  if (address == MAP_FAILED) return false;
  mapping_ = static_cast<unsigned char*>(address);

  struct sockaddr_un sun {};
  sun.sun_family = AF_UNIX;
  if (socket_path.size() >= sizeof sun.sun_path) return false;
  std::memcpy(sun.sun_path, socket_path.c_str(), socket_path.size() + 1);
  (void)unlink(socket_path.c_str());
  UniqueFd listening(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!listening || bind(listening.get(), reinterpret_cast<sockaddr*>(&sun), sizeof sun) != 0 ||
      listen(listening.get(), 1) != 0) {
    return false;
  }
  socket_path_ = socket_path;
  // Forked before the client connects: both sides then run as they would
  // against the service, in two processes.
  pid_ = fork();
  if (pid_ < 0) return false;
  if (pid_ == 0) serve(listening.get(), mapping_, url_reply_bytes, icon_bytes);
  connection_.reset(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  return connection_ &&
         connect(connection_.get(), reinterpret_cast<sockaddr*>(&sun), sizeof sun) == 0;
}

bool BenchEchoPeer::url_round_trip() {
  sds_command header{SDS_CMD_GET_URL, 1, 1};
  unsigned char reply[256];
  return url_reply_bytes_ <= sizeof reply &&
         write_exact(connection_.get(), &header, sizeof header) &&
         read_exact(connection_.get(), reply, url_reply_bytes_);
}

bool BenchEchoPeer::icon_round_trip(unsigned char* out) {
  sds_command header{SDS_CMD_GET_ICON, 1, 1};
  int32_t reply[4];
  if (!write_exact(connection_.get(), &header, sizeof header) ||
      !read_exact(connection_.get(), reply, sizeof reply) || reply[0] != 0) {
    return false;
  }
  std::memcpy(out, mapping_, icon_bytes_);
  return true;
}
