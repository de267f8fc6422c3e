// An item database for one test: a scratch root (TempRoot) with the database
// opened through sds_ensure_db_open, closed and forgotten again at the end so
// that the next test starts without a connection. Plus small SQL helpers that
// run on the service's connection.
#pragma once

#include <string>

#include "support/temp_root.h"

class DbSession {
 public:
  // Opens the database unless `open` is false (for tests of the opening).
  explicit DbSession(bool open = true);
  ~DbSession();
  DbSession(const DbSession&) = delete;
  DbSession& operator=(const DbSession&) = delete;

  const TempRoot& root() const { return root_; }
  std::string db_path() const;
  // Closes sds_db_handle (without VACUUM) and resets it to null.
  static void close_handle();

  // Runs `sql` on sds_db_handle; true on success.
  static bool exec(const std::string& sql);
  // All rows of `sql` on sds_db_handle: columns joined by '|', rows by '\n',
  // NULL shown as "NULL" and blobs as "blob:<byte count>".
  static std::string rows(const std::string& sql);

 private:
  TempRoot root_;
};

// The same dump through a connection of its own to the file at `path`.
std::string rows_of_file(const std::string& path, const std::string& sql);
