// Reading server/last_pull: a small text file the pull writes whole, one
// `key value` per line, the value being the rest of the line.
#include "sitedeck-tool-last-pull.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <sstream>

namespace {

// The record is a few short lines; more than this is not the record.
constexpr size_t kLastPullCap = 4096;

// A whole decimal number in `text`; false for anything else.
bool __whole_number(const std::string& text, long long* value) {
  if (text.empty()) return false;
  char* end = nullptr;
  errno = 0;
  long long parsed = std::strtoll(text.c_str(), &end, 10);
  if (errno != 0 || *end != '\0') return false;
  *value = parsed;
  return true;
}

}  // namespace

sds_last_pull sds_tool_read_last_pull(const std::string& path) {
  sds_last_pull record;
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    record.state = errno == EACCES || errno == EPERM ? sds_last_pull_state::denied
                   : errno == ENOENT                 ? sds_last_pull_state::missing
                                                     : sds_last_pull_state::unreadable;
    return record;
  }
  std::string text(kLastPullCap + 1, '\0');
  ssize_t length = read(fd, text.data(), text.size());
  (void)close(fd);
  record.state = sds_last_pull_state::unreadable;
  if (length < 0 || static_cast<size_t>(length) > kLastPullCap) return record;
  text.resize(static_cast<size_t>(length));

  bool have_time = false, have_status = false;
  std::istringstream lines(text);
  std::string line;
  while (std::getline(lines, line)) {
    size_t blank = line.find(' ');
    if (blank == std::string::npos) continue;
    const std::string key = line.substr(0, blank), value = line.substr(blank + 1);
    long long number = 0;
    if (key == "time" && __whole_number(value, &number)) {
      record.time = static_cast<time_t>(number);
      have_time = true;
    } else if (key == "status" && __whole_number(value, &number)) {
      record.status = static_cast<int>(number);
      have_status = true;
    } else if (key == "stored" && __whole_number(value, &number)) {
      record.stored = static_cast<time_t>(number);
    } else if (key == "city") {
      record.city = value;
    } else if (key == "province") {
      record.province = value;
    }
  }
  if (have_time && have_status) record.state = sds_last_pull_state::present;
  return record;
}
