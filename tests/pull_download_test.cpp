// One item-list download against the stand-in content server: the ETag
// cycle, Cache-Control, redirects, failed and endless transfers, icons (their
// file names, shared URLs, refused images, failures) and a service killed in
// the middle of the merge.
#include <gtest/gtest.h>
#include <poll.h>
#include <sqlite3.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "sitedeck-client.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-utils.h"
#include "support/db_session.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"

namespace {

constexpr const char* kQuery = "platform=Valto&";
constexpr const char* kHerald = "http://daily-herald.example/";
constexpr const char* kWeather = "http://weather-now.example/";
constexpr const char* kShop = "http://shop-central.example/";
constexpr const char* kGarden = "http://garden-life.example/";
constexpr const char* kHeraldIcon = "daily-herald/apple-touch-icon.png";

class PullDownload : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(content_.ok()); }
  void TearDown() override {
    std::free(sds_redirect_base_url);
    sds_redirect_base_url = nullptr;
  }

  int pull() { return sds_download_and_parse_json_data(content_.signed_url(kQuery).c_str()); }
  // The ETag the server gives the current list, as it is sent.
  std::string list_etag() const { return http_get(content_.signed_url(kQuery)).header("ETag"); }
  std::string stat(const char* name) const { return content_.stats()[name]; }

  static std::string table() {
    return DbSession::rows(
        "SELECT url, title, order_index, icon_size, length(icon_data), image_last_updated "
        "FROM site_deck ORDER BY url");
  }
  static std::string urls() {
    return DbSession::rows("SELECT url FROM site_deck ORDER BY order_index");
  }
  static bool no_images_left() { return std::filesystem::is_empty(sds_path(SDS_IMAGES_DIR)); }
  static std::string garden_rows() {
    return DbSession::rows("SELECT count(*) FROM site_deck WHERE url = '" + std::string(kGarden) +
                           "'");
  }

  DbSession db_;
  ContentServerProcess content_;
  ItemListGuard guard_;
};

constexpr const char* kGlobalUrls =
    "http://daily-herald.example/\nhttp://weather-now.example/\nhttp://shop-central.example/\n"
    "http://video-river.example/\nhttp://mail-box.example/\nhttp://map-atlas.example/\n"
    "http://book-nook.example/\nhttp://photo-lab.example/\nhttp://sports-desk.example/\n"
    "http://music-box.example/\nhttp://travel-guide.example/\nhttp://recipe-box.example/\n"
    "http://game-zone.example/\nhttp://kids-corner.example/\nhttp://tech-talk.example/\n"
    "http://money-daily.example/\nhttp://health-hub.example/\nhttp://auto-trader.example/\n"
    "http://old-portal.example/\nhttp://plain-text.example/\nhttp://film-club.example/\n"
    "http://garden-life.example/\nhttp://local-deals.example/\nhttp://city-events.example/\n"
    "http://radio-local.example/";

TEST_F(PullDownload, FirstPullStoresListAndEtagAsSentAndTheNextRequestIsConditional) {
  const std::string etag = list_etag();
  ASSERT_EQ(etag.size(), 34u);  // a quoted MD5
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(stat("last_if_none_match"), "");
  EXPECT_EQ(urls(), kGlobalUrls);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag + "\r\n");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_TO_UPDATE_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_JSON_RESPONSE_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_HEADER_RESPONSE_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_TRUE(no_images_left());

  EXPECT_EQ(pull(), SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_EQ(stat("last_if_none_match"), etag);
}

TEST_F(PullDownload, NotModifiedLeavesTableAndEtagAndWritesTheMaxAge) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string before = table();
  const std::string etag = root_file_or_none(SDS_ETAG_PATH);
  ASSERT_TRUE(write_file(sds_path(SDS_NEXT_UPDATE_DURATION_PATH), "999"));
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_TO_UPDATE_PATH), "\"stale\"\r\n"));
  const std::string icon_requests = stat("icon_requests");

  EXPECT_EQ(pull(), SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_EQ(table(), before);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_TO_UPDATE_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_EQ(stat("icon_requests"), icon_requests);
}

TEST_F(PullDownload, CacheControlWithoutAPositiveMaxAgeWritesNoDuration) {
  struct Case {
    const char* setting;
    const char* value;
    const char* logged;  // null: no duration line at all
  } cases[] = {
      {"max_age", "0", "Next update duration: 0"},
      {"max_age", "-5", "Next update duration: -5"},
      {"cache_control", "max-age=", "Next update duration: 0"},
      {"cache_control", "none", nullptr},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(content_.reset());
    ASSERT_TRUE(content_.control({{"status", "304"}, {c.setting, c.value}}));
    ASSERT_TRUE(write_file(sds_path(SDS_NEXT_UPDATE_DURATION_PATH), "999"));
    LogCapture log;
    EXPECT_EQ(pull(), SDS_ERROR_HTTP_NOT_MODIFIED) << c.value;
    EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "<none>") << c.value;
    if (c.logged != nullptr) {
      EXPECT_TRUE(log.contains(c.logged)) << c.value;
    } else {
      for (const LogLine& line : log.lines()) {
        EXPECT_EQ(line.message.rfind("Next update duration:", 0), std::string::npos)
            << line.message;
      }
    }
  }
}

