// `sitedeck status` on scratch roots with the service stopped: after a good
// pull, before any pull, after a failed one (broken files), for a user who may
// not read the server files, and without a data directory; as text and as
// JSON, changing no file and creating no database.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json-glib/json-glib.h>
#include <sys/stat.h>

#include <cstring>
#include <filesystem>
#include <map>
#include <regex>
#include <string>
#include <vector>

#include "pull/sitedeck-service-server-data.h"
#include "sitedeck-service-paths.h"
#include "support/json_match.h"
#include "support/pull_env.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/temp_root.h"

namespace {

constexpr char kPullEnded[] = "1765051200";  // 2025-12-06 20:00:00 UTC

// Size and modification time of every file below `dir`.
std::map<std::string, std::pair<uintmax_t, long long>> Snapshot(const std::string& dir) {
  std::map<std::string, std::pair<uintmax_t, long long>> files;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(dir)) {
    struct stat info {};
    if (stat(entry.path().c_str(), &info) != 0) continue;
    files[entry.path().string()] = {entry.is_regular_file() ? entry.file_size() : 0,
                                    info.st_mtim.tv_sec * 1000000000LL + info.st_mtim.tv_nsec};
  }
  return files;
}

// The database's age grows with the clock: above zero, then taken as 1.
::testing::AssertionResult IsStatusJson(const std::string& text, const std::string& expected) {
  return IsJson(text, expected, [](JsonNode* printed) {
    if (!JSON_NODE_HOLDS_OBJECT(printed)) return false;
    JsonNode* database = json_object_get_member(json_node_get_object(printed), "database");
    if (database == nullptr || !JSON_NODE_HOLDS_OBJECT(database)) return true;
    JsonObject* object = json_node_get_object(database);
    if (json_object_get_int_member(object, "age_seconds") <= 0) return false;
    json_object_set_int_member(object, "age_seconds", 1);
    return true;
  });
}

class SitedeckStatus : public ::testing::Test {
 protected:
  // Time stamps are printed in local time; the tool inherits the zone.
  void SetUp() override { setenv("TZ", "UTC", 1); }
  void TearDown() override { unsetenv("TZ"); }

  void Seed() {
    ASSERT_TRUE(write_server_list({{1, "http://127.0.0.1:8080/", 500, 3, false},
                                   {2, "https://backup.example/deck/", 60000, 1, true}}));
    ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "3600"));
    char city[] = "Jongno-gu", province[] = "Seoul";
    sds_server_req_args args{};
    args.latitude = 37.5;
    args.longitude = 127;
    args.city = city;
    args.province = province;
    save_city_and_province(&args);
    SeedItem hidden = seed_item(9, "https://gone.example/", "Gone", 3);
    hidden.is_dirty = -1;
    ASSERT_TRUE(seed_deck({seed_item(7, "https://news.example/", "News", 1),
                           seed_item(3, "https://mail.example/", "Mail", 2), hidden}));
    // After the database: a newly created one drops any stored ETag.
    ASSERT_TRUE(write_file(root_.path(SDS_ETAG_PATH), "\"v1-abc\"\n"));
    ASSERT_TRUE(write_file(root_.path(SDS_LAST_PULL_PATH),
                           std::string("time ") + kPullEnded + "\nstatus 0\nstored " + kPullEnded +
                               "\ncity Jongno-gu\nprovince Seoul\n"));
    struct timespec times[2] = {{1577836800, 0}, {1577836800, 0}};  // 2020-01-01 00:00:00 UTC
    ASSERT_EQ(utimensat(AT_FDCWD, root_.path(SDS_DB_PATH).c_str(), times, 0), 0);
  }
  ProcessResult Status(const std::vector<std::string>& options = {}) {
    std::vector<std::string> argv = {SITEDECK_BIN_DIR "/sitedeck"};
    argv.insert(argv.end(), options.begin(), options.end());
    argv.push_back("status");
    return run_process(argv);
  }

  TempRoot root_;
  const std::string data_ = root_.path(SDS_DATA_DIR);
};

