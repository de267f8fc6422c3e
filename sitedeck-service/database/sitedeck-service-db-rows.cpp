// Generic row and column operations over the `site_deck` table: counting and
// finding rows, listing ids in order_index order, inserting, replacing one
// column, reading one column as text, bytes or integer, and deleting by URL.
// Table and column names are constants of the service and are formatted into
// the SQL text; every value is bound, except the URL of a delete, which is
// quoted as one SQL string literal. Each call prepares, runs and finalizes its
// own statements (or, inside an SdsDbStatementScope, reuses kept ones);
// nothing outlives it but the outputs it hands out.
#include <sqlite3.h>

#include <cstdlib>
#include <cstring>

#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-db.h"
#include "sitedeck-service-log.h"

namespace {

constexpr const char* kSiteDeck = "site_deck";

// Steps an INSERT or UPDATE once; true when it finished.
bool step_write(sqlite3* handle, sqlite3_stmt* stmt, int* error_code) {
  int rc = sqlite3_step(stmt);
  SDS_LOGE("Before write finalize, sqlite response code %d", rc);
  if (rc == SQLITE_DONE) return true;
  sds_db_log_failure(handle, "a write");
  *error_code = sds_db_reason_or(handle, SDS_ERROR_INVALID_PARAMETER);
  return false;
}

// Binds the condition of an id listing: the given value, or the integer 1
// when column or value is missing.
bool bind_condition(sqlite3* handle, sqlite3_stmt* stmt, const char* cond_column,
                    const void* cond_value, int cond_type, int* error_code) {
  int rc = SQLITE_OK;
  if (cond_column == nullptr || cond_value == nullptr) {
    rc = sqlite3_bind_int(stmt, 1, 1);
  } else if (cond_type == SDS_DB_COND_TYPE_INT) {
    rc = sqlite3_bind_int(stmt, 1, *static_cast<const int*>(cond_value));
  } else if (cond_type == SDS_DB_COND_TYPE_TEXT) {
    rc = sqlite3_bind_text(stmt, 1, static_cast<const char*>(cond_value), -1, SQLITE_STATIC);
  } else {
    SDS_LOGE("invalid type:%d", cond_type);
    *error_code = SDS_ERROR_INVALID_PARAMETER;
    return false;
  }
  return sds_db_bind_ok(handle, rc, error_code);
}

// Binds a fixed text field of an icon, which need not be terminated when full.
int bind_fixed_text(sqlite3_stmt* stmt, int index, const char* field, size_t capacity) {
  return sqlite3_bind_text(stmt, index, field, static_cast<int>(strnlen(field, capacity)),
                           SQLITE_STATIC);
}

}  // namespace

int sds_db_reason_or(sqlite3* handle, int fallback) {
  int code = sds_db_get_errorcode(handle);
  return code == SDS_ERROR_NONE ? fallback : code;
}

bool sds_db_prepare(sqlite3* handle, char* sql, SqliteStmt* stmt, int* error_code) {
  SqliteText text(sql);
  if (!text) {
    SDS_LOGE("check available memory");
    return false;
  }
  if (sqlite3_stmt* kept = sds_db_stmt_cache_take(handle, text.get())) {
    stmt->reset(kept);
    return true;
  }
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, text.get(), -1, &raw, nullptr);
  stmt->reset(raw);
  if (rc != SQLITE_OK) {
    SDS_LOGE("Before finalize, sqlite response code %d", rc);
    *error_code = sds_db_reason_or(handle, SDS_ERROR_INVALID_PARAMETER);
    return false;
  }
  (void)sds_db_stmt_cache_keep(handle, text.get(), raw);
  return true;
}

bool sds_db_bind_ok(sqlite3* handle, int rc, int* error_code) {
  if (rc == SQLITE_OK) return true;
  SDS_LOGE("Before finalize, sqlite response code %d", rc);
  *error_code = sds_db_reason_or(handle, SDS_ERROR_INVALID_PARAMETER);
  return false;
}

