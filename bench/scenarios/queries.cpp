// The two item queries a start page repeats most, each beside its floor:
// command 3 (a 40-byte URL) and command 7 (a 192x192 icon, pixels read by the
// client), through the client library against the real service.
#include <cstdio>
#include <vector>

#include "bench.h"
#include "echo_peer.h"
#include "scenarios.h"
#include "seeded_service.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"

bool bench_group_queries(const bench_options& options, bench_report* report) {
  BenchSeededService service;
  if (!service.start()) return false;
  BenchEchoPeer floor;
  if (!floor.start(sds_path("/bench-floor.sock"), 8 + kBenchUrlBytes, kBenchIconBytes)) {
    std::fprintf(stderr, "bench: queries: the floor peer did not start\n");
    return false;
  }
  SdsConnection connection;
  if (service.connect(&connection) != SDS_ERROR_NONE) {
    std::fprintf(stderr, "bench: queries: cannot connect to the service\n");
    return false;
  }
  std::vector<unsigned char> floor_pixels(kBenchIconBytes);
  int url_index = 0, icon_index = 0;
  // A new connection brings a new service process, which makes the
  // shared-memory object again should someone have removed it.
  auto reconnect = [&] {
    connection.close();
    return service.connect(&connection) == SDS_ERROR_NONE;
  };

  std::vector<bench_case> cases = {
      {"floor-url", "peer reads 12 bytes, answers 48 in one write", "",
       [&] { return floor.url_round_trip(); }},
      {"cmd3-url", "command 3: header, status, 40-byte string", "floor-url",
       [&] {
         UniqueCStr url;
         return sds_client_get_url(connection, BenchSeededService::item_id(url_index++), &url) ==
                SDS_ERROR_NONE;
       },
       reconnect},
      {"floor-icon", "peer copies 147456 bytes to shared memory, answers 16; client copies out", "",
       [&] { return floor.icon_round_trip(floor_pixels.data()); }},
      {"cmd7-icon", "command 7: 192x192 icon through shared memory, pixels copied out",
       "floor-icon",
       [&] {
         sds_client_icon icon;
         return sds_client_get_icon(connection, BenchSeededService::item_id(icon_index++), &icon) ==
                    SDS_ERROR_NONE &&
                icon.byte_count == kBenchIconBytes;
       },
       reconnect},
  };
  for (auto& result :
       bench_time_cases("queries", cases, bench_report::iterations(options, 20000, 2000),
                        bench_report::iterations(options, 500, 100))) {
    report->add(std::move(result));
  }
  return true;
}
