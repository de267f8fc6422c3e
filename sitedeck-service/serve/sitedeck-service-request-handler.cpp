// The request dispatcher: checks the slot and the header, makes sure the
// database is open, and hands the request to the handler of its command
// number. A command without a handler is an unknown command: it gets no reply
// and the connection goes on. The dispatcher keeps no state between requests.
#include "serve/sitedeck-service-request-handler.h"

#include "database/sitedeck-service-db-interface.h"
#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"
#include "serve/sitedeck-service-request-handler-internal.h"

namespace {

// A handler reads whatever else its command carries from the slot's socket,
// writes the whole reply and returns an SDS code; 1 or 7 ends the connection.
using sds_request_handler = int (*)(sds_client* slot, const sds_command* command);

int __sds_initialize(sds_client* slot, const sds_command*) { return _initialize(slot->sock); }
int __sds_release_shm(sds_client* slot, const sds_command*) { return _sds_release_shm(slot); }
int __sds_get_url(sds_client* slot, const sds_command* c) {
  return _sds_get_string(slot->sock, c->item_id, "url");
}
int __sds_get_title(sds_client* slot, const sds_command* c) {
  return _sds_get_string(slot->sock, c->item_id, "title");
}
int __sds_get_touch_icon_exists(sds_client* slot, const sds_command* c) {
  return _sds_get_int(slot->sock, c->item_id, "touch_icon_exists");
}
int __sds_get_icon_size(sds_client* slot, const sds_command* c) {
  return _sds_get_string(slot->sock, c->item_id, "icon_size");
}
int __sds_get_icon(sds_client* slot, const sds_command* c) {
  return _sds_get_blob(slot->sock, c->item_id);
}
int __sds_get_favicon_exists(sds_client* slot, const sds_command* c) {
  return _sds_get_int(slot->sock, c->item_id, "favicon_exists");
}
int __sds_get_dominant_color(sds_client* slot, const sds_command* c) {
  return _sds_get_string(slot->sock, c->item_id, "dominant_color");
}
int __sds_get_next_update(sds_client* slot, const sds_command*) {
  return _sds_get_next_update_duration(slot->sock);
}
int __sds_get_full_ids(sds_client* slot, const sds_command*) { return _sds_get_full_ids(slot->sock); }

// Handlers by command number (commands: docs/protocol.md).
constexpr sds_request_handler kHandlers[] = {
    nullptr,  // 0: never reaches the dispatcher (refused with the header)
    __sds_initialize,             // SDS_CMD_INITIALIZE
    __sds_release_shm,            // SDS_CMD_FREE_SHM
    __sds_get_url,                // SDS_CMD_GET_URL
    __sds_get_title,              // SDS_CMD_GET_TITLE
    __sds_get_touch_icon_exists,  // SDS_CMD_GET_TOUCH_ICON_EXISTS
    __sds_get_icon_size,          // SDS_CMD_GET_ICON_SIZE
    __sds_get_icon,               // SDS_CMD_GET_ICON
    __sds_get_favicon_exists,     // SDS_CMD_GET_FAVICON_EXISTS
    __sds_get_dominant_color,     // SDS_CMD_GET_DOMINANT_COLOR
    __sds_get_next_update,        // SDS_CMD_GET_NEXT_UPDATE_DURATION
    __sds_get_full_ids,           // SDS_CMD_GET_FULL_IDS
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