int sds_db_check_duplicated_int(sqlite3* handle, const char* table, const char* column, int value,
                                int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  SqliteStmt stmt;
  if (!sds_db_prepare(handle,
                      sqlite3_mprintf("SELECT count(*) FROM %s WHERE %s IS ?", table, column),
                      &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_int(stmt.get(), 1, value), error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  if (sqlite3_step(stmt.get()) != SQLITE_ROW) return 0;
  return sqlite3_column_int(stmt.get(), 0);
}

int sds_db_check_duplicated_string(sqlite3* handle, const char* table, const char* column,
                                   const char* value, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  SqliteStmt stmt;
  if (!sds_db_prepare(handle,
                      sqlite3_mprintf("SELECT %s FROM %s WHERE %s IS ?", "id", table, column),
                      &stmt, error_code) ||
      !sds_db_bind_ok(handle, sqlite3_bind_text(stmt.get(), 1, value, -1, SQLITE_STATIC),
                      error_code)) {
    return -1;
  }
  *error_code = SDS_ERROR_NONE;
  if (sqlite3_step(stmt.get()) != SQLITE_ROW) return -1;
  return sqlite3_column_int(stmt.get(), 0);
}

int sds_db_get_all_dirty_ids(sqlite3* handle, int** ids, int* count, const char* cond_column,
                             const void* cond_value, int cond_type, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  if (ids == nullptr || count == nullptr) {
    SDS_LOGE("check output arguments");
    return -1;
  }
  const char* column = cond_column != nullptr ? cond_column : "is_dirty";

  int total = 0;
  {
    SqliteStmt stmt;
    if (!sds_db_prepare(handle,
                        sqlite3_mprintf("SELECT count(*) FROM %s WHERE %s=? order by %s ASC",
                                        kSiteDeck, column, "order_index"),
                        &stmt, error_code) ||
        !bind_condition(handle, stmt.get(), cond_column, cond_value, cond_type, error_code)) {
      return -1;
    }
    if (sqlite3_step(stmt.get()) != SQLITE_ROW) return -1;
    total = sqlite3_column_int(stmt.get(), 0);
    *error_code = SDS_ERROR_NONE;
  }
  if (total <= 0) {
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }

  SqliteStmt stmt;
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (!sds_db_prepare(handle,
                      sqlite3_mprintf("SELECT %s FROM %s WHERE %s=? order by %s ASC", "id",
                                      kSiteDeck, column, "order_index"),
                      &stmt, error_code) ||
      !bind_condition(handle, stmt.get(), cond_column, cond_value, cond_type, error_code)) {
    return -1;
  }
  auto* list = static_cast<int*>(std::calloc(static_cast<size_t>(total), sizeof(int)));
  if (list == nullptr) {
    SDS_LOGE("failed to calloc");
    *error_code = SDS_ERROR_OUT_OF_MEMORY;
    return -1;
  }
  int filled = 0;
  while (filled < total && sqlite3_step(stmt.get()) == SQLITE_ROW) {
    list[filled++] = sqlite3_column_int(stmt.get(), 0);
  }
  // Only rows actually read are handed out, should the table have shrunk
  // between the two statements.
  if (filled == 0) {
    std::free(list);
    *error_code = SDS_ERROR_NO_DATA;
    return 0;
  }
  *ids = list;
  *count = filled;
  *error_code = SDS_ERROR_NONE;
  return 0;
}

int sds_db_create_site_deck_id(sqlite3* handle, int* id, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  if (id == nullptr) {
    SDS_LOGE("check output arguments");
    return -1;
  }
  SqliteStmt stmt;
  if (!sds_db_prepare(handle, sqlite3_mprintf("INSERT INTO %s (%s) VALUES ('')", kSiteDeck, "url"),
                      &stmt, error_code) ||
      !step_write(handle, stmt.get(), error_code)) {
    return -1;
  }
  *id = static_cast<int>(sqlite3_last_insert_rowid(handle));
  *error_code = SDS_ERROR_NONE;
  return 0;
}

int sds_db_create_site_deck_item(sqlite3* handle, const sds_item* item, int* error_code) {
  *error_code = SDS_ERROR_NONE;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  if (item == nullptr) {
    SDS_LOGE("check materials for insert");
    *error_code = SDS_ERROR_INVALID_PARAMETER;
    return -1;
  }
  SqliteStmt stmt;
  if (!sds_db_prepare(
          handle,
          sqlite3_mprintf("INSERT INTO %s (%s,%s,%s,%s,%s,%s,%s,%s) VALUES (?,?,?,?,?,?,?,?)",
                          kSiteDeck, "url", "title", "favicon_exists", "dominant_color",
                          "touch_icon_exists", "icon_size", "image_last_updated", "icon_path"),
          &stmt, error_code)) {
    return -1;
  }
  sqlite3_stmt* s = stmt.get();
  const sds_icon* icon = item->ps_sds_icon_list;
  const char* color = item->predominant_color != nullptr ? item->predominant_color : "";
  int rc = sqlite3_bind_text(s, 1, item->site_url, -1, SQLITE_STATIC);
  if (rc == SQLITE_OK) rc = sqlite3_bind_text(s, 2, item->site_name, -1, SQLITE_STATIC);
  if (rc == SQLITE_OK) rc = sqlite3_bind_int(s, 3, item->fav_icon_exists);
  if (rc == SQLITE_OK) rc = sqlite3_bind_text(s, 4, color, -1, SQLITE_STATIC);
  if (rc == SQLITE_OK) rc = sqlite3_bind_int(s, 5, item->touch_icons_exists);
  if (icon == nullptr) {
    for (int index = 6; index <= 8 && rc == SQLITE_OK; ++index) {
      rc = sqlite3_bind_text(s, index, "", -1, SQLITE_STATIC);
    }
  } else {
    if (rc == SQLITE_OK) rc = bind_fixed_text(s, 6, icon->icon_size, sizeof icon->icon_size);
    if (rc == SQLITE_OK) {
      rc = bind_fixed_text(s, 7, icon->last_modified, sizeof icon->last_modified);
    }
    if (rc == SQLITE_OK) rc = sqlite3_bind_text(s, 8, icon->icon_path, -1, SQLITE_STATIC);
  }
  if (!sds_db_bind_ok(handle, rc, error_code) || !step_write(handle, s, error_code)) return -1;
  return static_cast<int>(sqlite3_last_insert_rowid(handle));
}

int sds_db_column_replace(sqlite3* handle, int id, const char* table, const char* column,
                          const void* value, int length, int value_type, int* error_code) {
  sds_db_column_value one{column, value, length, value_type};
  return sds_db_columns_replace(handle, id, table, &one, 1, error_code);
}

int sds_db_columns_replace(sqlite3* handle, int id, const char* table,
                           const sds_db_column_value* values, int count, int* error_code) {
  *error_code = SDS_ERROR_INVALID_PARAMETER;
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return -1;
  }
  if (id <= 0) {
    SDS_LOGE("check id:%d", id);
    return -1;
  }
  bool complete = table != nullptr && values != nullptr && count > 0;
  for (int i = 0; complete && i < count; ++i) {
    complete = values[i].column != nullptr && values[i].value != nullptr;
  }
  if (!complete) {
    SDS_LOGE("check materials for query id:%d", id);
    return -1;
  }
  // "c1 = ?,c2 = ?": the names are constants of the service, as above.
  SqliteText assignments(sqlite3_mprintf("%s = ?", values[0].column));
  for (int i = 1; i < count && assignments; ++i) {
    assignments.reset(sqlite3_mprintf("%s,%s = ?", assignments.get(), values[i].column));
  }
  if (!assignments) {
    SDS_LOGE("check available memory");
    return -1;
  }
  SqliteStmt stmt;
  if (!sds_db_prepare(
          handle, sqlite3_mprintf("UPDATE %s SET %s WHERE %s IS ?", table, assignments.get(), "id"),
          &stmt, error_code)) {
    return -1;
  }
  for (int i = 0; i < count; ++i) {
    const sds_db_column_value& v = values[i];
    int rc = SQLITE_OK;
    switch (v.value_type) {
      case SDS_DB_COLUMN_TYPE_INT:
        rc = sqlite3_bind_int(stmt.get(), i + 1, *static_cast<const int*>(v.value));
        break;
      case SDS_DB_COLUMN_TYPE_INT64:
        rc = sqlite3_bind_int64(stmt.get(), i + 1, *static_cast<const int64_t*>(v.value));
        break;
      case SDS_DB_COLUMN_TYPE_TEXT:
        rc = sqlite3_bind_text(stmt.get(), i + 1, static_cast<const char*>(v.value), -1,
                               SQLITE_STATIC);
        break;
      case SDS_DB_COLUMN_TYPE_BLOB:
        if (v.length < 0) {
          SDS_LOGE("check materials for query id:%d", id);
          return -1;
        }
        rc = sqlite3_bind_blob(stmt.get(), i + 1, v.value, v.length, SQLITE_STATIC);
        break;
      default:
        SDS_LOGE("invalid type:%d", v.value_type);
        return -1;
    }
    if (!sds_db_bind_ok(handle, rc, error_code)) return -1;
  }
  if (!sds_db_bind_ok(handle, sqlite3_bind_int(stmt.get(), count + 1, id), error_code)) return -1;
  *error_code = SDS_ERROR_NONE;
  return step_write(handle, stmt.get(), error_code) ? 0 : -1;
}
