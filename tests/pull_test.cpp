// The data pull against the stand-in content server and geocoder: who is
// asked how often, redirects that lead nowhere, icons that fail, the
// geocoder's refusals, and the request's own parts (URL, signature, proxy,
// duration file). What the end-to-end suites cannot reach cheaply.
#include <curl/curl.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "kdb.h"
#include "pull/sitedeck-service-download-icon.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-signature.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "support/db_session.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/stand_in_servers.h"

namespace {

using Settings = std::vector<std::pair<std::string, std::string>>;
constexpr const char* kQuery = "platform=Valto&";
constexpr const char* kSigningKey = "SITEDECKTESTKEY0123456789ABCDEFG";
constexpr const char* kHerald = "http://daily-herald.example/";
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

  DbSession db_;
  ContentServerProcess content_;
  ItemListGuard guard_;
};

// An earlier answer's base URL was taken for a redirect that named none.
TEST_F(PullDownload, RedirectWithoutUsableLocationFailsAndForgetsEarlierBaseUrl) {
  const struct {
    const char* status;
    const char* location;
  } cases[] = {{"302", ""}, {"301", ""}, {"302", "mailto:x@example.org"}, {"301", "file:///etc/"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.status) + " " + c.location);
    ASSERT_TRUE(content_.control({{"status", "302"}, {"location", "http://127.0.0.1:1/v2/"}}));
    ASSERT_EQ(pull(), SDS_ERROR_HTTP_FOUND);
    EXPECT_STREQ(sds_redirect_base_url, "http://127.0.0.1:1/v2/SiteDeck/getSubRegionalItems");
    ASSERT_TRUE(content_.control({{"status", c.status}, {"location", c.location}}));
    EXPECT_EQ(pull(), SDS_ERROR_SERVER_REQUEST_FAILED);
    EXPECT_EQ(sds_redirect_base_url, nullptr);
  }
}

// A list whose icons failed is stored, but not taken as stored: its ETag is
// not kept and it is asked for again in a day, in full.
TEST_F(PullDownload, FailedIconKeepsTheOldEtagAndAsksAgainInADay) {
  // A killed pull left its pending ETag: an answer without one must not adopt it.
  ASSERT_TRUE(content_.control({{"etag", "none"}}));
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_TO_UPDATE_PATH), "\"from-a-killed-pull\"\r\n"));
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "<none>");
  ASSERT_TRUE(content_.control({{"etag", "normal"}}));
  ASSERT_EQ(pull(), SDS_ERROR_NONE);
  const std::string etag = root_file_or_none(SDS_ETAG_PATH);
  const std::string herald_pixel = first_pixel_hex(kHerald);
  ASSERT_EQ(herald_pixel, bgra_hex("#C62828"));
  // A directory where the icon file should go: the download cannot start.
  ASSERT_TRUE(content_.control({{"touch", kHerald}, {"remove", kGarden}}));
  UniqueCStr icon_file(get_icon_path(content_.icon_url(kHeraldIcon).c_str()));
  ASSERT_EQ(mkdir(icon_file.get(), 0700), 0);
  LogCapture log;
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_TRUE(log.contains("icon " + content_.icon_url(kHeraldIcon) + " of " + kHerald +
                           " not stored: its file could not be written: Is a directory"));
  EXPECT_TRUE(log.contains("[CRITICAL]  Failed to Download the Icon"));
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag);
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "86400");
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck WHERE url = '" + std::string(kGarden) +
                            "'"),
            "0");
  EXPECT_EQ(first_pixel_hex(kHerald), herald_pixel);
  ASSERT_EQ(rmdir(icon_file.get()), 0);

  ASSERT_TRUE(content_.control({{"icon_404", kHeraldIcon}}));
  log.clear();
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_TRUE(log.contains("icon " + content_.icon_url(kHeraldIcon) + " of " + kHerald +
                           " not stored: HTTP 404"));
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), etag);
  ASSERT_TRUE(content_.control({{"icon_ok", kHeraldIcon}}));
  EXPECT_EQ(pull(), SDS_ERROR_NONE);
  EXPECT_NE(root_file_or_none(SDS_ETAG_PATH), etag);
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "3600");
  EXPECT_EQ(first_pixel_hex(kHerald), bgra_hex("#39D7D7"));  // touched: colours inverted
}

