// Command 7 from the client's side: the reply gives byte count, width and
// height, and the pixels are read out of the service's shared-memory object
// (docs/protocol.md, "Shared memory"). The object is mapped read-only once
// per connection and mapped again only when its name leads to another object
// than the one mapped (removed and created anew by another connection).
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <unistd.h>

#include "sitedeck-client-commands.h"
#include "sitedeck-client-internal.h"
#include "sitedeck-service-paths.h"

namespace {

// The descriptor of the object, closed when the mapping is made.
struct ShmFd {
  int fd;
  ~ShmFd() {
    if (fd >= 0) (void)close(fd);
  }
};

// Makes the connection's view a mapping of the object now behind the name,
// holding at least `needed` bytes. SDS_ERROR_NONE or SDS_ERROR_SHM_FAILED.
int __sds_client_map_shm(SdsConnection& connection, size_t needed) {
  using Access = SdsConnectionAccess;
  struct stat named {};
  if (stat(SDS_SHM_FILE_PATH, &named) == 0 && Access::shm_address(connection) != nullptr &&
      named.st_ino == Access::shm_inode(connection) && Access::shm_size(connection) >= needed &&
      static_cast<size_t>(named.st_size) >= needed) {
    return SDS_ERROR_NONE;
  }
  Access::drop_shm(connection);
  ShmFd fd{shm_open(SDS_SHM_NAME, O_RDONLY | O_CLOEXEC, 0)};
  if (fd.fd < 0) {
    Access::set_error(connection, errno);
    __sds_client_log("shm_open %s: %s", SDS_SHM_NAME, std::strerror(errno));
    return SDS_ERROR_SHM_FAILED;
  }
  struct stat opened {};
  if (fstat(fd.fd, &opened) != 0) {
    Access::set_error(connection, errno);
    return SDS_ERROR_SHM_FAILED;
  }
  // Touching pages past the object's end would be a SIGBUS, not an error.
  size_t length = std::min(static_cast<size_t>(std::max<off_t>(opened.st_size, 0)), SDS_SHM_SIZE);
  if (length < needed || length == 0) {
    __sds_client_log("shared memory holds %zu bytes, %zu needed", length, needed);
    return SDS_ERROR_SHM_FAILED;
  }
  void* address = mmap(nullptr, length, PROT_READ, MAP_SHARED, fd.fd, 0);
  if (address == MAP_FAILED) {
    Access::set_error(connection, errno);
    __sds_client_log("mmap %s: %s", SDS_SHM_NAME, std::strerror(errno));
    return SDS_ERROR_SHM_FAILED;
  }
  Access::adopt_shm(connection, static_cast<const unsigned char*>(address), length, opened.st_ino);
  return SDS_ERROR_NONE;
}

}  // namespace

int sds_client_get_icon(SdsConnection& connection, int32_t item_id, sds_client_icon* icon) {
  if (icon == nullptr || item_id < 0) return SDS_ERROR_INVALID_PARAMETER;
  int status = sds_client_request(connection, SDS_CMD_GET_ICON, item_id);
  if (status != SDS_ERROR_NONE) return __sds_client_status_ends(connection, status);

  // Byte count, width, height: width comes first on the wire.
  int32_t reply[3] = {0, 0, 0};
  int result = __sds_client_read_reply(connection, reply, sizeof reply);
  if (result != SDS_ERROR_NONE) return result;
  const int32_t byte_count = reply[0], width = reply[1], height = reply[2];
  // Only a whole B,G,R,A image that fits the object is read: anything else
  // would read past what the service wrote, or past the object.
  if (byte_count <= 0 || static_cast<size_t>(byte_count) > SDS_SHM_SIZE || width <= 0 ||
      height <= 0 || int64_t{width} * height * 4 != byte_count) {
    __sds_client_log("icon reply: %d bytes for %dx%d", byte_count, width, height);
    return SDS_ERROR_INVALID_PARAMETER;
  }
  result = __sds_client_map_shm(connection, static_cast<size_t>(byte_count));
  if (result != SDS_ERROR_NONE) return result;
  SdsClientBuffer<unsigned char> pixels(
      static_cast<unsigned char*>(std::malloc(static_cast<size_t>(byte_count))));
  if (!pixels) return SDS_ERROR_OUT_OF_MEMORY;
  std::memcpy(pixels.get(), SdsConnectionAccess::shm_address(connection),
              static_cast<size_t>(byte_count));
  icon->pixels = std::move(pixels);
  icon->byte_count = byte_count;
  icon->width = width;
  icon->height = height;
  return SDS_ERROR_NONE;
}
