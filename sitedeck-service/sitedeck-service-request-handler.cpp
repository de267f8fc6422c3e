// The request dispatcher: checks the slot and the header, makes sure the
// database is open, and hands the request to the handler of its command
// number. A command without a handler is an unknown command: it gets no reply
// and the connection goes on. The dispatcher keeps no state between requests.
#include "sitedeck-service-request-handler.h"

#include "database/sitedeck-service-db-interface.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"

namespace {

// A handler reads whatever else its command carries from the slot's socket,
// writes the whole reply and returns an SDS code; 1 or 7 ends the connection.
using sds_request_handler = int (*)(sds_client* slot, const sds_command* command);

// Handlers by command number (commands: docs/protocol.md). An empty entry is
// served like an unknown command until its handler is wired in here.
constexpr sds_request_handler kHandlers[] = {
    nullptr,  // 0: never reaches the dispatcher (refused with the header)
    nullptr,  // SDS_CMD_INITIALIZE: _initialize
    nullptr,  // SDS_CMD_FREE_SHM: _sds_release_shm
    nullptr,  // SDS_CMD_GET_URL: _sds_get_string "url"
    nullptr,  // SDS_CMD_GET_TITLE: _sds_get_string "title"
    nullptr,  // SDS_CMD_GET_TOUCH_ICON_EXISTS: _sds_get_int "touch_icon_exists"
    nullptr,  // SDS_CMD_GET_ICON_SIZE: _sds_get_string "icon_size"
    nullptr,  // SDS_CMD_GET_ICON: _sds_get_blob
    nullptr,  // SDS_CMD_GET_FAVICON_EXISTS: _sds_get_int "favicon_exists"
    nullptr,  // SDS_CMD_GET_DOMINANT_COLOR: _sds_get_string "dominant_color"
    nullptr,  // SDS_CMD_GET_NEXT_UPDATE_DURATION: _sds_get_next_update_duration
    nullptr,  // SDS_CMD_GET_FULL_IDS: _sds_get_full_ids
};
static_assert(sizeof kHandlers / sizeof kHandlers[0] == SDS_CMD_GET_FULL_IDS + 1,
              "one entry per command number");

sds_request_handler __sds_find_handler(int cmd) {
  if (cmd < 0 || cmd > SDS_CMD_GET_FULL_IDS) return nullptr;
  return kHandlers[cmd];
}

}  // namespace

int sds_handle_requests(sds_client* slot, const sds_command* command) {
  if (slot == nullptr) {
    SDS_LOGE("[ERROR] NULL client");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (slot->sock < 0) {
    SDS_LOGE("[ERROR] sock establish");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (command == nullptr) {
    SDS_LOGE("[ERROR] NULL Command");
    if (sds_ipc_send_errorcode(slot->sock, SDS_ERROR_INVALID_PARAMETER) != 0) {
      return SDS_ERROR_IO_ERROR;
    }
    return SDS_ERROR_INVALID_PARAMETER;
  }
  // Data the client sent after the header stays unread when this fails.
  int db_result = sds_ensure_db_open();
  if (db_result != SDS_ERROR_NONE) {
    (void)sds_ipc_send_errorcode(slot->sock, db_result);
    return db_result;
  }
  sds_request_handler handler = __sds_find_handler(command->cmd);
  if (handler == nullptr) return SDS_ERROR_NONE;
  int result = handler(slot, command);
  // Initialize has already told the client how the pull went; whatever it
  // returns must not end the connection.
  if (command->cmd == SDS_CMD_INITIALIZE) return SDS_ERROR_NONE;
  return result;
}
