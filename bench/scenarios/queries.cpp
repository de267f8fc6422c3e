// The two item queries a start page repeats most, each beside its floor:
// command 3 (a 40-byte URL) and command 7 (a 192x192 icon, pixels read by the
// client), through the client library against the real service.
#include <cstdio>
#include <memory>
#include <vector>

#include "bench.h"
#include "echo_peer.h"
#include "scenarios.h"
#include "seeded_service.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"

namespace {

// Targets: a URL within half again the floor's time, an icon within twice.
constexpr double kUrlTarget = 1.5;
constexpr double kIconTarget = 2.0;

// One build's connection and the item it asks for next.
struct query_client {
  SdsConnection connection;
  int url_index = 0;
  int icon_index = 0;
};

}  // namespace

bool bench_group_queries(const bench_options& options, bench_report* report) {
  BenchSeededService service;
  if (!service.start(options.services)) return false;
  BenchEchoPeer floor;
  if (!floor.start(sds_path("/bench-floor.sock"), 8 + kBenchUrlBytes, kBenchIconBytes)) {
    std::fprintf(stderr, "bench: queries: the floor peer did not start\n");
    return false;
  }
  std::vector<unsigned char> floor_pixels(kBenchIconBytes);
  std::vector<bench_case> cases = {
      {"floor-url", "peer reads 12 bytes, answers 48 in one write", "",
       [&] { return floor.url_round_trip(); }},
      {"floor-icon", "peer copies 147456 bytes to shared memory, answers 16; client copies out", "",
       [&] { return floor.icon_round_trip(floor_pixels.data()); }},
  };
  std::vector<std::unique_ptr<query_client>> clients;
  for (size_t s = 0; s < options.services.size(); ++s) {
    clients.push_back(std::make_unique<query_client>());
    query_client* client = clients.back().get();
    if (service.connect(s, &client->connection) != SDS_ERROR_NONE) {
      std::fprintf(stderr, "bench: queries: cannot connect to the service\n");
      return false;
    }
    // A new connection brings a new service process, which makes the
    // shared-memory object again should someone have removed it.
    auto reconnect = [&service, client, s] {
      client->connection.close();
      return service.connect(s, &client->connection) == SDS_ERROR_NONE;
    };
    const bench_service& build = options.services[s];
    cases.push_back({.name = bench_scenario_name("cmd3-url", build),
                     .description = "command 3: header, status, 40-byte string",
                     .floor = "floor-url",
                     .body =
                         [client] {
                           SdsClientText url;
                           return sds_client_get_url(
                                      client->connection,
                                      BenchSeededService::item_id(client->url_index++),
                                      &url) == SDS_ERROR_NONE;
                         },
                     .recover = reconnect,
                     .target = kUrlTarget});
    cases.push_back({.name = bench_scenario_name("cmd7-icon", build),
                     .description = "command 7: 192x192 icon through shared memory, pixels copied out",
                     .floor = "floor-icon",
                     .body =
                         [client] {
                           sds_client_icon icon;
                           return sds_client_get_icon(
                                      client->connection,
                                      BenchSeededService::item_id(client->icon_index++),
                                      &icon) == SDS_ERROR_NONE &&
                                  icon.byte_count == kBenchIconBytes;
                         },
                     .recover = reconnect,
                     .target = kIconTarget});
  }
  for (auto& result :
       bench_time_cases("queries", cases, bench_report::iterations(options, 20000, 2000),
                        bench_report::iterations(options, 500, 100))) {
    report->add(std::move(result));
  }
  return true;
}
