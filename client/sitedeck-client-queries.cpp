// The calls for the item queries and the small commands: texts and flags of
// one item (3 to 6, 8, 9), the next update duration (10), the id lists (11)
// and the removal of the shared-memory object (2). Replies are laid out in
// docs/protocol.md.
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "sitedeck-client-commands.h"
#include "sitedeck-client-internal.h"

namespace {

// Command 11's condition flag meaning "no condition follows".
constexpr int32_t kNoCondition = SDS_ERROR_NO_DATA;
// Any other flag announces a selector; the service reads it as a plain word.
constexpr int32_t kConditionFollows = 0;

int __sds_client_get_text(SdsConnection& connection, int32_t cmd, int32_t item_id,
                          SdsClientText* out) {
  if (out == nullptr || item_id < 0) return SDS_ERROR_INVALID_PARAMETER;
  int status = sds_client_request(connection, cmd, item_id);
  if (status != SDS_ERROR_NONE) return __sds_client_status_ends(connection, status);
  // A stored text the protocol can't carry (over 4096 bytes) ends the reply
  // after the status; the read then times out, and the connection goes.
  return __sds_client_read_string(connection, out);
}

int __sds_client_get_word(SdsConnection& connection, int32_t cmd, int32_t item_id, int32_t* out) {
  if (out == nullptr || item_id < 0) return SDS_ERROR_INVALID_PARAMETER;
  int status = sds_client_request(connection, cmd, item_id);
  if (status != SDS_ERROR_NONE) return __sds_client_status_ends(connection, status);
  int32_t value = 0;
  int result = __sds_client_read_reply(connection, &value, sizeof value);
  if (result != SDS_ERROR_NONE) return result;
  *out = value;
  return SDS_ERROR_NONE;
}

// Command 11 with the condition words in `condition` (flag, and for a
// selector its word and value), sent with the header in one write.
int __sds_client_get_ids(SdsConnection& connection, const unsigned char* condition,
                         size_t condition_length, sds_client_ids* out) {
  if (out == nullptr) return SDS_ERROR_INVALID_PARAMETER;
  if (!connection.is_open()) return SDS_ERROR_IO_ERROR;
  unsigned char request[sizeof(sds_command) + 10];
  sds_command header = sds_client_header(connection, SDS_CMD_GET_FULL_IDS, 0);
  std::memcpy(request, &header, sizeof header);
  std::memcpy(request + sizeof header, condition, condition_length);
  int result = __sds_client_send(connection, request, sizeof header + condition_length);
  if (result != SDS_ERROR_NONE) return result;
  int status = sds_client_read_status(connection);
  // A service that could not open its database leaves the condition words
  // unread, where they would be taken for the next header.
  if (status == SDS_ERROR_DB_OPEN_FAILED) connection.close();
  if (status != SDS_ERROR_NONE) return __sds_client_status_ends(connection, status);

  int32_t count = 0;
  result = __sds_client_read_reply(connection, &count, sizeof count);
  if (result != SDS_ERROR_NONE) return result;
  if (count < 0 || count > SDS_CLIENT_MAX_IDS) {
    __sds_client_log("id count %d out of range", count);
    SdsConnectionAccess::set_error(connection, EPROTO);
    connection.close();
    return SDS_ERROR_INVALID_PARAMETER;
  }
  SdsClientBuffer<int32_t> ids;
  if (count > 0) {
    ids.reset(static_cast<int32_t*>(std::malloc(static_cast<size_t>(count) * sizeof(int32_t))));
    if (!ids) {
      connection.close();
      return SDS_ERROR_OUT_OF_MEMORY;
    }
    result = __sds_client_read_reply(connection, ids.get(),
                                     static_cast<size_t>(count) * sizeof(int32_t));
    if (result != SDS_ERROR_NONE) return result;
  }
  out->ids = std::move(ids);
  out->count = count;
  return SDS_ERROR_NONE;
}

}  // namespace

int sds_client_release_shm(SdsConnection& connection) {
  int status = sds_client_request(connection, SDS_CMD_FREE_SHM, 0);
  // Status 0 is the service's last word on this connection.
  if (status == SDS_ERROR_NONE) connection.close();
  return __sds_client_status_ends(connection, status);
}

int sds_client_get_url(SdsConnection& connection, int32_t item_id, SdsClientText* url) {
  return __sds_client_get_text(connection, SDS_CMD_GET_URL, item_id, url);
}

int sds_client_get_title(SdsConnection& connection, int32_t item_id, SdsClientText* title) {
  return __sds_client_get_text(connection, SDS_CMD_GET_TITLE, item_id, title);
}

int sds_client_get_icon_size(SdsConnection& connection, int32_t item_id, SdsClientText* size) {
  return __sds_client_get_text(connection, SDS_CMD_GET_ICON_SIZE, item_id, size);
}

int sds_client_get_dominant_color(SdsConnection& connection, int32_t item_id, SdsClientText* color) {
  return __sds_client_get_text(connection, SDS_CMD_GET_DOMINANT_COLOR, item_id, color);
}

int sds_client_get_touch_icon_exists(SdsConnection& connection, int32_t item_id, int32_t* value) {
  return __sds_client_get_word(connection, SDS_CMD_GET_TOUCH_ICON_EXISTS, item_id, value);
}

int sds_client_get_favicon_exists(SdsConnection& connection, int32_t item_id, int32_t* value) {
  return __sds_client_get_word(connection, SDS_CMD_GET_FAVICON_EXISTS, item_id, value);
}

int sds_client_get_next_update_duration(SdsConnection& connection, int32_t* seconds) {
  return __sds_client_get_word(connection, SDS_CMD_GET_NEXT_UPDATE_DURATION, 0, seconds);
}

int sds_client_get_full_ids(SdsConnection& connection, sds_client_ids* ids) {
  return __sds_client_get_ids(connection, reinterpret_cast<const unsigned char*>(&kNoCondition),
                              sizeof kNoCondition, ids);
}

int sds_client_get_ids_by_dirty(SdsConnection& connection, int32_t is_dirty, sds_client_ids* ids) {
  // Flag, 2-byte selector, then the value: packed, as the service reads them
  // one after the other.
  unsigned char condition[sizeof(int32_t) + sizeof(uint16_t) + sizeof(int32_t)];
  const int32_t flag = kConditionFollows;
  const uint16_t selector = SITE_DECK_ADAPTOR_O_DIRTY;
  std::memcpy(condition, &flag, sizeof flag);
  std::memcpy(condition + sizeof flag, &selector, sizeof selector);
  std::memcpy(condition + sizeof flag + sizeof selector, &is_dirty, sizeof is_dirty);
  return __sds_client_get_ids(connection, condition, sizeof condition, ids);
}
