#include "serve/sitedeck-service-activation.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstddef>
#include <cstdlib>
#include <cstring>

namespace {

// A whole decimal number without sign or blanks, in 1..INT_MAX; -EINVAL or
// -ERANGE otherwise.
int __sds_parse_positive(const char* text, int* value) {
  if (text[0] < '0' || text[0] > '9') return -EINVAL;
  errno = 0;
  char* end = nullptr;
  long parsed = std::strtol(text, &end, 10);
  if (*end != '\0') return -EINVAL;
  if (errno == ERANGE || parsed > INT_MAX) return -ERANGE;
  *value = static_cast<int>(parsed);
  return 0;
}

int __sds_count_passed(void) {
  const char* text = std::getenv("LISTEN_PID");
  if (text == nullptr) return 0;
  int pid = 0;
  int result = __sds_parse_positive(text, &pid);
  if (result < 0) return result;
  if (pid == 0) return -EINVAL;
  if (pid != getpid()) return 0;  // meant for another process
  text = std::getenv("LISTEN_FDS");
  if (text == nullptr) return 0;
  int count = 0;
  result = __sds_parse_positive(text, &count);
  if (result < 0) return result;
  if (count <= 0 || count > INT_MAX - SDS_LISTEN_FDS_START) return -EINVAL;
  for (int fd = SDS_LISTEN_FDS_START; fd < SDS_LISTEN_FDS_START + count; ++fd) {
    int flags = fcntl(fd, F_GETFD);
    if (flags < 0 || ((flags & FD_CLOEXEC) == 0 && fcntl(fd, F_SETFD, flags | FD_CLOEXEC) < 0)) {
      return -errno;
    }
  }
  return count;
}

}  // namespace

int sds_listen_fds(int unset_environment) {
  int result = __sds_count_passed();
  if (unset_environment) {
    (void)unsetenv("LISTEN_PID");
    (void)unsetenv("LISTEN_FDS");
    (void)unsetenv("LISTEN_FDNAMES");
  }
  return result;
}

int sds_is_socket_unix(int fd, int type, int listening, const char* path) {
  if (fd < 0) return -EBADF;
  struct stat st {};
  if (fstat(fd, &st) < 0) return -errno;
  if (!S_ISSOCK(st.st_mode)) return 0;
  if (type != 0) {
    int actual = 0;
    socklen_t length = sizeof actual;
    if (getsockopt(fd, SOL_SOCKET, SO_TYPE, &actual, &length) < 0) return -errno;
    if (length != sizeof actual || actual != type) return 0;
  }
  if (listening >= 0) {
    int accepting = 0;
    socklen_t length = sizeof accepting;
    if (getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &accepting, &length) < 0) return -errno;
    if (length != sizeof accepting || (accepting != 0) != (listening > 0)) return 0;
  }
  struct sockaddr_un address {};
  socklen_t length = sizeof address;
  if (getsockname(fd, reinterpret_cast<struct sockaddr*>(&address), &length) < 0) return -errno;
  if (length < sizeof address.sun_family || address.sun_family != AF_UNIX) return 0;
  if (path == nullptr) return 1;
  // A path socket's name is the path and its terminator; the kernel may or
  // may not count the terminator in the length.
  size_t name_length = length - offsetof(struct sockaddr_un, sun_path);
  size_t path_length = std::strlen(path);
  if (path_length == 0 || address.sun_path[0] == '\0') return 0;
  if (name_length < path_length || name_length > path_length + 1) return 0;
  return std::memcmp(address.sun_path, path, path_length) == 0 &&
                 (name_length == path_length || address.sun_path[path_length] == '\0')
             ? 1
             : 0;
}
