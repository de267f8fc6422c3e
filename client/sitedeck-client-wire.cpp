// The client end of the wire items (docs/protocol.md, "Items"): whole writes
// of requests, reads of exact lengths bounded by a deadline, strings, the
// request header and the status that opens every reply; and the library's
// log. The service may split a reply over any number of reads, so every read
// loops until its length is complete or the deadline passes.
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>
#include <utility>

#include "sitedeck-client-internal.h"

namespace {

struct sds_client_log_target {
  std::mutex lock;
  sds_client_log_fn log = nullptr;
  void* user = nullptr;
};

sds_client_log_target& __sds_client_log_target() {
  static sds_client_log_target target;
  return target;
}

int64_t __sds_client_now_ms() {
  struct timespec now {};
  (void)clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// Marks the connection failed with `error` and closes it.
int __sds_client_fail(SdsConnection& connection, int error, const char* what) {
  SdsConnectionAccess::set_error(connection, error);
  __sds_client_log("%s: %s", what, error != 0 ? std::strerror(error) : "the service ended the connection");
  connection.close();
  return SDS_ERROR_IO_ERROR;
}

}  // namespace

void sds_client_set_log(sds_client_log_fn log, void* user) {
  sds_client_log_target& target = __sds_client_log_target();
  std::lock_guard<std::mutex> guard(target.lock);
  target.log = log;
  target.user = user;
}

void __sds_client_log(const char* format, ...) {
  const int saved = errno;
  sds_client_log_target& target = __sds_client_log_target();
  std::lock_guard<std::mutex> guard(target.lock);
  if (target.log != nullptr) {
    char line[512];
    va_list arguments;
    va_start(arguments, format);
    (void)std::vsnprintf(line, sizeof line, format, arguments);
    va_end(arguments);
    target.log(target.user, line);
  }
  errno = saved;
}

int64_t __sds_client_deadline(int timeout_ms) {
  return timeout_ms > 0 ? __sds_client_now_ms() + timeout_ms : -1;
}

int __sds_client_wait_readable(int fd, int64_t deadline) {
  for (;;) {
    int wait_ms = -1;
    if (deadline >= 0) {
      int64_t left = deadline - __sds_client_now_ms();
      wait_ms = left > 0 ? static_cast<int>(left) : 0;
    }
    struct pollfd entry = {fd, POLLIN, 0};
    int ready = poll(&entry, 1, wait_ms);
    if (ready < 0 && errno == EINTR) continue;
    return ready < 0 ? -1 : (ready > 0 ? 1 : 0);
  }
}

int __sds_client_status_ends(SdsConnection& connection, int status) {
  if (status == SDS_ERROR_IO_ERROR || status == SDS_ERROR_OUT_OF_MEMORY) connection.close();
  return status;
}

int __sds_client_read_exact(SdsConnection& connection, void* buffer, size_t length,
                            int timeout_ms) {
  if (!connection.is_open()) return SDS_ERROR_IO_ERROR;
  const int64_t deadline = __sds_client_deadline(timeout_ms);
  auto* bytes = static_cast<unsigned char*>(buffer);
  size_t done = 0;
  while (done < length) {
    int ready = __sds_client_wait_readable(connection.fd(), deadline);
    if (ready == 0) return __sds_client_fail(connection, ETIMEDOUT, "waiting for a reply");
    if (ready < 0) return __sds_client_fail(connection, errno, "waiting for a reply");
    ssize_t n = read(connection.fd(), bytes + done, length - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return __sds_client_fail(connection, errno, "reading a reply");
    if (n == 0) return __sds_client_fail(connection, 0, "reading a reply");
    done += static_cast<size_t>(n);
  }
  return SDS_ERROR_NONE;
}

int __sds_client_read_reply(SdsConnection& connection, void* buffer, size_t length) {
  return __sds_client_read_exact(connection, buffer, length, connection.timeouts().reply_ms);
}

int __sds_client_read_string(SdsConnection& connection, SdsClientText* text) {
  int32_t length = 0;
  int result = __sds_client_read_reply(connection, &length, sizeof length);
  if (result != SDS_ERROR_NONE) return result;
  if (length < 1 || length > SDS_IPC_STRING_MAX) {
    // The announced bytes would follow: the stream can't be trusted.
    __sds_client_log("string length %d out of range", length);
    SdsConnectionAccess::set_error(connection, EPROTO);
    connection.close();
    return SDS_ERROR_IO_ERROR;
  }
  SdsClientText value(static_cast<char*>(std::malloc(static_cast<size_t>(length) + 1)));
  if (!value) {
    connection.close();
    return SDS_ERROR_OUT_OF_MEMORY;
  }
  result = __sds_client_read_reply(connection, value.get(), static_cast<size_t>(length));
  if (result != SDS_ERROR_NONE) return result;
  value.get()[length] = '\0';
  *text = std::move(value);
  return SDS_ERROR_NONE;
}

int __sds_client_send(SdsConnection& connection, const void* buffer, size_t length) {
  if (!connection.is_open()) return SDS_ERROR_IO_ERROR;
  const auto* bytes = static_cast<const unsigned char*>(buffer);
  size_t done = 0;
  while (done < length) {
    // MSG_NOSIGNAL: a service that went away is an error, not SIGPIPE in the
    // program that embeds the library.
    ssize_t n = send(connection.fd(), bytes + done, length - done, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return __sds_client_fail(connection, n < 0 ? errno : EIO, "sending a request");
    done += static_cast<size_t>(n);
  }
  return SDS_ERROR_NONE;
}

sds_command sds_client_header(const SdsConnection& connection, int32_t cmd, int32_t item_id) {
  sds_command header;
  header.cmd = cmd;
  header.cid = connection.cid();
  header.item_id = item_id;
  return header;
}

int sds_client_send_header(SdsConnection& connection, int32_t cmd, int32_t item_id) {
  // The service reads a header in one read: it goes out in one write.
  const sds_command header = sds_client_header(connection, cmd, item_id);
  return __sds_client_send(connection, &header, sizeof header);
}

int sds_client_read_status(SdsConnection& connection) {
  // The whole word: a status split over two reads must not be taken for a
  // small number.
  int32_t status = 0;
  int result = __sds_client_read_reply(connection, &status, sizeof status);
  return result != SDS_ERROR_NONE ? result : status;
}

int sds_client_request(SdsConnection& connection, int32_t cmd, int32_t item_id) {
  if (cmd == 0) return SDS_ERROR_INVALID_PARAMETER;
  if (!connection.is_open()) return SDS_ERROR_IO_ERROR;
  int result = sds_client_send_header(connection, cmd, item_id);
  if (result != SDS_ERROR_NONE) return result;
  SdsConnectionAccess::set_error(connection, 0);
  return sds_client_read_status(connection);
}
