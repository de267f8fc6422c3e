#include "seeded_service.h"

#include <cstdio>
#include <vector>

#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/temp_root.h"

BenchSeededService::BenchSeededService() = default;
BenchSeededService::~BenchSeededService() {
  service_.reset();  // stops the activator while the root still exists
  root_.reset();
}

bool BenchSeededService::start() {
  root_ = std::make_unique<TempRoot>();
  std::vector<SeedItem> items(kBenchDeckItems);
  for (int i = 0; i < kBenchDeckItems; ++i) {
    char url[kBenchUrlBytes + 1];
    std::snprintf(url, sizeof url, "https://site-%02d.bench.example/start.html", i + 1);
    char title[32], color[8];
    std::snprintf(title, sizeof title, "Bench Site %02d", i + 1);
    std::snprintf(color, sizeof color, "#%02X%02X%02X", (i * 37) & 0xFF, (i * 91) & 0xFF,
                  (i * 53) & 0xFF);
    SeedItem& item = items[static_cast<size_t>(i)];
    item = seed_item(i + 1, url, title, i + 1);
    item.dominant_color = color;
    item.icon_size = std::to_string(kBenchIconSide) + "x" + std::to_string(kBenchIconSide);
    item.touch_icon_exists = 1;
    item.favicon_exists = i % 2;
    item.icon_data = seed_pixels(kBenchIconSide, kBenchIconSide, static_cast<uint32_t>(i + 1));
  }
  if (!seed_deck(items)) {
    std::fprintf(stderr, "bench: could not seed the database in %s\n", root_->dir().c_str());
    return false;
  }
  service_ = std::make_unique<ServiceHarness>();
  if (!service_->start_activated(/*once=*/false)) {
    std::fprintf(stderr, "bench: the activator did not start:\n%s\n", service_->output().c_str());
    return false;
  }
  return true;
}

int BenchSeededService::connect(SdsConnection* out) {
  return service_ ? service_->connect(out) : SDS_ERROR_IO_ERROR;
}
