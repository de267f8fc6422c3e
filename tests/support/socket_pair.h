// A connected pair of Unix stream sockets standing in for the browser's
// connection, plus helpers to look at the raw bytes on the wire.
#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <string>

#include "sitedeck-service-raii.h"

struct SocketPair {
  UniqueFd service;  // the end the code under test uses
  UniqueFd peer;     // the end the test plays the other side on

  SocketPair() {
    int fds[2] = {-1, -1};
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0) {
      service.reset(fds[0]);
      peer.reset(fds[1]);
    }
  }
};

// True when `fd` has bytes (or an end of stream) to read right now. Writes on
// a socket pair land in the peer's buffer before write() returns, so this
// needs no waiting.
inline bool readable_now(int fd) {
  struct pollfd entry = {fd, POLLIN, 0};
  return poll(&entry, 1, 0) == 1;
}

// A peer that has gone away makes this return false: on a socket the write
// must not raise SIGPIPE, which would end the whole test binary.
inline bool write_all(int fd, const void* data, size_t length) {
  ssize_t written = send(fd, data, length, MSG_NOSIGNAL);
  if (written < 0 && errno == ENOTSOCK) written = write(fd, data, length);
  return written == static_cast<ssize_t>(length);
}

inline bool write_int(int fd, int32_t value) { return write_all(fd, &value, sizeof value); }

// printf-style formatting of an expected log message.
__attribute__((format(printf, 1, 2))) inline std::string format(const char* fmt, ...) {
  char buffer[512];
  va_list ap;
  va_start(ap, fmt);
  std::vsnprintf(buffer, sizeof buffer, fmt, ap);
  va_end(ap);
  return buffer;
}
