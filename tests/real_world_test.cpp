// Data pulls end to end, with what real places, servers, clients and disks
// send: the real service under the activator pulls from the stand-in content
// server and geocoder, and the deck is read back through the socket as the
// browser reads it. Each case is named after the fault it once showed.
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "kdb.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/pull_env.h"
#include "support/pull_rig.h"

namespace {

namespace fs = std::filesystem;

constexpr const char* kHerald = "http://daily-herald.example/";
constexpr const char* kWeather = "http://weather-now.example/";

// One site of a catalogue file for the content stand-in.
std::string site(const std::string& url, const std::string& name) {
  return R"({"url": ")" + url + R"(", "name": ")" + name +
         R"(", "color": "#123456", "icons": [{"id": 1, "file": "s/i.png", "size": 57}]})";
}

class RealWorld : public ::testing::Test, public PullRig {};

TEST_F(RealWorld, PlaceNamesWithSpacesOrBeyondAsciiMadeEveryPullFail) {
  const struct {
    double latitude, longitude;
    const char* version;
    const char* query;  // as sent, before the signature
    const char* regional_site;  // null: no city and province
    const char* region;         // as the last-pull record keeps it
  } cases[] = {
      {-33.9249, 18.4241, "2.0 beta",
       "platform=Valto&city=City%20of%20Cape%20Town&province=Western%20Cape&"
       "browserversion=2.0%20beta&",
       "http://cape-point.example/", "\ncity City of Cape Town\nprovince Western Cape\n"},
      {-23.5505, -46.6333, "2.0+1",
       "platform=Valto&city=S%C3%A3o%20Paulo&province=S%C3%A3o%20Paulo&browserversion=2.0%2B1&",
       "http://paulista.example/", "\ncity S\u00e3o Paulo\nprovince S\u00e3o Paulo\n"},
      // The position's edges: 90 is a latitude, a hair more is none at all.
      {90.0, 28.0473, "", "platform=Valto&", nullptr, nullptr},
      {90.000001, 28.0473, "2.0", "platform=Valto&", nullptr, nullptr},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.query);
    new_root();
    ASSERT_TRUE(open());
    ASSERT_EQ(pull_on(c.latitude, c.longitude, c.version), SDS_ERROR_NONE) << service->output();
    EXPECT_EQ(content.stats()["last_query"],
              std::string(c.query) + "&hash=" + stand_in_signature(c.query));
    if (c.regional_site != nullptr) {
      const std::vector<std::string> urls = live();
      EXPECT_NE(std::find(urls.begin(), urls.end(), c.regional_site), urls.end());
    }
    close();
    // The record of the pull names the region of the list it stored.
    const std::string last = file(SDS_LAST_PULL_PATH);
    EXPECT_NE(last.find("\nstatus 0\nstored "), std::string::npos) << last;
    if (c.region != nullptr) {
      EXPECT_NE(last.find(c.region), std::string::npos) << last;
    }
  }
}

TEST_F(RealWorld, ProxyStyleHeadersRelativeRedirectsAndHugeMaxAgeWereMisread) {
  // Lower-case names, a redirect to a path on the same host, a max-age no int holds.
  ASSERT_TRUE(content.control({{"header_case", "lower"},
                               {"status", "302"},
                               {"location", "/v2/"},
                               {"times", "1"},
                               {"cache_control", "max-age=99999999999999999999"}}));
  ASSERT_TRUE(open());
  ASSERT_EQ(pull_on(), SDS_ERROR_NONE) << service->output();
  EXPECT_EQ(content.stats()["last_path"], "/v2/SiteDeck/getSubRegionalItems");
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(seconds, 30 * 24 * 3600);
  close();
  // The lower-case ETag was kept: the next request is conditional.
  EXPECT_EQ(pull(), SDS_ERROR_HTTP_NOT_MODIFIED) << service->output();
}

