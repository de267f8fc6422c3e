// The record the data pull leaves in server/last_pull: when it ended, how,
// and where the list now in the deck came from. `sitedeck status` shows it
// and the start-page preview tells its origin from it. Reading only.
#pragma once

#include <ctime>
#include <string>

enum class sds_last_pull_state { missing, unreadable, denied, present };

struct sds_last_pull {
  sds_last_pull_state state = sds_last_pull_state::missing;
  time_t time = 0;    // when the pull ended
  int status = 0;     // its final status, as the browser got it
  time_t stored = 0;  // when a pull stored the list now in the deck; 0: none has
  std::string city, province;  // the region that list was asked for; may be empty
};

// Reads the record at `path`: `key value` lines in any order, unknown keys
// ignored; without a whole `time` and `status` it is unreadable. A file
// that cannot be opened for lack of permission is `denied`, never `missing`.
sds_last_pull sds_tool_read_last_pull(const std::string& path);
