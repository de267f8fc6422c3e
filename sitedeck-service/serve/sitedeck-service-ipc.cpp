// The wire primitives of both ends of the socket protocol (items and their
// layout: docs/protocol.md). They move exactly one item per call, log every
// refusal and failure, and report by their result; they never close the
// socket or decide about the connection, which is the caller's business.
#include "serve/sitedeck-service-ipc.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"

namespace {

// Variable-length data is read in pieces of at most this many bytes.
constexpr size_t kReadChunk = 1024;
constexpr int kRecvAttempts = 3;

const char* tag_or_empty(const char* tag) { return tag != nullptr ? tag : ""; }

// The bound on the request the service is serving (sds_ipc_request_begin),
// kept per thread: only the thread serving the connection reads and writes it.
struct request_bound {
  int sock = -1;
  struct timespec deadline {};
  int failure = 0;         // errno of the first failure; 0 while none
  bool timed_out = false;  // a read found the time up: nothing more is read
};
thread_local request_bound tl_bound;

request_bound* __sds_bound_of(int sock) {
  return sock >= 0 && tl_bound.sock == sock ? &tl_bound : nullptr;
}

void __sds_ipc_fail(request_bound* bound, int err) {
  if (bound != nullptr && bound->failure == 0) bound->failure = err != 0 ? err : EIO;
}

// Milliseconds left until the deadline, rounded up; 0 once it has passed.
int __sds_ms_left(const struct timespec& deadline) {
  struct timespec now {};
  (void)clock_gettime(CLOCK_MONOTONIC, &now);
  long long ns = (deadline.tv_sec - now.tv_sec) * 1000000000LL + (deadline.tv_nsec - now.tv_nsec);
  if (ns <= 0) return 0;
  return static_cast<int>(std::min((ns + 999999) / 1000000, static_cast<long long>(INT_MAX)));
}

// Waits until the bounded socket has something to read (data, its end, an
// error) or the request's time is up; false, with the failure noted, then.
bool __sds_ipc_wait_readable(request_bound* bound) {
  for (int left = __sds_ms_left(bound->deadline); left > 0; left = __sds_ms_left(bound->deadline)) {
    struct pollfd entry = {bound->sock, POLLIN, 0};
    int ready = poll(&entry, 1, left);
    if (ready != 0 && !(ready < 0 && errno == EINTR)) return true;
  }
  __sds_ipc_fail(bound, ETIMEDOUT);
  bound->timed_out = true;
  return false;
}

// One item, all of it: send() with MSG_NOSIGNAL keeps a client process that
// has not ignored SIGPIPE alive when the peer is gone; a descriptor that is
// not a socket falls back to a plain write. A blocking socket takes the item
// whole unless the reply time-out or a signal cut it short, and the rest of a
// cut item must still follow. 0, or -1 with errno set.
int __sds_ipc_write_all(int sock, const void* buffer, size_t length) {
  const auto* next = static_cast<const char*>(buffer);
  bool sent_any = false;
  while (length > 0) {
    ssize_t written = send(sock, next, length, MSG_NOSIGNAL);
    if (written < 0 && errno == ENOTSOCK) written = write(sock, next, length);
    if (written < 0 && errno == EINTR && sent_any) continue;
    if (written <= 0) {
      if (written == 0) errno = EIO;
      return -1;
    }
    sent_any = true;
    next += written;
    length -= static_cast<size_t>(written);
  }
  return 0;
}

int __sds_ipc_write_item(int sock, const void* buffer, size_t length) {
  request_bound* bound = __sds_bound_of(sock);
  if (bound != nullptr && bound->failure != 0) {
    errno = bound->failure;
    return -1;
  }
  if (__sds_ipc_write_all(sock, buffer, length) != 0) {
    int err = errno;
    SDS_LOGE("[IPC.Write] exception sock:%d [%s]", sock, strerror(err));
    __sds_ipc_fail(bound, err);
    errno = err;
    return -1;
  }
  return 0;
}

// Reads `length` bytes in chunks into `buffer`; returns the last chunk's
// result: above 0 when everything arrived, 0 for a closed peer, -1 otherwise.
int __sds_ipc_read_chunks(int sock, char* buffer, size_t length, const char* tag) {
  size_t done = 0;
  int result = 0;
  while (done < length) {
    size_t chunk = std::min(length - done, kReadChunk);
    result = sds_ipc_recv(sock, buffer + done, chunk, tag);
    if (result <= 0) break;
    if (static_cast<size_t>(result) > kReadChunk) {
      result = -1;
      break;
    }
    done += static_cast<size_t>(result);
  }
  return result;
}

}  // namespace

