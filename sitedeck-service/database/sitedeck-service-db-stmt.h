// Owners for the SQLite objects the storage modules create: a prepared
// statement (finalized through __db_finalize, so a failing finalize is logged)
// and a statement text from sqlite3_mprintf, with the steps every operation
// shares. Private to sitedeck-service/database.
#pragma once

#include <sqlite3.h>

#include <memory>

#include "database/sitedeck-service-db.h"

struct SqliteStmtFinalizer {
  void operator()(sqlite3_stmt* stmt) const noexcept { __db_finalize(stmt); }
};
using SqliteStmt = std::unique_ptr<sqlite3_stmt, SqliteStmtFinalizer>;

struct SqliteTextFree {
  void operator()(char* text) const noexcept { sqlite3_free(text); }
};
using SqliteText = std::unique_ptr<char, SqliteTextFree>;

// The connection's own reason for its last failure (sds_db_get_errorcode), or
// `fallback` when it has none.
int sds_db_reason_or(sqlite3* handle, int fallback);
// Prepares `sql` (from sqlite3_mprintf, freed here) into `stmt`. On failure
// logs, sets `error_code` from the connection and returns false.
bool sds_db_prepare(sqlite3* handle, char* sql, SqliteStmt* stmt, int* error_code);
// Checks the result of a bind; on failure logs and sets `error_code`.
bool sds_db_bind_ok(sqlite3* handle, int rc, int* error_code);
// Reads an icon size text "WIDTHxHEIGHT" (each number as atoi reads it,
// saturated); false, with the outputs untouched, when there is no x.
bool sds_db_parse_icon_size(const char* text, int* width, int* height);
