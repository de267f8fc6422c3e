// The statements kept by an SdsDbStatementScope: looked up by their SQL
// text when prepared, reset instead of finalized when given back. And the
// read transaction of SdsDbReadTransaction, and the paused file mapping of
// SdsDbFileMappingPause.
#include "database/sitedeck-service-db-stmt-cache.h"

#include <sqlite3.h>

#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "sitedeck-service-log.h"

namespace {

// More distinct statements than any bulk operation runs; past this many new
// ones are simply not kept.
constexpr size_t kMaxKept = 64;

struct kept_statement {
  std::string sql;
  sqlite3_stmt* stmt = nullptr;
  bool in_use = false;
};

struct statement_cache {
  sqlite3* handle = nullptr;  // null: no scope open
  std::vector<kept_statement> kept;
};

// The connection is used by one thread at a time; a scope belongs to the
// thread that opened it.
thread_local statement_cache g_cache;

}  // namespace

SdsDbStatementScope::SdsDbStatementScope(sqlite3* handle) {
  if (g_cache.handle != nullptr || handle == nullptr) return;
  g_cache.handle = handle;
  owner_ = true;
}

SdsDbStatementScope::~SdsDbStatementScope() {
  if (!owner_) return;
  for (kept_statement& k : g_cache.kept) {
    // One still in use is finalized by its holder, which no longer finds it.
    if (!k.in_use) (void)sqlite3_finalize(k.stmt);
  }
  g_cache.kept.clear();
  g_cache.kept.shrink_to_fit();
  g_cache.handle = nullptr;
}

SdsDbReadTransaction::SdsDbReadTransaction(sqlite3* handle) {
  if (handle == nullptr || sqlite3_get_autocommit(handle) == 0) return;
  if (sqlite3_exec(handle, "BEGIN", nullptr, nullptr, nullptr) == SQLITE_OK) handle_ = handle;
}

SdsDbReadTransaction::~SdsDbReadTransaction() {
  // A read transaction has nothing to lose: should COMMIT fail, roll back.
  if (handle_ == nullptr || sqlite3_get_autocommit(handle_) != 0) return;
  if (sqlite3_exec(handle_, "COMMIT", nullptr, nullptr, nullptr) != SQLITE_OK) {
    (void)sqlite3_exec(handle_, "ROLLBACK", nullptr, nullptr, nullptr);
  }
}

SdsDbFileMappingPause::SdsDbFileMappingPause(sqlite3* handle) {
  if (handle == nullptr) return;
  sqlite3_stmt* raw = nullptr;
  long long size = 0;
  if (sqlite3_prepare_v2(handle, "PRAGMA mmap_size", -1, &raw, nullptr) == SQLITE_OK &&
      sqlite3_step(raw) == SQLITE_ROW) {
    size = sqlite3_column_int64(raw, 0);
  }
  (void)sqlite3_finalize(raw);
  if (size <= 0) return;
  if (sqlite3_exec(handle, "PRAGMA mmap_size=0", nullptr, nullptr, nullptr) != SQLITE_OK) return;
  handle_ = handle;
  size_ = size;
}

SdsDbFileMappingPause::~SdsDbFileMappingPause() {
  if (handle_ == nullptr) return;
  char* restore = sqlite3_mprintf("PRAGMA mmap_size=%lld", size_);
  if (restore != nullptr) (void)sqlite3_exec(handle_, restore, nullptr, nullptr, nullptr);
  sqlite3_free(restore);
}

sqlite3_stmt* sds_db_stmt_cache_take(sqlite3* handle, const char* sql) {
  if (g_cache.handle == nullptr || handle != g_cache.handle || sql == nullptr) return nullptr;
  for (kept_statement& k : g_cache.kept) {
    if (!k.in_use && k.sql == sql) {
      k.in_use = true;
      return k.stmt;
    }
  }
  return nullptr;
}

bool sds_db_stmt_cache_keep(sqlite3* handle, const char* sql, sqlite3_stmt* stmt) {
  if (g_cache.handle == nullptr || handle != g_cache.handle || sql == nullptr || stmt == nullptr ||
      g_cache.kept.size() >= kMaxKept) {
    return false;
  }
  try {
    g_cache.kept.push_back(kept_statement{sql, stmt, true});
  } catch (const std::bad_alloc&) {
    return false;  // not kept: the holder finalizes it as usual
  }
  return true;
}

bool sds_db_stmt_cache_give_back(sqlite3_stmt* stmt) {
  if (g_cache.handle == nullptr || stmt == nullptr) return false;
  for (kept_statement& k : g_cache.kept) {
    if (k.stmt != stmt || !k.in_use) continue;
    // sqlite3_reset repeats the error of a failed last step, as
    // sqlite3_finalize would have; the log says so in the same words.
    if (sqlite3_reset(stmt) != SQLITE_OK) {
      SDS_LOGE("sqlite3_finalize:%s", sqlite3_errmsg(g_cache.handle));
    }
    (void)sqlite3_clear_bindings(stmt);
    k.in_use = false;
    return true;
  }
  return false;
}
