#include "net_connection.h"

#include <cstring>
#include <string>

#include "kdb.h"

struct connection_handle_s {
  int unused = 0;
};

int connection_create(connection_h* connection) {
  if (connection == nullptr) return CONNECTION_ERROR_INVALID_PARAMETER;
  *connection = new connection_handle_s();
  return CONNECTION_ERROR_NONE;
}

int connection_get_proxy(connection_h connection, connection_address_family_e family,
                         char** proxy) {
  if (connection == nullptr || proxy == nullptr || family != CONNECTION_ADDRESS_FAMILY_IPV4) {
    return CONNECTION_ERROR_INVALID_PARAMETER;
  }
  *proxy = nullptr;
  std::string value;
  if (kdb_read("memory/connection/proxy", &value)) *proxy = strdup(value.c_str());
  return CONNECTION_ERROR_NONE;
}

int connection_destroy(connection_h connection) {
  if (connection == nullptr) return CONNECTION_ERROR_INVALID_PARAMETER;
  delete connection;
  return CONNECTION_ERROR_NONE;
}
