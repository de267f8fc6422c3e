// The service as benchmarks meet it: a scratch root whose database holds a
// deck of 24 items with 192x192 icons, and each build of the service under
// measurement running under an activator of its own, which starts a fresh
// service process for every connection.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "bench.h"
#include "sitedeck-client.h"

// Shape of the seeded deck: what a start page shows.
constexpr int kBenchDeckItems = 24;
constexpr int kBenchIconSide = 192;
constexpr int kBenchIconBytes = kBenchIconSide * kBenchIconSide * 4;  // 147456
// Every URL is this long, so command 3's reply is 4 + 4 + 40 = 48 bytes.
constexpr int kBenchUrlBytes = 40;

class TempRoot;
class BenchActivated;

class BenchSeededService {
 public:
  BenchSeededService();
  ~BenchSeededService();
  BenchSeededService(const BenchSeededService&) = delete;
  BenchSeededService& operator=(const BenchSeededService&) = delete;

  // Seeds the database and starts one activator per build in `services`;
  // false (reason on stderr) when any of that fails.
  bool start(const std::vector<bench_service>& services);
  // The same with the service beside the benchmark alone.
  bool start();
  // A new connection to build `index`, which its activator gives a service
  // process of its own.
  int connect(size_t index, SdsConnection* out);
  int connect(SdsConnection* out) { return connect(0, out); }
  // The activator of build `index`.
  BenchActivated& activated(size_t index) { return *services_[index]; }
  // Item ids are 1 to kBenchDeckItems.
  static int item_id(int index) { return 1 + index % kBenchDeckItems; }

 private:
  std::unique_ptr<TempRoot> root_;
  std::vector<std::unique_ptr<BenchActivated>> services_;
};
