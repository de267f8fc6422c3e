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

std::string micros(int64_t ns) { return fixed(static_cast<double>(ns) / 1000.0, 1); }

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

// A sample as people read it: microseconds, or MiB for memory.
std::string amount(int64_t value, bool memory) {
  if (memory) return fixed(static_cast<double>(value) / (1024.0 * 1024.0), 2) + " MiB";
  return micros(value) + " µs";
}

// How `value` stands to `floor_value`: a ratio, or the excess for memory.
std::string relation(int64_t value, int64_t floor_value, bool memory) {
  if (memory) {
    double excess = static_cast<double>(value - floor_value) / (1024.0 * 1024.0);
    std::string text = excess >= 0 ? "+" : "";
    text += fixed(excess, 2);
    text += " MiB";
    return text;
  }
  return floor_value > 0 ? fixed(static_cast<double>(value) / floor_value, 2) : "—";
}

bool meets(const bench_target& target, int64_t value, int64_t floor_value, bool memory) {
  if (memory) return target.excess_bytes > 0 && value - floor_value <= target.excess_bytes;
  return target.ratio > 0 && floor_value > 0 &&
         static_cast<double>(value) <= target.ratio * static_cast<double>(floor_value);
}

std::string target_text(const bench_target& target, bool memory) {
  if (memory && target.excess_bytes > 0) {
    return "≤ +" + fixed(static_cast<double>(target.excess_bytes) / (1024.0 * 1024.0), 0) +
           " MiB";
  }
  if (!memory && target.ratio > 0) return "≤ " + fixed(target.ratio, 1);
  return "";
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

bool bench_report::any_failed() const {
  return std::any_of(results_.begin(), results_.end(), [](const auto& r) { return r.failed; });
}

std::string bench_report::markdown() const {
  std::string out =
      "| scenario | iterations | median | p99 | floor | floor median | floor p99 | ratio median "
      "| ratio p99 | target | met (median / p99) |\n"
      "|---|---:|---:|---:|---|---:|---:|---:|---:|---|---|\n";
  for (const auto& r : results_) {
    std::string name = r.group + "/" + r.name;
    if (r.failed) {
      out += "| " + name + " | failed: " + r.failure + " | | | | | | | | | |\n";
      continue;
    }
    int64_t median = bench_quantile(r.samples_ns, 0.5), p99 = bench_quantile(r.samples_ns, 0.99);
    std::string floor_cells = "— | | ", ratio_cells = "— | —", target_cell, met_cell;
    if (const bench_result* f = r.floor.empty() ? nullptr : find(r.floor)) {
      int64_t floor_median = bench_quantile(f->samples_ns, 0.5);
      int64_t floor_p99 = bench_quantile(f->samples_ns, 0.99);
      floor_cells = f->name + " | " + amount(floor_median, r.memory) + " | " +
                    amount(floor_p99, r.memory);
      ratio_cells = relation(median, floor_median, r.memory) + " | " +
                    relation(p99, floor_p99, r.memory);
      target_cell = target_text(r.target, r.memory);
      if (!target_cell.empty()) {
        met_cell = std::string(meets(r.target, median, floor_median, r.memory) ? "yes" : "no") +
                   " / " + (meets(r.target, p99, floor_p99, r.memory) ? "yes" : "no");
      }
    }
    out += "| " + name + " | " + std::to_string(r.samples_ns.size()) + " | " +
           amount(median, r.memory) + " | " + amount(p99, r.memory) + " | " + floor_cells + " | " +
           ratio_cells + " | " + target_cell + " | " + met_cell + " |\n";
  }
  for (const auto& r : results_) {
    if (r.repeated > 0) {
      out += "\n" + r.group + "/" + r.name + ": " + std::to_string(r.repeated) +
             " iteration(s) repeated after a recovery (another process disturbed the run)\n";
    }
  }
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
    int64_t median = bench_quantile(r.samples_ns, 0.5), p99 = bench_quantile(r.samples_ns, 0.99);
    // Memory results carry bytes where time results carry nanoseconds.
    const std::string unit = r.memory ? "_bytes" : "_ns";
    out += ", \"iterations\": " + std::to_string(r.samples_ns.size()) + ", \"median" + unit +
           "\": " + std::to_string(median) + ", \"p99" + unit + "\": " + std::to_string(p99) +
           ", \"min" + unit + "\": " + std::to_string(bench_quantile(r.samples_ns, 0.0)) +
           ", \"repeated\": " + std::to_string(r.repeated);
    if (const bench_result* f = r.floor.empty() ? nullptr : find(r.floor)) {
      int64_t floor_median = bench_quantile(f->samples_ns, 0.5);
      int64_t floor_p99 = bench_quantile(f->samples_ns, 0.99);
      out += ", \"floor\": \"" + json_escape(f->name) + "\"";
      if (r.memory) {
        out += ", \"excess_median_bytes\": " + std::to_string(median - floor_median) +
               ", \"excess_p99_bytes\": " + std::to_string(p99 - floor_p99);
        if (r.target.excess_bytes > 0) {
          out += ", \"target_excess_bytes\": " + std::to_string(r.target.excess_bytes);
        }
      } else if (floor_median > 0 && floor_p99 > 0) {
        out += ", \"ratio_median\": " + fixed(static_cast<double>(median) / floor_median, 3) +
               ", \"ratio_p99\": " + fixed(static_cast<double>(p99) / floor_p99, 3);
        if (r.target.ratio > 0) out += ", \"target_ratio\": " + fixed(r.target.ratio, 2);
      }
      if (r.target.ratio > 0 || r.target.excess_bytes > 0) {
        out += std::string(", \"met_median\": ") +
               (meets(r.target, median, floor_median, r.memory) ? "true" : "false") +
               ", \"met_p99\": " + (meets(r.target, p99, floor_p99, r.memory) ? "true" : "false");
      }
    }
    out += "}";
  }
  out += "\n  ]\n}\n";
  return out;
}
