// Handlers of the browser's item queries (commands 2 to 11): each reads what
// the command carries, asks the item store and writes the reply. The reply
// layouts are fixed by the wire protocol (docs/protocol.md).
#include <cstdio>
#include <cstdlib>
#include <cstring>

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

}  // namespace

int _sds_get_string(int sock, int item_id, const char* column) {
  if (sock < 0 || item_id < 0 || column == nullptr) {
    SDS_LOGE("[CRITICAL]  Invalid Parameter");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  char* text = nullptr;
  int code = sds_get_string_from_db(item_id, &text, column);
  UniqueCStr owned(text);
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
  unsigned char* bytes = nullptr;
  int code = sds_get_blob_from_db(item_id, &length, &height, &width, &bytes);
  UniqueMalloc<unsigned char> pixels(bytes);
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("[CRITICAL]  No Data");
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_NO_DATA);
    return code;
  }
  // The object holds SDS_SHM_SIZE bytes; a bigger icon cannot be handed over.
  if (length < 0 || static_cast<size_t>(length) > SDS_SHM_SIZE) {
    SDS_LOGE("[CRITICAL] icon of %d bytes does not fit the shared memory", length);
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_SHM_FAILED);
    return SDS_ERROR_NONE;
  }
  void* mapping = sds_attach_shm();
  if (mapping == nullptr) {
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_SHM_FAILED);
    return SDS_ERROR_NONE;
  }
  std::memcpy(mapping, pixels.get(), static_cast<size_t>(length));
  if (sds_dettach_shm(mapping) != 1) {
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_SHM_FAILED);
    return SDS_ERROR_NONE;
  }
  if (sds_ipc_send_errorcode(sock, SDS_ERROR_NONE) == 0 &&
      sds_ipc_send_custom_type(sock, &length, sizeof length) == 0 &&
      sds_ipc_send_custom_type(sock, &width, sizeof width) == 0) {
    (void)sds_ipc_send_custom_type(sock, &height, sizeof height);
  }
  return SDS_ERROR_NONE;
}

int _sds_release_shm(sds_client* slot) {
  if (sds_free_shm() == 1) {
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
