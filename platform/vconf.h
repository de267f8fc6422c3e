// Stand-in for the platform's key-value configuration.
#pragma once

#define VCONFKEY_BROWSER_USER_AGENT "db/browser/user_agent"
#define VCONFKEY_CSC_COUNTRY_ISO "db/csc/country_iso"

// Returns a malloc'ed copy of the key's value, or null when the key is absent.
char* vconf_get_str(const char* key);
