// Column reads of one row (by id or by URL) and the delete by URL. A read
// tells a missing row (SDS_ERROR_ID_NOT_FOUND, result -1) from a row whose
// value is NULL, empty or of another type (SDS_ERROR_NO_DATA, result 0), and
// writes its outputs only when it delivers a value. The reads by id of an
// item's served columns are answered from the rows the connection read
// lately while the file is unchanged (sitedeck-service-db-kept-rows.cpp),
// with the same outcome, codes and log lines as a read of the table.
#include <sqlite3.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-db.h"
#include "sitedeck-service-log.h"

namespace {

// The text of a one-row read of `column`, keyed by `key_column` = ?1.
char* read_sql(const char* table, const char* column, const char* key_column) {
  return sqlite3_mprintf("SELECT %s FROM %s WHERE %s = ? LIMIT 1", column, table, key_column);
}

// Prepares a one-row read by id, kept with the connection: the requests of
// the browser repeat these reads all the time.
bool prepare_read_by_id(sqlite3* handle, const char* table, const char* column,
                        SqliteKeptStmt* stmt, int* error_code) {
  return sds_db_prepare_kept(handle, read_sql(table, column, "id"), stmt, error_code);
}

// The type code of the text typeof() gives.
int type_code(const unsigned char* type_name) {
  static const struct {
    const char* name;
    int code;
  } kTypes[] = {{"integer", SQLITE_INTEGER}, {"real", SQLITE_FLOAT}, {"text", SQLITE_TEXT},
                {"blob", SQLITE_BLOB}, {"null", SQLITE_NULL}};
  for (const auto& type : kTypes) {
    if (type_name != nullptr && std::strcmp(reinterpret_cast<const char*>(type_name), type.name) == 0) {
      return type.code;
    }
  }
  return SQLITE_NULL;
}

// The first column of the statement's current row.
sds_db_column column_of(sqlite3_stmt* stmt) {
  sds_db_column column;
  column.type = sqlite3_column_type(stmt, 0);
  if (column.type == SQLITE_TEXT) {
    column.text = sqlite3_column_text(stmt, 0);
    column.bytes = sqlite3_column_bytes(stmt, 0);
  } else if (column.type == SQLITE_INTEGER || column.type == SQLITE_FLOAT) {
    column.number = sqlite3_column_int64(stmt, 0);
  }
  return column;
}

// Copies a text column into a new terminated string.
void take_text(const sds_db_column& column, char** value, int* error_code) {
  if (column.type != SQLITE_TEXT) {
    SDS_LOGE("check column type:%d", column.type);
    *error_code = SDS_ERROR_NO_DATA;
    return;
  }
  if (column.bytes < 1) {
    *error_code = SDS_ERROR_NO_DATA;
    return;
  }
  auto* copy = static_cast<char*>(std::calloc(static_cast<size_t>(column.bytes) + 1, 1));
  if (copy == nullptr || column.text == nullptr) {
    std::free(copy);
    SDS_LOGE("check available system memory");
    *error_code = SDS_ERROR_OUT_OF_MEMORY;
    return;
  }
  std::memcpy(copy, column.text, static_cast<size_t>(column.bytes));
  *value = copy;
}

// Takes an integer column: an INTEGER into the first four bytes, a FLOAT
// converted to a 64-bit integer over all eight.
void take_int(const sds_db_column& column, sds_db_value* value, int* error_code) {
  if (column.type == SQLITE_INTEGER) {
    value->i32 = static_cast<int32_t>(column.number);
  } else if (column.type == SQLITE_FLOAT) {
    value->i64 = column.number;
  } else {
    SDS_LOGE("check column type:%d", column.type);
    *error_code = SDS_ERROR_NO_DATA;
  }
}

// Steps a text read and evaluates it; see the module comment for the codes.
int finish_text_read(sqlite3* handle, sqlite3_stmt* stmt, char** value, int* error_code) {
  *error_code = SDS_ERROR_NONE;
  if (sqlite3_step(stmt) == SQLITE_ROW) {
    take_text(column_of(stmt), value, error_code);
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
  sds_db_column kept;
  if (sds_db_kept_column(handle, id, table, column, &kept)) {
    *error_code = SDS_ERROR_NONE;
    take_text(kept, value, error_code);
    return *error_code == SDS_ERROR_NONE || *error_code == SDS_ERROR_NO_DATA ? 0 : -1;
  }
  SqliteKeptStmt stmt;
  if (!prepare_read_by_id(handle, table, column, &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt.get(), 1, id), error_code)) {
    return -1;
  }
  return finish_text_read(handle, stmt.get(), value, error_code);
}

int sds_db_view_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                              SqliteKeptStmt* stmt, const unsigned char** value, int* size,
                              int* error_code) {
  if (!check_read_by_id(handle, id, table, column, value, error_code)) return -1;
  if (size == nullptr) {
    SDS_LOGE("check materials for query id:%d", id);
    return -1;
  }
  if (!prepare_read_by_id(handle, table, column, stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt->get(), 1, id), error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  int rc = sqlite3_step(stmt->get());
  *size = 0;
  if (rc != SQLITE_ROW) {
    *error_code = sds_db_reason_or(handle, SDS_ERROR_ID_NOT_FOUND);
    return -1;
  }
  int type = sqlite3_column_type(stmt->get(), 0);
  if (type != SQLITE_BLOB) {
    SDS_LOGE("check column type:%d", type);
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  const void* blob = sqlite3_column_blob(stmt->get(), 0);
  int bytes = sqlite3_column_bytes(stmt->get(), 0);
  if (bytes < 1 || blob == nullptr) {
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  *value = static_cast<const unsigned char*>(blob);
  *size = bytes;
  return 0;
}

int sds_db_check_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                               SqliteKeptStmt* stmt, int* size, int* error_code) {
  if (!check_read_by_id(handle, id, table, column, stmt, error_code)) return -1;
  if (size == nullptr) {
    SDS_LOGE("check materials for query id:%d", id);
    return -1;
  }
  // typeof() and length() of a column leave the value itself unread.
  if (!sds_db_prepare_kept(handle,
                           sqlite3_mprintf("SELECT typeof(%s), length(%s) FROM %s WHERE %s = ? LIMIT 1",
                                           column, column, table, "id"),
                           stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt->get(), 1, id), error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  int rc = sqlite3_step(stmt->get());
  *size = 0;
  if (rc != SQLITE_ROW) {
    *error_code = sds_db_reason_or(handle, SDS_ERROR_ID_NOT_FOUND);
    return -1;
  }
  int type = type_code(sqlite3_column_text(stmt->get(), 0));
  if (type != SQLITE_BLOB) {
    SDS_LOGE("check column type:%d", type);
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  int bytes = sqlite3_column_int(stmt->get(), 1);
  if (bytes < 1) {
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  *size = bytes;
  return 0;
}

int sds_db_read_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                              unsigned char* destination, int size, int* error_code) {
  sqlite3_blob* raw = nullptr;
  int rc = sqlite3_blob_open(handle, "main", table, column, id, 0, &raw);
  std::unique_ptr<sqlite3_blob, int (*)(sqlite3_blob*)> blob(raw, sqlite3_blob_close);
  if (rc == SQLITE_OK && sqlite3_blob_bytes(blob.get()) == size) {
    rc = sqlite3_blob_read(blob.get(), destination, size, 0);
    if (rc == SQLITE_OK) return 0;
  }
  *error_code = sds_db_reason_or(handle, SDS_ERROR_NO_DATA);
  return -1;
}

int sds_db_get_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                             unsigned char** value, int* size, int* error_code) {
  SqliteKeptStmt stmt;
  const unsigned char* stored = nullptr;
  int result = sds_db_view_property_blob(handle, id, table, column, &stmt,
                                         value != nullptr ? &stored : nullptr, size, error_code);
  if (result != 0 || stored == nullptr) return result;
  auto* copy = static_cast<unsigned char*>(std::malloc(static_cast<size_t>(*size)));
  if (copy == nullptr) {
    SDS_LOGE("check available system memory");
    *error_code = SDS_ERROR_OUT_OF_MEMORY;
    *size = 0;
    return -1;
  }
  std::memcpy(copy, stored, static_cast<size_t>(*size));
  *value = copy;
  return 0;
}

int sds_db_get_property_int(sqlite3* handle, int id, const char* table, const char* column,
                            sds_db_value* value, int* error_code) {
  if (!check_read_by_id(handle, id, table, column, value, error_code)) return -1;
  sds_db_column kept;
  if (sds_db_kept_column(handle, id, table, column, &kept)) {
    *error_code = SDS_ERROR_NONE;
    take_int(kept, value, error_code);
    return 0;
  }
  SqliteKeptStmt stmt;
  if (!prepare_read_by_id(handle, table, column, &stmt, error_code) ||
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
  take_int(column_of(stmt.get()), value, error_code);
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
  if (!sds_db_prepare(handle, read_sql(table, column, "url"), &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_text(stmt.get(), 1, url, -1, SQLITE_STATIC),
                      error_code)) {
    return -1;
  }
  return finish_text_read(handle, stmt.get(), value, error_code);
}
