// What real places, servers and disks send, end to end: the real service under
// the activator pulls from the stand-in content server and geocoder, and the
// deck is read back through the socket as the browser reads it. Each case is
// named after the fault it once showed.
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "kdb.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

namespace fs = std::filesystem;

// A latitude out of range: no location step, the global list.
constexpr double kNoPosition = 1000.0;
constexpr const char* kHerald = "http://daily-herald.example/";
constexpr const char* kHeraldIcon = "daily-herald/apple-touch-icon.png";
constexpr const char* kWeather = "http://weather-now.example/";
constexpr const char* kWeatherIcon = "weather-now/apple-touch-icon.png";

// One site of a catalogue file for the content stand-in.
std::string site(const std::string& url, const std::string& name) {
  return R"({"url": ")" + url + R"(", "name": ")" + name +
         R"(", "color": "#123456", "icons": [{"id": 1, "file": "s/i.png", "size": 57}]})";
}

class RealWorld : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(content_.ok());
    ASSERT_TRUE(geocoder_.ok());
    new_root();
  }
  void new_root() {
    root_.reset();
    root_ = std::make_unique<TempRoot>();
    ASSERT_TRUE(write_server_list({{1, content_.base_url()}}));
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
  }
  // Starts the service under the activator and connects; false on failure.
  bool open() {
    service_ = std::make_unique<ServiceHarness>();
    connection_ = SdsConnection();
    if (!service_->start_activated()) return false;
    return service_->connect(&connection_, 60000) == SDS_ERROR_NONE;
  }
  // Ends the connection; the service must exit 0.
  void close() {
    connection_.close();
    int status = 0;
    ASSERT_TRUE(service_->wait_exit(&status)) << service_->output();
    EXPECT_EQ(exit_code_of(status), 0) << service_->output();
  }
  // One pull on a fresh connection, which stays open for reading the deck.
  int pull(double latitude = kNoPosition, double longitude = 0, const char* version = nullptr) {
    if (!open()) return -1;
    const std::string text = version != nullptr ? version : "";
    return run_initialize(connection_.fd(), connection_.cid(), latitude, longitude,
                          version != nullptr ? 0 : SDS_ERROR_NO_DATA,
                          version != nullptr ? &text : nullptr)
        .final;
  }
  // The live sites' URLs in deck order, through the open connection.
  std::vector<std::string> live() {
    std::vector<std::string> urls;
    sds_client_ids ids;
    if (sds_client_get_ids_by_dirty(connection_, 1, &ids) != SDS_ERROR_NONE) return urls;
    for (int32_t i = 0; i < ids.count; ++i) {
      SdsClientText url;
      if (sds_client_get_url(connection_, ids.ids.get()[i], &url) != SDS_ERROR_NONE) return {};
      urls.emplace_back(url.get());
    }
    return urls;
  }
  // The id of the site with `url`, or -1.
  int32_t id_of(const std::string& url) const {
    const std::string id =
        rows_of_file(root_->path(SDS_DB_PATH), "SELECT id FROM site_deck WHERE url = '" + url + "'");
    return id.empty() ? -1 : std::stoi(id);
  }
  std::string table() const {
    return rows_of_file(root_->path(SDS_DB_PATH),
                        "SELECT id, url, title, is_dirty, order_index, icon_size, icon_path, "
                        "image_last_updated, length(icon_data) FROM site_deck ORDER BY id");
  }
  std::string file(const char* fixed) const { return root_file_or_none(fixed); }

  ContentServerProcess content_;
  GeocoderProcess geocoder_;
  std::unique_ptr<TempRoot> root_;
  std::unique_ptr<ServiceHarness> service_;
  SdsConnection connection_;
};

