// sitedeck-soak: runs the real service for a long time and watches its
// resources. First one connection serves many requests (commands 3, 5, 7, 10
// and 11 in turn) while the service's open descriptors, memory mappings and
// resident memory are sampled; then many connections in a row go through the
// activator, one service process each, sampled per connection. At the end no
// shared-memory object and no stray file may be left behind. Prints the
// figures and exits 1 when descriptors or mappings grew or something was left.
// Not a test: a run takes minutes (tests/soak_test.cpp is the short version).
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <sqlite3.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "dlog.h"
#include "proc_stats.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-client.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;

constexpr int kItems = 30;
constexpr int kReadTimeoutMs = 30000;
// How much the mapping count of two fresh service processes may differ.
constexpr long kMapsJitter = 16;
constexpr int32_t kCommands[] = {SDS_CMD_GET_URL, SDS_CMD_GET_TOUCH_ICON_EXISTS, SDS_CMD_GET_ICON,
                                 SDS_CMD_GET_NEXT_UPDATE_DURATION, SDS_CMD_GET_FULL_IDS};

struct Options {
  long requests = 100000;
  long connections = 1000;
  int samples = 10;
  std::string bin_dir;
};

bool parse(int argc, char** argv, Options* o) {
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--requests" && i + 1 < argc) {
      o->requests = std::atol(argv[++i]);
    } else if (a == "--connections" && i + 1 < argc) {
      o->connections = std::atol(argv[++i]);
    } else if (a == "--samples" && i + 1 < argc) {
      o->samples = std::max(1, std::atoi(argv[++i]));
    } else if (a == "--bin-dir" && i + 1 < argc) {
      o->bin_dir = argv[++i];
    } else {
      std::fprintf(stderr,
                   "usage: sitedeck-soak [--requests N] [--connections N] [--samples N] "
                   "[--bin-dir DIR]\n  defaults: 100000 requests on one connection, 1000 "
                   "connections, 10 samples; binaries next to this program\n");
      return false;
    }
  }
  if (o->bin_dir.empty()) o->bin_dir = fs::read_symlink("/proc/self/exe").parent_path().string();
  return o->requests >= 0 && o->connections >= 0;
}

[[noreturn]] void die(const char* what) {
  std::fprintf(stderr, "sitedeck-soak: %s: %s\n", what, std::strerror(errno));
  std::exit(2);
}

// A scratch root laid out like a device, holding kItems items with icons.
std::string make_root() {
  std::string templ = (fs::temp_directory_path() / "sitedeck-soak-XXXXXX").string();
  if (mkdtemp(templ.data()) == nullptr) die("mkdtemp");
  for (const char* sub : {SDS_SERVER_DIR, SDS_DATABASE_DIR, SDS_IMAGES_DIR,
                          "/opt/data/browser-sitedeck-service", "/opt/var/kdb"}) {
    fs::create_directories(templ + sub);
  }
  setenv("SITEDECK_ROOT", templ.c_str(), 1);
  dlog_set_quiet(true);
  if (sds_ensure_db_open() != SDS_ERROR_NONE) die("database");
  std::string sql = "BEGIN;";
  for (int i = 1; i <= kItems; ++i) {
    sql +=
        "INSERT INTO site_deck(url,title,touch_icon_exists,is_dirty,order_index,icon_size,"
        "icon_data) VALUES ('http://site-" +
        std::to_string(i) + ".example/','Site " + std::to_string(i) + "',1,1," + std::to_string(i) +
        ",'57x57',randomblob(12996));";
  }
  sql += "COMMIT;";
  if (sqlite3_exec(sds_db_handle, sql.c_str(), nullptr, nullptr, nullptr) != SQLITE_OK) {
    die("seeding the database");
  }
  sqlite3_close(sds_db_handle);
  sds_db_handle = nullptr;
  UniqueFile f(std::fopen(sds_path(SDS_NEXT_UPDATE_DURATION_PATH).c_str(), "w"));
  if (!f) die("duration file");
  std::fputs("3600", f.get());
  return templ;
}