TEST_F(PullDownload, RedirectsHandTheNewBaseUrlToThePullJob) {
  struct Case {
    const char* status;
    int result;
  } cases[] = {{"301", SDS_ERROR_HTTP_MOVED_PERMANENTLY}, {"302", SDS_ERROR_HTTP_FOUND}};
  for (const auto& c : cases) {
    ASSERT_TRUE(content_.control({{"status", c.status}, {"location", "http://127.0.0.1:1/v2/"}}));
    LogCapture log;
    EXPECT_EQ(pull(), c.result) << c.status;
    ASSERT_NE(sds_redirect_base_url, nullptr) << c.status;
    EXPECT_STREQ(sds_redirect_base_url, "http://127.0.0.1:1/v2/SiteDeck/getSubRegionalItems");
    // The platform log drops the messages' final line feed.
    EXPECT_TRUE(log.contains("Redirected Processed url = \"http://127.0.0.1:1/v2/\""));
    EXPECT_TRUE(log.contains(
        "Base url for redirected url = \"http://127.0.0.1:1/v2/SiteDeck/getSubRegionalItems\""));
    std::free(sds_redirect_base_url);
    sds_redirect_base_url = nullptr;
  }
}

// An earlier answer's base URL was taken for a redirect that named none.
TEST_F(PullDownload, RedirectWithoutUsableLocationFailsAndForgetsEarlierBaseUrl) {
  struct Case {
    const char* status;
    const char* location;
  } cases[] = {{"302", ""}, {"301", ""}, {"302", "mailto:x@example.org"}, {"301", "file:///etc/"}};
  for (const auto& c : cases) {
    ASSERT_TRUE(content_.control({{"status", "302"}, {"location", "http://127.0.0.1:1/"}}));
    ASSERT_EQ(pull(), SDS_ERROR_HTTP_FOUND);
    ASSERT_NE(sds_redirect_base_url, nullptr);  // left unconsumed on purpose
    ASSERT_TRUE(content_.control({{"status", c.status}, {"location", c.location}}));
    EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED) << c.status << " " << c.location;
    EXPECT_EQ(sds_redirect_base_url, nullptr) << c.status << " " << c.location;
  }
}

TEST_F(PullDownload, FailedOrEndlessTransfersAre18AndChangeNothing) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string before = table();
  const std::string etag = root_file_or_none(SDS_ETAG_PATH);
  ASSERT_TRUE(content_.control({{"touch", kHerald}}));  // the next answer is a 200
  set_stall_seconds(1);
  struct Case {
    const char* name;
    std::vector<std::pair<std::string, std::string>> settings;
  } cases[] = {
      {"status 500", {{"status", "500"}, {"times", "1"}}},
      {"status 404", {{"status", "404"}, {"times", "1"}}},
      {"stalled body", {{"body", "stall"}, {"stall_s", "600"}, {"times", "1"}}},
      {"cut-off body", {{"body", "cut"}, {"times", "1"}}},
      {"huge body", {{"body", "huge"}, {"huge_mb", "20"}, {"times", "1"}}},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(content_.control(c.settings)) << c.name;
    EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED) << c.name;
    EXPECT_EQ(table(), before) << c.name;
    EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag) << c.name;
    EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "<none>") << c.name;
    ASSERT_TRUE(content_.release());
  }
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_NE(table(), before);
}

TEST_F(PullDownload, FailedIconKeepsTheOldEtagAndAsksAgainInADay) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string etag = root_file_or_none(SDS_ETAG_PATH);
  const std::string herald_pixel = first_pixel_hex(kHerald);
  ASSERT_EQ(herald_pixel, bgra_hex("#C62828"));
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"remove", kGarden}}));
  // A directory where the icon file should go: the download cannot start.
  UniqueCStr icon_file(get_icon_path(content_.icon_url(kHeraldIcon).c_str()));
  ASSERT_TRUE(icon_file);
  ASSERT_EQ(mkdir(icon_file.get(), 0700), 0);

  LogCapture log;
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_TRUE(log.contains("icon " + content_.icon_url(kHeraldIcon) + " of " + kHerald +
                           " not stored: its file could not be written: Is a directory"));
  EXPECT_TRUE(log.contains("[CRITICAL]  Failed to Download the Icon"));
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag);
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "86400");
  EXPECT_EQ(garden_rows(), "0");
  EXPECT_EQ(first_pixel_hex(kHerald), herald_pixel);

  ASSERT_EQ(rmdir(icon_file.get()), 0);
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), list_etag() + "\r\n");
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_EQ(first_pixel_hex(kHerald), bgra_hex("#39D7D7"));  // touched: colours inverted
}

