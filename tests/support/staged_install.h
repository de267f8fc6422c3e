// Installs the build this test binary belongs to into a scratch directory,
// as a package build would (`DESTDIR=... cmake --install BUILD --prefix P`),
// and finds the systemd tools the packaging tests drive. Whether a missing
// tool skips a case or fails it is the environment's choice: with
// SITEDECK_REQUIRE_SYSTEMD_TOOLS=1 (scripts/test sets it) it fails.
#pragma once

#include <string>

#include "support/run_process.h"

// Runs the installation of this build below `destdir` for `prefix`; the
// result carries cmake's output for a failure message.
ProcessResult install_staged(const std::string& destdir, const std::string& prefix);

// The full path of `name` found on $PATH (or in the usual system
// directories), or empty.
std::string find_program(const char* name);

// True when SITEDECK_REQUIRE_SYSTEMD_TOOLS is "1".
bool systemd_tools_required();

