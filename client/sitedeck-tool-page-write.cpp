// Putting the preview page on disk: the output directory is made when
// missing, and the page goes to a temporary file beside index.html that is
// renamed over it, so a reader (a browser reloading the page) never sees half
// a page and a failed run leaves the previous page as it was.
#include <fcntl.h>
#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

#include "sitedeck-tool-page.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"

namespace {

constexpr char kPageName[] = "index.html";

// "what: strerror(errno)" for the caller's message, malloc'ed.
char* __reason(const std::string& what, int error) {
  return strdup((what + ": " + std::strerror(error)).c_str());
}

// Writes all of `length` bytes, retrying short writes and EINTR.
bool __write_all(int fd, const char* data, size_t length) {
  while (length > 0) {
    ssize_t written = write(fd, data, length);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return false;
    data += written;
    length -= static_cast<size_t>(written);
  }
  return true;
}

int __page_write(const char* out_dir, const char* html, char** written_path, char** reason) {
  if (g_mkdir_with_parents(out_dir, 0755) != 0) {
    *reason = __reason(std::string("cannot create ") + out_dir, errno);
    return SDS_ERROR_IO_ERROR;
  }
  UniqueCStr directory(realpath(out_dir, nullptr));
  if (!directory) {
    *reason = __reason(std::string("cannot resolve ") + out_dir, errno);
    return SDS_ERROR_IO_ERROR;
  }
  const std::string page = std::string(directory.get()) + "/" + kPageName;
  std::string temporary = std::string(directory.get()) + "/." + kPageName + ".XXXXXX";
  UniqueFd fd(mkostemp(temporary.data(), O_CLOEXEC));
  if (!fd) {
    *reason = __reason("cannot create a file in " + std::string(directory.get()), errno);
    return SDS_ERROR_IO_ERROR;
  }
  // mkstemp makes the file private; a page is for anyone who may read the
  // directory.
  bool ok = fchmod(fd.get(), 0644) == 0 && __write_all(fd.get(), html, std::strlen(html)) &&
            fsync(fd.get()) == 0;
  int error = errno;
  if (ok && close(fd.release()) != 0) {
    ok = false;
    error = errno;
  }
  if (ok && rename(temporary.c_str(), page.c_str()) != 0) {
    ok = false;
    error = errno;
  }
  if (!ok) {
    (void)unlink(temporary.c_str());
    *reason = __reason("cannot write " + page, error);
    return SDS_ERROR_IO_ERROR;
  }
  char* path = strdup(page.c_str());
  if (path == nullptr) return SDS_ERROR_OUT_OF_MEMORY;
  *written_path = path;
  return SDS_ERROR_NONE;
}

}  // namespace

int sds_page_write(const char* out_dir, const char* html, char** written_path, char** reason) {
  if (out_dir == nullptr || out_dir[0] == '\0' || html == nullptr || written_path == nullptr ||
      reason == nullptr) {
    return SDS_ERROR_INVALID_PARAMETER;
  }
  try {
    return __page_write(out_dir, html, written_path, reason);
  } catch (const std::bad_alloc&) {
    return SDS_ERROR_OUT_OF_MEMORY;
  }
}