TEST_F(SitedeckStatus, SeededRootShowsEveryStoredFactAndChangesNothing) {
  Seed();
  const auto before = Snapshot(root_.dir());
  ProcessResult result = Status();
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.err, "");
  const std::string head = "data directory: " + data_ +
                           "\nservers:        2 configured\n"
                           "  ID  BASE URL                      WAIT      RETRIES  FALLBACK\n"
                           "  1   http://127.0.0.1:8080/        500 ms    3        no\n"
                           "  2   https://backup.example/deck/  60000 ms  1        yes\n"
                           "stored ETag:    \"v1-abc\"\nnext update:    3600 s\n"
                           "last pull:      2025-12-06 20:00:00 UTC, SDS_ERROR_NONE\n"
                           "next due:       2025-12-06 21:00:00 UTC\n"
                           "last position:  37.500000,127.000000 (Jongno-gu, Seoul)\n"
                           "items:          2 live, 1 withdrawn\ndatabase:       modified ";
  ASSERT_EQ(result.out.substr(0, head.size()), head);
  // The age grows with the clock; its form and the time stamp do not.
  EXPECT_TRUE(std::regex_match(result.out.substr(head.size()),
                               std::regex("\\d+ d \\d+ h ago \\(2020-01-01 00:00:00 UTC\\)\n")))
      << result.out;
  result = Status({"--json"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(Snapshot(root_.dir()), before);
  EXPECT_TRUE(IsStatusJson(result.out, R"({"data_directory": ")" + data_ + R"(",
      "servers": [
        {"id": 1, "base_url": "http://127.0.0.1:8080/", "wait_time_ms": 500, "retry_count": 3,
         "fall_back": false},
        {"id": 2, "base_url": "https://backup.example/deck/", "wait_time_ms": 60000,
         "retry_count": 1, "fall_back": true}],
      "etag": "\"v1-abc\"", "next_update": {"stored": "3600", "seconds": 3600},
      "last_pull": {"time": 1765051200, "status": 0, "name": "SDS_ERROR_NONE"},
      "next_due": 1765054800, "permission_denied": [],
      "location": {"position": "37.500000,127.000000", "city": "Jongno-gu", "province": "Seoul"},
      "database": {"path": ")" + root_.path(SDS_DB_PATH) + R"(", "live_items": 2,
                   "withdrawn_items": 1, "modified": 1577836800, "age_seconds": 1}})"));
}

// Missing or broken files are told, not failures; the one failure is a
// missing data directory. The broken root's last pull failed, in a record
// whose lines come in another order and with a key of a later version.
TEST_F(SitedeckStatus, EmptyRootAndBrokenFilesAnswerNoneAndCreateNothing) {
  struct Case {
    const char* name;
    bool broken;
    std::string next_update, last_pull, database, stored;  // `stored`: as JSON
    std::string last_pull_json;
  } cases[] = {
      {"empty root", false, "none", "none (no pull has run)", "", "null",
       R"("last_pull": null, "next_due": null)"},
      {"broken files", true, "\"0\" is not above 0",
       "2025-12-06 20:00:00 UTC, SDS_ERROR_SERVER_REQUEST_FAILED\n"
       "next due:       2025-12-07 20:00:00 UTC",
       ": file is not a database", "\"0\"",
       R"("last_pull": {"time": 1765051200, "status": 18,
           "name": "SDS_ERROR_SERVER_REQUEST_FAILED"}, "next_due": 1765137600)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.broken) {
      ASSERT_TRUE(write_file(root_.path(SDS_SERVER_DATA_XML), "<values><Server>"));
      ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "0\n"));
      ASSERT_TRUE(write_file(root_.path(SDS_LOCATION_INFO_PATH), "not xml"));
      ASSERT_TRUE(write_file(root_.path(SDS_DB_PATH), "this is not an SQLite database file"));
      ASSERT_TRUE(write_file(root_.path(SDS_LAST_PULL_PATH),
                             std::string("status 18\nattempts 3\ntime ") + kPullEnded + "\n"));
    }
    const auto before = Snapshot(root_.dir());
    ProcessResult result = Status();
    EXPECT_EQ(result.exit_code, 0) << result.err;
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "data directory: " + data_ +
                              "\nservers:        none (no usable server list at " +
                              root_.path(SDS_SERVER_DATA_XML) + ")\nstored ETag:    none\n" +
                              "next update:    " + c.next_update + " (86400 s is used)\n" +
                              "last pull:      " + c.last_pull + "\n" +
                              "last position:  none\nitems:          none\n" +
                              "database:       no database at " + root_.path(SDS_DB_PATH) +
                              c.database + "\n");
    result = Status({"--json"});
    EXPECT_TRUE(IsStatusJson(result.out, R"({"data_directory": ")" + data_ +
                                             R"(", "servers": null, "etag": null, "location": null,
                                       "database": null, "permission_denied": [], )" +
                                             c.last_pull_json + R"(, "next_update": {"stored": )" +
                                             c.stored + R"(, "seconds": 86400}})"));
    EXPECT_EQ(Snapshot(root_.dir()), before);
    EXPECT_EQ(file_exists(root_.path(SDS_DB_PATH)), c.broken);
  }
  std::filesystem::remove_all(data_);
  ProcessResult result = Status();
  EXPECT_EQ(result.exit_code, 1);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err,
            "sitedeck: status: no data directory at " + data_ + " (is the service installed?)\n");
}

// The installation keeps server/ from other users: such a user is told
// "permission denied" for each file there, never "none", and the command fails.
TEST_F(SitedeckStatus, FilesTheUserMayNotReadArePermissionDeniedNotMissing) {
  Seed();
  ASSERT_EQ(chmod(root_.dir().c_str(), 0755), 0);
  ASSERT_EQ(chmod(root_.path(SDS_SERVER_DIR).c_str(), 0), 0);
  ProcessResult result = run_process(without_root({SITEDECK_BIN_DIR "/sitedeck", "status"}));
  ASSERT_EQ(chmod(root_.path(SDS_SERVER_DIR).c_str(), 0750), 0);
  EXPECT_EQ(result.exit_code, 1);
  for (const char* line :
       {"servers:        permission denied (no usable server list at ",
        "stored ETag:    permission denied\n", "last pull:      permission denied\n",
        "last position:  permission denied\n"}) {
    EXPECT_NE(result.out.find(line), std::string::npos) << line << "\n" << result.out;
  }
  EXPECT_EQ(result.err, "sitedeck: status: permission denied: 5 file(s) under " + data_ +
                            " cannot be read by this user (first: " +
                            root_.path(SDS_SERVER_DATA_XML) + ")\n");
}

}  // namespace
