// Command 1 from the client's side: position, then the optional browser
// version, then the long wait for the data pull's result. The wait polls the
// socket in ticks so that a caller can show progress or give up; the pull
// time-out bounds it, long enough for a pull with retries.
#include <cerrno>
#include <cstring>

#include "sitedeck-client-commands.h"
#include "sitedeck-client-internal.h"

namespace {

// Flag words before the version: 0 announces a string, anything else none.
constexpr int32_t kVersionFollows = 0;
constexpr int32_t kNoVersion = SDS_ERROR_NO_DATA;
constexpr int kDefaultTickMs = 100;

// Waits until the final status can be read. SDS_ERROR_NONE, or
// SDS_ERROR_IO_EINTR when `waiting` gave up or the pull time-out passed.
int __sds_client_wait_for_result(int fd, sds_client_wait_fn waiting, void* user, int tick_ms,
                                 int64_t deadline) {
  for (;;) {
    int64_t tick_deadline = waiting != nullptr ? __sds_client_deadline(tick_ms) : deadline;
    if (deadline >= 0 && tick_deadline > deadline) tick_deadline = deadline;
    int ready = __sds_client_wait_readable(fd, tick_deadline);
    if (ready != 0) return SDS_ERROR_NONE;  // the status, the end, or a failure the read reports
    if (deadline >= 0 && tick_deadline == deadline) return SDS_ERROR_IO_EINTR;
    if (!waiting(user)) return SDS_ERROR_IO_EINTR;
  }
}

}  // namespace

int sds_client_initialize(SdsConnection& connection, double latitude, double longitude,
                          const char* browser_version, sds_client_wait_fn waiting, void* user,
                          int tick_ms) {
  size_t version_length = browser_version != nullptr ? std::strlen(browser_version) : 0;
  if (version_length > static_cast<size_t>(SDS_IPC_STRING_MAX)) return SDS_ERROR_INVALID_PARAMETER;
  if (tick_ms <= 0) tick_ms = kDefaultTickMs;

  // The service answers the header before reading anything more, so that a
  // database it can't open leaves nothing unread.
  int status = sds_client_request(connection, SDS_CMD_INITIALIZE, 0);
  if (status != SDS_ERROR_NONE) return __sds_client_status_ends(connection, status);
  const double position[2] = {latitude, longitude};
  int result = __sds_client_send(connection, position, sizeof position);
  if (result != SDS_ERROR_NONE) return result;
  status = sds_client_read_status(connection);
  if (status != SDS_ERROR_NONE) return __sds_client_status_ends(connection, status);

  // Flag, then (for a version) its length and bytes, in one write.
  unsigned char message[sizeof(int32_t) * 2 + SDS_IPC_STRING_MAX];
  size_t message_length = 0;
  const int32_t flag = version_length > 0 ? kVersionFollows : kNoVersion;
  std::memcpy(message, &flag, sizeof flag);
  message_length += sizeof flag;
  if (version_length > 0) {
    const int32_t wire_length = static_cast<int32_t>(version_length);
    std::memcpy(message + message_length, &wire_length, sizeof wire_length);
    message_length += sizeof wire_length;
    std::memcpy(message + message_length, browser_version, version_length);
    message_length += version_length;
  }
  result = __sds_client_send(connection, message, message_length);
  if (result != SDS_ERROR_NONE) return result;

  const int64_t deadline = __sds_client_deadline(connection.timeouts().pull_ms);
  if (__sds_client_wait_for_result(connection.fd(), waiting, user, tick_ms, deadline) !=
      SDS_ERROR_NONE) {
    __sds_client_log("gave up waiting for the pull's result");
    connection.close();
    return SDS_ERROR_IO_EINTR;
  }
  status = sds_client_read_status(connection);
  return __sds_client_status_ends(connection, status);
}