// The ETag of a list whose merge was rolled back named a list never stored,
// so the next request got 304 and the list was never fetched again.
TEST_F(PullDownload, EtagOfAListTheMergeRolledBackWasKept) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string before = table();
  const std::string etag = root_file_or_none(SDS_ETAG_PATH);
  ASSERT_TRUE(content_.control({{"remove", kGarden}}));
  // Another writer holds the database past the merge's busy time-out.
  sqlite3* writer = nullptr;
  ASSERT_EQ(sqlite3_open(db_.db_path().c_str(), &writer), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(writer, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);
  EXPECT_EQ(pull(), SDS_ERROR_DISK_BUSY);
  (void)sqlite3_exec(writer, "ROLLBACK", nullptr, nullptr, nullptr);
  sqlite3_close(writer);
  EXPECT_EQ(table(), before);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag);
  EXPECT_TRUE(no_images_left());

  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(garden_rows(), "0");
}

TEST_F(PullDownload, AnswerWithoutEtagDeletesTheStoredOne) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  ASSERT_NE(root_file_or_none(SDS_ETAG_PATH), "<none>");
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"etag", "none"}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "<none>");
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(stat("last_if_none_match"), "");
}

// A killed pull left its pending ETag; an answer without one must not adopt it.
TEST_F(PullDownload, PendingEtagLeftByAKilledPullIsNeverCommitted) {
  ASSERT_TRUE(content_.control({{"etag", "none"}}));
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_TO_UPDATE_PATH), "\"from-a-killed-pull\"\r\n"));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_TO_UPDATE_PATH), "<none>");
}

// "etag:" and "cache-control:" (as proxies write them) were not recognised:
// no conditional request, no update duration.
TEST_F(PullDownload, LowerCaseHeaderNamesWereNotRecognised) {
  ASSERT_TRUE(content_.control({{"header_case", "lower"}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH).rfind("\"", 0), 0u);
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_EQ(pull(), SDS_ERROR_HTTP_NOT_MODIFIED);
}

TEST_F(PullDownload, SitesWhoseIconFilesShareANameEachKeepTheirOwnPixels) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  // All three icons are ".../apple-touch-icon.png".
  EXPECT_EQ(first_pixel_hex(kHerald), bgra_hex("#C62828"));
  EXPECT_EQ(centre_pixel_hex(kHerald), bgra_hex("#39D7D7", "80"));
  EXPECT_EQ(first_pixel_hex(kWeather), bgra_hex("#1565C0"));
  EXPECT_EQ(centre_pixel_hex(kWeather), bgra_hex("#EA9A3F", "80"));
  EXPECT_EQ(first_pixel_hex(kShop), bgra_hex("#2E7D32"));
  EXPECT_EQ(centre_pixel_hex(kShop), bgra_hex("#D182CD"));
  EXPECT_EQ(
      DbSession::rows("SELECT icon_path FROM site_deck WHERE url = '" + std::string(kShop) + "'"),
      content_.icon_url("shop-central/icons/apple-touch-icon.png"));
}

// The icon was fetched once for both sites, and storing the first site's
// copy removed the file before the second site's turn.
TEST(PullDownloadSharedIcon, SecondSiteNamingTheSameIconUrlLostItsIcon) {
  DbSession db;
  ItemListGuard guard;
  const std::string catalogue = db.root().dir() + "/catalogue.json";
  auto site = [](const char* name, const char* color, int id, const char* file) {
    return std::string(R"({"url": "http://)") + name + R"(.example/", "name": ")" + name +
           R"(", "color": ")" + color + R"(", "section": "global", "icons": [{"id": )" +
           std::to_string(id) + R"(, "file": ")" + file +
           R"(", "size": 57, "colorType": "rgb", "bitDepth": 8, "administered": true,
           "lastModified": "2024-03-01 09:30:00.000"}]})";
  };
  ASSERT_TRUE(write_file(catalogue, R"({"sites": [)" +
                                        site("first", "#102030", 1, "shared/apple-touch-icon.png") +
                                        "," +
                                        site("second", "#102030", 2, "shared/apple-touch-icon.png") +
                                        "," + site("third", "#708090", 3, "third/apple-touch-icon.png") +
                                        "]}"));
  ContentServerProcess content({"--catalogue", catalogue});
  ASSERT_TRUE(content.ok());
  EXPECT_EQ(sds_download_and_parse_json_data(content.signed_url(kQuery).c_str()), SDS_ERROR_NONE);
  EXPECT_EQ(content.stats()["icon_requests"], "2");
  EXPECT_EQ(first_pixel_hex("http://first.example/"), bgra_hex("#102030"));
  EXPECT_EQ(first_pixel_hex("http://second.example/"), bgra_hex("#102030"));
  EXPECT_EQ(first_pixel_hex("http://third.example/"), bgra_hex("#708090"));
  EXPECT_EQ(DbSession::rows("SELECT url, icon_size, length(icon_data) FROM site_deck ORDER BY url"),
            "http://first.example/|57x57|12996\n"
            "http://second.example/|57x57|12996\n"
            "http://third.example/|57x57|12996");
  EXPECT_TRUE(std::filesystem::is_empty(sds_path(SDS_IMAGES_DIR)));
}

