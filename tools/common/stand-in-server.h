// What the two stand-in servers (content server and reverse geocoder) share:
// binding 127.0.0.1 on a given or kernel-chosen port and announcing it, the
// run-time control routes (/_control/set, /_control/reset, /_control/release,
// /_control/stats), waits that shutdown can cut short, and command-line
// parsing that feeds the same settings as the control route. These servers are
// test tools: they never bind anything but the loopback address.
#pragma once

#include <httplib.h>

#include <functional>
#include <string>
#include <utility>
#include <vector>

// Applies one setting; returns an empty text on success, else why it was refused.
using standin_setter = std::function<std::string(const std::string& key, const std::string& value)>;

struct standin_control {
  standin_setter set;                  // one key=value of /_control/set or of a flag
  std::function<void()> reset;         // back to the start-up settings, counters zeroed
  std::function<std::string()> stats;  // "name: value" lines
};

struct standin_listen_options {
  int port = 0;           // 0 lets the kernel choose
  std::string port_file;  // written with the port once bound, when not empty
  bool quiet = false;     // no request log on stderr
};

// Parses argv: --port, --port-file and --quiet fill `listen`; every other
// "--name value" pair goes to `set` (dashes in the name read as underscores).
// Returns false, after printing why, on a malformed command line.
bool standin_parse_args(int argc, char** argv, standin_listen_options* listen,
                        const standin_setter& set);

// Decimal integer within [lo, hi], nothing else around it.
bool standin_parse_long(const std::string& text, long lo, long hi, long* out);

// Adds the /_control routes to `svr`.
void standin_add_control_routes(httplib::Server& svr, standin_control control);

// Blocks the termination signals (call first in main, before any thread
// exists) and binds 127.0.0.1. Returns the bound port or -1.
int standin_bind(httplib::Server& svr, const standin_listen_options& options, const char* tool);

// Announces the port ("listening on 127.0.0.1:PORT" on stdout, and the port
// file), then serves until SIGTERM, SIGINT or SIGHUP. Returns the exit code.
int standin_serve(httplib::Server& svr, int port, const standin_listen_options& options,
                  const char* tool);

// Waits up to `ms` milliseconds. Returns true when the whole time passed and
// false when shutdown, or a /_control/release for a stall, cut it short.
bool standin_wait_ms(long ms);

// Wakes every waiter of standin_wait_ms.
void standin_release_waiters();

// The query part of a raw request target, without "?"; empty when none.
std::string standin_raw_query(const httplib::Request& req);
