// Maps the service's fixed paths below an optional relocatable root.
#include "sitedeck-service-paths.h"

#include <cstdlib>

std::string sds_path(const char* fixed_path) {
  const char* root = std::getenv("SITEDECK_ROOT");
  std::string path;
  if (root != nullptr && root[0] != '\0') path = root;
  path += fixed_path;
  return path;
}