int sds_ipc_recv(int sock, void* buffer, size_t length, const char* tag) {
  tag = tag_or_empty(tag);
  if (sock < 0) {
    SDS_LOGE("[ERROR] %s check sock:%d", tag, sock);
    return -1;
  }
  if (buffer == nullptr) {
    SDS_LOGE("[ERROR] %s check buffer sock:%d", tag, sock);
    return -1;
  }
  length = std::min(length, static_cast<size_t>(INT_MAX));
  request_bound* bound = __sds_bound_of(sock);
  ssize_t result = -1;
  for (int attempt = 1; attempt <= kRecvAttempts; ++attempt) {
    // A bounded request's time counts over all its reads and their retries;
    // once it is up, nothing more is read or logged for it. (What a client
    // that does not read its replies has already sent can still be read.)
    if (bound != nullptr && (bound->timed_out || !__sds_ipc_wait_readable(bound))) {
      errno = ETIMEDOUT;
      return -1;
    }
    result = read(sock, buffer, length);
    int code = SDS_ERROR_NONE;
    if (result < 0) {
      int saved = errno;  // the log call may change errno before it is mapped
      SDS_LOGE("[IPC.Read] %s exception sock:%d", tag, sock);
      errno = saved;
      code = sds_ipc_check_stderr(SDS_ERROR_IO_ERROR);
    } else if (result == 0) {
      SDS_LOGE("[ERROR] %s closed peer sock:%d", tag, sock);
      code = SDS_ERROR_IO_ERROR;
    }
    if (code != SDS_ERROR_IO_EAGAIN && code != SDS_ERROR_IO_EINTR) break;
  }
  return static_cast<int>(result);
}

int sds_ipc_check_stderr(int default_code) {
  int err = errno;
  const char* text = strerror(err);
  int code = default_code;
  switch (err) {
    case EPIPE:
      SDS_LOGE("[EPIPE:%d] Broken Pipe [%s]", err, text);
      code = SDS_ERROR_IO_ERROR;
      break;
    case EAGAIN:
      SDS_LOGE("[EAGAIN:%d] [%s]", err, text);
      code = SDS_ERROR_IO_EAGAIN;
      break;
    case EINTR:
      SDS_LOGE("[EINTR:%d] [%s]", err, text);
      code = SDS_ERROR_IO_EINTR;
      break;
    default:
      SDS_LOGE("[errno:%d] [%s]", err, text);
      break;
  }
  errno = err;
  return code;
}

int sds_ipc_read_errorcode(int sock) {
  int32_t value = 0;
  if (sds_ipc_recv(sock, &value, sizeof value, "sds_ipc_read_errorcode") < 1) {
    return SDS_ERROR_IO_ERROR;
  }
  return value;
}

int sds_ipc_send_errorcode(int sock, int code) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return -1;
  }
  int32_t value = code;
  return __sds_ipc_write_item(sock, &value, sizeof value);
}

int sds_ipc_send_command(int sock, const sds_command* command) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return -1;
  }
  if (command == nullptr) {
    SDS_LOGE("[ERROR] check buffer sock:%d", sock);
    return -1;
  }
  return __sds_ipc_write_item(sock, command, sizeof *command);
}

int sds_ipc_read_int(int sock, int* value) {
  if (sock < 0) {
    SDS_LOGE("[CHECK SOCKET]");
    return -1;
  }
  int32_t read_value = -1;
  if (read(sock, &read_value, sizeof read_value) < 0) {
    SDS_LOGE("[CRITICAL] read [%s]", strerror(errno));
    return -1;
  }
  if (value != nullptr) *value = read_value;
  return read_value;
}

int sds_ipc_read_custom_type(int sock, void* buffer, size_t length) {
  return sds_ipc_recv(sock, buffer, length, "sds_ipc_read_custom_type") > 0 ? 0 : -1;
}

char* sds_ipc_read_string(int sock) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return nullptr;
  }
  int32_t length = 0;
  int result = sds_ipc_recv(sock, &length, sizeof length, "sds_ipc_read_string");
  if (result <= 0) {
    SDS_LOGE("[ERROR] read length:%d sock:%d", result, sock);
    return nullptr;
  }
  // Checked as unsigned so that a negative length is refused with the rest;
  // the announced bytes stay unread.
  if (length == 0 || static_cast<uint32_t>(length) > SDS_IPC_STRING_MAX) {
    SDS_LOGE("[ERROR] check length:%d sock:%d", length, sock);
    return nullptr;
  }
  UniqueCStr text(static_cast<char*>(std::calloc(static_cast<size_t>(length) + 1, 1)));
  if (!text) {
    SDS_LOGE("[ERROR] calloc length:%d sock:%d [%s]", length, sock, strerror(errno));
    return nullptr;
  }
  result =
      __sds_ipc_read_chunks(sock, text.get(), static_cast<size_t>(length), "sds_ipc_read_string");
  if (result == 0) {
    SDS_LOGE("[ERROR] closed peer sock:%d", sock);
    return nullptr;
  }
  if (result < 0) {
    SDS_LOGE("[IPC.Read] exception sock:%d [%s]", sock, strerror(errno));
    return nullptr;
  }
  text.get()[length] = '\0';
  return text.release();
}

