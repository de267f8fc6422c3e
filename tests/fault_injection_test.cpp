// Faults injected into the real service from outside while it pulls from the
// stand-in content server: a kill at any moment, a database file of garbage,
// directories it may not write, a file size limit, too few descriptors.
// Whatever happens, it must not crash, must answer with a status, and must
// leave one whole list that the next pull updates.
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
#include <vector>

#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-types.h"
#include "support/db_session.h"
#include "support/pull_env.h"
#include "support/pull_rig.h"

namespace {

namespace fs = std::filesystem;

constexpr const char* kHerald = "http://daily-herald.example/";
constexpr const char* kGarden = "http://garden-life.example/";
constexpr uid_t kNobody = 65534;
const std::vector<std::string> kAsNobody = {"/usr/bin/setpriv", "--reuid=65534", "--regid=65534",
                                            "--clear-groups"};

std::vector<std::string> file_size_limit(long bytes) {
  return {"/usr/bin/prlimit", "--fsize=" + std::to_string(bytes), "--"};
}

class FaultInjection : public ::testing::Test, public PullRig {
 protected:
  // Copies the data directory aside, or puts the copy back in its place.
  void snapshot() const { copy_tree(path(SDS_DATA_DIR), root_->dir() + "/snapshot"); }
  void restore() const { copy_tree(root_->dir() + "/snapshot", path(SDS_DATA_DIR)); }
  static void copy_tree(const std::string& from, const std::string& to) {
    fs::remove_all(to);
    fs::copy(from, to, fs::copy_options::recursive);
  }
  std::string integrity() const { return rows_of_file(path(SDS_DB_PATH), "PRAGMA integrity_check"); }
  // Working files a finished pull must not leave behind.
  void expect_no_working_files() const {
    for (const char* fixed : {SDS_JSON_RESPONSE_PATH, SDS_HEADER_RESPONSE_PATH,
                              SDS_ETAG_TO_UPDATE_PATH}) {
      EXPECT_FALSE(file_exists(path(fixed))) << fixed;
    }
    EXPECT_TRUE(fs::is_empty(path(SDS_IMAGES_DIR)));
  }
  // Lets an unprivileged user reach the data directories, and write the named ones.
  void open_tree_for_nobody(const std::vector<const char*>& writable) const {
    for (fs::path p = path(SDS_DATA_DIR); p.string().size() >= root_->dir().size();
         p = p.parent_path()) {
      ASSERT_EQ(chmod(p.c_str(), 0755), 0) << p;
    }
    // Only ownership grants writing, whatever umask made the tree.
    for (const auto& entry : fs::recursive_directory_iterator(path(SDS_DATA_DIR))) {
      fs::permissions(entry.path(), fs::perms::group_write | fs::perms::others_write,
                      fs::perm_options::remove);
    }
    for (const char* fixed : writable) {
      for (const auto& entry : fs::recursive_directory_iterator(path(fixed))) {
        ASSERT_EQ(chown(entry.path().c_str(), kNobody, kNobody), 0);
      }
      ASSERT_EQ(chown(path(fixed).c_str(), kNobody, kNobody), 0);
    }
  }
};

TEST_F(FaultInjection, PullKilledAtAnyMomentLeavesOneWholeListAndTheNextPullRepairsIt) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  snapshot();
  // The next list: one site gone, one new, new pixels, every position changed;
  // slow answers stretch the pull so that the kills land all over it.
  ASSERT_TRUE(content.control({{"remove", kGarden}, {"add", "http://newcomer.example/"},
                               {"reverse", "1"}, {"touch", kHerald}, {"delay_ms", "40"}}));
  const auto started = std::chrono::steady_clock::now();
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const auto whole_pull = std::chrono::steady_clock::now() - started;
  const std::vector<std::string> new_list = live();
  ASSERT_NE(new_list, old_list);

  std::mt19937 random(20240601);
  std::uniform_real_distribution<double> jitter(0.0, 1.0);
  for (int round = 0; round < 8; ++round) {
    SCOPED_TRACE("round " + std::to_string(round));
    restore();
    const auto kill_after = std::chrono::duration_cast<std::chrono::microseconds>(
        whole_pull * ((round + jitter(random)) / 8.0));
    // Activated directly (env execs the service), so that the signal reaches
    // the service itself, not an activator in front of it.
    ASSERT_TRUE(open({"/usr/bin/env"}));
    ASSERT_TRUE(send_initialize(connection.fd(), connection.cid(), kNoPosition, 0,
                                SDS_ERROR_NO_DATA, nullptr));
    // This pause is the fault's moment, not a wait for an event.
    std::this_thread::sleep_for(kill_after);
    ASSERT_TRUE(service->signal(SIGKILL));
    int wait_status = 0;
    ASSERT_TRUE(service->wait_exit(&wait_status));
    EXPECT_TRUE(WIFSIGNALED(wait_status));
    connection.close();
    const std::vector<std::string> after_kill = live();
    EXPECT_TRUE(after_kill == old_list || after_kill == new_list) << kill_after.count() << " us";
    EXPECT_EQ(integrity(), "ok");
    const int repair = pull();
    EXPECT_TRUE(repair == SDS_ERROR_NONE || repair == SDS_ERROR_HTTP_NOT_MODIFIED) << repair;
    EXPECT_EQ(live(), new_list);
    expect_no_working_files();
  }
}

