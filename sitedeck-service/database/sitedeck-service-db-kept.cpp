// The statements a connection keeps: the reads that every request of the
// browser repeats (one column of one item by id) are prepared once per
// connection instead of once per request, which was most of a request's time.
// A kept statement is reset and its bindings cleared when handed back, so
// between requests it holds no lock and no value; the cache holds a few,
// keyed by connection and SQL text, and is emptied when the connection closes.
// Only the connection's one thread uses it, as everything in this module.
#include <sqlite3.h>

#include <array>
#include <cstring>
#include <string>

#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-db.h"
#include "sitedeck-service-log.h"

namespace {

// More than the distinct reads of the requests (eight).
constexpr size_t kKeptStatements = 16;

struct kept_statement {
  sqlite3* handle = nullptr;
  std::string sql;
  sqlite3_stmt* stmt = nullptr;
  bool in_use = false;
};

std::array<kept_statement, kKeptStatements> g_kept;

kept_statement* __db_find_kept(sqlite3_stmt* stmt) {
  for (auto& entry : g_kept) {
    if (entry.stmt == stmt) return &entry;
  }
  return nullptr;
}

}  // namespace

bool sds_db_prepare_kept(sqlite3* handle, char* sql, SqliteKeptStmt* stmt, int* error_code) {
  SqliteText text(sql);
  if (!text) {
    SDS_LOGE("check available memory");
    return false;
  }
  kept_statement* free_place = nullptr;
  for (auto& entry : g_kept) {
    if (entry.stmt == nullptr) {
      if (free_place == nullptr) free_place = &entry;
    } else if (entry.handle == handle && !entry.in_use && entry.sql == text.get()) {
      entry.in_use = true;
      stmt->reset(entry.stmt);
      return true;
    }
  }
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, text.get(), -1, &raw, nullptr);
  if (rc != SQLITE_OK) {
    __db_finalize(raw);
    SDS_LOGE("Before finalize, sqlite response code %d", rc);
    *error_code = sds_db_reason_or(handle, SDS_ERROR_INVALID_PARAMETER);
    return false;
  }
  if (free_place != nullptr && raw != nullptr) {
    free_place->handle = handle;
    free_place->sql = text.get();
    free_place->stmt = raw;
    free_place->in_use = true;
  }
  stmt->reset(raw);
  return true;
}

void sds_db_release_kept(sqlite3_stmt* stmt) {
  if (stmt == nullptr) return;
  kept_statement* entry = __db_find_kept(stmt);
  if (entry == nullptr) {
    __db_finalize(stmt);
    return;
  }
  // Reset reports a failed step as finalize would; the log says so alike.
  if (sqlite3_reset(stmt) != SQLITE_OK) {
    SDS_LOGE("sqlite3_finalize:%s", sqlite3_errmsg(sqlite3_db_handle(stmt)));
  }
  (void)sqlite3_clear_bindings(stmt);
  entry->in_use = false;
}

void sds_db_drop_kept_statements(sqlite3* handle) {
  sds_db_drop_kept_rows(handle);
  for (auto& entry : g_kept) {
    if (entry.stmt == nullptr || entry.handle != handle) continue;
    (void)sqlite3_finalize(entry.stmt);
    entry = kept_statement{};
  }
}