TEST_F(PullDownload, IconsThatAreNoUsablePngLeaveOnlyTheirSiteWithoutIcon) {
  ASSERT_TRUE(content_.control({{"icon_garbage", kHeraldIcon},
                                {"icon_huge", "weather-now/apple-touch-icon.png"},
                                {"icon_404", "shop-central/icons/apple-touch-icon.png"}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(first_pixel_hex(kHerald), "NULL");
  EXPECT_EQ(first_pixel_hex(kWeather), "NULL");
  EXPECT_EQ(first_pixel_hex(kShop), "NULL");
  EXPECT_EQ(first_pixel_hex("http://video-river.example/"), bgra_hex("#6A1B9A"));
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck WHERE icon_data IS NOT NULL"), "20");
  // Neither path, time stamp nor size without pixels: the next pull asks again.
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck WHERE icon_data IS NULL AND "
                            "(icon_size != '' OR icon_path != '' OR image_last_updated != '')"),
            "0");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "");
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "86400");
  EXPECT_TRUE(no_images_left());
  // Mended by the server: the broken icons of new sites arrive after all.
  ASSERT_TRUE(content_.reset());
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(first_pixel_hex(kHerald), bgra_hex("#C62828"));
  EXPECT_NE(first_pixel_hex(kWeather), "NULL");
  EXPECT_NE(first_pixel_hex(kShop), "NULL");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), list_etag() + "\r\n");
}

// Waits up to 20 s for `name` to be created in the watched directory.
bool wait_for_creation(int inotify_fd, const std::string& name) {
  alignas(inotify_event) char buffer[4096];
  for (;;) {
    pollfd p{inotify_fd, POLLIN, 0};
    if (poll(&p, 1, 20000) != 1) return false;
    ssize_t n = read(inotify_fd, buffer, sizeof buffer);
    if (n <= 0) return false;
    for (ssize_t at = 0; at < n;) {
      const auto* event = reinterpret_cast<const inotify_event*>(buffer + at);
      if (event->len > 0 && name == event->name) return true;
      at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
}

TEST_F(PullDownload, ServiceKilledInTheMiddleOfTheMergeLeavesThePreviousTable) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string before = table();
  const std::string etag = root_file_or_none(SDS_ETAG_PATH);
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"remove", kGarden}}));
  ASSERT_TRUE(write_server_list({{1, content_.base_url(), 0, 1, false}}));

  // A reader in its own transaction keeps the merge from committing, so the
  // kill is certain to land inside it.
  sqlite3* reader = nullptr;
  ASSERT_EQ(sqlite3_open_v2(db_.db_path().c_str(), &reader, SQLITE_OPEN_READONLY, nullptr),
            SQLITE_OK);
  ASSERT_EQ(
      sqlite3_exec(reader, "BEGIN; SELECT count(*) FROM site_deck;", nullptr, nullptr, nullptr),
      SQLITE_OK);
  UniqueFd watch(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  ASSERT_TRUE(watch);
  ASSERT_GE(inotify_add_watch(watch.get(), sds_path(SDS_DATABASE_DIR).c_str(), IN_CREATE), 0);

  ServiceHarness service;
  ASSERT_TRUE(service.start_direct());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  ASSERT_TRUE(send_initialize(connection.fd(), connection.cid(), 91.0, 0.0, 6, nullptr));
  const bool merging = wait_for_creation(watch.get(), ".site-deck.db-journal");
  ASSERT_TRUE(service.signal(SIGKILL));
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_TRUE(WIFSIGNALED(status));
  ASSERT_TRUE(merging) << service.output();
  (void)sqlite3_exec(reader, "COMMIT", nullptr, nullptr, nullptr);
  sqlite3_close(reader);

  EXPECT_EQ(table(), before);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag);
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(stat("last_if_none_match") + "\r\n", etag);
  EXPECT_EQ(garden_rows(), "0");
  EXPECT_EQ(first_pixel_hex(kHerald), bgra_hex("#39D7D7"));
}

}  // namespace