// A 301 to an address that never answers rewrote the server list for good;
// now the list changes once the new address has answered.
TEST_F(RealWorld, PermanentMoveToAnAddressThatNeverAnswersCutTheDeviceOff) {
  const std::string before = file(SDS_SERVER_DATA_XML);
  ASSERT_TRUE(content.control({{"status", "301"}, {"location", "http://127.0.0.1:1/"}}));
  EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
  // The log names the cause: server, address without query, attempt, error.
  EXPECT_TRUE(service->has_message_matching(
      "pull: server 1, http://127\\.0\\.0\\.1:1/SiteDeck/getSubRegionalItems, attempt 1 of 1 "
      "failed \\(18\\): Failed to connect.* after [0-9.]+ s"))
      << service->output();
  EXPECT_EQ(file(SDS_SERVER_DATA_XML), before);
  // The failed pull is on record; no list was ever stored.
  const std::string last = file(SDS_LAST_PULL_PATH);
  EXPECT_EQ(last.substr(0, 5), "time ");
  EXPECT_NE(last.find("\nstatus 18\n"), std::string::npos) << last;
  EXPECT_EQ(last.find("stored"), std::string::npos) << last;

  ContentServerProcess moved;
  ASSERT_TRUE(moved.ok());
  ASSERT_TRUE(content.control({{"location", moved.root_url() + "/"}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_NE(file(SDS_SERVER_DATA_XML).find("<Base-url>" + moved.base_url() + "</Base-url>"),
            std::string::npos);
}

// An icon whose pixels outgrow the shared memory was stored anyway, and a
// broken icon of a new site was never fetched again once mended.
TEST_F(RealWorld, OversizedAndBrokenIconsWereStoredOrNeverFetchedAgain) {
  ASSERT_TRUE(content.control({{"icon_bomb", "daily-herald/apple-touch-icon.png"},
                               {"icon_garbage", "weather-now/apple-touch-icon.png"}}));
  for (bool mended : {false, true}) {
    SCOPED_TRACE(mended ? "mended" : "broken");
    if (mended) {
      ASSERT_TRUE(content.reset());
    }
    ASSERT_TRUE(open());
    ASSERT_EQ(pull_on(), SDS_ERROR_NONE) << service->output();
    for (const char* url : {kHerald, kWeather}) {
      sds_client_icon icon;
      SdsClientText size;
      const int icon_status = sds_client_get_icon(connection, id_of(url), &icon);
      const int size_status = sds_client_get_icon_size(connection, id_of(url), &size);
      EXPECT_EQ(icon_status, mended ? SDS_ERROR_NONE : SDS_ERROR_NO_DATA) << url;
      EXPECT_EQ(size_status, icon_status) << url;
      if (mended) {
        EXPECT_EQ(std::string(size.get()),
                  std::to_string(icon.width) + "x" + std::to_string(icon.height));
      }
    }
    EXPECT_EQ(mended, !service->has_message_matching(
                          "icon .*daily-herald/apple-touch-icon.png of http://daily-herald.example/"
                          " not stored: its pixels would exceed the 3145728 bytes of the shared "
                          "memory"));
    close();
  }
}

// Unusable sites: a list of javascript: and data: addresses deleted the deck;
// such sites were stored; a title no string item carries silenced the socket.
TEST_F(RealWorld, OnlyWebSitesWithTextsTheSocketCarriesJoinTheDeck) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::vector<std::string> deck = live();
  const std::string etag = file(SDS_ETAG_PATH);
  const struct {
    std::vector<std::string> sites;
    std::vector<std::string> live;  // empty: the deck as it was
  } cases[] = {
      {{site("javascript:alert(1)", "JS"), site("data:text/html,hi", "Data")}, {}},
      {{site("javascript:alert(1)", "JS"), site("https://long.example/", std::string(5000, 'T')),
        site("http://plain.example/", "Plain")},
       {"https://long.example/", "http://plain.example/"}},
  };
  for (const auto& c : cases) {
    std::string catalogue;
    for (const std::string& s : c.sites) catalogue += (catalogue.empty() ? "" : ",") + s;
    ASSERT_TRUE(write_file(root_->dir() + "/catalogue.json", R"({"sites": [)" + catalogue + "]}"));
    ContentServerProcess server({"--catalogue", root_->dir() + "/catalogue.json"});
    ASSERT_TRUE(server.ok());
    ASSERT_TRUE(write_server_list({{1, server.base_url()}}));
    EXPECT_EQ(pull(), SDS_ERROR_NONE);
    EXPECT_EQ(live(), c.live.empty() ? deck : c.live);
    if (c.live.empty()) {
      EXPECT_EQ(file(SDS_ETAG_PATH), etag);
    }
  }
  ASSERT_TRUE(open());
  SdsClientText title;
  ASSERT_EQ(sds_client_get_title(connection, id_of("https://long.example/"), &title),
            SDS_ERROR_NONE);
  EXPECT_STREQ(title.get(), "https://long.example/");
  close();
}

// Answers that never end as a list were taken for one: lists past a bound
// were stored in part (or thrown away) and answered 0, and a server dripping
// one byte a second passed the stall guard and held the service's one
// connection for as long as the list took. Each is now a failed attempt that
// names its cause, and the deck and its ETag stay.
TEST_F(RealWorld, ListsPastABoundOrDrippedByteByByteWereTakenForLists) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string before = table();
  const std::string etag = file(SDS_ETAG_PATH);
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/transfer_deadline_seconds", "1"));
  const struct {
    std::vector<std::pair<std::string, std::string>> settings;
    const char* cause;
  } cases[] = {
      {{{"body", "huge"}, {"huge_mb", "8"}}, "HTTP 200, the item list is larger than 4194304 bytes"},
      {{{"body", "drip"}, {"drip_ms", "100"}}, ".*timed out.*"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.cause);
    ASSERT_TRUE(content.control(c.settings));
    ASSERT_TRUE(content.control({{"touch", kHerald}}));
    EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
    EXPECT_TRUE(service->has_message_matching(std::string(".*attempt 1 of 1 failed \\(18\\): ") +
                                              c.cause + ".*"))
        << service->output();
    EXPECT_EQ(table(), before);
    EXPECT_EQ(file(SDS_ETAG_PATH), etag);
  }
  // The whole pull has a deadline too: no attempt starts after it.
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/pull_deadline_seconds", "1"));
  ASSERT_TRUE(write_server_list({{1, content.base_url(), 2000, 50}}));
  EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_TRUE(service->has_message("pull: deadline passed, no further attempt"));
  ASSERT_TRUE(content.release());
}

// Working and icon files were opened through whatever stood at their names,
// and icon files of a pull killed before its clean-up stayed for good.
TEST_F(RealWorld, SymlinksAtWorkingFilesWereFollowedAndStaleIconsKept) {
  const std::string victim = root_->dir() + "/victim";
  ASSERT_TRUE(write_file(victim, "untouched"));
  for (const char* fixed : {SDS_JSON_RESPONSE_PATH, SDS_HEADER_RESPONSE_PATH,
                            SDS_NEXT_UPDATE_DURATION_PATH, SDS_ETAG_TO_UPDATE_PATH}) {
    ASSERT_EQ(symlink(victim.c_str(), path(fixed).c_str()), 0);
  }
  ASSERT_TRUE(write_file(path(SDS_IMAGES_DIR) + "/left-by-a-killed-pull.png", "x"));
  ASSERT_EQ(pull(), SDS_ERROR_NONE) << service->output();
  EXPECT_EQ(read_file(victim), "untouched");
  EXPECT_EQ(file(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_TRUE(fs::is_empty(path(SDS_IMAGES_DIR)));
}

// The browser never learnt the result: its next pull must be a full one.
TEST_F(RealWorld, ClientGoneBeforeTheResultDropsTheEtagAndAsksAgainInADay) {
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string etag = file(SDS_ETAG_PATH);
  // The answer (304) waits long enough for the client to be gone.
  ASSERT_TRUE(content.control({{"delay_ms", "1000"}}));
  ASSERT_TRUE(open());
  ASSERT_TRUE(send_initialize(connection.fd(), connection.cid(), 91.0, 0.0, 6, nullptr));
  close();
  EXPECT_EQ(content.stats()["last_if_none_match"] + "\r\n", etag);
  EXPECT_EQ(file(SDS_ETAG_PATH), "<none>");
  EXPECT_EQ(file(SDS_NEXT_UPDATE_DURATION_PATH), "86400");
}

// On a full disk SQLite rolled the merge back by itself, the loop went on
// committing statement by statement, and rows without pixels stayed.
TEST_F(RealWorld, FullDiskCommittedHalfAMergeWhileThePullReportedFailure) {
  const std::string data = path(SDS_DATA_DIR);
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
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
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
  EXPECT_EQ(pull(), SDS_ERROR_DISK_BUSY) << service->output();
  EXPECT_EQ(table(), before);
  EXPECT_EQ(file(SDS_ETAG_PATH), etag);
  EXPECT_FALSE(file_exists(path(SDS_DB_PATH) + "-journal"));

  fs::remove(data + "/filler");
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(live().size(), 150u);
  EXPECT_EQ(rows_of_file(path(SDS_DB_PATH),
                         "SELECT count(*) FROM site_deck WHERE icon_data IS NOT NULL"),
            "150");
}

}  // namespace
