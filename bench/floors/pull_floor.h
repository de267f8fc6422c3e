// The floor of a data pull: one process doing only the work no pull can
// avoid. It fetches the item list, reads it with json-glib, picks each item's
// icon the way the service does, fetches those icons over one reused libcurl
// handle (or `parallel` at a time with the multi interface), decodes them to
// B, G, R, A rows with libpng and writes one row per site into a fresh SQLite
// file in one transaction, with one prepared statement.
#pragma once

#include <string>

struct pull_floor_config {
  std::string list_url;  // the signed item-list URL, as the service sends it
  std::string db_path;   // removed and made anew by every run
  int parallel = 1;      // 1: one reused easy handle; more: multi, this many at a time
};

// One pull. Returns the number of rows stored with an icon, or -1 (the reason
// on stderr) when a step failed.
int pull_floor_run(const pull_floor_config& config);
