#include "support/log_capture.h"

#include <cstdlib>
#include <cstring>

#include "dlog.h"

LogCapture::LogCapture() {
  dlog_set_sink(&LogCapture::sink, this);
  // Keep test output readable; SITEDECK_TEST_LOG=1 shows every line.
  const char* show = std::getenv("SITEDECK_TEST_LOG");
  dlog_set_quiet(show == nullptr || std::strcmp(show, "1") != 0);
}

LogCapture::~LogCapture() {
  dlog_set_sink(nullptr, nullptr);
  dlog_set_quiet(false);
}

void LogCapture::sink(int prio, const char* /*tag*/, const char* text, void* user) {
  auto* self = static_cast<LogCapture*>(user);
  std::string line = text;
  LogLine parsed{prio, "", line};
  size_t colon = line.find(": ");
  size_t arrow = line.find(") > ");
  if (colon != std::string::npos && arrow != std::string::npos) {
    parsed.file = line.substr(0, colon);
    parsed.message = line.substr(arrow + 4);
  }
  std::lock_guard<std::mutex> guard(self->mutex_);
  self->lines_.push_back(std::move(parsed));
}

std::vector<LogLine> LogCapture::lines() const {
  std::lock_guard<std::mutex> guard(mutex_);
  return lines_;
}

bool LogCapture::contains(const std::string& message) const { return count(message) > 0; }

int LogCapture::count(const std::string& message) const {
  std::lock_guard<std::mutex> guard(mutex_);
  int n = 0;
  for (const auto& l : lines_) n += (l.message == message) ? 1 : 0;
  return n;
}

void LogCapture::clear() {
  std::lock_guard<std::mutex> guard(mutex_);
  lines_.clear();
}
