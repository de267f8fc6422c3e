#include "bench.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <ctime>

namespace {

// Tries of one iteration before its case counts as failed.
constexpr int kTriesPerIteration = 3;

// `value` with `decimals` digits after the point.
std::string fixed(double value, int decimals) {
  char buffer[64];
  std::snprintf(buffer, sizeof buffer, "%.*f", decimals, value);
  return buffer;
}

// A time in the unit that keeps it readable, or a byte count in MiB.
std::string amount(const bench_result& r, int64_t value) {
  auto v = static_cast<double>(value);
  if (r.bytes) return fixed(v / (1024.0 * 1024.0), 1) + " MiB";
  if (value >= 10'000'000) return fixed(v / 1e6, 1) + " ms";
  return fixed(v / 1000.0, 1) + " µs";
}

std::string json_escape(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '"' || c == '\\') out += '\\';
    if (static_cast<unsigned char>(c) < 0x20) continue;
    out += c;
  }
  return out;
}

// Runs one iteration, recovering and repeating it after a failure when the
// case can; `elapsed_ns` gets the time of the try that succeeded.
bool run_once(const bench_case& c, bench_result* result, int64_t* elapsed_ns) {
  for (int attempt = 1; attempt <= kTriesPerIteration; ++attempt) {
    if (c.prepare && !c.prepare()) return false;
    int64_t elapsed = 0;
    bool ok = false;
    if (c.timed) {
      ok = c.timed(&elapsed);
    } else {
      auto start = std::chrono::steady_clock::now();
      ok = c.body();
      auto end = std::chrono::steady_clock::now();
      elapsed = std::chrono::duration_cast<std::chrono::nanoseconds>(end - start).count();
    }
    if (ok) {
      if (elapsed_ns != nullptr) *elapsed_ns = elapsed;
      return true;
    }
    if (!c.recover || attempt == kTriesPerIteration || !c.recover()) return false;
    ++result->repeated;
  }
  return false;
}

}  // namespace

std::vector<bench_result> bench_time_cases(const std::string& group,
                                           const std::vector<bench_case>& cases, int iterations,
                                           int warmup, int block) {
  std::vector<bench_result> results(cases.size());
  for (size_t c = 0; c < cases.size(); ++c) {
    results[c].group = group;
    results[c].name = cases[c].name;
    results[c].description = cases[c].description;
    results[c].floor = cases[c].floor;
    results[c].floor_scale = cases[c].floor_scale;
    results[c].target = cases[c].target;
    results[c].samples_ns.reserve(static_cast<size_t>(iterations));
    for (int i = 0; i < warmup && !results[c].failed; ++i) {
      if (!run_once(cases[c], &results[c], nullptr)) {
        results[c].failed = true;
        results[c].failure = "failed during warm-up";
      }
    }
  }
  if (block < 1) block = 1;
  for (int done = 0; done < iterations; done += block) {
    int count = std::min(block, iterations - done);
    for (size_t c = 0; c < cases.size(); ++c) {
      bench_result& result = results[c];
      for (int i = 0; i < count && !result.failed; ++i) {
        int64_t elapsed_ns = 0;
        if (!run_once(cases[c], &result, &elapsed_ns)) {
          result.failed = true;
          result.failure = "failed at iteration " + std::to_string(done + i);
          break;
        }
        result.samples_ns.push_back(elapsed_ns);
      }
    }
  }
  return results;
}

std::string bench_scenario_name(const std::string& name, const bench_service& service) {
  return service.label.empty() ? name : name + "@" + service.label;
}

int64_t bench_quantile(const std::vector<int64_t>& samples_ns, double q) {
  if (samples_ns.empty()) return 0;
  std::vector<int64_t> sorted = samples_ns;
  std::sort(sorted.begin(), sorted.end());
  auto rank = static_cast<size_t>(std::ceil(q * static_cast<double>(sorted.size())));
  return sorted[std::clamp<size_t>(rank, 1, sorted.size()) - 1];
}

void bench_report::add(bench_result result) {
  if (result.failed) {
    std::fprintf(stderr, "bench: %s/%s: %s\n", result.group.c_str(), result.name.c_str(),
                 result.failure.c_str());
  }
  results_.push_back(std::move(result));
}

int bench_report::iterations(const bench_options& options, int full, int quick) {
  return options.quick ? quick : full;
}

const bench_result* bench_report::find(const std::string& name) const {
  for (const auto& r : results_) {
    if (r.name == name && !r.failed) return &r;
  }
  return nullptr;
}

