// Helpers for bulk operations on the connection. Reuse of prepared statements: A merge runs the
// same dozen statements once per listed item; preparing each anew costs more
// than running it. While an SdsDbStatementScope lives, every statement the
// database module prepares on that connection is kept when its operation is
// done (reset, bindings cleared) and handed out again for the same SQL text;
// when the scope ends, every kept statement is finalized. Outside a scope a
// statement lives only as long as the operation that prepared it.
#pragma once

typedef struct sqlite3 sqlite3;
typedef struct sqlite3_stmt sqlite3_stmt;

// One scope at a time, on the thread that uses the connection; a scope opened
// inside another does nothing. Statements must be given back before it ends.
class SdsDbStatementScope {
 public:
  explicit SdsDbStatementScope(sqlite3* handle);
  ~SdsDbStatementScope();
  SdsDbStatementScope(const SdsDbStatementScope&) = delete;
  SdsDbStatementScope& operator=(const SdsDbStatementScope&) = delete;

 private:
  bool owner_ = false;
};

// One read transaction around a run of reads: the file's lock is taken and
// the journal looked for once, not for every statement. Does nothing when a
// transaction is already open or cannot begin; ends it (COMMIT) when it goes.
class SdsDbReadTransaction {
 public:
  explicit SdsDbReadTransaction(sqlite3* handle);
  ~SdsDbReadTransaction();
  SdsDbReadTransaction(const SdsDbReadTransaction&) = delete;
  SdsDbReadTransaction& operator=(const SdsDbReadTransaction&) = delete;

 private:
  sqlite3* handle_ = nullptr;  // set when this object began the transaction
};

// Reads through SQLite's own page cache instead of the file's memory mapping
// while it lives, and restores the connection's mapping size when it goes. A
// pull reads or writes most of the file (the quick check, a merge of
// thousands of icons), and every page it read through the mapping would stay
// in the process's resident memory to the end: a 5000-item pull's file alone
// is some 190 MB. Does nothing when the connection maps nothing.
class SdsDbFileMappingPause {
 public:
  explicit SdsDbFileMappingPause(sqlite3* handle);
  ~SdsDbFileMappingPause();
  SdsDbFileMappingPause(const SdsDbFileMappingPause&) = delete;
  SdsDbFileMappingPause& operator=(const SdsDbFileMappingPause&) = delete;

 private:
  sqlite3* handle_ = nullptr;  // set when the mapping was paused
  long long size_ = 0;         // the mapping size to restore
};

// A kept statement for `sql` on `handle`, marked in use, or null when no
// scope is open for it, or the one for `sql` is in use (the caller then
// prepares its own). A statement prepared by the caller can be offered with
// sds_db_stmt_cache_keep.
sqlite3_stmt* sds_db_stmt_cache_take(sqlite3* handle, const char* sql);
// Offers a statement just prepared for `sql`: when a scope is open on its
// connection it is kept (in use) and true is returned.
bool sds_db_stmt_cache_keep(sqlite3* handle, const char* sql, sqlite3_stmt* stmt);
// Gives a statement back: a kept one is reset for the next use and true is
// returned (a failed last step is logged as finalizing it would be); false
// for any other statement, which the caller finalizes.
bool sds_db_stmt_cache_give_back(sqlite3_stmt* stmt);