TEST_F(RealWorld, PlaceNamesWithSpacesOrBeyondAsciiMadeEveryPullFail) {
  const struct {
    double latitude, longitude;
    const char* version;
    const char* query;  // as sent, before the signature
    const char* regional_site;
    const char* city;
    const char* province;
  } cases[] = {
      {-33.9249, 18.4241, "2.0 beta",
       "platform=Valto&city=City%20of%20Cape%20Town&province=Western%20Cape&"
       "browserversion=2.0%20beta&",
       "http://cape-point.example/", "City of Cape Town", "Western Cape"},
      {-23.5505, -46.6333, "2.0+1",
       "platform=Valto&city=S%C3%A3o%20Paulo&province=S%C3%A3o%20Paulo&browserversion=2.0%2B1&",
       "http://paulista.example/", "S\u00e3o Paulo", "S\u00e3o Paulo"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.query);
    new_root();
    ASSERT_EQ(pull(c.latitude, c.longitude, c.version), SDS_ERROR_NONE) << service_->output();
    EXPECT_EQ(content_.stats()["last_query"],
              std::string(c.query) + "&hash=" + stand_in_signature(c.query));
    const std::vector<std::string> urls = live();
    EXPECT_NE(std::find(urls.begin(), urls.end(), c.regional_site), urls.end());
    close();
    // The record of the pull names the region of the list it stored.
    const std::string last = file(SDS_LAST_PULL_PATH);
    EXPECT_NE(last.find("\nstatus 0\nstored "), std::string::npos) << last;
    EXPECT_NE(last.find(std::string("\ncity ") + c.city + "\nprovince " + c.province + "\n"),
              std::string::npos)
        << last;
  }
}

TEST_F(RealWorld, ProxyStyleHeadersRelativeRedirectsAndHugeMaxAgeWereMisread) {
  // Lower-case names, a redirect to a path on the same host, a max-age no int holds.
  ASSERT_TRUE(content_.control({{"header_case", "lower"},
                                {"status", "302"},
                                {"location", "/v2/"},
                                {"times", "1"},
                                {"cache_control", "max-age=99999999999999999999"}}));
  ASSERT_EQ(pull(), SDS_ERROR_NONE) << service_->output();
  EXPECT_EQ(content_.stats()["last_path"], "/v2/SiteDeck/getSubRegionalItems");
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(seconds, 30 * 24 * 3600);
  close();
  // The lower-case ETag was kept: the next request is conditional.
  EXPECT_EQ(pull(), SDS_ERROR_HTTP_NOT_MODIFIED) << service_->output();
  close();
}

