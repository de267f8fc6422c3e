// A scratch root for one test: a fresh directory laid out like an installed
// device (data, server, database and images directories), named by
// $SITEDECK_ROOT while the object lives.
#pragma once

#include <string>

class TempRoot {
 public:
  TempRoot();
  ~TempRoot();
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;

  const std::string& dir() const { return dir_; }
  // `fixed` below this root, as the service sees it.
  std::string path(const char* fixed) const { return dir_ + fixed; }

 private:
  std::string dir_;
  std::string previous_;
  bool had_previous_ = false;
};

// Whole-file helpers for test data.
std::string read_file(const std::string& path);
bool write_file(const std::string& path, const std::string& content);
bool file_exists(const std::string& path);
