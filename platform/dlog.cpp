// Log stand-in: one line per call, on standard error or, when standard error is
// the systemd journal's stream, straight to the journal with structured fields
// (the stream would file the same line a second time); and to a test sink.
#include "dlog.h"

#include <dlfcn.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>

namespace {

std::mutex g_sink_mutex;
dlog_sink_fn g_sink = nullptr;
void* g_sink_user = nullptr;
std::atomic<bool> g_quiet{false};

char priority_letter(int prio) {
  switch (prio) {
    case DLOG_INFO:
      return 'I';
    case DLOG_WARN:
      return 'W';
    default:
      return 'E';
  }
}

int journal_priority(int prio) {
  switch (prio) {
    case DLOG_INFO:
      return 6;  // LOG_INFO
    case DLOG_WARN:
      return 4;  // LOG_WARNING
    default:
      return 3;  // LOG_ERR
  }
}

// systemd sets JOURNAL_STREAM to "<dev>:<ino>" of the stream it connected to
// standard error; only when that is still our stderr do we talk to the journal.
bool stderr_is_journal() {
  const char* env = std::getenv("JOURNAL_STREAM");
  if (env == nullptr) return false;
  unsigned long long dev = 0, ino = 0;
  if (std::sscanf(env, "%llu:%llu", &dev, &ino) != 2) return false;
  struct stat st {};
  if (fstat(STDERR_FILENO, &st) != 0) return false;
  return st.st_dev == dev && st.st_ino == ino;
}

using journal_send_fn = int (*)(const char* format, ...);

// sd_journal_send, from libsystemd loaded when the first line goes to the
// journal: a process that logs to a plain stream (or not at all) does not
// pay for loading that library and the seven it needs at every start.
// Null when it cannot be had; the line then goes to standard error only.
journal_send_fn journal_send() {
  static const journal_send_fn send = [] {
    void* library = dlopen("libsystemd.so.0", RTLD_NOW | RTLD_LOCAL);
    return library != nullptr ? reinterpret_cast<journal_send_fn>(dlsym(library, "sd_journal_send"))
                              : nullptr;
  }();
  return send;
}

// The service formats lines as "file: function(line) > message"; pull the three
// code fields back out for the journal.
// True when the line reached the journal.
bool send_to_journal(int prio, const char* tag, const std::string& text) {
  std::string file, func, line;
  size_t colon = text.find(": ");
  size_t paren = colon == std::string::npos ? std::string::npos : text.find('(', colon);
  size_t close = paren == std::string::npos ? std::string::npos : text.find(") > ", paren);
  if (close != std::string::npos) {
    file = text.substr(0, colon);
    func = text.substr(colon + 2, paren - colon - 2);
    line = text.substr(paren + 1, close - paren - 1);
  }
  journal_send_fn send = journal_send();
  if (send == nullptr) return false;
  return send("MESSAGE=%s", text.c_str(), "PRIORITY=%d", journal_priority(prio),
              "SYSLOG_IDENTIFIER=%s", tag, "CODE_FILE=%s", file.c_str(), "CODE_LINE=%s",
              line.c_str(), "CODE_FUNC=%s", func.c_str(), nullptr) >= 0;
}

}  // namespace

int __dlog_print(log_id_t /*log_id*/, int prio, const char* tag, const char* fmt, ...) {
  if (tag == nullptr || fmt == nullptr) return -1;
  va_list ap;
  va_start(ap, fmt);
  char stack_buffer[1024];
  va_list copy;
  va_copy(copy, ap);
  int needed = std::vsnprintf(stack_buffer, sizeof stack_buffer, fmt, copy);
  va_end(copy);
  std::string text;
  if (needed < 0) {
    va_end(ap);
    return -1;
  }
  if (static_cast<size_t>(needed) < sizeof stack_buffer) {
    text.assign(stack_buffer, static_cast<size_t>(needed));
  } else {
    text.resize(static_cast<size_t>(needed) + 1);
    std::vsnprintf(text.data(), text.size(), fmt, ap);
    text.resize(static_cast<size_t>(needed));
  }
  va_end(ap);
  // A message's own line feed ends the line; it must not add a blank one.
  if (!text.empty() && text.back() == '\n') text.pop_back();

  static const bool journal = stderr_is_journal();
  if (!g_quiet.load(std::memory_order_relaxed) && !(journal && send_to_journal(prio, tag, text))) {
    std::string line;
    line.reserve(text.size() + std::strlen(tag) + 5);
    line += priority_letter(prio);
    line += '/';
    line += tag;
    line += ": ";
    line += text;
    line += '\n';
    // One write per line keeps lines of the two threads from interleaving.
    (void)!write(STDERR_FILENO, line.data(), line.size());
  }

  std::lock_guard<std::mutex> guard(g_sink_mutex);
  if (g_sink != nullptr) g_sink(prio, tag, text.c_str(), g_sink_user);
  return 0;
}

void dlog_set_sink(dlog_sink_fn sink, void* user) {
  std::lock_guard<std::mutex> guard(g_sink_mutex);
  g_sink = sink;
  g_sink_user = user;
}

void dlog_set_quiet(bool quiet) { g_quiet.store(quiet, std::memory_order_relaxed); }
