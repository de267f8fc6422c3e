// Runs the real service binary for end-to-end tests, in the TempRoot named by
// $SITEDECK_ROOT: under the activator, directly with a listening socket as
// descriptor 3, or unactivated. Every wait is bounded (a ready pipe, a pidfd);
// the log lines are kept in a file of the root; the destructor stops what
// still runs and removes the machine-wide shared-memory object.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "sitedeck-client.h"

class ServiceHarness {
 public:
  ServiceHarness();
  ~ServiceHarness();
  ServiceHarness(const ServiceHarness&) = delete;
  ServiceHarness& operator=(const ServiceHarness&) = delete;

  // Starts sitedeck-activator with the service and returns once it listens.
  // With `once`, the activator exits after one service run, with its status.
  bool start_activated(bool once = true);
  // Listens on the socket itself and runs the service with it as descriptor 3
  // and LISTEN_FDS/LISTEN_PID set, as the activation would.
  bool start_direct();
  // As start_direct, with `wrapper` in front of the service: a program and
  // its arguments that ends by exec'ing the service in the same process
  // (prlimit, setpriv), so that the activation environment still holds.
  bool start_direct_wrapped(const std::vector<std::string>& wrapper);
  // Runs the service with no activation at all.
  bool start_unactivated();
  // Runs `path` instead of the service beside the tests (a copy elsewhere);
  // call before starting.
  void set_service_path(const std::string& path) { service_path_ = path; }

  // Waits until the directly started service blocks in accept(), so that its
  // signal handling is in place.
  bool wait_until_accepting(int timeout_ms = 10000);

  // Connects with the client library; the connection's reads are bounded.
  int connect(SdsConnection* out, int read_timeout_ms = 10000);

  // Sends `signal_number` to the started process (activator or service).
  bool signal(int signal_number);
  // Waits for the started process to end and reaps it; false on time-out.
  bool wait_exit(int* wait_status, int timeout_ms = 20000);

  // Standard error of the started process (and, under the activator, of the
  // service), read from its file.
  std::string output() const;
  // The text after "> " of every log line, in order.
  std::vector<std::string> messages() const;
  bool has_message(const std::string& message) const;
  // True when some message matches `pattern` (ECMAScript) as a whole.
  bool has_message_matching(const std::string& pattern) const;

  const std::string& socket_path() const { return socket_path_; }
  pid_t pid() const { return pid_; }

 private:
  bool spawn(const std::vector<std::string>& argv, int fd3, bool activation_environment);
  void stop();

  std::string root_;
  std::string socket_path_;
  std::string stderr_path_;
  std::string service_path_;
  std::string activator_path_;
  pid_t pid_ = -1;
  int pidfd_ = -1;
  int listen_fd_ = -1;
  bool activated_ = false;
};

// The exit code of a wait status, or -1 when the process did not exit itself.
int exit_code_of(int wait_status);
