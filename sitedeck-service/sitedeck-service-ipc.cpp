// The wire primitives of both ends of the socket protocol (items and their
// layout: docs/protocol.md). They move exactly one item per call, log every
// refusal and failure, and report by their result; they never close the
// socket or decide about the connection, which is the caller's business.
#include "sitedeck-service-ipc.h"

#include <sys/socket.h>
#include <sys/uio.h>
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

// One write of one item. send() with MSG_NOSIGNAL keeps a client process that
// has not ignored SIGPIPE alive when the peer is gone; a descriptor that is not
// a socket falls back to a plain write.
ssize_t __sds_ipc_write(int sock, const void* buffer, size_t length) {
  ssize_t written = send(sock, buffer, length, MSG_NOSIGNAL);
  if (written < 0 && errno == ENOTSOCK) written = write(sock, buffer, length);
  return written;
}

int __sds_ipc_write_item(int sock, const void* buffer, size_t length) {
  if (__sds_ipc_write(sock, buffer, length) < 1) {
    SDS_LOGE("[IPC.Write] exception sock:%d [%s]", sock, strerror(errno));
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
  ssize_t result = -1;
  for (int attempt = 1; attempt <= kRecvAttempts; ++attempt) {
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
  if (sock < 0 || items == nullptr || count < 1 || count > kMaxItems) return 0;
  struct iovec rest[kMaxItems];
  std::memcpy(rest, items, sizeof(struct iovec) * static_cast<size_t>(count));
  struct iovec* next = rest;
  bool sent_any = false;
  while (count > 0) {
    struct msghdr message {};
    message.msg_iov = next;
    message.msg_iovlen = static_cast<size_t>(count);
    ssize_t written = sendmsg(sock, &message, MSG_NOSIGNAL);
    if (written < 0 && errno == ENOTSOCK) written = writev(sock, next, count);
    // Once part of the reply is out, the rest must follow it.
    if (written < 0 && errno == EINTR && sent_any) continue;
    if (written <= 0) {
      if (!sent_any) return 0;
      SDS_LOGE("[IPC.Write] exception sock:%d [%s]", sock, strerror(errno));
      return -1;
    }
    sent_any = true;
    // A blocking socket sends everything unless a signal cut it short.
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
  return 1;
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
