// `sitedeck status` on scratch roots with the service stopped: a root seeded
// as a working device leaves it, an empty root, a root with broken files and
// one without a data directory, as text and as JSON; and that the command
// changes no file at all, nor creates the database.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json-glib/json-glib.h>
#include <sys/stat.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <map>
#include <memory>
#include <regex>
#include <string>
#include <vector>

#include "sitedeck-service-paths.h"
#include "sitedeck-service-server-data.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/temp_root.h"

namespace {

// 2020-01-01 00:00:00 UTC, the database's time stamp in the seeded root.
constexpr time_t kDatabaseTime = 1577836800;

const char kServerList[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<values>"
    "<Server><Id>1</Id><Base-url>http://127.0.0.1:8080/</Base-url><WaitTime>500</WaitTime>"
    "<RetryCount>3</RetryCount><FallBack>false</FallBack></Server>"
    "<Server><Id>2</Id><Base-url>https://backup.example/deck/</Base-url><WaitTime>60000</WaitTime>"
    "<RetryCount>1</RetryCount><FallBack>true</FallBack></Server></values>\n";

// Size and modification time of every file below `dir`, to show that
// nothing was written.
std::map<std::string, std::pair<uintmax_t, long long>> Snapshot(const std::string& dir) {
  std::map<std::string, std::pair<uintmax_t, long long>> files;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(dir)) {
    struct stat info {};
    if (stat(entry.path().c_str(), &info) != 0) continue;
    long long stamp =
        static_cast<long long>(info.st_mtim.tv_sec) * 1000000000 + info.st_mtim.tv_nsec;
    files[entry.path().string()] = {entry.is_regular_file() ? entry.file_size() : 0, stamp};
  }
  return files;
}

struct JsonParserFree {
  void operator()(JsonParser* parser) const { g_object_unref(parser); }
};
using UniqueJsonParser = std::unique_ptr<JsonParser, JsonParserFree>;

class SitedeckStatus : public ::testing::Test {
 protected:
  void SetUp() override {
    const char* tz = std::getenv("TZ");
    had_tz_ = tz != nullptr;
    if (had_tz_) old_tz_ = tz;
    // The time stamp is printed in local time; the tool inherits this.
    setenv("TZ", "UTC", 1);
  }
  void TearDown() override {
    if (had_tz_) {
      setenv("TZ", old_tz_.c_str(), 1);
    } else {
      unsetenv("TZ");
    }
  }

  void Seed() {
    ASSERT_TRUE(write_file(root_.path(SDS_SERVER_DATA_XML), kServerList));
    ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "3600"));
    sds_server_req_args args{};
    args.latitude = 37.5;
    args.longitude = 127;
    args.city = strdup("Jongno-gu");
    args.province = strdup("Seoul");
    save_city_and_province(&args);
    std::free(args.city);
    std::free(args.province);
    SeedItem hidden = seed_item(9, "https://gone.example/", "Gone", 3);
    hidden.is_dirty = -1;
    ASSERT_TRUE(seed_deck({seed_item(7, "https://news.example/", "News", 1),
                           seed_item(3, "https://mail.example/", "Mail", 2), hidden}));
    // After the database: a newly created one drops any stored ETag.
    ASSERT_TRUE(write_file(root_.path(SDS_ETAG_PATH), "\"v1-abc\"\n"));
    struct timespec times[2] = {{kDatabaseTime, 0}, {kDatabaseTime, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, root_.path(SDS_DB_PATH).c_str(), times, 0), 0);
  }

  ProcessResult Status(const std::vector<std::string>& options = {}) {
    std::vector<std::string> argv = {std::string(SITEDECK_BIN_DIR) + "/sitedeck"};
    argv.insert(argv.end(), options.begin(), options.end());
    argv.push_back("status");
    return run_process(argv);
  }

  // The JSON document the tool printed, parsed; its root object in `*root`.
  UniqueJsonParser Parse(const std::string& text, JsonObject** root) {
    UniqueJsonParser parser(json_parser_new());
    EXPECT_TRUE(json_parser_load_from_data(parser.get(), text.c_str(), -1, nullptr)) << text;
    JsonNode* node = json_parser_get_root(parser.get());
    *root = node != nullptr && JSON_NODE_HOLDS_OBJECT(node) ? json_node_get_object(node) : nullptr;
    return parser;
  }

  TempRoot root_;
  bool had_tz_ = false;
  std::string old_tz_;
};

