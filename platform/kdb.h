// The file-backed key store shared by the configuration, telephony and network
// stand-ins: key "a/b/c" is the file $SITEDECK_ROOT/opt/var/kdb/a/b/c, its value
// the file's content less one trailing line feed; no file, no key.
#pragma once

#include <string>

// Returns true and fills `value` when the key exists.
bool kdb_read(const char* key, std::string* value);
// Test and demo helper: writes (or, with null, removes) a key.
bool kdb_write(const char* key, const char* value);