int sds_ipc_send_string(int sock, const char* text) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return -1;
  }
  if (text == nullptr) {
    SDS_LOGE("[ERROR] check buffer sock:%d", sock);
    return -1;
  }
  size_t length = std::strlen(text);
  if (length == 0 || length > SDS_IPC_STRING_MAX) {
    SDS_LOGE("[ERROR] check length:%d sock:%d",
             static_cast<int>(std::min(length, static_cast<size_t>(INT_MAX))), sock);
    return -1;
  }
  int32_t wire_length = static_cast<int32_t>(length);
  if (__sds_ipc_write_item(sock, &wire_length, sizeof wire_length) != 0) return -1;
  return __sds_ipc_write_item(sock, text, length);
}

int sds_ipc_simple_response(int sock, const sds_command* command) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (command == nullptr) {
    SDS_LOGE("[ERROR] check buffer sock:%d", sock);
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (command->cmd == 0) {
    SDS_LOGE("[ERROR] check command(%d) sock:%d", command->cmd, sock);
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (sds_ipc_send_command(sock, command) != 0) return SDS_ERROR_IO_ERROR;
  return sds_ipc_read_errorcode(sock);
}

int sds_ipc_send_custom_type(int sock, const void* buffer, size_t length) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return -1;
  }
  if (buffer == nullptr) {
    SDS_LOGE("[ERROR] check buffer sock:%d", sock);
    return -1;
  }
  return __sds_ipc_write_item(sock, buffer, length);
}

int sds_ipc_send_reply(int sock, const struct iovec* items, int count) {
  constexpr int kMaxItems = 8;
  if (sock < 0 || items == nullptr || count < 1 || count > kMaxItems) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return -1;
  }
  request_bound* bound = __sds_bound_of(sock);
  if (bound != nullptr && bound->failure != 0) {
    errno = bound->failure;
    return -1;
  }
  struct iovec rest[kMaxItems];
  std::memcpy(rest, items, sizeof(struct iovec) * static_cast<size_t>(count));
  struct iovec* next = rest;
  while (count > 0) {
    struct msghdr message {};
    message.msg_iov = next;
    message.msg_iovlen = static_cast<size_t>(count);
    ssize_t written = sendmsg(sock, &message, MSG_NOSIGNAL);
    if (written < 0 && errno == ENOTSOCK) written = writev(sock, next, count);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) {
      int err = written == 0 ? EIO : errno;
      SDS_LOGE("[IPC.Write] exception sock:%d [%s]", sock, strerror(err));
      __sds_ipc_fail(bound, err);
      errno = err;
      return -1;
    }
    // A blocking socket sends everything unless the reply time-out or a
    // signal cut it short; the rest must follow what went out.
    auto left = static_cast<size_t>(written);
    while (count > 0 && left >= next->iov_len) {
      left -= next->iov_len;
      ++next;
      --count;
    }
    if (count > 0) {
      next->iov_base = static_cast<char*>(next->iov_base) + left;
      next->iov_len -= left;
    }
  }
  return 0;
}

void sds_ipc_request_begin(int sock, int timeout_ms) {
  tl_bound = {};
  if (sock < 0) return;
  tl_bound.sock = sock;
  (void)clock_gettime(CLOCK_MONOTONIC, &tl_bound.deadline);
  long long ns = tl_bound.deadline.tv_nsec + (std::max(timeout_ms, 0) % 1000) * 1000000LL;
  tl_bound.deadline.tv_sec += std::max(timeout_ms, 0) / 1000 + ns / 1000000000LL;
  tl_bound.deadline.tv_nsec = static_cast<long>(ns % 1000000000LL);
}

int sds_ipc_request_end(int sock) {
  request_bound* bound = __sds_bound_of(sock);
  int failure = bound != nullptr ? bound->failure : 0;
  tl_bound = {};
  return failure;
}

int sds_ipc_read_blob(int sock, void* buffer, size_t size) {
  if (sock < 0) {
    SDS_LOGE("[ERROR] check sock:%d", sock);
    return -1;
  }
  if (buffer == nullptr) {
    SDS_LOGE("[ERROR] check buffer sock:%d", sock);
    return -1;
  }
  if (size == 0) {
    SDS_LOGE("[ERROR] check size:%d sock:%d", 0, sock);
    return -1;
  }
  int result = __sds_ipc_read_chunks(sock, static_cast<char*>(buffer), size, "sds_ipc_read_blob");
  if (result == 0) {
    SDS_LOGE("[ERROR] closed peer sock:%d", sock);
    return -1;
  }
  if (result < 0) {
    SDS_LOGE("[IPC.Read] exception sock:%d [%s]", sock, strerror(errno));
    return -1;
  }
  return 0;
}
