// sitedeck-activator does for the service what a systemd socket unit with
// Accept=no does: it owns the listening socket and, whenever a connection is
// pending and no service process runs, starts one with the socket as
// descriptor 3 and LISTEN_FDS/LISTEN_PID set. It never accepts a connection
// itself. Single-threaded; signals arrive through a signalfd.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "sitedeck-service-paths.h"

namespace {

// A service that keeps failing would otherwise be restarted for the same
// pending connection forever.
constexpr int kMaxFailuresInARow = 5;
// Where socket activation puts the first passed descriptor.
constexpr int kListenFd = 3;

struct activator_options {
  bool once = false;
  bool quiet_service = false;
  int ready_fd = -1;
  std::string socket_path;
  std::string service;
};

struct activator_state {
  int listen_fd = -1;
  int signal_fd = -1;
  pid_t child = 0;
  bool stopping = false;
  int failures_in_a_row = 0;
  sigset_t original_mask;
};

void usage(FILE* out) {
  std::fprintf(out,
               "usage: sitedeck-activator [--once] [--ready-fd N] [--quiet-service] "
               "[--socket PATH] [SERVICE]\n"
               "  Listens on the service's socket (default $SITEDECK_ROOT%s) and starts\n"
               "  SERVICE (default: browser-sitedeck-service next to this program) for\n"
               "  each pending connection, as systemd socket activation would.\n"
               "  --once           serve one activation, then exit with the service's status\n"
               "  --ready-fd N     write \"ready\\n\" to descriptor N once listening, instead\n"
               "                   of printing it on standard output\n"
               "  --quiet-service  send the service's standard error to /dev/null\n",
               SDS_SOCKET_PATH);
}

bool parse_options(int argc, char** argv, activator_options* options) {
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "--once") {
      options->once = true;
    } else if (arg == "--quiet-service") {
      options->quiet_service = true;
    } else if (arg == "--ready-fd" && i + 1 < argc) {
      char* end = nullptr;
      long fd = std::strtol(argv[++i], &end, 10);
      if (*end != '\0' || fd < 0 || fd > 65535) return false;
      options->ready_fd = static_cast<int>(fd);
    } else if (arg == "--socket" && i + 1 < argc) {
      options->socket_path = argv[++i];
    } else if (arg == "--help" || arg == "-h") {
      usage(stdout);
      std::exit(0);
    } else if (!arg.empty() && arg[0] != '-' && options->service.empty()) {
      options->service = arg;
    } else {
      return false;
    }
  }
  if (options->socket_path.empty()) options->socket_path = sds_path(SDS_SOCKET_PATH);
  if (options->service.empty()) {
    std::error_code ec;
    auto self = std::filesystem::read_symlink("/proc/self/exe", ec);
    if (ec) return false;
    options->service = (self.parent_path() / "browser-sitedeck-service").string();
  }
  return true;
}

int listen_on(const std::string& path) {
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    std::fprintf(stderr, "sitedeck-activator: socket path too long: %s\n", path.c_str());
    return -1;
  }
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
  struct stat st {};
  if (lstat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) (void)unlink(path.c_str());

  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0 ||
      chmod(path.c_str(), 0666) != 0 || listen(fd, SOMAXCONN) != 0) {
    std::fprintf(stderr, "sitedeck-activator: cannot listen on %s: %s\n", path.c_str(),
                 std::strerror(errno));
    (void)close(fd);
    return -1;
  }
  return fd;
}

void announce_ready(const activator_options& options) {
  static const char kReady[] = "ready\n";
  if (options.ready_fd >= 0) {
    (void)!write(options.ready_fd, kReady, sizeof kReady - 1);
    (void)close(options.ready_fd);
  } else {
    std::fputs(kReady, stdout);
    (void)std::fflush(stdout);
  }
}

