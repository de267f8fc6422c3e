// Faults injected into the real service while it pulls from the stand-in
// content server. Whatever happens, the service must not crash, must answer
// with a status, and must leave one whole list that the next pull updates.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "sitedeck-client-commands.h"
#include "sitedeck-service-types.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

namespace fs = std::filesystem;
using Settings = std::vector<std::pair<std::string, std::string>>;

// A latitude out of range: the pull skips the location step, so no geocoder
// is needed, and asks for the global list.
constexpr double kNoPosition = 1000.0;
constexpr int kReadTimeoutMs = 60000;
constexpr const char* kHerald = "http://daily-herald.example/";
constexpr const char* kHeraldIcon = "daily-herald/apple-touch-icon.png";
constexpr const char* kGarden = "http://garden-life.example/";
constexpr uid_t kNobody = 65534;

// The live items as "id|url" in the service's order; empty when a step failed.
std::vector<std::string> live_items(SdsConnection& connection) {
  sds_client_ids ids;
  if (sds_client_get_ids_by_dirty(connection, 1, &ids) != SDS_ERROR_NONE) return {};
  std::vector<std::string> items;
  for (int32_t i = 0; i < ids.count; ++i) {
    SdsClientText url;
    if (sds_client_get_url(connection, ids.ids.get()[i], &url) != SDS_ERROR_NONE) return {};
    items.push_back(std::to_string(ids.ids.get()[i]) + "|" + url.get());
  }
  return items;
}

// A service process (behind a wrapper such as prlimit or setpriv) and a
// connection to it.
struct ServiceRun {
  ServiceHarness service;
  SdsConnection connection;
};

class FaultInjection : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(content_.ok());
    ASSERT_TRUE(write_server_list());
  }

  std::string data(const char* fixed) const { return root_.path(fixed); }

  bool write_server_list() const { return ::write_server_list({{1, content_.base_url()}}); }

  // A whole pull on `connection`, without a position or browser version.
  static int pull_on(const SdsConnection& connection) {
    return run_initialize(connection.fd(), connection.cid(), kNoPosition, 0, SDS_ERROR_NO_DATA,
                          nullptr)
        .final;
  }

  // Starts the service and connects; false (with a failure) when it can't.
  static bool start(ServiceRun* run, const std::vector<std::string>& wrapper = {}) {
    if (!run->service.start_direct_wrapped(wrapper)) {
      ADD_FAILURE() << "service not started";
      return false;
    }
    const int status = run->service.connect(&run->connection, kReadTimeoutMs);
    EXPECT_EQ(status, SDS_ERROR_NONE) << run->service.output();
    return status == SDS_ERROR_NONE;
  }
  // Closes the connection; the service must then end normally.
  static void finish(ServiceRun* run) {
    run->connection.close();
    int wait_status = 0;
    ASSERT_TRUE(run->service.wait_exit(&wait_status)) << run->service.output();
    EXPECT_EQ(exit_code_of(wait_status), 0) << run->service.output();
  }

  // One pull through a fresh service process; -1 when it could not be reached.
  int pull(const std::vector<std::string>& wrapper = {}) {
    ServiceRun run;
    if (!start(&run, wrapper)) return -1;
    const int status = pull_on(run.connection);
    finish(&run);
    return status;
  }

  // The live items as a fresh service process reports them.
  std::vector<std::string> live() {
    ServiceRun run;
    if (!start(&run)) return {};
    std::vector<std::string> items = live_items(run.connection);
    finish(&run);
    return items;
  }

  // Copies the data directory aside, or puts the copy back in its place.
  void snapshot() const { copy_tree(data(SDS_DATA_DIR), root_.dir() + "/snapshot"); }
  void restore() const { copy_tree(root_.dir() + "/snapshot", data(SDS_DATA_DIR)); }
  static void copy_tree(const std::string& from, const std::string& to) {
    fs::remove_all(to);
    fs::copy(from, to, fs::copy_options::recursive);
  }

  size_t files_in(const char* fixed_dir) const {
    size_t n = 0;
    for (const auto& entry : fs::directory_iterator(data(fixed_dir))) n += entry.is_regular_file();
    return n;
  }

  // Working files a finished pull must not leave behind.
  void expect_no_working_files() const {
    for (const char* fixed :
         {SDS_JSON_RESPONSE_PATH, SDS_HEADER_RESPONSE_PATH, SDS_ETAG_TO_UPDATE_PATH}) {
      EXPECT_FALSE(file_exists(data(fixed))) << fixed;
    }
    EXPECT_EQ(files_in(SDS_IMAGES_DIR), 0u);
  }

  std::string integrity() const {
    return rows_of_file(data(SDS_DB_PATH), "PRAGMA integrity_check");
  }

  // Makes every directory from the root down to the data directories
  // reachable by an unprivileged user, and the named ones writable by it.
  void open_tree_for_nobody(const std::vector<const char*>& writable) const {
    for (fs::path p = data(SDS_DATA_DIR); p.string().size() >= root_.dir().size();
         p = p.parent_path()) {
      ASSERT_EQ(chmod(p.c_str(), 0755), 0) << p;
    }
    for (const char* fixed : writable) {
      for (const auto& entry : fs::recursive_directory_iterator(data(fixed))) {
        ASSERT_EQ(chown(entry.path().c_str(), kNobody, kNobody), 0);
      }
      ASSERT_EQ(chown(data(fixed).c_str(), kNobody, kNobody), 0);
    }
  }

  TempRoot root_;
  ContentServerProcess content_;
};

