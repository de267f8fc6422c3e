#include "vconf.h"

#include <cstring>
#include <string>

#include "kdb.h"

char* vconf_get_str(const char* key) {
  std::string value;
  if (!kdb_read(key, &value)) return nullptr;
  return strdup(value.c_str());
}