// The icon was fetched once for both sites, and storing the first site's
// copy removed the file before the second site's turn.
TEST(PullDownloadSharedIcon, SecondSiteNamingTheSameIconUrlLostItsIcon) {
  DbSession db;
  ItemListGuard guard;
  auto site = [](const char* name, const char* color, const char* file) {
    return std::string(R"({"url": "http://)") + name + R"(.example/", "name": ")" + name +
           R"(", "color": ")" + color + R"(", "icons": [{"id": 1, "file": ")" + file +
           R"(", "size": 57}]})";
  };
  const std::string catalogue = db.root().dir() + "/catalogue.json";
  ASSERT_TRUE(write_file(
      catalogue, R"({"sites": [)" + site("first", "#102030", "shared/apple-touch-icon.png") + "," +
                     site("second", "#102030", "shared/apple-touch-icon.png") + "," +
                     site("third", "#708090", "third/apple-touch-icon.png") + "]}"));
  ContentServerProcess content({"--catalogue", catalogue});
  ASSERT_TRUE(content.ok());
  EXPECT_EQ(sds_download_and_parse_json_data(content.signed_url(kQuery).c_str()), SDS_ERROR_NONE);
  EXPECT_EQ(content.stats()["icon_requests"], "2");
  // The icons of "second" and "third" share a file name too.
  EXPECT_EQ(first_pixel_hex("http://first.example/"), bgra_hex("#102030"));
  EXPECT_EQ(first_pixel_hex("http://second.example/"), bgra_hex("#102030"));
  EXPECT_EQ(first_pixel_hex("http://third.example/"), bgra_hex("#708090"));
  EXPECT_TRUE(std::filesystem::is_empty(sds_path(SDS_IMAGES_DIR)));
}

class PullJob : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(a_.ok());
    ASSERT_TRUE(b_.ok());
  }
  DbSession db_;
  ContentServerProcess a_;
  ContentServerProcess b_;
  ItemListGuard guard_;
};

// Each row: server a's answers, the server list ('a', 'b' or 'x' for an
// address that never answers, with attempts and fall-back flag), the pull's
// result and the requests each server got.
TEST_F(PullJob, ServerListDecidesWhoIsAskedHowOften) {
  struct Entry {
    char server;
    int attempts;
    bool fall_back = false;
  };
  const std::string moved = b_.root_url() + "/";
  set_stall_seconds(1);
  const struct {
    const char* name;
    Settings a_answers;
    std::vector<Entry> list;
    int result;
    const char *a_requests, *b_requests;
    bool a_listed;  // a's address still in the list afterwards
  } cases[] = {
      {"a stalled answer is given up", {{"body", "stall"}, {"stall_s", "600"}}, {{'a', 1}},
       SDS_ERROR_SERVER_REQUEST_FAILED, "1", "0", true},
      {"a failing server gets its attempts, then the fall-back server is asked",
       {{"status", "503"}}, {{'a', 3}, {'b', 1, true}}, SDS_ERROR_NONE, "3", "1", true},
      {"not modified ends the pull unasking the next", {{"status", "304"}},
       {{'a', 3}, {'b', 1, true}}, SDS_ERROR_HTTP_NOT_MODIFIED, "1", "0", true},
      {"a first entry without attempts ends the pull unasked", {}, {{'a', 0}, {'b', 1}},
       SDS_ERROR_DATA_PULL_FAILED, "0", "0", true},
      {"an entry without attempts after failures is passed over", {{"status", "503"}},
       {{'a', 1}, {'x', 0}, {'b', 1}}, SDS_ERROR_NONE, "1", "1", true},
      {"found redirects this pull only", {{"status", "302"}, {"location", moved}, {"times", "1"}},
       {{'a', 1}}, SDS_ERROR_NONE, "1", "1", true},
      {"moved permanently rewrites the list once the new address answered",
       {{"status", "301"}, {"location", moved}, {"times", "1"}}, {{'a', 1}, {'x', 1, true}},
       SDS_ERROR_NONE, "1", "1", false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(a_.reset() && b_.reset() && (c.a_answers.empty() || a_.control(c.a_answers)));
    std::vector<ServerEntry> list;
    for (const Entry& e : c.list) {
      const std::string url = e.server == 'a'   ? a_.base_url()
                              : e.server == 'b' ? b_.base_url()
                                                : "http://127.0.0.1:1/SiteDeck/getSubRegionalItems";
      list.push_back({int(list.size()) + 1, url, 0, e.attempts, e.fall_back});
    }
    ASSERT_TRUE(write_server_list(list));
    (void)std::remove(sds_path(SDS_ETAG_PATH).c_str());
    EXPECT_EQ(sds_check_data_pull_required(nullptr), c.result);
    EXPECT_EQ(a_.stats()["item_list_requests"], c.a_requests);
    EXPECT_EQ(b_.stats()["item_list_requests"], c.b_requests);
    const std::string after = read_file(sds_path(SDS_SERVER_DATA_XML));
    EXPECT_EQ(after.find(a_.base_url()) != std::string::npos, c.a_listed) << after;
  }
  EXPECT_EQ(b_.stats()["last_query"],
            std::string(kQuery) + "&hash=" + stand_in_signature(kQuery));
}

constexpr const char* kStoredEtag = "\"list-etag\"\r\n";

class Geocoder : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(geocoder_.ok());
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
    ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), kStoredEtag));
  }
  // The location step for a fresh record: "RESULT CITY/PROVINCE", "-" for a text not set.
  static std::string resolve(double latitude, double longitude) {
    sds_server_req_args args{};
    args.latitude = latitude;
    args.longitude = longitude;
    const int result = sds_get_city_and_province(&args);
    const std::string place = std::to_string(result) + " " + (args.city ? args.city : "-") + "/" +
                              (args.province ? args.province : "-");
    std::free(args.city);
    std::free(args.province);
    return place;
  }
  TempRoot root_;
  GeocoderProcess geocoder_;
};