const std::vector<std::string> kAsNobody = {"/usr/bin/setpriv", "--reuid=65534", "--regid=65534",
                                            "--clear-groups"};

std::vector<std::string> file_size_limit(long bytes) {
  return {"/usr/bin/prlimit", "--fsize=" + std::to_string(bytes), "--"};
}

TEST_F(FaultInjection, PullKilledAtAnyMomentLeavesOneWholeListAndTheNextPullRepairsIt) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  ASSERT_GE(old_list.size(), 20u);
  snapshot();

  // The next list: one site gone, one new, new pixels for eight, and every
  // position changed.
  ASSERT_TRUE(content_.control({{"remove", kGarden}, {"add", "http://newcomer.example/"}}));
  ASSERT_TRUE(content_.control({{"reverse", "1"}}));
  for (size_t i = 0; i < 8; ++i) {
    const std::string url = old_list[i].substr(old_list[i].find('|') + 1);
    if (url != kGarden) {
      ASSERT_TRUE(content_.control({{"touch", url}}));
    }
  }
  // Slow answers stretch the pull so that the kills land all over it.
  ASSERT_TRUE(content_.control({{"delay_ms", "40"}}));
  const auto started = std::chrono::steady_clock::now();
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const auto whole_pull = std::chrono::steady_clock::now() - started;
  const std::vector<std::string> new_list = live();
  ASSERT_NE(new_list, old_list);

  std::mt19937 random(20240601);
  std::uniform_real_distribution<double> jitter(0.0, 1.0);
  int kept_old = 0;
  int got_new = 0;
  for (int round = 0; round < 8; ++round) {
    SCOPED_TRACE("round " + std::to_string(round));
    restore();
    const auto kill_after = std::chrono::duration_cast<std::chrono::microseconds>(
        whole_pull * ((round + jitter(random)) / 8.0));
    {
      ServiceRun run;
      ASSERT_TRUE(start(&run));
      ASSERT_TRUE(send_initialize(run.connection.fd(), run.connection.cid(), kNoPosition, 0,
                                  SDS_ERROR_NO_DATA, nullptr));
      // This pause is the fault's moment, not a wait for an event.
      std::this_thread::sleep_for(kill_after);
      ASSERT_TRUE(run.service.signal(SIGKILL));
      int wait_status = 0;
      ASSERT_TRUE(run.service.wait_exit(&wait_status));
      EXPECT_TRUE(WIFSIGNALED(wait_status));
    }
    const std::vector<std::string> after_kill = live();
    EXPECT_TRUE(after_kill == old_list || after_kill == new_list)
        << "killed after " << kill_after.count() << " us";
    kept_old += after_kill == old_list;
    got_new += after_kill == new_list;
    EXPECT_EQ(integrity(), "ok");

    const int repair = pull();
    EXPECT_TRUE(repair == SDS_ERROR_NONE || repair == SDS_ERROR_HTTP_NOT_MODIFIED) << repair;
    EXPECT_EQ(live(), new_list);
    expect_no_working_files();
  }
  std::printf("kills that kept the old list: %d, that left the new one: %d\n", kept_old, got_new);
}

