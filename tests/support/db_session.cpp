#include "support/db_session.h"

#include <sqlite3.h>

#include "database/sitedeck-service-db-interface.h"
#include "sitedeck-service-paths.h"

namespace {

std::string dump(sqlite3* db, const std::string& sql) {
  if (db == nullptr) return "<no connection>";
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK) {
    return std::string("<error: ") + sqlite3_errmsg(db) + ">";
  }
  std::string out;
  int rc;
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
    if (!out.empty()) out += '\n';
    for (int c = 0; c < sqlite3_column_count(stmt); ++c) {
      if (c > 0) out += '|';
      switch (sqlite3_column_type(stmt, c)) {
        case SQLITE_NULL:
          out += "NULL";
          break;
        case SQLITE_BLOB:
          out += "blob:" + std::to_string(sqlite3_column_bytes(stmt, c));
          break;
        default:
          out += reinterpret_cast<const char*>(sqlite3_column_text(stmt, c));
      }
    }
  }
  if (rc != SQLITE_DONE) out += std::string("<error: ") + sqlite3_errmsg(db) + ">";
  sqlite3_finalize(stmt);
  return out;
}

}  // namespace

DbSession::DbSession(bool open) {
  close_handle();
  if (open) (void)sds_ensure_db_open();
}

DbSession::~DbSession() { close_handle(); }

std::string DbSession::db_path() const { return root_.path(SDS_DB_PATH); }

void DbSession::close_handle() {
  if (sds_db_handle != nullptr) {
    // The reads keep their statements with the connection.
    sds_db_drop_kept_statements(sds_db_handle);
    (void)sqlite3_close(sds_db_handle);
  }
  sds_db_handle = nullptr;
}

bool DbSession::exec(const std::string& sql) {
  return sds_db_handle != nullptr &&
         sqlite3_exec(sds_db_handle, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK;
}

std::string DbSession::rows(const std::string& sql) { return dump(sds_db_handle, sql); }

std::string rows_of_file(const std::string& path, const std::string& sql) {
  sqlite3* db = nullptr;
  std::string out;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    out = dump(db, sql);
  } else {
    out = "<cannot open>";
  }
  sqlite3_close(db);
  return out;
}
