// Files written beside their final name and renamed into place.
#include "pull/sitedeck-service-file-write.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <utility>

namespace {

// The files were made with the process's umask before; mkostemp makes them
// 0600. They are the service's own and readable as before by whoever may
// enter their directory.
constexpr mode_t kFileMode = 0644;

}  // namespace

SdsFileBeside::SdsFileBeside(std::string path) : path_(std::move(path)) {
  std::string pattern = path_ + ".XXXXXX";
  int fd = mkostemp(pattern.data(), O_CLOEXEC);
  if (fd < 0) return;
  (void)fchmod(fd, kFileMode);
  file_ = fdopen(fd, "w");
  if (file_ == nullptr) {
    const int saved = errno;
    (void)close(fd);
    (void)unlink(pattern.c_str());
    errno = saved;
    return;
  }
  temp_ = std::move(pattern);
}

SdsFileBeside::~SdsFileBeside() {
  if (file_ != nullptr) (void)std::fclose(file_);
  if (!temp_.empty()) (void)unlink(temp_.c_str());
}

bool SdsFileBeside::commit(bool sync) {
  if (file_ == nullptr) return false;
  bool ok = std::fflush(file_) == 0 && std::ferror(file_) == 0;
  if (ok && sync) ok = fsync(fileno(file_)) == 0;
  ok = std::fclose(std::exchange(file_, nullptr)) == 0 && ok;
  if (ok) ok = std::rename(temp_.c_str(), path_.c_str()) == 0;
  if (ok) temp_.clear();
  return ok;
}

bool sds_write_file_whole(const std::string& path, const void* data, size_t length, bool sync) {
  SdsFileBeside file(path);
  if (file.get() == nullptr) return false;
  if (length > 0 && std::fwrite(data, 1, length, file.get()) != length) return false;
  return file.commit(sync);
}