bench_report::bench_summary bench_report::summarise(const bench_result& r) const {
  bench_summary s;
  s.median = bench_quantile(r.samples_ns, 0.5);
  s.p99 = bench_quantile(r.samples_ns, 0.99);
  s.floor = r.floor.empty() ? nullptr : find(r.floor);
  if (s.floor != nullptr) {
    double scale = r.floor_scale > 0 ? r.floor_scale : 1.0;
    double floor_median = static_cast<double>(bench_quantile(s.floor->samples_ns, 0.5)) * scale;
    double floor_p99 = static_cast<double>(bench_quantile(s.floor->samples_ns, 0.99)) * scale;
    if (floor_median > 0) s.ratio_median = static_cast<double>(s.median) / floor_median;
    if (floor_p99 > 0) s.ratio_p99 = static_cast<double>(s.p99) / floor_p99;
  }
  if (r.target > 0) {
    double measured = s.floor != nullptr ? s.ratio_median : static_cast<double>(s.median);
    s.target_met = measured > 0 && measured <= r.target;
  }
  return s;
}

bool bench_report::any_failed() const {
  return std::any_of(results_.begin(), results_.end(), [](const auto& r) { return r.failed; });
}

std::string bench_report::markdown() const {
  std::string out =
      "| scenario | iterations | median | p99 | floor | ratio median | ratio p99 | target |\n"
      "|---|---:|---:|---:|---|---:|---:|---:|\n";
  for (const auto& r : results_) {
    std::string name = r.group + "/" + r.name;
    if (r.failed) {
      out += "| " + name + " | failed: " + r.failure + " | | | | | | |\n";
      continue;
    }
    const bench_summary s = summarise(r);
    std::string floor_cell = "—", ratio_median = "—", ratio_p99 = "—", target = "—";
    if (s.floor != nullptr) {
      floor_cell = s.floor->name;
      if (r.floor_scale != 1.0) floor_cell += " × " + fixed(r.floor_scale, 0);
      if (s.ratio_median > 0) ratio_median = fixed(s.ratio_median, 2);
      if (s.ratio_p99 > 0) ratio_p99 = fixed(s.ratio_p99, 2);
    }
    if (r.target > 0) {
      target = "≤ " + (r.bytes ? amount(r, static_cast<int64_t>(r.target)) : fixed(r.target, 2)) +
               (s.target_met ? " ✓" : " ✗");
    }
    out += "| " + name + " | " + std::to_string(r.samples_ns.size()) + " | " + amount(r, s.median) +
           " | " + amount(r, s.p99) + " | " + floor_cell + " | " + ratio_median + " | " +
           ratio_p99 + " | " + target + " |\n";
  }
  for (const auto& r : results_) {
    if (r.repeated > 0) {
      out += "\n" + r.group + "/" + r.name + ": " + std::to_string(r.repeated) +
             " iteration(s) repeated after a recovery (another process disturbed the run)\n";
    }
  }
  for (const auto& n : notes_) out += "\n" + n + "\n";
  return out;
}

std::string bench_report::json(const std::string& mode) const {
  char when[32] = {};
  std::time_t now = std::time(nullptr);
  (void)std::strftime(when, sizeof when, "%Y-%m-%dT%H:%M:%SZ", std::gmtime(&now));
  std::string out = "{\n  \"time\": \"" + std::string(when) + "\",\n  \"mode\": \"" + mode +
                    "\",\n  \"scenarios\": [";
  bool first = true;
  for (const auto& r : results_) {
    out += first ? "\n" : ",\n";
    first = false;
    out += "    {\"group\": \"" + json_escape(r.group) + "\", \"name\": \"" + json_escape(r.name) +
           "\", \"description\": \"" + json_escape(r.description) + "\"";
    if (r.failed) {
      out += ", \"failed\": \"" + json_escape(r.failure) + "\"}";
      continue;
    }
    const bench_summary s = summarise(r);
    out += ", \"unit\": \"" + std::string(r.bytes ? "bytes" : "ns") +
           "\", \"iterations\": " + std::to_string(r.samples_ns.size()) +
           ", \"median_ns\": " + std::to_string(s.median) +
           ", \"p99_ns\": " + std::to_string(s.p99) +
           ", \"min_ns\": " + std::to_string(bench_quantile(r.samples_ns, 0.0)) +
           ", \"repeated\": " + std::to_string(r.repeated);
    if (s.floor != nullptr) {
      out += ", \"floor\": \"" + json_escape(s.floor->name) + "\"";
      if (r.floor_scale != 1.0) out += ", \"floor_scale\": " + fixed(r.floor_scale, 3);
      if (s.ratio_median > 0 && s.ratio_p99 > 0) {
        out += ", \"ratio_median\": " + fixed(s.ratio_median, 3) +
               ", \"ratio_p99\": " + fixed(s.ratio_p99, 3);
      }
    }
    if (r.target > 0) {
      out += ", \"target\": " + fixed(r.target, 3) +
             ", \"target_met\": " + (s.target_met ? "true" : "false");
    }
    out += "}";
  }
  out += "\n  ],\n  \"notes\": [";
  for (size_t i = 0; i < notes_.size(); ++i) {
    out += (i == 0 ? "\"" : ", \"") + json_escape(notes_[i]) + "\"";
  }
  out += "]\n}\n";
  return out;
}
