// The item database file and its one connection: opening an existing file,
// replacing a file that is not a database, creating a missing or empty one
// with the `site_deck` table, dropping the stored ETag while the table holds
// no item, closing, finalizing statements and mapping SQLite results to SDS
// codes. It never creates directories; the database directory comes with the
// installation. The table layout is described in docs/storage.md.
#include "database/sitedeck-service-db.h"

#include <sqlite3.h>
#include <unistd.h>

#include <string>

#include "database/sitedeck-service-db-stmt.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"

namespace {

constexpr const char* kCreateSiteDeckTable =
    "CREATE TABLE IF NOT EXISTS site_deck(id INTEGER UNIQUE PRIMARY KEY,url TEXT DEFAULT "
    "NULL,title TEXT DEFAULT NULL,favicon_exists  INTEGER DEFAULT 0,dominant_color TEXT DEFAULT "
    "NULL,touch_icon_exists INTEGER DEFAULT 0,touchicon TEXT,is_dirty INTEGER DEFAULT "
    "1,image_last_updated TEXT,icon_size TEXT,icon_path TEXT,icon_data BLOB,order_index INTEGER "
    "DEFAULT 0,sync1 TEXT DEFAULT NULL,sync2 TEXT DEFAULT NULL,sync3 TEXT DEFAULT NULL,sync4 TEXT "
    "DEFAULT NULL)";

// Sites are looked up by URL once per listed item during a merge and once
// or twice per item before its icon is fetched; without an index each lookup
// reads the whole table, which makes a merge quadratic in the list's length.
// Kept beside the table's own statement, which stays as it is.
constexpr const char* kCreateUrlIndex =
    "CREATE INDEX IF NOT EXISTS site_deck_url_index ON site_deck(url)";

// Another process of the service (a second browser connection) may hold the
// file for a moment; wait for it rather than fail at once.
constexpr int kBusyTimeoutMs = 2000;

// Reads go through a memory mapping of the file, up to this size, instead of
// a read() per page: an icon spans some forty overflow pages, and each
// statement re-reads the file header. A connection setting: the file on disk
// is the same either way.
constexpr const char* kMapFileForReads = "PRAGMA mmap_size=268435456";

// Set by __db_open when it created the table in a file that had none (a new
// file, one made afresh after damage, or an empty one), so it holds no row.
// Cleared by sds_db_open before each open and by sds_db_take_created_table.
bool g_created_table = false;

// The settings every connection of the service gets.
void configure_connection(sqlite3* db) {
  (void)sqlite3_busy_timeout(db, kBusyTimeoutMs);
  (void)sqlite3_exec(db, kMapFileForReads, nullptr, nullptr, nullptr);
}

// SQLite opens files lazily: a file that is not a database, or whose first
// page (the schema) is damaged, is only noticed at the first statement.
// Reading the schema makes that happen now; the header alone would not.
// Returns SQLITE_OK or the result of the failing call; `*tables` gets the
// number of schema entries (0 for an empty file, as a creation that could not
// write its table, a full disk or a crash, leaves it).
int probe_database(sqlite3* db, int* tables) {
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db, "SELECT count(*) FROM sqlite_master", -1, &raw, nullptr);
  SqliteStmt stmt(raw);
  if (rc != SQLITE_OK) return rc;
  rc = sqlite3_step(stmt.get());
  if (rc != SQLITE_ROW) return rc == SQLITE_DONE ? SQLITE_OK : rc;
  *tables = sqlite3_column_int(stmt.get(), 0);
  return SQLITE_OK;
}

// The stored ETag names the list in the table. A table without rows (just
// created, rebuilt after corruption) holds no list, and a request sent with
// that ETag would be answered 304 and leave the deck empty until the list
// changes; without it the next pull fetches the whole list.
void forget_etag_of_empty_table(sqlite3* db) {
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db, "SELECT count(*) FROM site_deck", -1, &raw, nullptr);
  SqliteStmt stmt(raw);
  if (rc != SQLITE_OK || sqlite3_step(stmt.get()) != SQLITE_ROW ||
      sqlite3_column_int(stmt.get(), 0) != 0) {
    return;
  }
  std::string etag = sds_path(SDS_ETAG_PATH);
  if (unlink(etag.c_str()) == 0) SDS_LOGE("no items stored: the stored ETag is dropped");
}

// Adds the URL index to a file made before it existed. A file without the
// table is left as it is (the statement fails and nothing is written); when
// the index exists the statement writes nothing either.
void ensure_url_index(sqlite3* db) {
  (void)sqlite3_exec(db, kCreateUrlIndex, nullptr, nullptr, nullptr);
}