TEST_F(FaultInjection, DatabaseFileOfGarbageIsRebuiltAndTheNextPullRefillsIt) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> full = live();
  const std::string database = read_file(data(SDS_DB_PATH));
  ASSERT_GT(database.size(), 8192u);
  std::mt19937 random(7);
  std::string noise(64 * 1024, '\0');
  for (char& c : noise) c = static_cast<char>(random());

  // Damage that shows when the file is opened makes the service rebuild it
  // at once; damage deeper in the file is found by the next pull.
  const struct {
    const char* name;
    std::string content;
    bool rebuilt_at_open;
  } cases[] = {
      {"random bytes", noise, true},
      {"a database header over random pages", database.substr(0, 100) + noise, true},
      {"a database cut after its first page", database.substr(0, 4096), true},
      // The header alone looked sound: the damaged schema went unnoticed.
      {"the schema on the first page overwritten",
       database.substr(0, 100) + noise.substr(0, 3996) + database.substr(4096), true},
      {"an empty file", "", true},
      {"a page in the middle overwritten",
       database.substr(0, 8192) + noise.substr(0, 4096) + database.substr(12288), false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(write_file(data(SDS_DB_PATH), c.content));
    {
      ServiceRun run;
      ASSERT_TRUE(start(&run));
      sds_client_ids ids;
      const int status = sds_client_get_full_ids(run.connection, &ids);
      if (c.rebuilt_at_open) {
        EXPECT_EQ(status, SDS_ERROR_NO_DATA) << run.service.output();
      }
      finish(&run);
    }
    EXPECT_EQ(pull(), SDS_ERROR_NONE);
    EXPECT_EQ(live(), full);
    EXPECT_EQ(integrity(), "ok");
  }
}

TEST_F(FaultInjection, DataDirectoriesTheServiceMayNotWriteGiveStatusesNotCrashes) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  const std::string etag = read_file(data(SDS_ETAG_PATH));
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"remove", kGarden}}));
  snapshot();

  {
    SCOPED_TRACE("server directory read-only: the answer cannot be saved");
    open_tree_for_nobody({SDS_DATABASE_DIR, SDS_IMAGES_DIR});
    ServiceRun run;
    ASSERT_TRUE(start(&run, kAsNobody));
    EXPECT_EQ(pull_on(run.connection), SDS_ERROR_IO_ERROR);
    // The duration of the last answer could not be removed either.
    int32_t seconds = 0;
    EXPECT_EQ(sds_client_get_next_update_duration(run.connection, &seconds), SDS_ERROR_NONE);
    EXPECT_EQ(seconds, 3600);
    EXPECT_EQ(live_items(run.connection), old_list);
    finish(&run);
    EXPECT_EQ(read_file(data(SDS_ETAG_PATH)), etag);
  }
  {
    SCOPED_TRACE("images directory read-only: no icon can be fetched");
    restore();
    open_tree_for_nobody({SDS_DATABASE_DIR, SDS_SERVER_DIR});
    EXPECT_EQ(pull(kAsNobody), SDS_ERROR_NONE);
    EXPECT_NE(live(), old_list);
    // A list whose icons failed is not taken as stored: asked again in full.
    EXPECT_EQ(read_file(data(SDS_ETAG_PATH)), etag);
    EXPECT_EQ(read_file(data(SDS_NEXT_UPDATE_DURATION_PATH)), "86400");
  }
  {
    SCOPED_TRACE("database file read-only: the merge cannot be stored");
    restore();
    open_tree_for_nobody({SDS_SERVER_DIR, SDS_IMAGES_DIR});
    EXPECT_EQ(pull(kAsNobody), SDS_ERROR_DISK_BUSY);
    EXPECT_EQ(live(), old_list);
    EXPECT_EQ(read_file(data(SDS_ETAG_PATH)), etag);
  }
  {
    SCOPED_TRACE("database directory read-only and no database: the connection ends");
    restore();
    fs::remove(data(SDS_DB_PATH));
    open_tree_for_nobody({SDS_SERVER_DIR, SDS_IMAGES_DIR});
    ServiceRun run;
    ASSERT_TRUE(start(&run, kAsNobody));
    sds_client_ids ids;
    EXPECT_EQ(sds_client_get_full_ids(run.connection, &ids), SDS_ERROR_IO_ERROR);
    finish(&run);
  }
}

// The shared-memory object takes 3 MiB of the file size limit, so the limits
// here stay above that; the answer or the database is made bigger instead.
constexpr long kShmBytes = static_cast<long>(SDS_SHM_SIZE);

TEST_F(FaultInjection, FileSizeLimitKilledTheServiceInsteadOfFailingTheWrite) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  const std::string etag = read_file(data(SDS_ETAG_PATH));
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"body", "huge"}, {"huge_mb", "5"}}));

  ServiceRun run;
  ASSERT_TRUE(start(&run, file_size_limit(kShmBytes + 4096)));
  EXPECT_EQ(pull_on(run.connection), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_EQ(live_items(run.connection), old_list);
  finish(&run);
  EXPECT_EQ(read_file(data(SDS_ETAG_PATH)), etag);
}