// In the child: descriptor 3 becomes the listening socket (dup2 leaves it
// open across exec), everything above it is closed, and LISTEN_PID names the
// child itself, since the service only trusts variables meant for its own pid.
[[noreturn]] void exec_service(const activator_options& options, activator_state& state) {
  (void)sigprocmask(SIG_SETMASK, &state.original_mask, nullptr);
  if (state.listen_fd == kListenFd) {
    (void)fcntl(kListenFd, F_SETFD, 0);
  } else if (dup2(state.listen_fd, kListenFd) < 0) {
    _exit(127);
  }
  if (options.quiet_service) {
    int null_fd = open("/dev/null", O_WRONLY);
    if (null_fd >= 0) (void)dup2(null_fd, STDERR_FILENO);
  }
  (void)close_range(kListenFd + 1, ~0U, 0);
  std::string pid = std::to_string(getpid());
  (void)setenv("LISTEN_FDS", "1", 1);
  (void)setenv("LISTEN_PID", pid.c_str(), 1);
  (void)unsetenv("LISTEN_FDNAMES");
  execl(options.service.c_str(), options.service.c_str(), static_cast<char*>(nullptr));
  std::fprintf(stderr, "sitedeck-activator: cannot run %s: %s\n", options.service.c_str(),
               std::strerror(errno));
  _exit(127);
}

int status_to_exit_code(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  activator_options options;
  if (!parse_options(argc, argv, &options)) {
    usage(stderr);
    return 2;
  }
  activator_state state;
  sigset_t handled;
  sigemptyset(&handled);
  sigaddset(&handled, SIGCHLD);
  sigaddset(&handled, SIGTERM);
  sigaddset(&handled, SIGINT);
  (void)sigprocmask(SIG_BLOCK, &handled, &state.original_mask);
  state.signal_fd = signalfd(-1, &handled, SFD_CLOEXEC);
  state.listen_fd = listen_on(options.socket_path);
  if (state.signal_fd < 0 || state.listen_fd < 0) return 1;
  announce_ready(options);

  int exit_code = 0;
  bool done = false;
  while (!done) {
    struct pollfd fds[2] = {{state.signal_fd, POLLIN, 0}, {-1, POLLIN, 0}};
    if (state.child == 0 && !state.stopping) fds[1].fd = state.listen_fd;
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      exit_code = 1;
      break;
    }
    if (fds[0].revents & POLLIN) {
      struct signalfd_siginfo info {};
      if (read(state.signal_fd, &info, sizeof info) != sizeof info) continue;
      if (info.ssi_signo == SIGTERM || info.ssi_signo == SIGINT) {
        // A second request to stop no longer waits for the service.
        if (state.child != 0) (void)kill(state.child, state.stopping ? SIGKILL : SIGTERM);
        state.stopping = true;
        if (state.child == 0) done = true;
      }
      int status = 0;
      pid_t pid = 0;
      while ((pid = waitpid(-1, &status, WNOHANG)) > 0) {
        if (pid != state.child) continue;
        state.child = 0;
        int code = status_to_exit_code(status);
        state.failures_in_a_row = code == 0 ? 0 : state.failures_in_a_row + 1;
        if (state.stopping) {
          done = true;
        } else if (options.once) {
          exit_code = code;
          done = true;
        } else if (state.failures_in_a_row >= kMaxFailuresInARow) {
          std::fprintf(stderr, "sitedeck-activator: the service failed %d times in a row\n",
                       state.failures_in_a_row);
          exit_code = 1;
          done = true;
        }
      }
    }
    if (!done && fds[1].fd >= 0 && (fds[1].revents & POLLIN)) {
      pid_t pid = fork();
      if (pid == 0) exec_service(options, state);
      if (pid < 0) {
        std::fprintf(stderr, "sitedeck-activator: fork: %s\n", std::strerror(errno));
        exit_code = 1;
        done = true;
      } else {
        state.child = pid;
      }
    }
  }
  (void)close(state.listen_fd);
  (void)unlink(options.socket_path.c_str());
  return exit_code;
}
