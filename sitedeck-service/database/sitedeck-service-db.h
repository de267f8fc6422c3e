// The item database: opening (with rebuild after corruption), the schema of the
// one table `site_deck`, the mapping of SQLite results to SDS codes, and the
// generic row and column operations every accessor is built on. Every
// operation takes the connection first and reports a reason code through its
// last argument; statements never outlive the call that prepared them, except
// inside an SdsDbStatementScope (sitedeck-service-db-stmt-cache.h) and for the
// few reads every request repeats, which the connection keeps.
#pragma once

#include <cstdint>

#include "sitedeck-service-types.h"

typedef struct sqlite3 sqlite3;
typedef struct sqlite3_stmt sqlite3_stmt;

enum sds_db_column_type_e : int {
  SDS_DB_COLUMN_TYPE_INT = 0,
  SDS_DB_COLUMN_TYPE_INT64 = 1,
  SDS_DB_COLUMN_TYPE_TEXT = 2,
  SDS_DB_COLUMN_TYPE_BLOB = 3,
};

enum sds_db_cond_type_e : int {
  SDS_DB_COND_TYPE_INT = 0,
  SDS_DB_COND_TYPE_TEXT = 1,
};

// The 8-byte output of an integer read: an INTEGER lands in `i32`, a REAL
// converted to a 64-bit integer over all eight bytes.
union sds_db_value {
  int32_t i32;
  int64_t i64;
  unsigned char raw[8];
};

int sds_db_open(sqlite3** handle);
// True once after an sds_db_open that created the `site_deck` table (the file
// was missing, damaged or empty), so the table holds no row yet; the flag is
// cleared by this call and by the next sds_db_open.
bool sds_db_take_created_table(void);
// True unless SQLite's quick check finds the file damaged (a page that is no
// valid page, a broken b-tree); a busy or locked file counts as sound.
bool sds_db_is_sound(sqlite3* handle);
// Closes `handle` and deletes the database file with its journal, for a
// database found damaged; the next sds_db_open creates it afresh.
void sds_db_discard(sqlite3* handle);
int __db_open(const char* path, sqlite3** handle, int* error_code);
// Logs, for a person to act on, which database file failed at `what` and
// SQLite's own message for the connection's last failure.
void sds_db_log_failure(sqlite3* handle, const char* what);
int __rebuild_site_deck_tables(sqlite3* handle);
int __check_table(sqlite3* handle, const char* table);
void sds_db_close(sqlite3* handle);
int sds_db_get_errorcode(sqlite3* handle);
void __db_finalize(sqlite3_stmt* stmt);
// Finalizes the statements kept for `handle` (the reads of the requests keep
// theirs for the life of the connection). Whoever closes a connection other
// than through sds_db_close calls this first: SQLite does not close a
// connection with statements left.
void sds_db_drop_kept_statements(sqlite3* handle);

int sds_db_check_duplicated_int(sqlite3* handle, const char* table, const char* column, int value,
                                int* error_code);
int sds_db_check_duplicated_string(sqlite3* handle, const char* table, const char* column,
                                   const char* value, int* error_code);
int sds_db_get_all_dirty_ids(sqlite3* handle, int** ids, int* count, const char* cond_column,
                             const void* cond_value, int cond_type, int* error_code);
int sds_db_create_site_deck_id(sqlite3* handle, int* id, int* error_code);
int sds_db_create_site_deck_item(sqlite3* handle, const sds_item* item, int* error_code);
int sds_db_column_replace(sqlite3* handle, int id, const char* table, const char* column,
                          const void* value, int length, int value_type, int* error_code);

// One column's new value for sds_db_columns_replace; `length` counts the
// bytes of a blob and is ignored for the other types.
struct sds_db_column_value {
  const char* column = nullptr;
  const void* value = nullptr;
  int length = 0;
  int value_type = SDS_DB_COLUMN_TYPE_INT;
};
// Writes several columns of row `id` in one UPDATE, with the checks and
// messages of sds_db_column_replace; the row ends as if each column had been
// written by sds_db_column_replace in turn and all of them had succeeded.
// 0, or -1 with the reason in `error_code` and no column written.
int sds_db_columns_replace(sqlite3* handle, int id, const char* table,
                           const sds_db_column_value* values, int count, int* error_code);
int sds_db_get_property_string(sqlite3* handle, int id, const char* table, const char* column,
                               char** value, int* error_code);
int sds_db_get_property_blob(sqlite3* handle, int id, const char* table, const char* column,
                             unsigned char** value, int* size, int* error_code);
int sds_db_get_property_int(sqlite3* handle, int id, const char* table, const char* column,
                            sds_db_value* value, int* error_code);
int sds_db_delete_url(sqlite3* handle, const char* url, const char* table, int* error_code);
int sds_db_get_property_string_for_url(sqlite3* handle, const char* url, const char* table,
                                       const char* column, char** value, int* error_code);