TEST_F(SitedeckStatus, SeededRootShowsEveryStoredFactAndChangesNothing) {
  Seed();
  const auto before = Snapshot(root_.dir());
  ProcessResult result = Status();
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.err, "");
  const std::string data = root_.path(SDS_DATA_DIR);
  const std::string head = "data directory: " + data + "\n" +
                           "servers:        2 configured\n"
                           "  ID  BASE URL                      WAIT      RETRIES  FALLBACK\n"
                           "  1   http://127.0.0.1:8080/        500 ms    3        no\n"
                           "  2   https://backup.example/deck/  60000 ms  1        yes\n"
                           "stored ETag:    \"v1-abc\"\n"
                           "next update:    3600 s\n"
                           "last position:  37.500000,127.000000 (Jongno-gu, Seoul)\n"
                           "items:          2 live, 1 hidden\n"
                           "database:       modified ";
  ASSERT_EQ(result.out.substr(0, head.size()), head);
  // The age grows with the clock; its form and the time stamp do not.
  std::string database_line = result.out.substr(head.size());
  EXPECT_TRUE(std::regex_match(database_line,
                               std::regex("\\d+ d \\d+ h ago \\(2020-01-01 00:00:00 UTC\\)\n")))
      << database_line;

  result = Status({"--json"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(Snapshot(root_.dir()), before);

  JsonObject* root = nullptr;
  UniqueJsonParser parser = Parse(result.out, &root);
  ASSERT_NE(root, nullptr);
  EXPECT_STREQ(json_object_get_string_member(root, "data_directory"), data.c_str());
  JsonArray* servers = json_object_get_array_member(root, "servers");
  ASSERT_EQ(json_array_get_length(servers), 2u);
  JsonObject* backup = json_array_get_object_element(servers, 1);
  EXPECT_EQ(json_object_get_int_member(backup, "id"), 2);
  EXPECT_STREQ(json_object_get_string_member(backup, "base_url"), "https://backup.example/deck/");
  EXPECT_EQ(json_object_get_int_member(backup, "wait_time_ms"), 60000);
  EXPECT_EQ(json_object_get_int_member(backup, "retry_count"), 1);
  EXPECT_TRUE(json_object_get_boolean_member(backup, "fall_back"));
  EXPECT_STREQ(json_object_get_string_member(root, "etag"), "\"v1-abc\"");
  JsonObject* next = json_object_get_object_member(root, "next_update");
  EXPECT_STREQ(json_object_get_string_member(next, "stored"), "3600");
  EXPECT_EQ(json_object_get_int_member(next, "seconds"), 3600);
  JsonObject* location = json_object_get_object_member(root, "location");
  EXPECT_STREQ(json_object_get_string_member(location, "position"), "37.500000,127.000000");
  EXPECT_STREQ(json_object_get_string_member(location, "city"), "Jongno-gu");
  EXPECT_STREQ(json_object_get_string_member(location, "province"), "Seoul");
  JsonObject* database = json_object_get_object_member(root, "database");
  EXPECT_STREQ(json_object_get_string_member(database, "path"), root_.path(SDS_DB_PATH).c_str());
  EXPECT_EQ(json_object_get_int_member(database, "live_items"), 2);
  EXPECT_EQ(json_object_get_int_member(database, "hidden_items"), 1);
  EXPECT_EQ(json_object_get_int_member(database, "modified"), kDatabaseTime);
}

TEST_F(SitedeckStatus, EmptyRootAnswersNoneAndCreatesNoDatabase) {
  ProcessResult result = Status();
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  const std::string data = root_.path(SDS_DATA_DIR);
  EXPECT_EQ(result.out, "data directory: " + data + "\n" +
                            "servers:        none (no usable server list at " +
                            root_.path(SDS_SERVER_DATA_XML) + ")\n" +
                            "stored ETag:    none\n"
                            "next update:    none (86400 s is used)\n"
                            "last position:  none\n"
                            "items:          none\n"
                            "database:       no database at " +
                            root_.path(SDS_DB_PATH) + "\n");
  EXPECT_FALSE(file_exists(root_.path(SDS_DB_PATH)));

  result = Status({"--json"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  JsonObject* root = nullptr;
  UniqueJsonParser parser = Parse(result.out, &root);
  ASSERT_NE(root, nullptr);
  for (const char* member : {"servers", "etag", "location", "database"}) {
    EXPECT_TRUE(json_object_get_null_member(root, member)) << member;
  }
  JsonObject* next = json_object_get_object_member(root, "next_update");
  EXPECT_TRUE(json_object_get_null_member(next, "stored"));
  EXPECT_EQ(json_object_get_int_member(next, "seconds"), 86400);
  EXPECT_FALSE(file_exists(root_.path(SDS_DB_PATH)));
}

TEST_F(SitedeckStatus, BrokenFilesAreExplainedNotFailures) {
  ASSERT_TRUE(write_file(root_.path(SDS_SERVER_DATA_XML), "<values><Server>"));
  ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "0\n"));
  ASSERT_TRUE(write_file(root_.path(SDS_LOCATION_INFO_PATH), "not xml"));
  ASSERT_TRUE(write_file(root_.path(SDS_DB_PATH), "this is not an SQLite database file"));
  const auto before = Snapshot(root_.dir());
  ProcessResult result = Status();
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.err, "");
  EXPECT_EQ(result.out, "data directory: " + root_.path(SDS_DATA_DIR) + "\n" +
                            "servers:        none (no usable server list at " +
                            root_.path(SDS_SERVER_DATA_XML) + ")\n" +
                            "stored ETag:    none\n"
                            "next update:    \"0\" is not above 0 (86400 s is used)\n"
                            "last position:  none\n"
                            "items:          none\n"
                            "database:       no database at " +
                            root_.path(SDS_DB_PATH) + ": file is not a database\n");
  EXPECT_EQ(Snapshot(root_.dir()), before);
}

TEST_F(SitedeckStatus, MissingDataDirectoryIsTheOneFailure) {
  std::filesystem::remove_all(root_.path(SDS_DATA_DIR));
  ProcessResult result = Status();
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 1);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err, "sitedeck: status: no data directory at " + root_.path(SDS_DATA_DIR) +
                            " (is the service installed?)\n");
}

}  // namespace
