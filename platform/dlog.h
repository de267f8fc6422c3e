// Stand-in for the platform log service. Each call writes one line to standard
// error, "<P>/<tag>: <formatted text>", P being I, W or E; when standard error
// is the systemd journal the line goes to the journal instead, with structured
// fields, once.
#pragma once

#include <cstdarg>

enum log_id_t { LOG_ID_MAIN = 0 };

enum log_priority { DLOG_INFO = 4, DLOG_WARN = 5, DLOG_ERROR = 6 };

int __dlog_print(log_id_t log_id, int prio, const char* tag, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));

// Test hook: every line (without the "<P>/<tag>: " prefix) is also handed to
// `sink`. Pass null to remove it. Not for use by the service itself.
using dlog_sink_fn = void (*)(int prio, const char* tag, const char* text, void* user);
void dlog_set_sink(dlog_sink_fn sink, void* user);
// Test hook: stop writing to standard error (the sink still receives lines).
void dlog_set_quiet(bool quiet);
