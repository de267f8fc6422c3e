// Stand-in for the telephony client: the current network's name comes from the
// key "memory/telephony/network_name".
#pragma once

#define TAPI_PROP_NETWORK_NETWORK_NAME "org.valto.telephony.Network:network_name"

struct TapiHandle;

// Returns a handle (never null in the stand-in); `cp_name` is ignored.
TapiHandle* tel_init(const char* cp_name);
// Fills `*value` with a malloc'ed copy of the property, or null; 0 when found.
int tel_get_property_string(TapiHandle* handle, const char* property, char** value);
int tel_deinit(TapiHandle* handle);
