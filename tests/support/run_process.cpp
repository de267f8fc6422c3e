#include "support/run_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>

int ms_left(std::chrono::steady_clock::time_point deadline) {
  auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
      deadline - std::chrono::steady_clock::now());
  return left.count() > 0 ? static_cast<int>(left.count()) : 0;
}

ProcessResult run_process(const std::vector<std::string>& argv, int timeout_ms) {
  ProcessResult result;
  int out_pipe[2] = {-1, -1}, err_pipe[2] = {-1, -1};
  if (pipe2(out_pipe, O_CLOEXEC) != 0 || pipe2(err_pipe, O_CLOEXEC) != 0) {
    for (int fd : {out_pipe[0], out_pipe[1]}) (void)close(fd);
    return result;
  }
  // Built before fork: only async-signal-safe calls may follow it.
  std::vector<std::string> args = argv;
  std::vector<char*> argvp;
  for (auto& a : args) argvp.push_back(a.data());
  argvp.push_back(nullptr);

  pid_t pid = fork();
  if (pid == 0) {
    (void)dup2(out_pipe[1], STDOUT_FILENO);
    (void)dup2(err_pipe[1], STDERR_FILENO);
    int null_fd = open("/dev/null", O_RDONLY);
    if (null_fd >= 0) (void)dup2(null_fd, STDIN_FILENO);
    execv(argvp[0], argvp.data());
    _exit(127);
  }
  (void)close(out_pipe[1]);
  (void)close(err_pipe[1]);
  if (pid < 0) {
    (void)close(out_pipe[0]);
    (void)close(err_pipe[0]);
    return result;
  }

  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeout_ms);
  struct pollfd fds[2] = {{out_pipe[0], POLLIN, 0}, {err_pipe[0], POLLIN, 0}};
  std::string* sinks[2] = {&result.out, &result.err};
  int open_pipes = 2;
  bool over_time = false;
  while (open_pipes > 0) {
    int ready = poll(fds, 2, ms_left(deadline));
    if (ready == 0) {
      over_time = true;
      break;
    }
    if (ready < 0) continue;
    for (int i = 0; i < 2; ++i) {
      if (fds[i].fd < 0 || fds[i].revents == 0) continue;
      char buffer[4096];
      ssize_t n = read(fds[i].fd, buffer, sizeof buffer);
      if (n > 0) {
        sinks[i]->append(buffer, static_cast<size_t>(n));
      } else {
        (void)close(fds[i].fd);
        fds[i].fd = -1;
        --open_pipes;
      }
    }
  }
  for (auto& entry : fds) {
    if (entry.fd >= 0) (void)close(entry.fd);
  }
  // A program that closed its output may still run: its end is awaited
  // within the same bound.
  int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (!over_time && pidfd >= 0) {
    struct pollfd entry = {pidfd, POLLIN, 0};
    over_time = poll(&entry, 1, ms_left(deadline)) != 1;
  }
  if (pidfd >= 0) (void)close(pidfd);
  if (over_time) (void)kill(pid, SIGKILL);
  int status = 0;
  if (waitpid(pid, &status, 0) == pid) {
    result.finished = !over_time;
    if (WIFEXITED(status)) result.exit_code = WEXITSTATUS(status);
  }
  return result;
}

std::vector<std::string> without_root(std::vector<std::string> argv) {
  if (geteuid() != 0) return argv;
  argv.insert(argv.begin(),
              {"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"});
  return argv;
}
