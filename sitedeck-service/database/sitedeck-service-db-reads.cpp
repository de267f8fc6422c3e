// Column reads of one row (by id or by URL) and the delete by URL. A read
// tells a missing row (SDS_ERROR_ID_NOT_FOUND, result -1) from a row whose
// value is NULL, empty or of another type (SDS_ERROR_NO_DATA, result 0), and
// writes its outputs only when it delivers a value.
#include <sqlite3.h>

#include <cstdlib>
#include <cstring>

#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-db.h"
#include "sitedeck-service-log.h"

namespace {

// Prepares a one-row read of `column`, keyed by `key_column` = ?1.
bool prepare_read(sqlite3* handle, const char* table, const char* column, const char* key_column,
                  SqliteStmt* stmt, int* error_code) {
  return sds_db_prepare(
      handle, sqlite3_mprintf("SELECT %s FROM %s WHERE %s = ? LIMIT 1", column, table, key_column),
      stmt, error_code);
}

// Copies a text column of the current row into a new terminated string.
void take_text(sqlite3_stmt* stmt, char** value, int* error_code) {
  int type = sqlite3_column_type(stmt, 0);
  if (type != SQLITE_TEXT) {
    SDS_LOGE("check column type:%d", type);
    *error_code = SDS_ERROR_NO_DATA;
    return;
  }
  const unsigned char* text = sqlite3_column_text(stmt, 0);
  int bytes = sqlite3_column_bytes(stmt, 0);
  if (bytes < 1) {
    *error_code = SDS_ERROR_NO_DATA;
    return;
  }
  auto* copy = static_cast<char*>(std::calloc(static_cast<size_t>(bytes) + 1, 1));
  if (copy == nullptr || text == nullptr) {
    std::free(copy);
    SDS_LOGE("check available system memory");
    *error_code = SDS_ERROR_OUT_OF_MEMORY;
    return;
  }
  std::memcpy(copy, text, static_cast<size_t>(bytes));
  *value = copy;
}

// Steps a text read and evaluates it; see the module comment for the codes.
int finish_text_read(sqlite3* handle, sqlite3_stmt* stmt, char** value, int* error_code) {
  *error_code = SDS_ERROR_NONE;
  if (sqlite3_step(stmt) == SQLITE_ROW) {
    take_text(stmt, value, error_code);
  } else {
    *error_code = sds_db_reason_or(handle, SDS_ERROR_ID_NOT_FOUND);
  }
  return *error_code == SDS_ERROR_NONE || *error_code == SDS_ERROR_NO_DATA ? 0 : -1;
}

// The common checks of a read by id; false after logging.
bool check_read_by_id(sqlite3* handle, int id, const char* table, const char* column,
                      const void* output, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return false;
  }
  if (id <= 0) {
    SDS_LOGE("check id:%d", id);
    return false;
  }
  if (table == nullptr || column == nullptr || output == nullptr) {
    SDS_LOGE("check materials for query id:%d", id);
    return false;
  }
  return true;
}

}  // namespace

int sds_db_get_property_string(sqlite3* handle, int id, const char* table, const char* column,
                               char** value, int* error_code) {
  if (!check_read_by_id(handle, id, table, column, value, error_code)) return -1;
  SqliteStmt stmt;
  if (!prepare_read(handle, table, column, "id", &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt.get(), 1, id), error_code)) {
    return -1;
  }
  return finish_text_read(handle, stmt.get(), value, error_code);
}

int sds_db_get_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                             unsigned char** value, int* size, int* error_code) {
  if (!check_read_by_id(handle, id, table, column, value, error_code)) return -1;
  if (size == nullptr) {
    SDS_LOGE("check materials for query id:%d", id);
    return -1;
  }
  SqliteStmt stmt;
  if (!prepare_read(handle, table, column, "id", &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt.get(), 1, id), error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  int rc = sqlite3_step(stmt.get());
  *size = 0;
  if (rc != SQLITE_ROW) {
    *error_code = sds_db_reason_or(handle, SDS_ERROR_ID_NOT_FOUND);
    return -1;
  }
  int type = sqlite3_column_type(stmt.get(), 0);
  if (type != SQLITE_BLOB) {
    SDS_LOGE("check column type:%d", type);
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  const void* blob = sqlite3_column_blob(stmt.get(), 0);
  int bytes = sqlite3_column_bytes(stmt.get(), 0);
  if (bytes < 1 || blob == nullptr) {
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  auto* copy = static_cast<unsigned char*>(std::malloc(static_cast<size_t>(bytes)));
  if (copy == nullptr) {
    SDS_LOGE("check available system memory");
    *error_code = SDS_ERROR_OUT_OF_MEMORY;
    return -1;
  }
  std::memcpy(copy, blob, static_cast<size_t>(bytes));
  *value = copy;
  *size = bytes;
  return 0;
}

int sds_db_get_property_int(sqlite3* handle, int id, const char* table, const char* column,
                            sds_db_value* value, int* error_code) {
  if (!check_read_by_id(handle, id, table, column, value, error_code)) return -1;
  SqliteStmt stmt;
  if (!prepare_read(handle, table, column, "id", &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt.get(), 1, id), error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  int rc = sqlite3_step(stmt.get());
  if (rc == SQLITE_DONE) {
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  if (rc != SQLITE_ROW) {
    *error_code = sds_db_reason_or(handle, SDS_ERROR_ID_NOT_FOUND);
    return -1;
  }
  int type = sqlite3_column_type(stmt.get(), 0);
  if (type == SQLITE_INTEGER) {
    value->i32 = sqlite3_column_int(stmt.get(), 0);
  } else if (type == SQLITE_FLOAT) {
    value->i64 = sqlite3_column_int64(stmt.get(), 0);
  } else {
    SDS_LOGE("check column type:%d", type);
    *error_code = SDS_ERROR_NO_DATA;
  }
  return 0;
}

int sds_db_delete_url(sqlite3* handle, const char* url, const char* table, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  if (table == nullptr || url == nullptr) {
    SDS_LOGE("check materials for delete");
    return -1;
  }
  // %q doubles every single quote, so the URL stays one string literal.
  SqliteStmt stmt;
  if (!sds_db_prepare(handle, sqlite3_mprintf("DELETE FROM %s WHERE %s = '%q'", table, "url", url),
                      &stmt, error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  if (sqlite3_step(stmt.get()) != SQLITE_DONE) {
    SDS_LOGE("deleting url (%s) from DB failed", url);
    *error_code = SDS_ERROR_NO_DATA;
  }
  return *error_code == SDS_ERROR_NONE ? 0 : -1;
}

int sds_db_get_property_string_for_url(sqlite3* handle, const char* url, const char* table,
                                       const char* column, char** value, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  if (url == nullptr || url[0] == '\0') {
    SDS_LOGE("Url is null or empty");
    return -1;
  }
  if (table == nullptr || column == nullptr || value == nullptr) {
    SDS_LOGE("check materials for query for url = %s", url);
    return -1;
  }
  SqliteStmt stmt;
  if (!prepare_read(handle, table, column, "url", &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_text(stmt.get(), 1, url, -1, SQLITE_STATIC),
                      error_code)) {
    return -1;
  }
  return finish_text_read(handle, stmt.get(), value, error_code);
}
