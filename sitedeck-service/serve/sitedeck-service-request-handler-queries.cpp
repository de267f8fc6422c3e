// Handlers of the browser's item queries (commands 2 to 11): each reads what
// the command carries, asks the item store and writes the reply. The reply
// layouts are fixed by the wire protocol (docs/protocol.md). A reply of
// several items goes out in one write: the browser waits for the last item,
// and a write per item woke it once per item. A reply that could not be
// written is given up and answers SDS_ERROR_IO_ERROR, which ends the
// connection: what a peer that has gone away, or does not read, would get
// after it could only be out of step.
#include <sys/uio.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <initializer_list>

#include "database/sitedeck-service-db-interface.h"
#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "serve/sitedeck-service-request-handler-internal.h"
#include "serve/sitedeck-service-shm.h"

namespace {

// The duration file holds a short decimal number; more is not a duration.
constexpr long kMaxDurationFileBytes = 64;

struct iovec __sds_item(const void* data, size_t length) {
  return {const_cast<void*>(data), length};
}

// Writes a whole reply; `code` when it went out, SDS_ERROR_IO_ERROR when not.
int __sds_reply(int sock, int code, std::initializer_list<struct iovec> items) {
  if (sds_ipc_send_reply(sock, items.begin(), static_cast<int>(items.size())) != 0) {
    return SDS_ERROR_IO_ERROR;
  }
  return code;
}

// A reply that is a status alone.
int __sds_reply_status(int sock, int code) {
  const int32_t status = code;
  return __sds_reply(sock, code, {__sds_item(&status, sizeof status)});
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
  if (code != SDS_ERROR_NONE) return __sds_reply_status(sock, code);
  size_t length = owned ? std::strlen(owned.get()) : 0;
  // A string item carries 1 to SDS_IPC_STRING_MAX bytes. Status 0 without
  // the string would leave the browser waiting for it, or reading its next
  // reply as the string; such a text counts as not stored.
  if (length == 0 || length > SDS_IPC_STRING_MAX) {
    SDS_LOGE("[ERROR] %s of id:%d is %zu bytes, not sendable as a string", column, item_id, length);
    return __sds_reply_status(sock, SDS_ERROR_NO_DATA);
  }
  const int32_t status = SDS_ERROR_NONE;
  const auto wire_length = static_cast<int32_t>(length);
  return __sds_reply(
      sock, code,
      {__sds_item(&status, sizeof status), __sds_item(&wire_length, sizeof wire_length),
       __sds_item(owned.get(), length)});
}

int _sds_get_int(int sock, int item_id, const char* column) {
  if (sock < 0 || item_id < 0 || column == nullptr) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  sds_db_value value{};
  value.i64 = 0;
  int code = sds_get_int_from_db(item_id, &value, column);
  if (code != SDS_ERROR_NONE) return __sds_reply_status(sock, code);
  const int32_t status = SDS_ERROR_NONE;
  return __sds_reply(
      sock, code, {__sds_item(&status, sizeof status), __sds_item(&value.i32, sizeof value.i32)});
}

int _sds_get_blob(int sock, int item_id) {
  if (sock < 0 || item_id < 0) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int length = 0, height = 0, width = 0;
  icon_delivery delivery;
  sds_shm_copy_begin();
  int code = sds_copy_blob_from_db(item_id, &length, &height, &width, __sds_place_icon, &delivery);
  bool whole = sds_shm_copy_end();
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("[CRITICAL]  No Data");
    int sent = __sds_reply_status(sock, SDS_ERROR_NO_DATA);
    return sent == SDS_ERROR_IO_ERROR ? sent : code;
  }
  if (delivery.too_big) {
    SDS_LOGE("[CRITICAL] icon of %d bytes does not fit the shared memory", length);
  } else if (!whole) {
    SDS_LOGE("[CRITICAL] shared memory cut short while the icon was copied");
  }
  // The icon could not be handed over; the connection goes on.
  if (delivery.too_big || delivery.unmapped || !whole) {
    return __sds_reply_status(sock, SDS_ERROR_SHM_FAILED) == SDS_ERROR_IO_ERROR ? SDS_ERROR_IO_ERROR
                                                                                : SDS_ERROR_NONE;
  }
  const int32_t reply[4] = {SDS_ERROR_NONE, length, width, height};
  return __sds_reply(sock, SDS_ERROR_NONE, {__sds_item(reply, sizeof reply)});
}

int _sds_release_shm(sds_client* slot) {
  if (sds_free_shm() == 1) {
    sds_shm_drop_kept_mapping();
    slot->client_id = -1;
    return __sds_reply_status(slot->sock, SDS_ERROR_NONE);
  }
  return __sds_reply_status(slot->sock, SDS_ERROR_SHM_FAILED);
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
        return __sds_reply_status(sock, SDS_ERROR_OUT_OF_MEMORY);
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
  return __sds_reply(sock, SDS_ERROR_NONE, {__sds_item(reply, sizeof reply)});
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
  if (code != SDS_ERROR_NONE) return __sds_reply_status(sock, code);
  // A count of 0 is followed by no ids.
  const int32_t head[2] = {SDS_ERROR_NONE, count};
  if (count > 0 && owned_ids) {
    return __sds_reply(sock, code,
                       {__sds_item(head, sizeof head),
                        __sds_item(owned_ids.get(), static_cast<size_t>(count) * sizeof(int))});
  }
  return __sds_reply(sock, code, {__sds_item(head, sizeof head)});
}
