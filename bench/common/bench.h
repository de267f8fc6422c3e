// The benchmark's common part: timing a scenario (one sample per iteration,
// after a warm-up), the statistics of the samples, and the report (a Markdown
// table on standard output and a JSON file). Scenario groups live in
// bench/scenarios/, one file each, and are listed in bench/main.cpp.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

// A build of the service to measure. The benchmark measures the service
// beside it by default; more builds (an older one, say) are measured in the
// same run, their scenario names ending in "@label".
struct bench_service {
  std::string label;  // empty for the default build
  std::string path;   // the service binary; its pull module sits beside it
};

struct bench_options {
  bool quick = false;      // fewer iterations: a smoke run in seconds
  bool verbose = false;    // let the client library's log lines through
  std::string only_group;  // run this group alone when not empty
  std::string json_path;   // where the JSON report goes; empty: nowhere
  std::vector<bench_service> services;  // at least the default build
};

// `name` with the label of `service` appended ("name@label"), unchanged for
// the default build.
std::string bench_scenario_name(const std::string& name, const bench_service& service);

// One scenario's measurements. `floor` names another result measured in the
// same run: the cost of the same exchange with nothing but the transport.
struct bench_result {
  std::string group;
  std::string name;
  std::string description;
  std::string floor;
  // The ratio to the floor is taken against floor x floor_scale: a pull of
  // 5000 items beside the pull of 50 compares the time per item.
  double floor_scale = 1.0;
  // The goal: the median ratio to the floor (or, for a byte count with no
  // floor, the median itself) must not exceed it. 0: none.
  double target = 0.0;
  bool bytes = false;               // samples are byte counts, not times
  std::vector<int64_t> samples_ns;  // one per timed iteration
  int repeated = 0;                 // iterations redone after a recovery
  bool failed = false;              // an iteration's body reported failure
  std::string failure;
};

// One scenario to time: `body` is one iteration and returns false when it
// failed. `floor` as in bench_result. `recover`, when set, is called after a
// failed iteration to put things right (a new connection, say) before the
// iteration is tried again; only the try that succeeds is timed. The reason:
// the shared-memory object has one machine-wide name, and a test run
// elsewhere on the machine may remove it under a running service.
struct bench_case {
  std::string name;
  std::string description;
  std::string floor;
  std::function<bool()> body;
  std::function<bool()> recover = {};
  // Runs untimed before every try of an iteration (a fresh start state, say);
  // false fails the iteration.
  std::function<bool()> prepare = {};
  double floor_scale = 1.0;  // as in bench_result
  double target = 0.0;       // as in bench_result
  // When set, replaces `body` for a case that times only a part of its
  // iteration itself (connect to handshake, without the process's exit):
  // false on failure, the time in its argument.
  std::function<bool(int64_t* elapsed_ns)> timed = {};
};

// Runs every case `warmup` times untimed, then `iterations` times timed, the
// cases taking turns in blocks of `block` iterations, so that a change in the
// machine's load during the run weighs on all of them alike (a floor and
// what is compared with it above all). A failing body stops its case.
std::vector<bench_result> bench_time_cases(const std::string& group,
                                           const std::vector<bench_case>& cases, int iterations,
                                           int warmup, int block = 50);

// The q-quantile (0..1) of the samples, in nanoseconds (nearest rank).
int64_t bench_quantile(const std::vector<int64_t>& samples_ns, double q);

// All results of a run, in the order they were measured.
class bench_report {
 public:
  void add(bench_result result);
  // A line printed under the table (and listed in the JSON): a condition of
  // the run that its numbers depend on.
  void note(std::string text) { notes_.push_back(std::move(text)); }
  // Scenario's iteration count: `full`, or `quick` in a quick run.
  static int iterations(const bench_options& options, int full, int quick);
  // The Markdown table for people.
  std::string markdown() const;
  // The JSON document for tools; `mode` is "quick" or "full".
  std::string json(const std::string& mode) const;
  bool any_failed() const;

 private:
  struct bench_summary {
    int64_t median = 0;
    int64_t p99 = 0;
    const bench_result* floor = nullptr;
    double ratio_median = 0;  // 0 when there is no floor
    double ratio_p99 = 0;
    bool target_met = false;
  };
  const bench_result* find(const std::string& name) const;
  bench_summary summarise(const bench_result& r) const;
  std::vector<bench_result> results_;
  std::vector<std::string> notes_;
};

// A scenario group: measures its scenarios and adds them to the report.
// Returns false when it could not set up at all (the reason on stderr).
using bench_group_fn = bool (*)(const bench_options& options, bench_report* report);
