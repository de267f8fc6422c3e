// The pull's entry points where the pull code is linked in: in the module
// itself, and in every program but the service binary, whose own
// sds_pull_get_calls (sitedeck-service-pull-module.cpp) loads the module.
#include "pull/sitedeck-service-default-deck.h"
#include "sitedeck-service-pull.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-utils.h"

namespace {

constexpr sds_pull_calls kLinkedCalls = {
    sds_check_data_pull_required,
    remove_file,
    sds_set_next_update_duration,
    sds_default_deck_load,
};

}  // namespace

extern "C" const sds_pull_calls* sds_pull_module_calls(void) { return &kLinkedCalls; }

// Inside the module the service binary's own sds_pull_get_calls is the one
// that counts; a second definition there would only hide it.
#ifndef SITEDECK_PULL_MODULE
const sds_pull_calls* sds_pull_get_calls(void) { return sds_pull_module_calls(); }
#endif
