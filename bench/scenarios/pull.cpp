// Data pulls as the browser sees them: connect (the activator starts a
// service process), initialize, wait for the pull's result. Every pull starts
// from the same state: no database, no stored ETag, no icon files, and the
// location file already stored for the position sent, so the geocoder is
// never asked. The stand-in content server synthesises the items (two icons
// each; the 96 px RGBA one is chosen). Beside it the floor of
// bench/floors/pull_floor.cpp fetches the same list and icons and writes the
// same rows in one process. Also measured: pulls of 500 and 5000 items per
// item against the pull of 50, and the service's peak resident memory.
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sqlite3.h>
#include <sys/resource.h>
#include <sys/statfs.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "bench.h"
#include "scenarios.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-server-data.h"
#include "sitedeck-service-types.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

extern char** environ;

namespace {

// A position whose city and province are stored beforehand.
constexpr double kLatitude = 37.5;
constexpr double kLongitude = 127.0;
constexpr const char* kVersion = "1.0";
// The answer delay of the latency scenario, in milliseconds.
constexpr int kLatencyMs = 50;
constexpr double kPullTarget = 1.5;
constexpr double kLatencyTarget = 1.3;
constexpr double kScaleTarget = 1.2;
constexpr double kRssTarget = 64.0 * 1024 * 1024;

// Waits up to `ms` for process `pid` (not our child) to end.
bool wait_gone(pid_t pid, int ms) {
  int fd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (fd < 0) return errno == ESRCH;
  pollfd p{fd, POLLIN, 0};
  int ready = 0;
  do {
    ready = poll(&p, 1, ms);
  } while (ready < 0 && errno == EINTR);
  close(fd);
  return ready > 0;
}

// The first child of `parent`: the service process the activator started.
pid_t first_child(pid_t parent) {
  std::ifstream in("/proc/" + std::to_string(parent) + "/task/" + std::to_string(parent) +
                   "/children");
  pid_t child = -1;
  return in >> child ? child : -1;
}

// Peak resident set of `pid` in bytes (VmHWM), or -1.
int64_t peak_rss(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return std::atoll(line.c_str() + 6) * 1024;
  }
  return -1;
}

struct pull_floor_config {
  std::string list_url;  // the signed item-list URL, as the service sends it
  std::string db_path;   // removed and made anew by every run
  int parallel = 1;      // 1: one reused easy handle; more: multi, this many at a time
};

