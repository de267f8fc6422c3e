// Runs a program to its end for a test and collects what it printed: standard
// output and standard error separately, the exit code, all within a bound
// (the program is killed when it runs over).
#pragma once

#include <chrono>
#include <string>
#include <vector>

struct ProcessResult {
  bool finished = false;  // false: it could not start or ran over the bound
  int exit_code = -1;     // -1 when it did not exit by itself
  std::string out;
  std::string err;
};

// Milliseconds until `deadline`, 0 once it has passed: a poll's time-out.
int ms_left(std::chrono::steady_clock::time_point deadline);

// `argv[0]` is the program's path; the environment is the test's own.
ProcessResult run_process(const std::vector<std::string>& argv, int timeout_ms = 20000);

// `argv` run without root's right to pass file permissions: as the user
// nobody when the tests run as root, unchanged otherwise.
std::vector<std::string> without_root(std::vector<std::string> argv);
