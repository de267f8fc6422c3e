// A program under the activator, as the service runs on a device: the
// activator listens on a socket and starts a fresh process of the program for
// every connection. The benchmark runs the service this way, and the start-up
// floor (a libc-only program) the same way, so that both pay the same fork,
// exec and activation.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>

class BenchActivated {
 public:
  BenchActivated() = default;
  // Stops the activator, which stops the program it runs.
  ~BenchActivated();
  BenchActivated(const BenchActivated&) = delete;
  BenchActivated& operator=(const BenchActivated&) = delete;

  // Starts the activator for `program` on `socket_path` and returns once it
  // listens; false (reason on stderr) otherwise. The program's standard error
  // goes to /dev/null: its log lines are not what is measured.
  bool start(const std::string& program, const std::string& socket_path);
  const std::string& socket_path() const { return socket_path_; }

  // A new connection's descriptor (blocking, close-on-exec), or -1.
  int connect_socket() const;
  // The process the activator runs now, or 0 when none runs.
  pid_t child() const;
  // Waits until the activator runs no process (the last one has ended and
  // been reaped), so that the next connection meets an idle activator, as a
  // browser does. False when that takes longer than `timeout_ms`.
  bool wait_idle(int timeout_ms = 10000) const;

 private:
  pid_t pid_ = -1;
  int pidfd_ = -1;
  std::string socket_path_;
};

// Resident memory (VmRSS) of process `pid` in bytes, or -1.
int64_t bench_resident_bytes(pid_t pid);
// CPU time process `pid` has had so far, all its threads together (from
// /proc/PID/task/*/schedstat, in nanoseconds), or -1.
int64_t bench_cpu_time_ns(pid_t pid);
// A memory line of /proc/PID/status ("VmRSS:", "RssAnon:"...) in bytes, or -1.
int64_t bench_status_bytes(pid_t pid, const char* key);
