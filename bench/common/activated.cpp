#include "activated.h"

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>

namespace {

int pidfd_open_for(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

// The first child listed for `pid` (its main thread's children), or 0.
pid_t first_child(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) + "/children");
  long child = 0;
  if (in >> child) return static_cast<pid_t>(child);
  return 0;
}

}  // namespace

BenchActivated::~BenchActivated() {
  if (pid_ > 0) {
    (void)kill(pid_, SIGTERM);
    struct pollfd entry = {pidfd_, POLLIN, 0};
    if (poll(&entry, 1, 10000) != 1) (void)kill(pid_, SIGKILL);
    (void)waitpid(pid_, nullptr, 0);
  }
  if (pidfd_ >= 0) (void)close(pidfd_);
}

bool BenchActivated::start(const std::string& program, const std::string& socket_path) {
  if (pid_ > 0) return false;
  socket_path_ = socket_path;
  const std::string activator = std::string(SITEDECK_BIN_DIR) + "/sitedeck-activator";
  int ready[2];
  if (pipe2(ready, O_CLOEXEC) != 0) return false;
  // Built before fork: the child only duplicates descriptors and execs.
  std::string fd_text = "3";
  const char* argv[] = {activator.c_str(), "--ready-fd",   fd_text.c_str(), "--quiet-service",
                        "--socket",        socket_path.c_str(), program.c_str(), nullptr};
  pid_t pid = fork();
  if (pid == 0) {
    (void)dup2(ready[1], 3);
    (void)close_range(4, ~0U, 0);
    execv(argv[0], const_cast<char* const*>(argv));
    _exit(127);
  }
  (void)close(ready[1]);
  if (pid < 0) {
    (void)close(ready[0]);
    return false;
  }
  pid_ = pid;
  pidfd_ = pidfd_open_for(pid);
  char line[8] = {};
  struct pollfd entry = {ready[0], POLLIN, 0};
  bool ok = poll(&entry, 1, 10000) == 1 && read(ready[0], line, 6) == 6 &&
            std::strcmp(line, "ready\n") == 0;
  (void)close(ready[0]);
  if (!ok) std::fprintf(stderr, "bench: the activator for %s did not start\n", program.c_str());
  return ok && pidfd_ >= 0;
}

int BenchActivated::connect_socket() const {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (socket_path_.size() >= sizeof address.sun_path) return -1;
  std::memcpy(address.sun_path, socket_path_.c_str(), socket_path_.size() + 1);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (connect(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0) {
    (void)close(fd);
    return -1;
  }
  return fd;
}

pid_t BenchActivated::child() const { return pid_ > 0 ? first_child(pid_) : 0; }

bool BenchActivated::wait_idle(int timeout_ms) const {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeout_ms);
  for (;;) {
    pid_t running = child();
    if (running == 0) return true;
    // Wait for the process itself on its pidfd; a zombie stays listed until
    // the activator has reaped it, which takes it a moment.
    int pidfd = pidfd_open_for(running);
    if (pidfd >= 0) {
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      struct pollfd entry = {pidfd, POLLIN, 0};
      int ready = poll(&entry, 1, left.count() > 0 ? static_cast<int>(left.count()) : 0);
      (void)close(pidfd);
      if (ready != 1) return false;
    }
    if (std::chrono::steady_clock::now() > deadline) return false;
    (void)sched_yield();
  }
}

int64_t bench_cpu_time_ns(pid_t pid) {
  std::error_code ec;
  int64_t total = 0;
  bool any = false;
  for (const auto& task :
       std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", ec)) {
    std::ifstream in(task.path() / "schedstat");
    int64_t on_cpu = 0;
    if (in >> on_cpu) {
      total += on_cpu;
      any = true;
    }
  }
  return any ? total : -1;
}

int64_t bench_resident_bytes(pid_t pid) { return bench_status_bytes(pid, "VmRSS:"); }

int64_t bench_status_bytes(pid_t pid, const char* wanted) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string key;
  while (in >> key) {
    if (key == wanted) {
      int64_t kib = -1;
      if (in >> kib) return kib * 1024;
      return -1;
    }
    std::string rest;
    std::getline(in, rest);
  }
  return -1;
}