// Deletes a database file that can't be used, with its rollback journal, so
// the fresh file does not inherit a stale journal.
void delete_database_file(const char* path) {
  (void)unlink(path);
  std::string journal = std::string(path) + "-journal";
  (void)unlink(journal.c_str());
}

}  // namespace

int sds_db_open(sqlite3** handle) {
  if (handle == nullptr) return -1;
  std::string path = sds_path(SDS_DB_PATH);
  int error_code = SDS_ERROR_NONE;
  g_created_table = false;
  int result = __db_open(path.c_str(), handle, &error_code);
  if (error_code != SDS_ERROR_NONE || *handle == nullptr) SDS_LOGE("errorcode : %d", error_code);
  if (*handle != nullptr) forget_etag_of_empty_table(*handle);
  return result;
}

bool sds_db_take_created_table(void) {
  const bool created = g_created_table;
  g_created_table = false;
  return created;
}

bool sds_db_is_sound(sqlite3* handle) {
  if (handle == nullptr) return true;
  // The check reads every page; through the mapping they would all stay resident.
  SdsDbFileMappingPause unmapped(handle);
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, "PRAGMA quick_check(1)", -1, &raw, nullptr);
  SqliteStmt stmt(raw);
  if (rc == SQLITE_OK) rc = sqlite3_step(stmt.get());
  if (rc == SQLITE_ROW) {
    const auto* verdict = reinterpret_cast<const char*>(sqlite3_column_text(stmt.get(), 0));
    if (verdict != nullptr && std::string(verdict) == "ok") return true;
    SDS_LOGE("database check: %s", verdict != nullptr ? verdict : "(none)");
    return false;
  }
  const int primary = rc & 0xff;
  return primary != SQLITE_CORRUPT && primary != SQLITE_NOTADB;
}

void sds_db_discard(sqlite3* handle) {
  if (handle != nullptr) {
    // Kept statements would keep the connection, and the deleted file, open
    // behind a close; the rows kept from it describe a file that is gone.
    sds_db_drop_kept_statements(handle);
    if (sqlite3_close(handle) != SQLITE_OK) {
      SDS_LOGE("database %s: close failed: %s", sds_path(SDS_DB_PATH).c_str(),
               sqlite3_errmsg(handle));
      (void)sqlite3_close_v2(handle);
    }
  }
  delete_database_file(sds_path(SDS_DB_PATH).c_str());
}

int __db_open(const char* path, sqlite3** handle, int* error_code) {
  if (path == nullptr || handle == nullptr || error_code == nullptr) return -1;
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(path, &db, SQLITE_OPEN_READWRITE, nullptr);
  if (rc == SQLITE_OK) {
    configure_connection(db);
    int tables = -1;
    rc = probe_database(db, &tables);
    // Anything but a file that is no database (a busy lock, say) leaves the
    // file as it is: it is a database and is used unchanged.
    if ((rc & 0xff) != SQLITE_NOTADB && (rc & 0xff) != SQLITE_CORRUPT) {
      // A file with tables of its own is used as it is; an empty one would
      // otherwise stay without the table for good.
      if (rc == SQLITE_OK && tables == 0) {
        g_created_table = __rebuild_site_deck_tables(db) == 0;
      }
      if (rc == SQLITE_OK) ensure_url_index(db);
      *handle = db;
      return 0;
    }
  } else {
    rc = sqlite3_errcode(db);
  }
  SDS_LOGE("database open error(%d):%s", rc, sqlite3_errmsg(db));
  // A missing file is a first start, not a failure to explain.
  if (rc != SQLITE_CANTOPEN || access(path, F_OK) == 0) {
    SDS_LOGE("database %s: open failed: %s", path, sqlite3_errmsg(db));
  }

  rc &= 0xff;
  if (rc == SQLITE_CORRUPT || rc == SQLITE_NOTADB) {
    (void)sqlite3_close(db);
    db = nullptr;
    delete_database_file(path);
    rc = SQLITE_CANTOPEN;
  }
  if (rc != SQLITE_CANTOPEN) {
    SDS_LOGE("can not handle this error(%d):%s", rc, sqlite3_errmsg(db));
    *error_code = SDS_ERROR_OUT_OF_MEMORY;
    (void)sqlite3_close(db);
    *handle = nullptr;
    return -1;
  }
  (void)sqlite3_close(db);
  db = nullptr;
  *handle = nullptr;

  rc = sqlite3_open(path, &db);
  if (rc != SQLITE_OK) {
    (void)unlink(path);
    rc = sqlite3_errcode(db);
    SDS_LOGE("database new error(%d):%s", rc, sqlite3_errmsg(db));
    *error_code =
        (rc == SQLITE_FULL || rc == SQLITE_CANTOPEN) ? SDS_ERROR_NO_SPACE : SDS_ERROR_DISK_BUSY;
    (void)sqlite3_close(db);
    *handle = nullptr;
    return -1;
  }
  configure_connection(db);
  // A table that can't be created shows later as failing statements.
  g_created_table = __rebuild_site_deck_tables(db) == 0;
  *handle = db;
  return 0;
}

