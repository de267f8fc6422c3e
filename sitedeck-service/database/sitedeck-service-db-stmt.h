// Owners for the SQLite objects the storage modules create: a prepared
// statement (finalized through __db_finalize, so a failing finalize is logged,
// or given back to the merge's statement cache when it came from there),
// a statement kept for the life of the connection (handed back to the
// connection's cache instead of finalized) and a statement text from
// sqlite3_mprintf, with the steps every operation shares. Private to
// sitedeck-service/database.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>

#include "database/sitedeck-service-db-stmt-cache.h"
#include "database/sitedeck-service-db.h"

struct SqliteStmtFinalizer {
  void operator()(sqlite3_stmt* stmt) const noexcept {
    if (!sds_db_stmt_cache_give_back(stmt)) __db_finalize(stmt);
  }
};
using SqliteStmt = std::unique_ptr<sqlite3_stmt, SqliteStmtFinalizer>;

// Hands a statement from sds_db_prepare_kept back: reset and kept for the
// next use when it came from the cache, finalized otherwise. Either way a
// failed step is logged as a failing finalize would log it.
void sds_db_release_kept(sqlite3_stmt* stmt);
struct SqliteKeptRelease {
  void operator()(sqlite3_stmt* stmt) const noexcept { sds_db_release_kept(stmt); }
};
using SqliteKeptStmt = std::unique_ptr<sqlite3_stmt, SqliteKeptRelease>;

struct SqliteTextFree {
  void operator()(char* text) const noexcept { sqlite3_free(text); }
};
using SqliteText = std::unique_ptr<char, SqliteTextFree>;

// The connection's own reason for its last failure (sds_db_get_errorcode), or
// `fallback` when it has none.
int sds_db_reason_or(sqlite3* handle, int fallback);
// Prepares `sql` (from sqlite3_mprintf, freed here) into `stmt`, or takes the
// statement kept for it by an open SdsDbStatementScope. On failure
// logs, sets `error_code` from the connection and returns false.
bool sds_db_prepare(sqlite3* handle, char* sql, SqliteStmt* stmt, int* error_code);
// As sds_db_prepare, for the statements every request repeats: the statement
// for the same text on the same connection is prepared once and kept until
// sds_db_drop_kept_statements (sds_db_close calls it). A statement already in
// use, or one beyond the cache's few places, is prepared afresh as usual.
bool sds_db_prepare_kept(sqlite3* handle, char* sql, SqliteKeptStmt* stmt, int* error_code);
// As sds_db_get_property_blob, with the same checks, codes and log lines, but
// the stored bytes are handed out in place: `*value` points into the
// statement `stmt` holds and is valid as long as `stmt` holds it.
int sds_db_view_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                              SqliteKeptStmt* stmt, const unsigned char** value, int* size,
                              int* error_code);
// The checks of sds_db_get_property_blob (same codes and log lines) without
// reading the bytes: `*size` gets their count, and `stmt` holds the read
// transaction in which sds_db_read_property_blob then copies them.
int sds_db_check_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                               SqliteKeptStmt* stmt, int* size, int* error_code);
// Copies the `size` bytes of the column straight into `destination`, inside
// the transaction a checking statement holds. 0, or -1 with `*error_code`
// set when they could not be read (an I/O failure of the file).
int sds_db_read_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                              unsigned char* destination, int size, int* error_code);
// One column of a row as a read found it: the type, and the text (TEXT; null
// when SQLite could not give it) or the number (INTEGER, FLOAT).
struct sds_db_column {
  int type = SQLITE_NULL;
  const unsigned char* text = nullptr;
  int bytes = 0;
  int64_t number = 0;
};
// Answers a by-id read of `column` of `table` from the item rows the
// connection read lately, while the file has not changed since
// (sitedeck-service-db-kept-rows.cpp). False when the read must go to the
// table: a column not kept, no such row, a failed read, a transaction of
// this connection under way. `*found` is valid until the next call.
bool sds_db_kept_column(sqlite3* handle, int id, const char* table, const char* column,
                        sds_db_column* found);
// Forgets the kept rows of `handle`; sds_db_drop_kept_statements calls it.
void sds_db_drop_kept_rows(sqlite3* handle);
// Checks the result of a bind; on failure logs and sets `error_code`.
bool sds_db_bind_ok(sqlite3* handle, int rc, int* error_code);
// Reads an icon size text "WIDTHxHEIGHT" (each number as atoi reads it,
// saturated); false, with the outputs untouched, when there is no x.
bool sds_db_parse_icon_size(const char* text, int* width, int* height);