// A 301 to an address that never answers rewrote the server list for good;
// now the list changes once the new address has answered.
TEST_F(RealWorld, PermanentMoveToAnAddressThatNeverAnswersCutTheDeviceOff) {
  const std::string before = file(SDS_SERVER_DATA_XML);
  ASSERT_TRUE(content_.control({{"status", "301"}, {"location", "http://127.0.0.1:1/"}}));
  EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
  // The log names the cause: server, address without query, attempt, error.
  EXPECT_TRUE(service_->has_message_matching(
      "pull: server 1, http://127\\.0\\.0\\.1:1/SiteDeck/getSubRegionalItems, attempt 1 of 1 "
      "failed \\(18\\): Failed to connect.* after [0-9.]+ s"))
      << service_->output();
  close();
  EXPECT_EQ(file(SDS_SERVER_DATA_XML), before);
  // The failed pull is on record; no list was ever stored.
  const std::string last = file(SDS_LAST_PULL_PATH);
  EXPECT_EQ(last.substr(0, 5), "time ");
  EXPECT_NE(last.find("\nstatus 18\n"), std::string::npos) << last;
  EXPECT_EQ(last.find("stored"), std::string::npos) << last;

  ContentServerProcess moved;
  ASSERT_TRUE(moved.ok());
  ASSERT_TRUE(content_.control({{"location", moved.root_url() + "/"}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  close();
  EXPECT_NE(file(SDS_SERVER_DATA_XML).find("<Base-url>" + moved.base_url() + "</Base-url>"),
            std::string::npos);
}

// An icon whose pixels outgrow the shared memory was stored anyway, and a
// broken icon of a new site was never fetched again once mended.
TEST_F(RealWorld, OversizedAndBrokenIconsWereStoredOrNeverFetchedAgain) {
  ASSERT_TRUE(content_.control({{"icon_bomb", kHeraldIcon}, {"icon_garbage", kWeatherIcon}}));
  ASSERT_EQ(pull(), SDS_ERROR_NONE) << service_->output();
  for (const char* url : {kHerald, kWeather}) {
    SCOPED_TRACE(url);
    const int32_t id = id_of(url);
    ASSERT_GT(id, 0);
    sds_client_icon icon;
    EXPECT_EQ(sds_client_get_icon(connection_, id, &icon), SDS_ERROR_NO_DATA);
    SdsClientText size;
    EXPECT_EQ(sds_client_get_icon_size(connection_, id, &size), SDS_ERROR_NO_DATA);
  }
  EXPECT_TRUE(service_->has_message_matching(
      "icon .*daily-herald/apple-touch-icon.png of http://daily-herald.example/ not stored: its "
      "pixels would exceed the 3145728 bytes of the shared memory"))
      << service_->output();
  close();

  ASSERT_TRUE(content_.reset());
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  for (const char* url : {kHerald, kWeather}) {
    SCOPED_TRACE(url);
    sds_client_icon icon;
    ASSERT_EQ(sds_client_get_icon(connection_, id_of(url), &icon), SDS_ERROR_NONE);
    SdsClientText size;
    ASSERT_EQ(sds_client_get_icon_size(connection_, id_of(url), &size), SDS_ERROR_NONE);
    EXPECT_EQ(std::string(size.get()),
              std::to_string(icon.width) + "x" + std::to_string(icon.height));
  }
  close();
}

// Unusable sites: a list of javascript: and data: addresses deleted the deck;
// such sites were stored; a title no string item carries silenced the socket.
TEST_F(RealWorld, OnlyWebSitesWithTextsTheSocketCarriesJoinTheDeck) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> deck = live();
  close();
  const std::string etag = file(SDS_ETAG_PATH);

  const std::string unusable = root_->dir() + "/unusable.json";
  ASSERT_TRUE(write_file(unusable, R"({"sites": [)" + site("javascript:alert(1)", "JS") + "," +
                                       site("data:text/html,hi", "Data") + "]}"));
  ContentServerProcess hostile({"--catalogue", unusable});
  ASSERT_TRUE(hostile.ok());
  ASSERT_TRUE(write_server_list({{1, hostile.base_url()}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(live(), deck);
  close();
  EXPECT_EQ(file(SDS_ETAG_PATH), etag);

  const std::string mixed = root_->dir() + "/mixed.json";
  ASSERT_TRUE(write_file(mixed, R"({"sites": [)" + site("javascript:alert(1)", "JS") + "," +
                                    site("https://long.example/", std::string(5000, 'T')) + "," +
                                    site("http://plain.example/", "Plain") + "]}"));
  ContentServerProcess some({"--catalogue", mixed});
  ASSERT_TRUE(some.ok());
  ASSERT_TRUE(write_server_list({{1, some.base_url()}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(live(), (std::vector<std::string>{"https://long.example/", "http://plain.example/"}));
  SdsClientText title;
  ASSERT_EQ(sds_client_get_title(connection_, id_of("https://long.example/"), &title),
            SDS_ERROR_NONE);
  EXPECT_STREQ(title.get(), "https://long.example/");
  close();
}

// Lists past a bound were stored in part (or thrown away) and answered 0.
TEST_F(RealWorld, ListsPastABoundWereAnsweredAsStored) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  close();
  const std::string before = table();
  const std::string etag = file(SDS_ETAG_PATH);
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"body", "huge"}, {"huge_mb", "8"}}));
  EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_TRUE(service_->has_message_matching(
      ".*attempt 1 of 1 failed \\(18\\): HTTP 200, the item list is larger than 4194304 bytes.*"))
      << service_->output();
  close();
  EXPECT_EQ(table(), before);
  EXPECT_EQ(file(SDS_ETAG_PATH), etag);
}

// A server dripping one byte a second passed the stall guard and held the
// service's one connection for as long as the list took.
TEST_F(RealWorld, DrippingServerHeldTheConnectionForAsLongAsItLiked) {
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/transfer_deadline_seconds", "1"));
  ASSERT_TRUE(content_.control({{"body", "drip"}, {"drip_ms", "100"}}));
  EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_TRUE(service_->has_message_matching(".*attempt 1 of 1 failed \\(18\\): .*timed out.*"))
      << service_->output();
  close();

  // The whole pull has a deadline too: no attempt starts after it.
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/pull_deadline_seconds", "1"));
  ASSERT_TRUE(write_server_list({{1, content_.base_url(), 2000, 50}}));
  EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_TRUE(service_->has_message("pull: deadline passed, no further attempt"));
  close();
  ASSERT_TRUE(content_.release());
}

// Working and icon files were opened through whatever stood at their names,
// and icon files of a pull killed before its clean-up stayed for good.
TEST_F(RealWorld, SymlinksAtWorkingFilesWereFollowedAndStaleIconsKept) {
  const std::string victim = root_->dir() + "/victim";
  ASSERT_TRUE(write_file(victim, "untouched"));
  for (const char* fixed : {SDS_JSON_RESPONSE_PATH, SDS_HEADER_RESPONSE_PATH,
                            SDS_NEXT_UPDATE_DURATION_PATH, SDS_ETAG_TO_UPDATE_PATH}) {
    ASSERT_EQ(symlink(victim.c_str(), root_->path(fixed).c_str()), 0);
  }
  ASSERT_TRUE(write_file(root_->path(SDS_IMAGES_DIR) + "/left-by-a-killed-pull.png", "x"));
  ASSERT_EQ(pull(), SDS_ERROR_NONE) << service_->output();
  close();
  EXPECT_EQ(read_file(victim), "untouched");
  EXPECT_EQ(file(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_TRUE(fs::is_empty(root_->path(SDS_IMAGES_DIR)));
}

// On a full disk SQLite rolled the merge back by itself, the loop went on
// committing statement by statement, and rows without pixels stayed.
TEST_F(RealWorld, FullDiskCommittedHalfAMergeWhileThePullReportedFailure) {
  const std::string data = root_->path(SDS_DATA_DIR);
  const std::string saved = root_->dir() + "/saved";
  fs::rename(data, saved);
  fs::create_directories(data);
  if (mount("tmpfs", data.c_str(), "tmpfs", 0, "size=16m") != 0) {
    fs::remove(data);
    fs::rename(saved, data);
    GTEST_SKIP() << "no tmpfs can be mounted here: " << std::strerror(errno);
  }
  struct Unmount {
    std::string dir;
    ~Unmount() { (void)umount2(dir.c_str(), MNT_DETACH); }
  } unmount{data};
  fs::copy(saved, data, fs::copy_options::recursive);

  ContentServerProcess big({"--items", "150"});
  ASSERT_TRUE(big.ok());
  ASSERT_TRUE(write_server_list({{1, content_.base_url()}}));
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  close();
  const std::string before = table();
  const std::string etag = file(SDS_ETAG_PATH);
  // Fill the disk up to a few hundred KiB of room: enough for the answer, the
  // icons and the first rows, not for the whole merge.
  struct statvfs room {};
  ASSERT_EQ(statvfs(data.c_str(), &room), 0);
  const size_t free_bytes = room.f_bavail * room.f_frsize;
  ASSERT_GT(free_bytes, 1024u * 1024);
  ASSERT_TRUE(write_file(data + "/filler", std::string(free_bytes - 900 * 1024, 'f')));

  ASSERT_TRUE(write_server_list({{1, big.base_url()}}));
  EXPECT_EQ(pull(), SDS_ERROR_DISK_BUSY) << service_->output();
  close();
  EXPECT_EQ(table(), before);
  EXPECT_EQ(file(SDS_ETAG_PATH), etag);
  EXPECT_FALSE(file_exists(root_->path(SDS_DB_PATH) + "-journal"));

  fs::remove(data + "/filler");
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(live().size(), 150u);
  close();
  EXPECT_EQ(rows_of_file(root_->path(SDS_DB_PATH),
                         "SELECT count(*) FROM site_deck WHERE icon_data IS NOT NULL"),
            "150");
}

}  // namespace