// A new place is asked for exactly, stored, and drops the list's ETag (the
// list of the old place would be answered 304); the same place is not asked again.
TEST_F(Geocoder, NewPlaceIsAskedExactlyStoredAndDropsTheListEtag) {
  EXPECT_EQ(resolve(37.5, 127.0), "0 Gangnam-gu/Seoul");
  EXPECT_EQ(geocoder_.stats()["last_query"],
            "prox=37.500000,127.000000&mode=retrieveAddresses&app_id=Vb7Qm2Lx9Tr4Kp6Ws1Nd"
            "&app_code=Hk3Pz8Rt_Wm5Yc2Nq7Lv4J&gen=1");
  EXPECT_EQ(root_file_or_none(SDS_LOCATION_INFO_PATH),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Location><LatitudeLongitude>37.500000,"
            "127.000000</LatitudeLongitude><City>Gangnam-gu</City><Province>Seoul</Province>"
            "</Location>\n");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_HERE_XML_PATH), "<none>");
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), kStoredEtag));
  EXPECT_EQ(resolve(37.5000001, 127.0), "0 Gangnam-gu/Seoul");  // the same to six decimals
  EXPECT_EQ(geocoder_.stats()["request_count"], "1");
  // An answer without a city stores nothing and keeps the ETag.
  EXPECT_EQ(resolve(51.5074, -0.1278), "0 -/England");
  EXPECT_EQ(geocoder_.stats()["request_count"], "2");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);
}

TEST_F(Geocoder, RefusingStatusLinesAre18AndNamedInTheLog) {
  const struct {
    const char* status;
    std::vector<std::string> logged;  // in this order
  } cases[] = {
      {"401", {"Here Service : 401 Unauthorized", "Check app_Code or app_id for here service"}},
      {"400", {"Here Service : 400 Bad Request"}},
      {"404", {"Here Service : 404 Not Found"}},
      {"503", {}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.status);
    // Credentials the geocoder does not know are what gives a real 401.
    ASSERT_TRUE(geocoder_.reset() && (std::string(c.status) == "401"
                                          ? geocoder_.control({{"app_id", "SomeoneElsesAppId123"}})
                                          : geocoder_.control({{"status", c.status}})));
    LogCapture log;
    EXPECT_EQ(resolve(37.5, 127.0), "18 -/-");
    std::vector<std::string> seen;
    for (const LogLine& line : log.lines()) {
      if (line.message.rfind("Here Service", 0) == 0 || line.message.rfind("Check app_", 0) == 0) {
        seen.push_back(line.message);
      }
    }
    EXPECT_EQ(seen, c.logged);
    // The platform log keeps the leading line feed and drops the final one.
    EXPECT_TRUE(log.contains("\nNot Parsing XML"));
    EXPECT_EQ(root_file_or_none(SDS_LOCATION_INFO_PATH), "<none>");
    EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);
  }
}

std::string glib_md5(const std::string& text) {
  gchar* hex = g_compute_checksum_for_string(G_CHECKSUM_MD5, text.c_str(), -1);
  std::string out = hex;
  g_free(hex);
  return out;
}

