// Reading the whole deck the way a start page does: the live ids, then each
// tile's URL, title, colour, icon size, both flags and icon. Once on an open
// connection beside its floor (the same exchanges with the floor peer of the
// query benchmarks), and once with the connection made for it, which includes
// the activator starting a service process and that process opening the
// database.
#include <cstdio>
#include <memory>
#include <vector>

#include "bench.h"
#include "echo_peer.h"
#include "scenarios.h"
#include "seeded_service.h"
#include "sitedeck-client-deck.h"
#include "sitedeck-service-paths.h"

namespace {

constexpr double kDeckTarget = 1.5;
// Requests per tile besides the icon: URL, title, colour, icon size, two flags.
constexpr int kSmallRequestsPerTile = 6;

bool read_deck(SdsConnection& connection) {
  sds_client_ids ids;
  if (sds_client_get_full_ids(connection, &ids) != SDS_ERROR_NONE || ids.count != kBenchDeckItems) {
    return false;
  }
  for (int32_t i = 0; i < ids.count; ++i) {
    sds_client_item item;
    if (sds_client_read_item(connection, ids.ids.get()[i], true, &item) != SDS_ERROR_NONE ||
        item.icon_status != SDS_ERROR_NONE) {
      return false;
    }
  }
  return true;
}

// The deck's exchanges with the floor peer: each small request as a URL
// exchange, each icon as an icon exchange.
bool read_floor_deck(BenchEchoPeer& floor, unsigned char* pixels) {
  if (!floor.url_round_trip()) return false;
  for (int tile = 0; tile < kBenchDeckItems; ++tile) {
    for (int i = 0; i < kSmallRequestsPerTile; ++i) {
      if (!floor.url_round_trip()) return false;
    }
    if (!floor.icon_round_trip(pixels)) return false;
  }
  return true;
}

}  // namespace

bool bench_group_deck(const bench_options& options, bench_report* report) {
  BenchSeededService service;
  if (!service.start(options.services)) return false;
  BenchEchoPeer floor;
  if (!floor.start(sds_path("/bench-floor.sock"), 8 + kBenchUrlBytes, kBenchIconBytes)) {
    std::fprintf(stderr, "bench: deck: the floor peer did not start\n");
    return false;
  }
  std::vector<unsigned char> floor_pixels(kBenchIconBytes);
  std::vector<bench_case> open_cases = {
      {"floor-deck", "the deck's 169 small and 24 icon exchanges with the floor peer", "",
       [&] { return read_floor_deck(floor, floor_pixels.data()); }},
  };
  std::vector<std::unique_ptr<SdsConnection>> connections;
  for (size_t s = 0; s < options.services.size(); ++s) {
    connections.push_back(std::make_unique<SdsConnection>());
    SdsConnection* connection = connections.back().get();
    if (service.connect(s, connection) != SDS_ERROR_NONE) {
      std::fprintf(stderr, "bench: deck: cannot connect to the service\n");
      return false;
    }
    // A new connection brings a new service process, which makes the
    // shared-memory object again should someone have removed it.
    auto reconnect = [&service, connection, s] {
      connection->close();
      return service.connect(s, connection) == SDS_ERROR_NONE;
    };
    open_cases.push_back({.name = bench_scenario_name("deck-24", options.services[s]),
                          .description =
                              "ids, then 24 tiles of 7 requests each, on an open connection",
                          .floor = "floor-deck",
                          .body = [connection] { return read_deck(*connection); },
                          .recover = reconnect,
                          .target = kDeckTarget});
  }
  for (auto& result :
       bench_time_cases("deck", open_cases, bench_report::iterations(options, 500, 50),
                        bench_report::iterations(options, 20, 5), 10)) {
    report->add(std::move(result));
  }
  connections.clear();

  std::vector<bench_case> fresh_cases;
  for (size_t s = 0; s < options.services.size(); ++s) {
    fresh_cases.push_back({bench_scenario_name("connect+deck-24", options.services[s]),
                           "connect (a new service process), handshake, the deck, close", "",
                           [&service, s] {
                             SdsConnection fresh;
                             return service.connect(s, &fresh) == SDS_ERROR_NONE &&
                                    read_deck(fresh);
                           },
                           [] { return true; }});
  }
  for (auto& result :
       bench_time_cases("deck", fresh_cases, bench_report::iterations(options, 100, 15),
                        bench_report::iterations(options, 5, 2), 10)) {
    report->add(std::move(result));
  }
  return true;
}
