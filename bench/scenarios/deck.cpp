// Reading the whole deck the way a start page does: the live ids, then each
// tile's URL, title, colour, icon size, both flags and icon. Once on an open
// connection, and once with the connection made for it, which includes the
// activator starting a service process and that process opening the database.
#include <cstdio>

#include "bench.h"
#include "scenarios.h"
#include "seeded_service.h"
#include "sitedeck-client-deck.h"

namespace {

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

}  // namespace

bool bench_group_deck(const bench_options& options, bench_report* report) {
  BenchSeededService service;
  if (!service.start()) return false;
  SdsConnection connection;
  if (service.connect(&connection) != SDS_ERROR_NONE) {
    std::fprintf(stderr, "bench: deck: cannot connect to the service\n");
    return false;
  }
  // A new connection brings a new service process, which makes the
  // shared-memory object again should someone have removed it.
  auto reconnect = [&] {
    connection.close();
    return service.connect(&connection) == SDS_ERROR_NONE;
  };
  std::vector<bench_case> open_cases = {
      {"deck-24", "ids, then 24 tiles of 7 requests each, on an open connection", "",
       [&] { return read_deck(connection); }, reconnect},
  };
  for (auto& result :
       bench_time_cases("deck", open_cases, bench_report::iterations(options, 500, 50),
                        bench_report::iterations(options, 20, 5))) {
    report->add(std::move(result));
  }
  connection.close();

  std::vector<bench_case> fresh_cases = {
      {"connect+deck-24", "connect (a new service process), handshake, the deck, close", "",
       [&] {
         SdsConnection fresh;
         return service.connect(&fresh) == SDS_ERROR_NONE && read_deck(fresh);
       },
       [] { return true; }},
  };
  for (auto& result :
       bench_time_cases("deck", fresh_cases, bench_report::iterations(options, 100, 15),
                        bench_report::iterations(options, 5, 2))) {
    report->add(std::move(result));
  }
  return true;
}