int __rebuild_site_deck_tables(sqlite3* handle) {
  if (__check_table(handle, "site_deck") == 0) {
    ensure_url_index(handle);
    return 0;
  }
  // Table and index in one transaction: one journal and one round of
  // syncs instead of two. Should the transaction not start, each statement
  // commits by itself as before.
  const bool together = sqlite3_exec(handle, "BEGIN", nullptr, nullptr, nullptr) == SQLITE_OK;
  int rc = sqlite3_exec(handle, kCreateSiteDeckTable, nullptr, nullptr, nullptr);
  if (rc == SQLITE_OK) {
    ensure_url_index(handle);
    if (together) rc = sqlite3_exec(handle, "COMMIT", nullptr, nullptr, nullptr);
  }
  if (rc != SQLITE_OK) {
    SDS_LOGE("create tables:%d error:%s", rc, sqlite3_errmsg(handle));
    if (sqlite3_get_autocommit(handle) == 0) {
      (void)sqlite3_exec(handle, "ROLLBACK", nullptr, nullptr, nullptr);
    }
    return -1;
  }
  return 0;
}

int __check_table(sqlite3* handle, const char* table) {
  if (handle == nullptr || table == nullptr) {
    SDS_LOGE("check handle or table name");
    return -1;
  }
  SqliteText query(
      sqlite3_mprintf("SELECT name FROM sqlite_master WHERE type='table' AND name='%q'", table));
  if (!query) {
    SDS_LOGE("failed to make query statement");
    return -1;
  }
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(handle, query.get(), -1, &raw, nullptr);
  SqliteStmt stmt(raw);
  if (rc != SQLITE_OK) {
    SDS_LOGE("sqlite3_prepare:%s", sqlite3_errmsg(handle));
    return -1;
  }
  return sqlite3_step(stmt.get()) == SQLITE_ROW ? 0 : -1;
}

void sds_db_close(sqlite3* handle) {
  if (handle == nullptr) return;
  sds_db_drop_kept_statements(handle);
  if (sqlite3_exec(handle, "VACUUM;", nullptr, nullptr, nullptr) != SQLITE_OK) {
    SDS_LOGE("sqlite3_exec failed");
    return;
  }
  if (sqlite3_close(handle) != SQLITE_OK) SDS_LOGE("check sqlite close");
}

int sds_db_get_errorcode(sqlite3* handle) {
  if (handle == nullptr) {
    SDS_LOGE("check connection handle");
    return SDS_ERROR_DISK_BUSY;
  }
  switch (sqlite3_errcode(handle)) {
    case SQLITE_FULL:
      SDS_LOGE("SQLITE_FULL-NO_SPACE");
      return SDS_ERROR_NO_SPACE;
    case SQLITE_TOOBIG:
    case SQLITE_LOCKED:
    case SQLITE_BUSY:
      SDS_LOGE("DISK_BUSY %s", sqlite3_errmsg(handle));
      return SDS_ERROR_DISK_BUSY;
    default:
      return SDS_ERROR_NONE;
  }
}

void sds_db_log_failure(sqlite3* handle, const char* what) {
  const char* file = handle != nullptr ? sqlite3_db_filename(handle, "main") : nullptr;
  SDS_LOGE("database %s: %s failed: %s",
           file != nullptr && file[0] != '\0' ? file : sds_path(SDS_DB_PATH).c_str(), what,
           handle != nullptr ? sqlite3_errmsg(handle) : "no connection");
}

void __db_finalize(sqlite3_stmt* stmt) {
  if (stmt == nullptr) return;
  // The connection must be taken before the statement is gone.
  sqlite3* db = sqlite3_db_handle(stmt);
  if (sqlite3_finalize(stmt) != SQLITE_OK) SDS_LOGE("sqlite3_finalize:%s", sqlite3_errmsg(db));
}
