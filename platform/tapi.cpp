#include "tapi.h"

#include <cstring>
#include <string>

#include "kdb.h"

struct TapiHandle {
  int unused = 0;
};

TapiHandle* tel_init(const char* /*cp_name*/) { return new TapiHandle(); }

int tel_get_property_string(TapiHandle* handle, const char* property, char** value) {
  if (handle == nullptr || property == nullptr || value == nullptr) return -1;
  *value = nullptr;
  if (std::strcmp(property, TAPI_PROP_NETWORK_NETWORK_NAME) != 0) return -1;
  std::string name;
  if (!kdb_read("memory/telephony/network_name", &name)) return -1;
  *value = strdup(name.c_str());
  return *value != nullptr ? 0 : -1;
}

int tel_deinit(TapiHandle* handle) {
  delete handle;
  return 0;
}
