// Process start-up as the browser meets it: from connect() to the 8-byte
// handshake, through the activator, which starts a new process for every
// connection; and the resident memory of that process right after the
// handshake. The floor is a libc-only program started by the same activator
// that accepts and writes the 8 bytes (bench/floors/handshake_floor.c).
// Every iteration begins with the activator idle, the previous process gone.
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <memory>
#include <vector>

#include "activated.h"
#include "bench.h"
#include "scenarios.h"
#include "seeded_service.h"
#include "sitedeck-client-deck.h"
#include "sitedeck-service-paths.h"

namespace {

constexpr double kHandshakeTarget = 5.0;
// Resident memory right after the handshake: at most 8 MiB (the floor's is
// listed beside it, and docs/performance.md gives the difference).
constexpr double kMemoryTarget = 8.0 * 1024 * 1024;
constexpr size_t kHandshakeBytes = 8;

// One activated program and what its iterations saw.
struct startup_subject {
  BenchActivated* activated = nullptr;
  std::vector<int64_t> rss_after_handshake;
  std::vector<int64_t> cpu_to_handshake;
};

bool read_exact(int fd, void* buffer, size_t length) {
  auto* out = static_cast<unsigned char*>(buffer);
  while (length > 0) {
    ssize_t n = read(fd, out, length);
    if (n <= 0) return false;
    out += n;
    length -= static_cast<size_t>(n);
  }
  return true;
}

// Connect, handshake (timed), resident memory of the process, close, and
// wait until that process is gone.
bool handshake_once(startup_subject* subject, int64_t* elapsed_ns) {
  if (!subject->activated->wait_idle()) return false;
  auto start = std::chrono::steady_clock::now();
  int fd = subject->activated->connect_socket();
  int32_t handshake[2] = {-1, 0};
  bool ok = fd >= 0 && read_exact(fd, handshake, kHandshakeBytes) && handshake[0] == 0;
  auto end = std::chrono::steady_clock::now();
  *elapsed_ns = std::chrono::duration_cast<std::chrono::nanoseconds>(end - start).count();
  if (ok) {
    pid_t pid = subject->activated->child();
    int64_t cpu = pid > 0 ? bench_cpu_time_ns(pid) : -1;
    int64_t rss = pid > 0 ? bench_resident_bytes(pid) : -1;
    if (cpu > 0) subject->cpu_to_handshake.push_back(cpu);
    if (rss > 0) subject->rss_after_handshake.push_back(rss);
  }
  if (fd >= 0) (void)close(fd);
  return ok && subject->activated->wait_idle();
}

bench_result memory_result(const std::string& name, const std::string& description,
                           const std::vector<int64_t>& samples, double target) {
  bench_result result;
  result.group = "startup";
  result.name = name;
  result.description = description;
  result.target = target;
  result.bytes = true;
  result.samples_ns = samples;
  if (samples.empty()) {
    result.failed = true;
    result.failure = "no resident memory could be read";
  }
  return result;
}

}  // namespace

