// The short version of tools/soak: the real service serves a couple of
// thousand requests on one connection, then thirty connections in a row go
// through the activator, and the processes' descriptors and mappings must not
// grow while nothing is left behind in the data directories.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/service_harness.h"
#include "support/temp_root.h"
#include "tools/soak/proc_stats.h"

namespace {

namespace fs = std::filesystem;

constexpr int kItems = 12;
constexpr int32_t kIconBytes = 57 * 57 * 4;
// How much the mapping count of two fresh service processes may differ.
constexpr long kMapsJitter = 16;
// Under AddressSanitizer freed memory is held in quarantine, so resident
// memory grows by design; its leak check at the service's exit stands in.
#if defined(__SANITIZE_ADDRESS__)
constexpr bool kUnderAddressSanitizer = true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
constexpr bool kUnderAddressSanitizer = true;
#else
constexpr bool kUnderAddressSanitizer = false;
#endif
#else
constexpr bool kUnderAddressSanitizer = false;
#endif

class Soak : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
    for (int i = 1; i <= kItems; ++i) {
      ASSERT_TRUE(DbSession::exec(
          "INSERT INTO site_deck(url,title,touch_icon_exists,is_dirty,order_index,icon_size,"
          "icon_data) VALUES ('http://site-" +
          std::to_string(i) + ".example/','Site',1,1," + std::to_string(i) +
          ",'57x57',randomblob(" + std::to_string(kIconBytes) + "))"));
    }
    DbSession::close_handle();
    ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "3600"));
    files_before_ = files();
  }

  // Every file of the data directories.
  std::set<std::string> files() const {
    std::set<std::string> found;
    for (const auto& e : fs::recursive_directory_iterator(root_.path(SDS_DATA_DIR))) {
      if (e.is_regular_file()) found.insert(e.path().string());
    }
    return found;
  }

  TempRoot root_;
  std::set<std::string> files_before_;
};

// Request `n` of the mix of commands 3, 5, 7, 10 and 11; true when its reply
// was the expected one.
bool one_request(SdsConnection& c, long n) {
  const auto id = static_cast<int32_t>(1 + (n / 5) % kItems);
  SdsClientText text;
  int32_t value = 0;
  sds_client_icon icon;
  sds_client_ids ids;
  switch (n % 5) {
    case 0:
      return sds_client_get_url(c, id, &text) == SDS_ERROR_NONE;
    case 1:
      return sds_client_get_touch_icon_exists(c, id, &value) == SDS_ERROR_NONE && value == 1;
    case 2:
      return sds_client_get_icon(c, id, &icon) == SDS_ERROR_NONE && icon.byte_count == kIconBytes &&
             icon.width == 57 && icon.height == 57;
    case 3:
      return sds_client_get_next_update_duration(c, &value) == SDS_ERROR_NONE && value == 3600;
    default:
      return sds_client_get_ids_by_dirty(c, 1, &ids) == SDS_ERROR_NONE && ids.count == kItems;
  }
}

TEST_F(Soak, OneConnectionServesTwoThousandRequestsWithFlatDescriptorsAndMappings) {
  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  ProcStats settled;
  long failures = 0;
  for (long n = 0; n < 2000; ++n) {
    if (!one_request(connection, n)) ++failures;
    // The first requests settle the database pages and the libraries' caches.
    if (n == 199) settled = proc_stats(service.pid());
  }
  const ProcStats last = proc_stats(service.pid());
  EXPECT_EQ(failures, 0);
  ASSERT_GT(settled.fds, 0);
  EXPECT_EQ(last.fds, settled.fds);
  EXPECT_EQ(last.mappings, settled.mappings);
  // 400 icon requests copy 5 MB through the service; none of it may stay.
  if (!kUnderAddressSanitizer) {
    EXPECT_LT(last.rss_kb - settled.rss_kb, 2048);
  }

  EXPECT_EQ(sds_client_release_shm(connection), SDS_ERROR_NONE);
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
  EXPECT_EQ(files(), files_before_);
}

TEST_F(Soak, ThirtyConnectionsInARowLeaveTheActivatorFlatAndNothingBehind) {
  ServiceHarness activator;
  ASSERT_TRUE(activator.start_activated(false));
  long failures = 0;
  std::vector<long> fds, maps;  // of each connection's service process
  ProcStats first;
  for (int n = 0; n < 30; ++n) {
    SdsConnection connection;
    ASSERT_EQ(activator.connect(&connection), SDS_ERROR_NONE) << activator.output();
    for (long r = 0; r < 5; ++r) failures += one_request(connection, n * 5 + r) ? 0 : 1;
    const std::vector<pid_t> services = proc_children(activator.pid());
    ASSERT_EQ(services.size(), 1u);
    const ProcStats s = proc_stats(services[0]);
    fds.push_back(s.fds);
    maps.push_back(s.mappings);
    if (n == 0) first = proc_stats(activator.pid());
    EXPECT_EQ(sds_client_release_shm(connection), SDS_ERROR_NONE);
  }
  const ProcStats last = proc_stats(activator.pid());
  EXPECT_EQ(failures, 0);
  const auto [fds_min, fds_max] = std::ranges::minmax(fds);
  const auto [maps_min, maps_max] = std::ranges::minmax(maps);
  EXPECT_EQ(fds_min, fds_max);
  EXPECT_LE(maps_max - maps_min, kMapsJitter);
  EXPECT_EQ(last.fds, first.fds);
  EXPECT_EQ(last.mappings, first.mappings);

  ASSERT_TRUE(activator.signal(SIGTERM));
  int status = 0;
  ASSERT_TRUE(activator.wait_exit(&status));
  EXPECT_EQ(files(), files_before_);
}

}  // namespace
