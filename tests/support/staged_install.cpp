#include "support/staged_install.h"

#include <unistd.h>

#include <cstdlib>
#include <sstream>
#include <vector>

ProcessResult install_staged(const std::string& destdir, const std::string& prefix) {
  // `cmake -E env` sets DESTDIR for the installation alone, not for the test.
  return run_process({SITEDECK_CMAKE_COMMAND, "-E", "env", "DESTDIR=" + destdir,
                      SITEDECK_CMAKE_COMMAND, "--install", SITEDECK_BUILD_DIR, "--prefix", prefix},
                     60000);
}

std::string find_program(const char* name) {
  std::vector<std::string> dirs;
  const char* path = std::getenv("PATH");
  std::stringstream list(path != nullptr ? path : "");
  std::string dir;
  while (std::getline(list, dir, ':')) {
    if (!dir.empty()) dirs.push_back(dir);
  }
  // A minimal $PATH (a CI runner's) may leave out where the tools live.
  for (const char* fallback : {"/usr/bin", "/bin", "/usr/lib/systemd", "/lib/systemd"}) {
    dirs.emplace_back(fallback);
  }
  for (const auto& d : dirs) {
    std::string candidate = d + "/" + name;
    if (access(candidate.c_str(), X_OK) == 0) return candidate;
  }
  return {};
}

bool systemd_tools_required() {
  const char* value = std::getenv("SITEDECK_REQUIRE_SYSTEMD_TOOLS");
  return value != nullptr && std::string(value) == "1";
}