// Every file below the root, relative to it, but the socket and the logs.
std::set<std::string> files_of(const std::string& root) {
  std::set<std::string> files;
  for (const auto& e : fs::recursive_directory_iterator(root)) {
    if (!e.is_directory() && !e.is_socket() && e.path().extension() != ".log") {
      files.insert(e.path().string().substr(root.size()));
    }
  }
  return files;
}

bool shm_object_exists() { return fs::exists(SDS_SHM_FILE_PATH); }

// Other service processes on this machine (tests, demos) make and remove the
// same machine-wide shared-memory object, which would fail this run's icon
// requests now and then. A mount namespace with a /dev/shm of its own keeps
// them apart; it needs root, and without it the shared one is used.
bool isolate_shared_memory() {
  return unshare(CLONE_NEWNS) == 0 &&
         mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
         mount("tmpfs", "/dev/shm", "tmpfs", MS_NOSUID | MS_NODEV, "size=64m") == 0;
}

pid_t spawn(const std::vector<std::string>& argv, int fd3, const std::string& log_path,
            bool activation) {
  std::vector<std::string> env;
  for (char** e = environ; *e != nullptr; ++e) {
    if (std::strncmp(*e, "LISTEN_", 7) != 0) env.emplace_back(*e);
  }
  if (activation) env.emplace_back("LISTEN_FDS=1");
  int log_fd = open(log_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (log_fd < 0) die("log file");
  pid_t pid = fork();
  if (pid == 0) {
    if (activation) env.push_back("LISTEN_PID=" + std::to_string(getpid()));
    std::vector<char*> envp;
    for (auto& e : env) envp.push_back(e.data());
    envp.push_back(nullptr);
    std::vector<std::string> args = argv;
    std::vector<char*> argvp;
    for (auto& a : args) argvp.push_back(a.data());
    argvp.push_back(nullptr);
    (void)dup2(log_fd, STDOUT_FILENO);
    (void)dup2(log_fd, STDERR_FILENO);
    if (fd3 == 3) {
      (void)fcntl(3, F_SETFD, 0);  // dup2 onto itself would keep close-on-exec
    } else if (fd3 >= 0 && dup2(fd3, 3) < 0) {
      _exit(127);
    }
    (void)close_range(fd3 >= 0 ? 4 : 3, ~0U, 0);
    execve(argvp[0], argvp.data(), envp.data());
    _exit(127);
  }
  (void)close(log_fd);
  if (pid < 0) die("fork");
  return pid;
}

// Waits up to `timeout_ms` for `pid` to end; true when it did (reaped).
bool wait_for(pid_t pid, int timeout_ms, int* status) {
  int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (pidfd < 0) return false;
  struct pollfd entry = {pidfd, POLLIN, 0};
  bool ended = poll(&entry, 1, timeout_ms) == 1;
  (void)close(pidfd);
  return ended && waitpid(pid, status, 0) == pid;
}

int listen_socket() {
  std::string path = sds_path(SDS_SOCKET_PATH);
  fs::create_directories(fs::path(path).parent_path());
  (void)unlink(path.c_str());
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  if (fd < 0 || bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      listen(fd, 16) != 0) {
    die("listening socket");
  }
  return fd;
}

// One request of the mix; false when its reply was not the expected one.
bool one_request(SdsConnection& c, long n) {
  const int32_t cmd = kCommands[n % 5];
  const auto id = static_cast<int32_t>(1 + (n / 5) % kItems);
  SdsClientText text;
  int32_t value = 0;
  sds_client_icon icon;
  sds_client_ids ids;
  switch (cmd) {
    case SDS_CMD_GET_URL:
      return sds_client_get_url(c, id, &text) == SDS_ERROR_NONE;
    case SDS_CMD_GET_TOUCH_ICON_EXISTS:
      return sds_client_get_touch_icon_exists(c, id, &value) == SDS_ERROR_NONE && value == 1;
    case SDS_CMD_GET_ICON:
      return sds_client_get_icon(c, id, &icon) == SDS_ERROR_NONE && icon.byte_count == 12996;
    case SDS_CMD_GET_NEXT_UPDATE_DURATION:
      return sds_client_get_next_update_duration(c, &value) == SDS_ERROR_NONE && value == 3600;
    default:
      return sds_client_get_ids_by_dirty(c, 1, &ids) == SDS_ERROR_NONE && ids.count == kItems;
  }
}

void print_row(const char* label, long at, const ProcStats& s) {
  std::printf("  %-12s %9ld %6ld %6ld %8ld\n", label, at, s.fds, s.mappings, s.rss_kb);
}

struct Range {
  long min = -1, max = -1;
  void add(long v) {
    min = min < 0 ? v : std::min(min, v);
    max = std::max(max, v);
  }
};

bool one_connection(const Options& o, const std::string& root) {
  std::printf("one connection, %ld requests (commands 3, 5, 7, 10, 11 in turn):\n", o.requests);
  std::printf("  %-12s %9s %6s %6s %8s\n", "", "requests", "fds", "maps", "rss_kB");
  int listen_fd = listen_socket();
  pid_t service = spawn({o.bin_dir + "/browser-sitedeck-service"}, listen_fd,
                        root + "/service-stderr.log", true);
  (void)close(listen_fd);
  SdsConnection c;
  if (sds_client_connect(sds_path(SDS_SOCKET_PATH), c, {kReadTimeoutMs, kReadTimeoutMs}) != SDS_ERROR_NONE) {
    die("connect");
  }
  const long every = std::max(1L, o.requests / o.samples);
  std::vector<ProcStats> samples;
  auto started = std::chrono::steady_clock::now();
  long failures = 0;
  for (long n = 0; n <= o.requests; ++n) {
    if (n % every == 0 || n == o.requests) {
      samples.push_back(proc_stats(service));
      print_row("sample", n, samples.back());
    }
    if (n < o.requests && !one_request(c, n)) ++failures;
  }
  double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count();
  const bool freed = sds_client_release_shm(c) == SDS_ERROR_NONE;
  c.close();
  int status = 0;
  const bool ended = wait_for(service, 10000, &status);
  // The first sample is taken before any request: descriptors and mappings
  // settle with the first requests (database pages, the library's caches).
  const ProcStats& settled = samples.size() > 1 ? samples[1] : samples[0];
  bool flat = true;
  for (size_t i = 1; i < samples.size(); ++i) {
    flat = flat && samples[i].fds == settled.fds && samples[i].mappings == settled.mappings;
  }
  std::printf(
      "  %.1f s, %.0f requests/s, %ld failed replies; fds and maps %s after the first "
      "%ld requests; rss %+ld kB from then on\n",
      seconds, o.requests / std::max(seconds, 1e-9), failures, flat ? "flat" : "NOT FLAT", every,
      samples.back().rss_kb - settled.rss_kb);
  std::printf("  command 2 %s; service %s\n", freed ? "removed the shared memory" : "FAILED",
              ended && WIFEXITED(status) && WEXITSTATUS(status) == 0 ? "exited 0" : "DID NOT END");
  return flat && failures == 0 && freed && ended;
}

bool many_connections(const Options& o, const std::string& root) {
  std::printf("%ld connections in a row through the activator, one service each:\n", o.connections);
  int ready[2];
  if (pipe2(ready, O_CLOEXEC) != 0) die("pipe");
  pid_t activator = spawn({o.bin_dir + "/sitedeck-activator", "--ready-fd", "3", "--quiet-service",
                           o.bin_dir + "/browser-sitedeck-service"},
                          ready[1], root + "/activator-stderr.log", false);
  (void)close(ready[1]);
  char line[8] = {};
  struct pollfd entry = {ready[0], POLLIN, 0};
  if (poll(&entry, 1, 10000) != 1 || read(ready[0], line, 6) != 6) die("activator not ready");
  (void)close(ready[0]);

  const long every = std::max(1L, o.connections / o.samples);
  std::printf("  %-12s %9s %6s %6s %8s\n", "", "conns", "fds", "maps", "rss_kB");
  Range fds, maps, rss;
  ProcStats first_activator{}, last_activator{};
  long failures = 0;
  auto started = std::chrono::steady_clock::now();
  for (long n = 0; n < o.connections; ++n) {
    SdsConnection c;
    if (sds_client_connect(sds_path(SDS_SOCKET_PATH), c, {kReadTimeoutMs, kReadTimeoutMs}) != SDS_ERROR_NONE) {
      ++failures;
      continue;
    }
    for (long r = 0; r < 5; ++r) {
      if (!one_request(c, n * 5 + r)) ++failures;
    }
    std::vector<pid_t> children = proc_children(activator);
    if (children.size() == 1) {
      ProcStats s = proc_stats(children[0]);
      fds.add(s.fds);
      maps.add(s.mappings);
      rss.add(s.rss_kb);
      if (n % every == 0) print_row("service", n, s);
    }
    if (n % every == 0) {
      last_activator = proc_stats(activator);
      if (n == 0) first_activator = last_activator;
      print_row("activator", n, last_activator);
    }
    if (sds_client_release_shm(c) != SDS_ERROR_NONE) ++failures;
  }
  double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count();
  // Let the last service end before stopping the activator.
  for (int i = 0; i < 1000 && !proc_children(activator).empty(); ++i) usleep(10000);
  last_activator = proc_stats(activator);
  print_row("activator", o.connections, last_activator);
  (void)kill(activator, SIGTERM);
  int status = 0;
  const bool ended = wait_for(activator, 10000, &status);
  // Each connection has a process of its own, so nothing can pile up in a
  // service; its mappings differ a little from process to process (where
  // the randomised layout lets neighbours merge). What lives on is the
  // activator, whose figures must not move.
  const bool flat = fds.min == fds.max && maps.max - maps.min <= kMapsJitter &&
                    first_activator.fds == last_activator.fds &&
                    first_activator.mappings == last_activator.mappings;
  std::printf("  %.1f s, %.1f connections/s, %ld failures\n", seconds,
              o.connections / std::max(seconds, 1e-9), failures);
  std::printf("  per service at its fifth request: fds %ld..%ld, maps %ld..%ld, rss %ld..%ld kB\n",
              fds.min, fds.max, maps.min, maps.max, rss.min, rss.max);
  std::printf("  activator: fds %ld -> %ld, maps %ld -> %ld, rss %ld -> %ld kB; %s\n",
              first_activator.fds, last_activator.fds, first_activator.mappings,
              last_activator.mappings, first_activator.rss_kb, last_activator.rss_kb,
              ended ? "stopped" : "DID NOT STOP");
  return flat && failures == 0 && ended;
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  if (!parse(argc, argv, &o)) return 2;
  std::signal(SIGPIPE, SIG_IGN);
  const bool isolated = isolate_shared_memory();
  const std::string root = make_root();
  const std::set<std::string> before = files_of(root);
  const bool shm_before = shm_object_exists();
  std::printf("scratch root %s; %s\n", root.c_str(),
              isolated ? "a /dev/shm of its own" : "the machine's /dev/shm (not root)");

  bool ok = one_connection(o, root);
  ok = many_connections(o, root) && ok;

  const std::set<std::string> after = files_of(root);
  std::vector<std::string> left;
  std::set_difference(after.begin(), after.end(), before.begin(), before.end(),
                      std::back_inserter(left));
  const bool shm_left = shm_object_exists();
  std::printf(
      "left behind: shared-memory object %s; new files: %zu",
      shm_left ? (shm_before ? "present (it was there before the run)" : "PRESENT") : "none",
      left.size());
  for (const auto& f : left) std::printf(" %s", f.c_str());
  std::printf("\n");
  ok = ok && left.empty() && (!shm_left || shm_before);
  std::error_code ec;
  if (ok) fs::remove_all(root, ec);
  std::printf("%s\n", ok ? "soak passed" : "soak FAILED (scratch root kept)");
  return ok ? 0 : 1;
}