TEST(RequestUrl, QueryPartsAndSignature) {
  const struct {
    const char* name;
    const char* country;  // null: key absent
    const char* network;  // null: no network name
    const char* city;
    const char* version;
    int fall_back;
    const char* query;
    const char* base = "https://cs.example/v1/list";
  } cases[] = {
      {"ZA and vodacom", "ZA", "vodacom", nullptr, "2.0", 0,
       "country=ZA&operator=VDC&platform=Valto&browserversion=2.0&"},
      {"ZA and mtn", "ZA", "mtn", nullptr, nullptr, 0, "country=ZA&operator=MTN&platform=Valto&"},
      {"ZA and an unknown network", "ZA", "Cell C", nullptr, nullptr, 0,
       "country=ZA&platform=Valto&"},
      {"ZA without telephony", "ZA", nullptr, nullptr, nullptr, 0, "country=ZA&platform=Valto&"},
      {"everything, from a fall-back server", "KR", nullptr, "Seoul", "3.1", 1,
       "country=KR&platform=Valto&city=Seoul&province=Gyeonggi-do&browserversion=3.1&&storage=s3"},
      {"no base URL: the URL starts with the query", nullptr, nullptr, nullptr, nullptr, 0,
       "platform=Valto&", ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    TempRoot root;
    ASSERT_TRUE(c.country == nullptr || kdb_write("db/csc/country_iso", c.country));
    ASSERT_TRUE(c.network == nullptr || kdb_write("memory/telephony/network_name", c.network));
    sds_server_req_args args;
    args.city = const_cast<char*>(c.city);
    args.province = const_cast<char*>(c.city != nullptr ? "Gyeonggi-do" : nullptr);
    args.browser_version = const_cast<char*>(c.version);
    sds_server_data server;
    server.base_url = const_cast<char*>(c.base);
    server.fall_back = c.fall_back;
    UniqueCStr url(sds_get_request_url(&server, &args));
    ASSERT_TRUE(url);
    EXPECT_EQ(std::string(url.get()), std::string(c.base) + "?" + c.query + "&hash=" +
                                          glib_md5(c.query + std::string(kSigningKey)));
  }
  EXPECT_EQ(sds_get_request_url(nullptr, nullptr), nullptr);
  // 55 bytes still fit the padding into one block, 56 need a second one.
  for (size_t length : {55u, 56u, 63u, 64u, 65u, 119u, 120u, 1000u}) {
    std::string text(length, 'x');
    for (size_t i = 0; i < length; ++i) text[i] = static_cast<char>('!' + i % 90);
    UniqueCStr hex(sds_md5_hex(text.c_str()));
    EXPECT_EQ(std::string(hex.get()), glib_md5(text)) << length;
  }
}

TEST(Signature, PlainKeyIsNotInTheLibrary) {
  // The compiler scrambles the key with ROT13 (letters move by 13, digits
  // stay); the module that ships must hold only that form.
  EXPECT_STREQ(sds_request_signing_key, "FVGRQRPXGRFGXRL0123456789NOPQRST");
  std::string plain = sds_request_signing_key;
  for (char& c : plain) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>('A' + (c - 'A' + 13) % 26);
  }
  EXPECT_EQ(plain, kSigningKey);
  const std::string library = read_file(SITEDECK_BIN_DIR "/libsitedeck-pull.so");
  ASSERT_FALSE(library.empty());
  EXPECT_EQ(library.find(plain), std::string::npos);
  EXPECT_NE(library.find(sds_request_signing_key), std::string::npos);
}

TEST(TransferSettings, ProxyDurationFileAndIconUrlsThatAreNotWebUrls) {
  TempRoot root;
  // A proxy address without a scheme is handed to the transfer with one.
  for (const char* address : {"127.0.0.1:3128", "http://127.0.0.1:3128"}) {
    ASSERT_TRUE(kdb_write("memory/connection/proxy", address));
    CURL* curl = curl_easy_init();
    ASSERT_NE(curl, nullptr);
    char* proxy = nullptr;
    EXPECT_EQ(sds_transfer_apply_proxy(curl, &proxy), SDS_ERROR_NONE);
    UniqueCStr owner(proxy);
    curl_easy_cleanup(curl);
    EXPECT_STREQ(proxy, "http://127.0.0.1:3128") << address;
  }
  // Icon URLs come from the network: one naming a local file must not be read.
  const std::string secret = root.dir() + "/secret.png";
  ASSERT_TRUE(write_file(secret, "not for the network"));
  for (const std::string& url : {"file://" + secret, std::string("ftp://127.0.0.1:1/icon.png")}) {
    sds_icon icon{};
    icon.icon_path = strdup(url.c_str());
    EXPECT_EQ(sds_download_icon(&icon), -1) << url;
    UniqueCStr path(get_icon_path(icon.icon_path));
    EXPECT_EQ(read_file(path.get()), "") << url;
    std::free(icon.icon_path);
  }
  ASSERT_EQ(rmdir(sds_path(SDS_SERVER_DIR).c_str()), 0);
  sds_last_error = SDS_ERROR_NONE;
  LogCapture log;
  sds_set_next_update_duration(3600);
  EXPECT_EQ(sds_last_error, SDS_ERROR_IO_ERROR);
  EXPECT_TRUE(log.contains("Unable to open file = " + sds_path(SDS_NEXT_UPDATE_DURATION_PATH)));
  sds_last_error = SDS_ERROR_NONE;
}

}  // namespace
