// How command 1 reaches the data pull. The pull needs libcurl, libxml2,
// json-glib and libpng, which the service process would otherwise load at
// every start although most connections only read the deck; so the service
// binary carries the pull as a module (libsitedeck-pull.so beside it), loaded
// when the first initialize arrives. Every other program (tests, tools,
// benchmarks, fuzzers) has the pull linked in, and gets the same calls.
#pragma once

#include "sitedeck-service-types.h"

// The entry points of the pull that initialize uses.
struct sds_pull_calls {
  int (*check_data_pull_required)(sds_server_req_args* args);
  int (*remove_file)(const char* path);
  void (*set_next_update_duration)(int seconds);
  // sds_default_deck_load (sitedeck-service-default-deck.h).
  int (*load_default_deck)(void);
};

// Returns the pull's entry points, loading the module on first use in the
// service binary; null, after a log line, when the module cannot be loaded.
// Worker thread only.
const sds_pull_calls* sds_pull_get_calls(void);

// The entry points of the pull code linked into this program; what the
// module exports, under this unmangled name, for the service to look up.
extern "C" const sds_pull_calls* sds_pull_module_calls(void);

// The module's file name, looked for in the service binary's directory.
#define SDS_PULL_MODULE_NAME "libsitedeck-pull.so"
