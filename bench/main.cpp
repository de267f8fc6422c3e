// sitedeck_bench: measures the service through its real socket, against the
// real service under the activator, and reports median and p99 per scenario
// with the ratio to a floor measured in the same run. Usage in bench/run.
#include <signal.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "bench.h"
#include "dlog.h"
#include "scenarios.h"

namespace {

struct bench_group {
  const char* name;
  bench_group_fn run;
};

constexpr bench_group kGroups[] = {
    {"queries", bench_group_queries},
    {"deck", bench_group_deck},
    {"pull", bench_group_pull},
    {"startup", bench_group_startup},
};

void usage(FILE* out) {
  std::fprintf(out,
               "usage: sitedeck_bench [--quick] [--verbose] [--only GROUP] [--json FILE]\n"
               "                      [--service LABEL=PATH]...\n"
               "  --quick       few iterations: a smoke run\n"
               "  --verbose     show the client library's log lines\n"
               "  --only GROUP  run one group:");
  for (const auto& group : kGroups) std::fprintf(out, " %s", group.name);
  std::fprintf(out,
               "\n  --json FILE   also write the results as JSON to FILE\n"
               "  --service LABEL=PATH  also measure the service binary at PATH (another\n"
               "                build, with its pull module beside it), as \"scenario@LABEL\"\n");
}

}  // namespace

int main(int argc, char** argv) {
  (void)signal(SIGPIPE, SIG_IGN);
  bench_options options;
  options.services.push_back({"", std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service"});
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--quick") == 0) {
      options.quick = true;
    } else if (std::strcmp(argv[i], "--only") == 0 && i + 1 < argc) {
      options.only_group = argv[++i];
    } else if (std::strcmp(argv[i], "--verbose") == 0) {
      options.verbose = true;
    } else if (std::strcmp(argv[i], "--json") == 0 && i + 1 < argc) {
      options.json_path = argv[++i];
    } else if (std::strcmp(argv[i], "--service") == 0 && i + 1 < argc &&
               std::strchr(argv[i + 1], '=') != nullptr && argv[i + 1][0] != '=') {
      std::string named = argv[++i];
      size_t equals = named.find('=');
      options.services.push_back({named.substr(0, equals), named.substr(equals + 1)});
    } else {
      usage(argv[i][1] == 'h' || std::strcmp(argv[i], "--help") == 0 ? stdout : stderr);
      return std::strcmp(argv[i], "--help") == 0 ? 0 : 2;
    }
  }
  // The client library logs failures only; a benchmark line is not one.
  dlog_set_quiet(!options.verbose);

  bench_report report;
  bool all_set_up = true;
  bool ran_any = false;
  for (const auto& group : kGroups) {
    if (!options.only_group.empty() && options.only_group != group.name) continue;
    ran_any = true;
    std::fprintf(stderr, "bench: %s...\n", group.name);
    if (!group.run(options, &report)) {
      std::fprintf(stderr, "bench: group %s could not be set up\n", group.name);
      all_set_up = false;
    }
  }
  if (!ran_any) {
    std::fprintf(stderr, "bench: no group named %s\n", options.only_group.c_str());
    return 2;
  }
  std::printf("%s", report.markdown().c_str());
  if (!options.json_path.empty()) {
    FILE* out = std::fopen(options.json_path.c_str(), "w");
    std::string json = report.json(options.quick ? "quick" : "full");
    if (out == nullptr || std::fwrite(json.data(), 1, json.size(), out) != json.size() ||
        std::fclose(out) != 0) {
      std::fprintf(stderr, "bench: cannot write %s\n", options.json_path.c_str());
      return 1;
    }
  }
  return all_set_up && !report.any_failed() ? 0 : 1;
}