TEST_F(FaultInjection, DatabaseFileOfGarbageIsRebuiltAndTheNextPullRefillsIt) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> full = live();
  const std::string database = read_file(path(SDS_DB_PATH));
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
    ASSERT_TRUE(write_file(path(SDS_DB_PATH), c.content));
    if (c.rebuilt_at_open) {
      EXPECT_TRUE(live().empty());
    }
    EXPECT_EQ(pull(), SDS_ERROR_NONE);
    EXPECT_EQ(live(), full);
    EXPECT_EQ(integrity(), "ok");
  }
}

TEST_F(FaultInjection, DataDirectoriesTheServiceMayNotWriteGiveStatusesNotCrashes) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  const std::string etag = read_file(path(SDS_ETAG_PATH));
  ASSERT_TRUE(content.control({{"touch", kHerald}, {"remove", kGarden}}));
  snapshot();
  const struct {
    const char* name;
    std::vector<const char*> writable;
    int status;
    bool old_list_stays;
  } cases[] = {
      {"server directory read-only: the answer cannot be saved",
       {SDS_DATABASE_DIR, SDS_IMAGES_DIR}, SDS_ERROR_IO_ERROR, true},
      // A list whose icons failed is not taken as stored: asked again in full.
      {"images directory read-only: no icon can be fetched", {SDS_DATABASE_DIR, SDS_SERVER_DIR},
       SDS_ERROR_NONE, false},
      {"database file read-only: the merge cannot be stored", {SDS_SERVER_DIR, SDS_IMAGES_DIR},
       SDS_ERROR_DISK_BUSY, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    restore();
    open_tree_for_nobody(c.writable);
    EXPECT_EQ(pull(kAsNobody), c.status);
    EXPECT_EQ(live() == old_list, c.old_list_stays);
    EXPECT_EQ(read_file(path(SDS_ETAG_PATH)), etag);
  }
  // Database directory read-only and no database: the connection ends.
  restore();
  fs::remove(path(SDS_DB_PATH));
  open_tree_for_nobody({SDS_SERVER_DIR, SDS_IMAGES_DIR});
  ASSERT_TRUE(open(kAsNobody));
  sds_client_ids ids;
  EXPECT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_IO_ERROR);
  close();
}

// Reaching a file size limit (a full quota) killed the service with SIGXFSZ;
// now the write fails. The shared-memory object takes 3 MiB of the limit, so
// the answer is made bigger than that.
TEST_F(FaultInjection, FileSizeLimitKilledTheServiceInsteadOfFailingTheWrite) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> old_list = live();
  const std::string etag = read_file(path(SDS_ETAG_PATH));
  ASSERT_TRUE(content.control({{"touch", kHerald}, {"body", "huge"}, {"huge_mb", "4"}}));
  EXPECT_EQ(pull(file_size_limit(static_cast<long>(SDS_SHM_SIZE) + 4096)),
            SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_EQ(live(), old_list);
  EXPECT_EQ(read_file(path(SDS_ETAG_PATH)), etag);
}

TEST_F(FaultInjection, LongListOpenedAFilePerIconAtOnceAndRanOutOfDescriptors) {
  // 300 sites, each with an icon to fetch, and room for 128 descriptors.
  ContentServerProcess big({"--items", "300"});
  ASSERT_TRUE(big.ok());
  ASSERT_TRUE(write_server_list({{1, big.base_url()}}));
  EXPECT_EQ(pull({"/usr/bin/prlimit", "--nofile=128", "--"}), SDS_ERROR_NONE);
  EXPECT_EQ(rows_of_file(path(SDS_DB_PATH),
                         "SELECT count(*) FROM site_deck WHERE length(icon_data) > 0"),
            "300");
  // Every icon arrived, so the list counts as stored.
  EXPECT_NE(file(SDS_ETAG_PATH), "");
  expect_no_working_files();
}

}  // namespace
