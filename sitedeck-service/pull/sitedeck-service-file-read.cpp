// Capped whole-file reads. The size is checked before allocating and again
// while reading, so neither a large file nor one that grows under us can make
// the service allocate more than the cap.
#include "pull/sitedeck-service-file-read.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"

char* sds_read_file_bounded(const char* path, long cap, size_t* length) {
  if (path == nullptr || length == nullptr || cap < 0) return nullptr;
  UniqueFd fd(::open(path, O_RDONLY | O_CLOEXEC));
  if (!fd) return nullptr;
  struct stat st {};
  if (fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return nullptr;
  if (st.st_size > cap) {
    SDS_LOGE("[CRITICAL] %s is larger than %ld bytes", path, cap);
    return nullptr;
  }
  // One byte past the size, to notice a file that grew after fstat.
  UniqueCStr buffer(static_cast<char*>(std::malloc(static_cast<size_t>(st.st_size) + 2)));
  if (!buffer) return nullptr;
  size_t room = static_cast<size_t>(st.st_size) + 1;
  size_t total = 0;
  while (total < room) {
    ssize_t n = ::read(fd.get(), buffer.get() + total, room - total);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return nullptr;
    if (n == 0) break;
    total += static_cast<size_t>(n);
  }
  if (total == room) {
    // Longer than fstat said: the file is being written; refuse, don't chase it.
    SDS_LOGE("[CRITICAL] %s changed while it was read", path);
    return nullptr;
  }
  buffer.get()[total] = '\0';
  *length = total;
  return buffer.release();
}
