// The item rows a connection has read lately, kept so that the browser's
// requests for the other fields of the same tile cost no table read. A read
// of the table, even of one column, costs a read transaction: SQLite takes
// and drops its file locks and looks for a journal every time, seven system
// calls that made up most of a request. So the first request for a tile
// reads all of its served columns at once, and the next requests answer from
// what that read found, for as long as the file has not changed since.
//
// That is told by the file change counter in the database header, which
// every SQLite connection increments when it commits a change to a file in
// rollback-journal mode (the only mode this file is ever in), and which a
// commit writes first: pages go to the file in page order, and the header is
// on page 1. So while the counter still reads as it did when the rows were
// read, no page of the file has changed since, and the kept values are what
// a read would find. The counter is read through SQLite's own mapping of the
// file (xFetch of the file's I/O methods), without taking a lock: a commit
// that has begun shows as a changed counter, and the read then goes to the
// table, where SQLite waits for the commit to end. Reads inside a
// transaction of this connection, which sees its own uncommitted writes, go
// to the table too. Only the connection's thread uses this.
#include <sqlite3.h>

#include <array>
#include <cstdint>
#include <cstring>
#include <string>
#include <unordered_map>

#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-db.h"

namespace {

// The columns of a tile that the requests read one by one.
constexpr std::array<const char*, 6> kKeptColumns = {
    "url", "title", "dominant_color", "icon_size", "touch_icon_exists", "favicon_exists"};
constexpr const char* kKeptTable = "site_deck";
constexpr const char* kReadRow =
    "SELECT url, title, dominant_color, icon_size, touch_icon_exists, favicon_exists "
    "FROM site_deck WHERE id = ? LIMIT 1";
// A deck has a few dozen tiles; more rows than this start the cache afresh.
constexpr size_t kMaxKeptRows = 512;

// The header fields that tell a file in rollback-journal mode and its
// change counter (the database file format, section 1.3).
constexpr int kHeaderBytes = 100;
constexpr int kWriteVersionOffset = 18;
constexpr int kReadVersionOffset = 19;
constexpr int kChangeCounterOffset = 24;
constexpr unsigned char kRollbackJournalVersion = 1;

struct kept_column {
  int type = SQLITE_NULL;
  int64_t number = 0;
  std::string text;
  bool text_lost = false;  // SQLite could not give the text (memory)
};

using kept_row = std::array<kept_column, kKeptColumns.size()>;

struct kept_rows {
  sqlite3* handle = nullptr;
  uint32_t counter = 0;
  std::unordered_map<int, kept_row> rows;
};

kept_rows g_kept;

int __db_kept_column_index(const char* column) {
  for (size_t i = 0; i < kKeptColumns.size(); ++i) {
    if (std::strcmp(kKeptColumns[i], column) == 0) return static_cast<int>(i);
  }
  return -1;
}

// The change counter of the connection's main file, read without a lock
// from SQLite's mapping of it; false when the file is not mapped or not in
// rollback-journal mode.
bool __db_change_counter(sqlite3* handle, uint32_t* counter) {
  sqlite3_file* file = nullptr;
  if (sqlite3_file_control(handle, "main", SQLITE_FCNTL_FILE_POINTER, &file) != SQLITE_OK ||
      file == nullptr || file->pMethods == nullptr || file->pMethods->iVersion < 3 ||
      file->pMethods->xFetch == nullptr || file->pMethods->xUnfetch == nullptr) {
    return false;
  }
  void* mapped = nullptr;
  if (file->pMethods->xFetch(file, 0, kHeaderBytes, &mapped) != SQLITE_OK || mapped == nullptr) {
    return false;
  }
  const auto* header = static_cast<const volatile unsigned char*>(mapped);
  bool rollback = header[kWriteVersionOffset] == kRollbackJournalVersion &&
                  header[kReadVersionOffset] == kRollbackJournalVersion;
  *counter = (uint32_t{header[kChangeCounterOffset]} << 24) |
             (uint32_t{header[kChangeCounterOffset + 1]} << 16) |
             (uint32_t{header[kChangeCounterOffset + 2]} << 8) |
             uint32_t{header[kChangeCounterOffset + 3]};
  (void)file->pMethods->xUnfetch(file, 0, mapped);
  return rollback;
}

void __db_forget_rows(sqlite3* handle, uint32_t counter) {
  g_kept.rows.clear();
  g_kept.handle = handle;
  g_kept.counter = counter;
}

// Reads row `id` into the kept rows; false when there is none or the read
// failed (the caller's own read then meets and reports that).
bool __db_keep_row(sqlite3* handle, int id) {
  int error_code = SDS_ERROR_NONE;
  SqliteKeptStmt stmt;
  if (!sds_db_prepare_kept(handle, sqlite3_mprintf("%s", kReadRow), &stmt, &error_code) ||
      sqlite3_bind_int(stmt.get(), 1, id) != SQLITE_OK || sqlite3_step(stmt.get()) != SQLITE_ROW) {
    return false;
  }
  // The statement holds the file's shared lock: no commit is under way, and
  // the counter belongs to the row just read.
  uint32_t counter = 0;
  if (!__db_change_counter(handle, &counter)) return false;
  if (g_kept.handle != handle || g_kept.counter != counter || g_kept.rows.size() >= kMaxKeptRows) {
    __db_forget_rows(handle, counter);
  }
  kept_row& row = g_kept.rows[id];
  for (size_t i = 0; i < kKeptColumns.size(); ++i) {
    kept_column& column = row[i];
    const int index = static_cast<int>(i);
    column.type = sqlite3_column_type(stmt.get(), index);
    if (column.type == SQLITE_TEXT) {
      const unsigned char* text = sqlite3_column_text(stmt.get(), index);
      column.text_lost = text == nullptr;
      if (text != nullptr) {
        column.text.assign(reinterpret_cast<const char*>(text),
                           static_cast<size_t>(sqlite3_column_bytes(stmt.get(), index)));
      }
    } else if (column.type == SQLITE_INTEGER || column.type == SQLITE_FLOAT) {
      column.number = sqlite3_column_int64(stmt.get(), index);
    }
  }
  return true;
}

}  // namespace

bool sds_db_kept_column(sqlite3* handle, int id, const char* table, const char* column,
                        sds_db_column* found) {
  if (std::strcmp(table, kKeptTable) != 0) return false;
  int index = __db_kept_column_index(column);
  // Inside a transaction this connection sees its own uncommitted writes,
  // which the counter does not show yet.
  if (index < 0 || sqlite3_get_autocommit(handle) == 0) return false;
  uint32_t counter = 0;
  if (!__db_change_counter(handle, &counter)) return false;
  if (g_kept.handle != handle || g_kept.counter != counter) __db_forget_rows(handle, counter);
  auto row = g_kept.rows.find(id);
  if (row == g_kept.rows.end()) {
    if (!__db_keep_row(handle, id)) return false;
    row = g_kept.rows.find(id);
    if (row == g_kept.rows.end()) return false;
  }
  const kept_column& kept = row->second[static_cast<size_t>(index)];
  found->type = kept.type;
  found->number = kept.number;
  found->text = kept.type == SQLITE_TEXT && !kept.text_lost
                    ? reinterpret_cast<const unsigned char*>(kept.text.data())
                    : nullptr;
  found->bytes = static_cast<int>(kept.text.size());
  return true;
}

void sds_db_drop_kept_rows(sqlite3* handle) {
  if (g_kept.handle == handle) {
    g_kept.rows.clear();
    g_kept.handle = nullptr;
  }
}
