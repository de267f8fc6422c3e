// Writing the pull's files without trusting what lies at their names. Each
// file is written under a new temporary name beside its final one, made with
// O_EXCL so that no symlink or other file planted there is followed or
// reused, and renamed over the final name once complete: a reader never sees
// half a file, and a symlink at the final name is replaced, not followed.
#pragma once

#include <cstddef>
#include <cstdio>
#include <string>

// One file being written beside `path`. Destroying it without commit()
// removes the temporary file, so a failed write leaves the final name as it was.
class SdsFileBeside {
 public:
  explicit SdsFileBeside(std::string path);
  ~SdsFileBeside();
  SdsFileBeside(const SdsFileBeside&) = delete;
  SdsFileBeside& operator=(const SdsFileBeside&) = delete;

  // The stream to write to; null when the temporary file could not be made
  // (errno tells why).
  FILE* get() const { return file_; }
  const std::string& path() const { return path_; }
  // Closes the stream (after fsync when `sync`) and renames the file to its
  // final name. False, with the temporary file removed, when any step failed.
  bool commit(bool sync = false);

 private:
  std::string path_;
  std::string temp_;
  FILE* file_ = nullptr;
};

// Writes `length` bytes as the whole content of `path`, beside and renamed.
// True when the file is complete under its name.
bool sds_write_file_whole(const std::string& path, const void* data, size_t length,
                          bool sync = false);
