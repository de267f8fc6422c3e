#include "support/service_harness.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>

#include "sitedeck-service-paths.h"
#include "support/run_process.h"
#include "support/temp_root.h"

extern char** environ;

namespace {

constexpr char kListenPidPrefix[] = "LISTEN_PID=";

int pidfd_open_for(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

// Async-signal-safe: writes the decimal form of `value` and a terminator.
void format_pid(char* out, pid_t value) {
  char digits[16];
  int n = 0;
  do {
    digits[n++] = static_cast<char>('0' + value % 10);
    value /= 10;
  } while (value > 0 && n < 15);
  while (n > 0) *out++ = digits[--n];
  *out = '\0';
}

}  // namespace

int exit_code_of(int wait_status) { return WIFEXITED(wait_status) ? WEXITSTATUS(wait_status) : -1; }

ServiceHarness::ServiceHarness() {
  const char* root = std::getenv("SITEDECK_ROOT");
  root_ = root != nullptr ? root : "";
  socket_path_ = sds_path(SDS_SOCKET_PATH);
  stderr_path_ = root_ + "/service-stderr.log";
  service_path_ = std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service";
  activator_path_ = std::string(SITEDECK_BIN_DIR) + "/sitedeck-activator";
}

ServiceHarness::~ServiceHarness() {
  stop();
  if (listen_fd_ >= 0) (void)close(listen_fd_);
  // The service creates the object at every connection; it is machine-wide.
  (void)shm_unlink(SDS_SHM_NAME);
}

bool ServiceHarness::spawn(const std::vector<std::string>& argv, int fd3,
                           bool activation_environment) {
  if (root_.empty() || pid_ > 0) return false;
  int out_fd =
      open(stderr_path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_APPEND | O_CLOEXEC, 0644);
  if (out_fd < 0) return false;

  // Everything the child needs is built here: after fork only
  // async-signal-safe calls are allowed in a possibly threaded test process.
  std::vector<std::string> env;
  for (char** e = environ; *e != nullptr; ++e) {
    if (std::strncmp(*e, "LISTEN_", 7) != 0) env.emplace_back(*e);
  }
  size_t pid_slot = env.size();
  if (activation_environment) {
    env.emplace_back("LISTEN_FDS=1");
    pid_slot = env.size();
    env.emplace_back(std::string(kListenPidPrefix) + std::string(16, '\0'));
  }
  std::vector<char*> envp;
  for (auto& e : env) envp.push_back(e.data());
  envp.push_back(nullptr);
  std::vector<std::string> args = argv;
  std::vector<char*> argvp;
  for (auto& a : args) argvp.push_back(a.data());
  argvp.push_back(nullptr);

  pid_t pid = fork();
  if (pid == 0) {
    (void)dup2(out_fd, STDOUT_FILENO);
    (void)dup2(out_fd, STDERR_FILENO);
    if (fd3 == 3) {
      (void)fcntl(3, F_SETFD, 0);
    } else if (fd3 >= 0) {
      (void)dup2(fd3, 3);
    }
    (void)close_range(fd3 >= 0 ? 4 : 3, ~0U, 0);
    if (activation_environment) {
      format_pid(envp[pid_slot] + sizeof kListenPidPrefix - 1, getpid());
    }
    execve(argvp[0], argvp.data(), envp.data());
    _exit(127);
  }
  (void)close(out_fd);
  if (pid < 0) return false;
  pid_ = pid;
  pidfd_ = pidfd_open_for(pid);
  return pidfd_ >= 0;
}

bool ServiceHarness::start_activated(bool once) {
  int ready[2];
  if (pipe2(ready, O_CLOEXEC) != 0) return false;
  std::vector<std::string> argv = {activator_path_, "--ready-fd", "3"};
  if (once) argv.emplace_back("--once");
  argv.push_back(service_path_);
  bool started = spawn(argv, ready[1], false);
  (void)close(ready[1]);
  activated_ = started;
  char line[8] = {};
  struct pollfd entry = {ready[0], POLLIN, 0};
  bool ok = started && poll(&entry, 1, 10000) == 1 && read(ready[0], line, 6) == 6 &&
            std::strcmp(line, "ready\n") == 0;
  (void)close(ready[0]);
  return ok;
}

bool ServiceHarness::start_direct() { return start_direct_wrapped({}); }

bool ServiceHarness::start_direct_wrapped(const std::vector<std::string>& wrapper) {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (socket_path_.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, socket_path_.c_str(), socket_path_.size() + 1);
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(socket_path_).parent_path(), ec);
  // A socket file left by an earlier run in this root would make bind fail.
  (void)unlink(socket_path_.c_str());
  listen_fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (listen_fd_ < 0 ||
      bind(listen_fd_, reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0 ||
      listen(listen_fd_, 16) != 0) {
    return false;
  }
  std::vector<std::string> argv = wrapper;
  argv.push_back(service_path_);
  return spawn(argv, listen_fd_, true);
}

bool ServiceHarness::start_unactivated() { return spawn({service_path_}, -1, false); }

bool ServiceHarness::wait_until_accepting(int timeout_ms) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeout_ms);
  std::string path = "/proc/" + std::to_string(pid_) + "/syscall";
  while (pid_ > 0) {
    std::ifstream in(path);
    long number = -1;
    if (in >> number && (number == SYS_accept || number == SYS_accept4)) return true;
    int left = ms_left(deadline);
    if (left == 0) return false;
    // Waiting on the pidfd paces the checks and notices an early exit at once.
    struct pollfd entry = {pidfd_, POLLIN, 0};
    if (poll(&entry, 1, 1) == 1) return false;
  }
  return false;
}

int ServiceHarness::connect(SdsConnection* out, int read_timeout_ms) {
  sds_client_timeouts timeouts;
  timeouts.connect_ms = read_timeout_ms;
  timeouts.reply_ms = read_timeout_ms;
  return sds_client_connect(socket_path_, *out, timeouts);
}

bool ServiceHarness::signal(int signal_number) {
  return pid_ > 0 && kill(pid_, signal_number) == 0;
}

bool ServiceHarness::wait_exit(int* wait_status, int timeout_ms) {
  if (pid_ <= 0) return false;
  struct pollfd entry = {pidfd_, POLLIN, 0};
  if (poll(&entry, 1, timeout_ms) != 1) return false;
  int status = 0;
  if (waitpid(pid_, &status, 0) != pid_) return false;
  (void)close(pidfd_);
  pidfd_ = -1;
  pid_ = -1;
  if (wait_status != nullptr) *wait_status = status;
  return true;
}

void ServiceHarness::stop() {
  if (pid_ <= 0) return;
  // The activator stops its service on SIGTERM; a bare service is killed.
  if (activated_ && kill(pid_, SIGTERM) == 0 && wait_exit(nullptr, 10000)) return;
  (void)kill(pid_, SIGKILL);
  (void)wait_exit(nullptr, 10000);
}

std::string ServiceHarness::output() const { return read_file(stderr_path_); }

std::vector<std::string> ServiceHarness::messages() const {
  std::vector<std::string> result;
  std::istringstream in(output());
  std::string line;
  while (std::getline(in, line)) {
    size_t arrow = line.find(") > ");
    if (arrow != std::string::npos) result.push_back(line.substr(arrow + 4));
  }
  return result;
}

bool ServiceHarness::has_message(const std::string& message) const {
  for (const auto& m : messages()) {
    if (m == message) return true;
  }
  return false;
}

bool ServiceHarness::has_message_matching(const std::string& pattern) const {
  std::regex re(pattern);
  for (const auto& m : messages()) {
    if (std::regex_match(m, re)) return true;
  }
  return false;
}
