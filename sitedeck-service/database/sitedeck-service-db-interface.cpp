// The item accessors: one property of one item by id or URL, the id list,
// and the single-column writes of the merge, each a generic row operation on
// `site_deck` through the process's one connection. Every code a row
// operation reports is logged here by name; the callers get it unchanged.
#include "database/sitedeck-service-db-interface.h"

#include "database/sitedeck-service-error.h"
#include "sitedeck-service-log.h"

sqlite3* sds_db_handle = nullptr;

namespace {

constexpr const char* kSiteDeck = "site_deck";

// Logs a non-zero code by name and hands it back.
int logged(int code) {
  if (code != SDS_ERROR_NONE) SDS_LOGE("Error : %s", sds_error_string(code));
  return code;
}

int read_text(int id, const char* column, char** value) {
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_property_string(sds_db_handle, id, kSiteDeck, column, value, &code);
  return logged(code);
}

// One-column write; 0, or -1 after logging the code.
int write_column(int id, const char* column, const void* value, int value_type) {
  int code = SDS_ERROR_NONE;
  if (sds_db_column_replace(sds_db_handle, id, kSiteDeck, column, value, 0, value_type, &code) ==
      0) {
    return 0;
  }
  (void)logged(code);
  return -1;
}

}  // namespace

int sds_ensure_db_open(void) {
  if (sds_db_handle != nullptr) return SDS_ERROR_NONE;
  (void)sds_db_open(&sds_db_handle);
  return sds_db_handle != nullptr ? SDS_ERROR_NONE : SDS_ERROR_DB_OPEN_FAILED;
}

int sds_ensure_db_sound(void) {
  if (sds_ensure_db_open() != SDS_ERROR_NONE) return SDS_ERROR_DB_OPEN_FAILED;
  if (sds_db_is_sound(sds_db_handle)) return SDS_ERROR_NONE;
  SDS_LOGE("database is damaged: it is made afresh");
  sds_db_discard(sds_db_handle);
  sds_db_handle = nullptr;
  return sds_ensure_db_open();
}

int sds_get_string_from_db(int id, char** value, const char* column) {
  if (value == nullptr) {
    SDS_LOGE("NULL check::value");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, column, value);
}

int sds_get_int_from_db(int id, sds_db_value* value, const char* column) {
  if (value == nullptr) {
    SDS_LOGE("NULL check::value");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_property_int(sds_db_handle, id, kSiteDeck, column, value, &code);
  return logged(code);
}

int sds_get_all_ids_from_db(int** ids, int* count, const char* cond_column, const void* cond_value,
                            int cond_type) {
  if (ids == nullptr) {
    SDS_LOGE("NULL check::dirty_ids");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_all_dirty_ids(sds_db_handle, ids, count, cond_column, cond_value, cond_type,
                                 &code);
  return logged(code);
}

int sds_get_string_for_url_from_db(const char* url, char** value, const char* column) {
  if (url == nullptr) {
    SDS_LOGE("NULL check::url");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (value == nullptr) {
    SDS_LOGE("NULL check::value");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_property_string_for_url(sds_db_handle, url, kSiteDeck, column, value, &code);
  return logged(code);
}

int update_sitedeck_order_index_to_db(int id, const int* order_index) {
  return write_column(id, "order_index", order_index, SDS_DB_COLUMN_TYPE_INT);
}

int update_sitedeck_is_specially_removed(int id, int flag) {
  int is_dirty = flag != 0 ? -1 : 1;
  return write_column(id, "is_dirty", &is_dirty, SDS_DB_COLUMN_TYPE_INT);
}

int update_sitedeck_title_to_db(int id, const char* title) {
  return write_column(id, "title", title, SDS_DB_COLUMN_TYPE_TEXT);
}

int update_sitedeck_predominant_color_to_db(int id, const char* color) {
  return write_column(id, "dominant_color", color, SDS_DB_COLUMN_TYPE_TEXT);
}

int delete_sitedeck_item_from_db(const char* url) {
  if (url == nullptr) {
    SDS_LOGE("NULL check::url");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int code = SDS_ERROR_NONE;
  if (sds_db_delete_url(sds_db_handle, url, kSiteDeck, &code) == 0) return 0;
  (void)logged(code);
  return -1;
}

int get_sitedeck_url_from_db(int id, char** url) {
  if (url == nullptr) {
    SDS_LOGE("NULL check::url");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, "url", url);
}

int get_sitedeck_title_from_db(int id, char** title) {
  if (title == nullptr) {
    SDS_LOGE("NULL check::title");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, "title", title);
}

int get_sitedeck_icon_path_from_db(int id, char** path) {
  if (path == nullptr) {
    SDS_LOGE("NULL check::path");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, "icon_path", path);
}

int get_sitedeck_icon_size_from_db(int id, char** size) {
  if (size == nullptr) {
    SDS_LOGE("NULL check::size");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, "icon_size", size);
}

int get_sitedeck_icon_data_from_db(int id, unsigned char** data, int* data_size) {
  if (data == nullptr) {
    SDS_LOGE("NULL check::data");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (data_size == nullptr) {
    SDS_LOGE("NULL check::data_size");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_property_blob(sds_db_handle, id, kSiteDeck, "icon_data", data, data_size, &code);
  return logged(code);
}

int get_sitedeck_icon_dominant_color(int id, char** color) {
  if (color == nullptr) {
    SDS_LOGE("NULL check::color");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, "dominant_color", color);
}

int get_sitedeck_icon_time_stamp(int id, char** time_stamp) {
  if (time_stamp == nullptr) {
    SDS_LOGE("NULL check::time_stamp");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return read_text(id, "image_last_updated", time_stamp);
}

int get_sitedeck_item_from_db(int /*id*/, sds_item* item) {
  if (item == nullptr) {
    SDS_LOGE("NULL check::item");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return SDS_ERROR_NONE;
}
