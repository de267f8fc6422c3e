#include "seeded_service.h"

#include <sys/mman.h>

#include <cstdio>
#include <vector>

#include "activated.h"
#include "sitedeck-service-paths.h"
#include "support/seeded_deck.h"
#include "support/temp_root.h"

BenchSeededService::BenchSeededService() = default;
BenchSeededService::~BenchSeededService() {
  services_.clear();  // stops the activators while the root still exists
  root_.reset();
  // Every service process makes the machine-wide object anew; nobody else
  // removes it once the benchmark is done.
  (void)shm_unlink(SDS_SHM_NAME);
}

bool BenchSeededService::start(const std::vector<bench_service>& services) {
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
  for (size_t i = 0; i < services.size(); ++i) {
    auto activated = std::make_unique<BenchActivated>();
    // The first build listens where the service's own socket lives.
    std::string socket = i == 0 ? sds_path(SDS_SOCKET_PATH)
                                : root_->dir() + "/service-" + std::to_string(i) + ".sock";
    if (!activated->start(services[i].path, socket)) return false;
    services_.push_back(std::move(activated));
  }
  return true;
}

bool BenchSeededService::start() {
  return start({{"", std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service"}});
}

int BenchSeededService::connect(size_t index, SdsConnection* out) {
  if (index >= services_.size()) return SDS_ERROR_IO_ERROR;
  return sds_client_connect(services_[index]->socket_path(), *out, {10000, 10000});
}
