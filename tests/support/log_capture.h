// Collects the service's log lines while the object lives, so that a test can
// assert the exact message text (the part after "> ").
#pragma once

#include <mutex>
#include <string>
#include <vector>

struct LogLine {
  int prio;
  std::string file;     // source file base name
  std::string message;  // text after "> "
};

class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<LogLine> lines() const;
  // True when some line's message equals `message` exactly.
  bool contains(const std::string& message) const;
  // Number of lines whose message equals `message` exactly.
  int count(const std::string& message) const;
  void clear();

 private:
  static void sink(int prio, const char* tag, const char* text, void* user);
  mutable std::mutex mutex_;
  std::vector<LogLine> lines_;
};
