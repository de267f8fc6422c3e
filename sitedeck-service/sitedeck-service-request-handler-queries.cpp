// Handlers of the browser's item queries (commands 2 to 11): each reads what
// the command carries, asks the item store and writes the reply. The reply
// layouts are fixed by the wire protocol (docs/protocol.md). A reply of
// several items goes out in one write when it can: the browser waits for the
// last item, and a write per item woke it once per item. Should that write
// fail, the items are written one by one as before, so that a peer that has
// gone away sees the same failures, and the log the same lines.
#include <sys/uio.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <initializer_list>

#include "database/sitedeck-service-db-interface.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-request-handler-internal.h"
#include "sitedeck-service-shm.h"

namespace {

// The duration file holds a short decimal number; more is not a duration.
constexpr long kMaxDurationFileBytes = 64;

// Writes a whole reply in one go. False when nothing of it could be written:
// the caller then writes the items one by one.
bool __sds_reply_at_once(int sock, std::initializer_list<struct iovec> items) {
  return sds_ipc_send_reply(sock, items.begin(), static_cast<int>(items.size())) != 0;
}

struct iovec __sds_item(const void* data, size_t length) {
  return {const_cast<void*>(data), length};
}

// Command 7's way with the pixels: straight from the store into the shared
// memory, which is mapped once for the connection.
struct icon_delivery {
  bool too_big = false;
  bool unmapped = false;
};

unsigned char* __sds_place_icon(int length, void* user) {
  auto* delivery = static_cast<icon_delivery*>(user);
  // The object holds SDS_SHM_SIZE bytes; a bigger icon cannot be handed over.
  if (length < 0 || static_cast<size_t>(length) > SDS_SHM_SIZE) {
    delivery->too_big = true;
    return nullptr;
  }
  void* mapping = sds_shm_kept_mapping();
  if (mapping == nullptr) delivery->unmapped = true;
  return static_cast<unsigned char*>(mapping);
}

}  // namespace

int _sds_get_string(int sock, int item_id, const char* column) {
  if (sock < 0 || item_id < 0 || column == nullptr) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  char* text = nullptr;
  int code = sds_get_string_from_db(item_id, &text, column);
  UniqueCStr owned(text);
  size_t length = owned ? std::strlen(owned.get()) : 0;
  // A string item carries 1 to SDS_IPC_STRING_MAX bytes. Status 0 without
  // the string would leave the browser waiting for it, or reading its next
  // reply as the string; such a text counts as not stored.
  if (code == SDS_ERROR_NONE && (length == 0 || length > SDS_IPC_STRING_MAX)) {
    SDS_LOGE("[ERROR] %s of id:%d is %zu bytes, not sendable as a string", column, item_id, length);
    code = SDS_ERROR_NO_DATA;
  }
  if (code == SDS_ERROR_NONE) {
    const int32_t status = SDS_ERROR_NONE;
    const auto wire_length = static_cast<int32_t>(length);
    if (__sds_reply_at_once(sock, {__sds_item(&status, sizeof status),
                                   __sds_item(&wire_length, sizeof wire_length),
                                   __sds_item(owned.get(), length)})) {
      return code;
    }
  }
  (void)sds_ipc_send_errorcode(sock, code);
  if (code == SDS_ERROR_NONE) (void)sds_ipc_send_string(sock, owned.get());
  return code;
}

int _sds_get_int(int sock, int item_id, const char* column) {
  if (sock < 0 || item_id < 0 || column == nullptr) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  sds_db_value value{};
  value.i64 = 0;
  int code = sds_get_int_from_db(item_id, &value, column);
  const int32_t status = SDS_ERROR_NONE;
  if (code == SDS_ERROR_NONE &&
      __sds_reply_at_once(sock, {__sds_item(&status, sizeof status),
                                 __sds_item(&value.i32, sizeof value.i32)})) {
    return code;
  }
  (void)sds_ipc_send_errorcode(sock, code);
  if (code == SDS_ERROR_NONE) (void)sds_ipc_send_custom_type(sock, &value.i32, sizeof value.i32);
  return code;
}

int _sds_get_blob(int sock, int item_id) {
  if (sock < 0 || item_id < 0) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int length = 0, height = 0, width = 0;
  icon_delivery delivery;
  int code =
      sds_copy_blob_from_db(item_id, &length, &height, &width, __sds_place_icon, &delivery);
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("[CRITICAL]  No Data");
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_NO_DATA);
    return code;
  }
  if (delivery.too_big) {
    SDS_LOGE("[CRITICAL] icon of %d bytes does not fit the shared memory", length);
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_SHM_FAILED);
    return SDS_ERROR_NONE;
  }
  if (delivery.unmapped) {
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_SHM_FAILED);
    return SDS_ERROR_NONE;
  }
  const int32_t reply[4] = {SDS_ERROR_NONE, length, width, height};
  if (__sds_reply_at_once(sock, {__sds_item(reply, sizeof reply)})) return SDS_ERROR_NONE;
  if (sds_ipc_send_errorcode(sock, SDS_ERROR_NONE) == 0 &&
      sds_ipc_send_custom_type(sock, &length, sizeof length) == 0 &&
      sds_ipc_send_custom_type(sock, &width, sizeof width) == 0) {
    (void)sds_ipc_send_custom_type(sock, &height, sizeof height);
  }
  return SDS_ERROR_NONE;
}