bool bench_group_startup(const bench_options& options, bench_report* report) {
  BenchSeededService service;
  if (!service.start(options.services)) return false;
  BenchActivated floor_activated;
  const std::string floor_program = std::string(SITEDECK_BIN_DIR) + "/sitedeck_handshake_floor";
  if (!floor_activated.start(floor_program, sds_path("/handshake-floor.sock"))) return false;

  std::vector<std::unique_ptr<startup_subject>> subjects;
  subjects.push_back(std::make_unique<startup_subject>());
  subjects.back()->activated = &floor_activated;
  startup_subject* floor_subject = subjects.back().get();
  std::vector<bench_case> cases = {
      {.name = "floor-handshake",
       .description = "libc-only program under the activator: accept, write 8 bytes",
       .floor = "",
       .body = {},
       .timed = [floor_subject](int64_t* elapsed) { return handshake_once(floor_subject, elapsed); }},
  };
  for (size_t s = 0; s < options.services.size(); ++s) {
    subjects.push_back(std::make_unique<startup_subject>());
    startup_subject* subject = subjects.back().get();
    subject->activated = &service.activated(s);
    cases.push_back(
        {.name = bench_scenario_name("handshake", options.services[s]),
         .description =
             "connect to the 8-byte handshake, a new service process under the activator",
         .floor = "floor-handshake",
         .body = {},
         .target = kHandshakeTarget,
         .timed = [subject](int64_t* elapsed) { return handshake_once(subject, elapsed); }});
  }
  const int warmup = bench_report::iterations(options, 10, 3);
  for (auto& result : bench_time_cases("startup", cases, bench_report::iterations(options, 300, 40),
                                       warmup, 10)) {
    report->add(std::move(result));
  }
  // The warm-up iterations went first; their samples are not counted.
  for (auto& subject : subjects) {
    for (auto* samples : {&subject->rss_after_handshake, &subject->cpu_to_handshake}) {
      samples->erase(samples->begin(),
                     samples->begin() + std::min<ptrdiff_t>(warmup, std::ssize(*samples)));
    }
  }
  // The processor time the process had had by the time the handshake
  // arrived (its worker's included): what the wall-clock time comes to on a
  // machine whose processors are busy with other work.
  auto cpu_result = [](const std::string& name, const std::string& floor,
                       const std::vector<int64_t>& samples) {
    bench_result result;
    result.group = "startup";
    result.name = name;
    result.description = "processor time of the process up to the handshake";
    result.floor = floor;
    result.samples_ns = samples;
    if (samples.empty()) {
      result.failed = true;
      result.failure = "no processor time could be read";
    }
    return result;
  };
  report->add(cpu_result("floor-handshake-cpu", "", floor_subject->cpu_to_handshake));
  for (size_t s = 0; s < options.services.size(); ++s) {
    report->add(cpu_result(bench_scenario_name("handshake-cpu", options.services[s]),
                           "floor-handshake-cpu", subjects[s + 1]->cpu_to_handshake));
  }

  report->add(memory_result("floor-rss",
                            "resident memory of the libc-only program after its handshake",
                            floor_subject->rss_after_handshake, 0));
  for (size_t s = 0; s < options.services.size(); ++s) {
    report->add(memory_result(bench_scenario_name("rss-after-handshake", options.services[s]),
                              "resident memory of the service process right after the handshake "
                              "(floor: floor-rss)",
                              subjects[s + 1]->rss_after_handshake, kMemoryTarget));
  }

  // For the record, the memory of a process that has served a whole deck:
  // all of it, and the part that is its own (heap and stacks), the rest
  // being pages of files it maps, the database among them.
  for (size_t s = 0; s < options.services.size(); ++s) {
    std::vector<int64_t> resident, own;
    for (int i = 0; i < bench_report::iterations(options, 10, 3); ++i) {
      if (!service.activated(s).wait_idle()) break;
      SdsConnection connection;
      if (service.connect(s, &connection) != SDS_ERROR_NONE) break;
      sds_client_ids ids;
      if (sds_client_get_full_ids(connection, &ids) != SDS_ERROR_NONE) break;
      bool ok = true;
      for (int32_t i_id = 0; ok && i_id < ids.count; ++i_id) {
        sds_client_item item;
        ok = sds_client_read_item(connection, ids.ids.get()[i_id], true, &item) == SDS_ERROR_NONE;
      }
      pid_t pid = service.activated(s).child();
      if (pid <= 0 || !ok) continue;
      int64_t rss = bench_resident_bytes(pid), anon = bench_status_bytes(pid, "RssAnon:");
      if (rss > 0) resident.push_back(rss);
      if (anon > 0) own.push_back(anon);
    }
    report->add(memory_result(bench_scenario_name("rss-after-deck", options.services[s]),
                              "resident memory of a service process that has served the deck",
                              resident, 0));
    report->add(memory_result(bench_scenario_name("anon-after-deck", options.services[s]),
                              "of that, the process's own pages (RssAnon)", own, 0));
  }
  return true;
}