TEST_F(FaultInjection, FullDiskDuringTheMergeKeepsTheOldListAndTellsTheBrowser) {
  // A list big enough that the database outgrows the shared-memory object.
  ContentServerProcess big({"--items", "120"});
  ASSERT_TRUE(big.ok());
  ASSERT_TRUE(::write_server_list({{1, big.base_url()}}));
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  const std::string etag = read_file(data(SDS_ETAG_PATH));
  const auto database_bytes = static_cast<long>(fs::file_size(data(SDS_DB_PATH)));
  ASSERT_GT(database_bytes, kShmBytes);
  ASSERT_TRUE(
      big.control({{"add", "http://newcomer.example/"}, {"touch", "http://site-0001.test/"}}));

  // The database may not grow: the answer is saved, the merge cannot be.
  EXPECT_EQ(pull(file_size_limit(database_bytes)), SDS_ERROR_DISK_BUSY);
  EXPECT_EQ(live(), old_list);
  EXPECT_EQ(read_file(data(SDS_ETAG_PATH)), etag);
  EXPECT_EQ(integrity(), "ok");

  // Room again: the next pull stores the new list.
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(live().size(), old_list.size() + 1);
  expect_no_working_files();
}

TEST_F(FaultInjection, ServerFaultsGiveTheirStatusesAndTheServiceServesOn) {
  const struct {
    const char* name;
    Settings settings;
    int status;
  } cases[] = {
      {"connection closed in the middle of the body", {{"body", "cut"}, {"times", "1"}}, 18},
      {"redirects to itself without end",
       {{"status", "302"}, {"location", content_.root_url() + "/"}},
       18},
      {"permanent redirects to itself without end",
       {{"status", "301"}, {"location", content_.root_url() + "/"}},
       18},
      {"an icon claiming 100000 x 100000 pixels", {{"icon_huge", kHeraldIcon}}, 0},
      {"an icon that is an HTML page", {{"icon_garbage", kHeraldIcon}}, 0},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(content_.reset());
    ASSERT_TRUE(write_server_list());
    fs::remove(data(SDS_ETAG_PATH));
    ASSERT_TRUE(content_.control(c.settings));
    ServiceRun run;
    ASSERT_TRUE(start(&run));
    EXPECT_EQ(pull_on(run.connection), c.status);
    // Served on: the same connection answers the next requests.
    sds_client_ids ids;
    const int ids_status = sds_client_get_ids_by_dirty(run.connection, 1, &ids);
    EXPECT_TRUE(ids_status == SDS_ERROR_NONE || ids_status == SDS_ERROR_NO_DATA) << ids_status;
    if (c.status == SDS_ERROR_NONE) {
      // The broken icon's site is stored, without an icon.
      int32_t herald = -1;
      for (const std::string& item : live_items(run.connection)) {
        if (item.ends_with(std::string("|") + kHerald)) herald = std::stoi(item);
      }
      ASSERT_GT(herald, 0);
      sds_client_icon icon;
      EXPECT_EQ(sds_client_get_icon(run.connection, herald, &icon), SDS_ERROR_NO_DATA);
    }
    finish(&run);
    EXPECT_EQ(files_in(SDS_IMAGES_DIR), 0u);
    EXPECT_FALSE(file_exists(data(SDS_ETAG_TO_UPDATE_PATH)));
  }
}

TEST_F(FaultInjection, LongListOpenedAFilePerIconAtOnceAndRanOutOfDescriptors) {
  // 300 sites, each with an icon to fetch, and room for 128 descriptors.
  ContentServerProcess big({"--items", "300"});
  ASSERT_TRUE(big.ok());
  ASSERT_TRUE(::write_server_list({{1, big.base_url()}}));
  ServiceRun run;
  ASSERT_TRUE(start(&run, {"/usr/bin/prlimit", "--nofile=128", "--"}));
  EXPECT_EQ(pull_on(run.connection), SDS_ERROR_NONE);
  EXPECT_EQ(live_items(run.connection).size(), 300u);
  finish(&run);
  EXPECT_FALSE(run.service.has_message("[CRITICAL]  Unable to open Image File"));
  EXPECT_EQ(
      rows_of_file(data(SDS_DB_PATH), "SELECT count(*) FROM site_deck WHERE length(icon_data) > 0"),
      "300");
  // Every icon arrived, so the list counts as stored.
  EXPECT_TRUE(file_exists(data(SDS_ETAG_PATH)));
  expect_no_working_files();
}

}  // namespace