int _sds_release_shm(sds_client* slot) {
  if (sds_free_shm() == 1) {
    sds_shm_drop_kept_mapping();
    (void)sds_ipc_send_errorcode(slot->sock, SDS_ERROR_NONE);
    slot->client_id = -1;
    return SDS_ERROR_NONE;
  }
  (void)sds_ipc_send_errorcode(slot->sock, SDS_ERROR_SHM_FAILED);
  return SDS_ERROR_SHM_FAILED;
}

int _sds_get_next_update_duration(int sock) {
  if (sock < 0) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int seconds = SDS_DEFAULT_UPDATE_SECONDS;
  UniqueFile file(std::fopen(sds_path(SDS_NEXT_UPDATE_DURATION_PATH).c_str(), "r"));
  if (file) {
    (void)std::fseek(file.get(), 0, SEEK_END);
    long size = std::ftell(file.get());
    if (size > 0) {
      if (size > kMaxDurationFileBytes) size = kMaxDurationFileBytes;
      UniqueCStr text(static_cast<char*>(std::calloc(static_cast<size_t>(size) + 1, 1)));
      if (!text) {
        SDS_LOGE("[Critical] calloc failed");
        (void)sds_ipc_send_errorcode(sock, SDS_ERROR_OUT_OF_MEMORY);
        return SDS_ERROR_OUT_OF_MEMORY;
      }
      std::rewind(file.get());
      if (std::fread(text.get(), 1, static_cast<size_t>(size), file.get()) > 0) {
        seconds = std::atoi(text.get());
        if (seconds < 1) {
          SDS_LOGE("Next update duration is <= zero ?");
          seconds = SDS_DEFAULT_UPDATE_SECONDS;
        }
      }
    }
  }
  const int32_t reply[2] = {SDS_ERROR_NONE, seconds};
  if (__sds_reply_at_once(sock, {__sds_item(reply, sizeof reply)})) return SDS_ERROR_NONE;
  (void)sds_ipc_send_errorcode(sock, SDS_ERROR_NONE);
  (void)sds_ipc_send_custom_type(sock, &seconds, sizeof seconds);
  return SDS_ERROR_NONE;
}

int _sds_get_full_ids(int sock) {
  if (sock < 0) {
    SDS_LOGE("[CRITICAL] Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int condition_value = 1;
  const char* condition_column = nullptr;
  bool valid = true;
  int flag = sds_ipc_read_errorcode(sock);
  if (flag == SDS_ERROR_NO_DATA) {
    SDS_LOGE("No conditional data to get IDs");
  } else {
    uint16_t selector = 0;
    if (sds_ipc_read_custom_type(sock, &selector, sizeof selector) != 0) selector = 0;
    if (selector == SITE_DECK_ADAPTOR_O_DIRTY) {
      SDS_LOGE("offset == SITE_DECK_ADAPTOR_O_DIRTY");
      if (sds_ipc_read_custom_type(sock, &condition_value, sizeof condition_value) != 0) {
        condition_value = 1;
      }
      condition_column = "is_dirty";
    } else {
      valid = false;
    }
  }
  int* ids = nullptr;
  int count = 0;
  int code = SDS_ERROR_INVALID_PARAMETER;
  if (valid) {
    code = sds_get_all_ids_from_db(&ids, &count, condition_column, &condition_value,
                                   SDS_DB_COND_TYPE_INT);
  }
  UniqueMalloc<int> owned_ids(ids);
  const int32_t head[2] = {SDS_ERROR_NONE, count};
  if (code == SDS_ERROR_NONE && count > 0 && owned_ids &&
      __sds_reply_at_once(sock, {__sds_item(head, sizeof head),
                                 __sds_item(owned_ids.get(),
                                            static_cast<size_t>(count) * sizeof(int))})) {
    return code;
  }
  (void)sds_ipc_send_errorcode(sock, code);
  if (code == SDS_ERROR_NONE) {
    (void)sds_ipc_send_custom_type(sock, &count, sizeof count);
    if (count > 0 && owned_ids) {
      (void)sds_ipc_send_custom_type(sock, owned_ids.get(),
                                     static_cast<size_t>(count) * sizeof(int));
    }
  }
  return code;
}
