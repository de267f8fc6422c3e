// Owners for the plain C resources the service handles: heap blocks from
// malloc, stdio streams and file descriptors. Library-specific owners (SQLite
// statements, curl handles, XML documents) live in the module wrapping that
// library, so that other headers do not pull in library headers.
#pragma once

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <utility>

struct SdsFreeDeleter {
  void operator()(void* p) const noexcept { std::free(p); }
};
template <typename T>
using UniqueMalloc = std::unique_ptr<T, SdsFreeDeleter>;
using UniqueCStr = std::unique_ptr<char, SdsFreeDeleter>;

struct SdsFileCloser {
  void operator()(FILE* f) const noexcept {
    if (f != nullptr) (void)std::fclose(f);
  }
};
using UniqueFile = std::unique_ptr<FILE, SdsFileCloser>;

// Move-only owner of a file descriptor; -1 when empty.
class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) reset(std::exchange(other.fd_, -1));
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { reset(); }

  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  int release() { return std::exchange(fd_, -1); }
  void reset(int fd = -1) {
    if (fd_ >= 0) (void)::close(fd_);
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};
