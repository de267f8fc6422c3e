// Link-time fallback for remove_file, which belongs to the icon-files module:
// lets the location tests link on a branch where that module has not landed.
// Weak, so the module's own definition replaces it as soon as it is linked in.
#include <unistd.h>

#include "sitedeck-service-log.h"
#include "sitedeck-service-utils.h"

__attribute__((weak)) int remove_file(const char* path) {
  if (path == nullptr || path[0] == '\0') {
    SDS_LOGE("Failed to remove file Path is invalid");
    return -1;
  }
  if (unlink(path) != 0) {
    SDS_LOGE("Failed to remove file in the path");
    return -1;
  }
  return 0;
}