// Runs the floor program once; the rows it stored with an icon, or -1. Its
// CPU time goes to `cpu` when given.
int pull_floor_run(const pull_floor_config& config, std::vector<int64_t>* cpu = nullptr) {
  std::string program = std::string(SITEDECK_BIN_DIR) + "/sitedeck_pull_floor";
  std::string parallel = std::to_string(config.parallel);
  char* argv[] = {program.data(), const_cast<char*>(config.list_url.c_str()),
                  const_cast<char*>(config.db_path.c_str()), parallel.data(), nullptr};
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return -1;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
  pid_t pid = -1;
  int spawned = posix_spawn(&pid, program.c_str(), &actions, nullptr, argv, environ);
  posix_spawn_file_actions_destroy(&actions);
  close(fds[1]);
  std::string out;
  char buffer[64];
  ssize_t n = 0;
  while (spawned == 0 && (n = read(fds[0], buffer, sizeof buffer)) != 0) {
    if (n > 0) out.append(buffer, static_cast<size_t>(n));
    if (n < 0 && errno != EINTR) break;
  }
  close(fds[0]);
  if (spawned != 0) return -1;
  int status = 0;
  struct rusage usage {};
  while (wait4(pid, &status, 0, &usage) < 0 && errno == EINTR) {
  }
  if (cpu != nullptr) {
    cpu->push_back((usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1000000000LL +
                   (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) * 1000LL);
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? std::atoi(out.c_str()) : -1;
}

// The kind of file system holding `dir`, which decides what a file costs.
std::string file_system_of(const std::string& dir) {
  struct statfs fs {};
  if (statfs(dir.c_str(), &fs) != 0) return "unknown";
  switch (static_cast<unsigned long>(fs.f_type)) {
    case 0xEF53:
      return "ext2/3/4";
    case 0x01021994:
      return "tmpfs";
    case 0x9123683E:
      return "btrfs";
    case 0x58465342:
      return "xfs";
    default: {
      char hex[32];
      std::snprintf(hex, sizeof hex, "type 0x%lx", static_cast<unsigned long>(fs.f_type));
      return hex;
    }
  }
}

// CPU time `pid` has used so far, all its threads, in nanoseconds; -1 when
// it cannot be read.
int64_t cpu_ns(pid_t pid) {
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

// count(*) and the summed icon bytes of the live rows of a database file.
std::pair<int64_t, int64_t> stored_totals(const std::string& path) {
  sqlite3* db = nullptr;
  std::pair<int64_t, int64_t> totals{-1, -1};
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(db,
                           "SELECT count(*), total(length(icon_data)) FROM site_deck "
                           "WHERE is_dirty = 1 AND order_index > 0",
                           -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW) {
      totals = {sqlite3_column_int64(s, 0), static_cast<int64_t>(sqlite3_column_double(s, 1))};
    }
    sqlite3_finalize(s);
  }
  sqlite3_close(db);
  return totals;
}

// The service under the activator in a scratch root, pulling from one of the
// content servers.
class PullRig {
 public:
  bool start() {
    sds_server_req_args args{};
    args.latitude = kLatitude;
    args.longitude = kLongitude;
    args.city = const_cast<char*>("Gangnam-gu");
    args.province = const_cast<char*>("Seoul");
    save_city_and_province(&args);
    if (!std::filesystem::exists(root_.path(SDS_LOCATION_INFO_PATH))) {
      std::fprintf(stderr, "bench: pull: the location file was not written\n");
      return false;
    }
    if (!service_.start_activated(/*once=*/false)) {
      std::fprintf(stderr, "bench: pull: the activator did not start:\n%s\n",
                   service_.output().c_str());
      return false;
    }
    return true;
  }

  // Points the service at `content`, which lists `items` sites.
  bool use(const ContentServerProcess& content, int items) {
    if (!settle()) return false;
    items_ = items;
    content_ = &content;
    return write_server_list({{1, content.base_url(), 0, 1, false}});
  }

  // Waits for the service process of the last pull to end and checks what
  // it stored: every item, live, numbered, with its 96x96 icon.
  bool settle() {
    if (last_service_ <= 0) return true;
    if (!wait_gone(last_service_, 60000)) {
      std::fprintf(stderr, "bench: pull: the previous service process did not end\n");
      return false;
    }
    last_service_ = -1;
    auto [rows, icon_bytes] = stored_totals(root_.path(SDS_DB_PATH));
    if (rows != items_ || icon_bytes != int64_t{items_} * 96 * 96 * 4) {
      std::fprintf(stderr, "bench: pull: stored %lld rows with %lld icon bytes, wanted %d\n",
                   static_cast<long long>(rows), static_cast<long long>(icon_bytes), items_);
      return false;
    }
    return true;
  }

  // The start state of every pull.
  bool reset() {
    if (!settle()) return false;
    for (const char* path : {SDS_DB_PATH, SDS_DB_PATH "-journal", SDS_ETAG_PATH,
                             SDS_ETAG_TO_UPDATE_PATH, SDS_NEXT_UPDATE_DURATION_PATH}) {
      (void)std::remove(root_.path(path).c_str());
    }
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(root_.path(SDS_IMAGES_DIR), ec)) {
      std::filesystem::remove_all(entry.path(), ec);
    }
    return true;
  }

  // One pull through the socket; remembers the service's peak memory.
  bool pull() {
    SdsConnection connection;
    if (service_.connect(&connection, 600000) != SDS_ERROR_NONE) return false;
    int result = sds_client_initialize(connection, kLatitude, kLongitude, kVersion);
    last_service_ = first_child(service_.pid());
    if (last_service_ > 0) {
      last_peak_rss_ = peak_rss(last_service_);
      last_cpu_ns_ = cpu_ns(last_service_);
    }
    if (result != SDS_ERROR_NONE) {
      std::fprintf(stderr, "bench: pull: initialize answered %d\n", result);
      return false;
    }
    return true;
  }

  // The signed item-list URL the service asked for last.
  std::string last_list_url() const {
    auto stats = content_->stats();
    return content_->base_url() + "?" + stats["last_query"];
  }

  std::string db_path() const { return root_.path(SDS_DB_PATH); }
  std::string floor_db_path() const { return root_.dir() + "/floor.db"; }
  const std::string& dir() const { return root_.dir(); }
  int64_t last_peak_rss() const { return last_peak_rss_; }
  // CPU time of the last pull's service process up to its answer, start included.
  int64_t last_cpu_ns() const { return last_cpu_ns_; }

 private:
  TempRoot root_;
  ServiceHarness service_;
  const ContentServerProcess* content_ = nullptr;
  int items_ = 0;
  pid_t last_service_ = -1;
  int64_t last_peak_rss_ = -1;
  int64_t last_cpu_ns_ = -1;
};

// Runs one pull and the floor once, and checks that both stored the same
// rows: every column the service writes, icon pixels included.
bool same_as_floor(PullRig& rig, const pull_floor_config& floor, int items) {
  if (!rig.reset() || !rig.pull() || !rig.settle() || pull_floor_run(floor) != items) {
    return false;
  }
  sqlite3* db = nullptr;
  int64_t same = -1;
  std::string attach = "ATTACH DATABASE '" + rig.db_path() + "' AS svc";
  if (sqlite3_open(floor.db_path.c_str(), &db) == SQLITE_OK &&
      sqlite3_exec(db, attach.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK) {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(
            db,
            "SELECT count(*) FROM main.site_deck f JOIN svc.site_deck s ON f.url = s.url "
            "WHERE f.title IS s.title AND f.favicon_exists IS s.favicon_exists AND "
            "f.dominant_color IS s.dominant_color AND f.touch_icon_exists IS s.touch_icon_exists "
            "AND f.is_dirty IS s.is_dirty AND f.image_last_updated IS s.image_last_updated AND "
            "f.icon_size IS s.icon_size AND f.icon_path IS s.icon_path AND "
            "f.icon_data IS s.icon_data AND f.order_index IS s.order_index",
            -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW) {
      same = sqlite3_column_int64(s, 0);
    }
    sqlite3_finalize(s);
  }
  sqlite3_close(db);
  if (same != items) {
    std::fprintf(stderr, "bench: pull: %lld of %d rows are the same in the floor's database\n",
                 static_cast<long long>(same), items);
    return false;
  }
  return true;
}

void add_all(bench_report* report, std::vector<bench_result> results) {
  for (auto& result : results) report->add(std::move(result));
}

// CPU time per iteration, collected beside the wall-clock time. On a busy
// machine it shows what the process itself spent, without the waits for a
// core; the waits for the disk are not in it.
struct cpu_samples {
  std::vector<int64_t> ns;
  int warmup = 0;  // the first samples, taken during the warm-up, are dropped
};

void add_cpu(bench_report* report, const std::string& name, const std::string& of,
             const std::string& floor, double floor_scale, const cpu_samples& cpu) {
  bench_result r;
  r.group = "pull";
  r.name = name;
  r.description = "CPU time (user + system, all threads) of " + of;
  r.floor = floor;
  r.floor_scale = floor_scale;
  for (size_t i = static_cast<size_t>(cpu.warmup); i < cpu.ns.size(); ++i) {
    if (cpu.ns[i] >= 0) r.samples_ns.push_back(cpu.ns[i]);
  }
  if (r.samples_ns.empty()) {
    r.failed = true;
    r.failure = "no measurement";
  }
  report->add(std::move(r));
}

}  // namespace

bool bench_group_pull(const bench_options& options, bench_report* report) {
  PullRig rig;
  if (!rig.start()) return false;
  // Icon files, the database and its journal are made and removed on every
  // pull: the file system under the scratch root weighs on the results.
  report->note("pull: scratch root " + rig.dir() + " on " + file_system_of(rig.dir()) +
               " (set TMPDIR to move it)");
  auto content = std::make_unique<ContentServerProcess>(std::vector<std::string>{"--items", "50"});
  if (!content->ok() || !rig.use(*content, 50)) return false;
  // One pull tells the floor which URL to ask.
  if (!rig.reset() || !rig.pull()) return false;
  pull_floor_config floor{rig.last_list_url(), rig.floor_db_path(), 1};
  if (!same_as_floor(rig, floor, 50)) return false;
  auto reset = [&] { return rig.reset(); };
  const int iterations = bench_report::iterations(options, 30, 5);
  const int warmup = bench_report::iterations(options, 2, 1);
  cpu_samples floor_cpu{{}, warmup}, pull_cpu{{}, warmup};
  auto pull_into = [&](cpu_samples* cpu) {
    return [&rig, cpu] {
      bool ok = rig.pull();
      if (ok) cpu->ns.push_back(rig.last_cpu_ns());
      return ok;
    };
  };
  auto run_floor = [&](const pull_floor_config& config, cpu_samples* cpu) {
    return [config, cpu] { return pull_floor_run(config, &cpu->ns) == 50; };
  };

  add_all(report,
          bench_time_cases("pull",
                           {{"floor-50",
                             "one process: list, 50 icons over one reused handle, decode, one "
                             "transaction",
                             "", run_floor(floor, &floor_cpu)},
                            {"pull-50",
                             "connect, initialize: 50 items with icons from the stand-in server",
                             "floor-50",
                             pull_into(&pull_cpu),
                             {},
                             reset,
                             1.0,
                             kPullTarget}},
                           iterations, warmup, 5));
  add_cpu(report, "floor-50-cpu", "floor-50", "", 1.0, floor_cpu);
  add_cpu(report, "pull-50-cpu", "the service process in pull-50", "floor-50-cpu", 1.0, pull_cpu);

  if (!content->control({{"delay_ms", std::to_string(kLatencyMs)}})) return false;
  pull_floor_config parallel = floor;
  parallel.parallel = 6;
  cpu_samples floor_latency_cpu{{}, warmup}, pull_latency_cpu{{}, warmup};
  add_all(report, bench_time_cases("pull",
                                   {{"floor-50-latency",
                                     "the floor with icons six at a time (multi), 50 ms per answer",
                                     "", run_floor(parallel, &floor_latency_cpu)},
                                    {"pull-50-latency",
                                     "pull-50 with the server taking 50 ms for every answer",
                                     "floor-50-latency",
                                     pull_into(&pull_latency_cpu),
                                     {},
                                     reset,
                                     1.0,
                                     kLatencyTarget}},
                                   bench_report::iterations(options, 15, 3), warmup, 5));
  add_cpu(report, "floor-50-latency-cpu", "floor-50-latency", "", 1.0, floor_latency_cpu);
  add_cpu(report, "pull-50-latency-cpu", "the service process in pull-50-latency",
          "floor-50-latency-cpu", 1.0, pull_latency_cpu);
  content.reset();

  std::vector<int> sizes = {500};
  if (!options.quick) sizes.push_back(5000);
  for (int items : sizes) {
    content = std::make_unique<ContentServerProcess>(
        std::vector<std::string>{"--items", std::to_string(items)});
    if (!content->ok() || !rig.use(*content, items)) return false;
    std::vector<int64_t> peaks;
    cpu_samples cpu{{}, 1};
    auto pull_and_measure = [&] {
      bool ok = rig.pull();
      if (ok) {
        peaks.push_back(rig.last_peak_rss());
        cpu.ns.push_back(rig.last_cpu_ns());
      }
      return ok;
    };
    const std::string name = "pull-" + std::to_string(items);
    const double scale = items / 50.0;
    add_all(report,
            bench_time_cases("pull",
                             {{name,
                               "the pull with " + std::to_string(items) +
                                   " items; ratio: time per item against pull-50",
                               "pull-50",
                               pull_and_measure,
                               {},
                               reset,
                               scale,
                               kScaleTarget}},
                             bench_report::iterations(options, items >= 5000 ? 5 : 10, 3), 1, 5));
    add_cpu(report, name + "-cpu", "the service process in " + name + ", per item against pull-50",
            "pull-50-cpu", scale, cpu);
    bench_result rss;
    rss.group = "pull";
    rss.name = "peak-rss-" + std::to_string(items);
    rss.description =
        "the service process's peak resident memory (VmHWM) in pull-" + std::to_string(items);
    rss.bytes = true;
    rss.target = items >= 5000 ? kRssTarget : 0.0;
    rss.samples_ns = peaks;
    if (peaks.empty()) {
      rss.failed = true;
      rss.failure = "no measurement";
    }
    report->add(std::move(rss));
    content.reset();
  }
  return rig.reset();
}
