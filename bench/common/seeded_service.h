// The service as benchmarks meet it: a scratch root whose database holds a
// deck of 24 items with 192x192 icons, and the real service under the
// activator, which starts a fresh service process for every connection.
#pragma once

#include <memory>
#include <string>

#include "sitedeck-client.h"

// Shape of the seeded deck: what a start page shows.
constexpr int kBenchDeckItems = 24;
constexpr int kBenchIconSide = 192;
constexpr int kBenchIconBytes = kBenchIconSide * kBenchIconSide * 4;  // 147456
// Every URL is this long, so command 3's reply is 4 + 4 + 40 = 48 bytes.
constexpr int kBenchUrlBytes = 40;

class TempRoot;
class ServiceHarness;

class BenchSeededService {
 public:
  BenchSeededService();
  ~BenchSeededService();
  BenchSeededService(const BenchSeededService&) = delete;
  BenchSeededService& operator=(const BenchSeededService&) = delete;

  // Seeds the database and starts the activator; false (reason on stderr)
  // when either fails.
  bool start();
  // A new connection, which the activator gives a service process of its own.
  int connect(SdsConnection* out);
  // Item ids are 1 to kBenchDeckItems.
  static int item_id(int index) { return 1 + index % kBenchDeckItems; }

 private:
  std::unique_ptr<TempRoot> root_;
  std::unique_ptr<ServiceHarness> service_;
};
