// Stand-in for the network connection API: the proxy address comes from the
// key "memory/connection/proxy".
#pragma once

typedef struct connection_handle_s* connection_h;

enum connection_address_family_e {
  CONNECTION_ADDRESS_FAMILY_IPV4 = 0,
  CONNECTION_ADDRESS_FAMILY_IPV6 = 1,
};

enum connection_error_e {
  CONNECTION_ERROR_NONE = 0,
  CONNECTION_ERROR_INVALID_PARAMETER = -22,
  CONNECTION_ERROR_NO_CONNECTION = -0x0200 - 1,
};

int connection_create(connection_h* connection);
// `*proxy` gets a malloc'ed text, or null when no proxy is configured.
int connection_get_proxy(connection_h connection, connection_address_family_e family, char** proxy);
int connection_destroy(connection_h connection);
