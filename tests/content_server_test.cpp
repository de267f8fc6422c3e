// The stand-in content server, driven through the test harness as the service
// would drive it: signature check, ETag/304 cycle, icons, and each fault.
#include <curl/curl.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <json-glib/json-glib.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "pull/sitedeck-service-utils.h"
#include "support/stand_in_servers.h"

namespace {

const char kQuery[] =
    "country=ZA&platform=Valto&city=Johannesburg&province=Gauteng&browserversion=2.0&";

// Pixels through the service's own decoder: 4 bytes per pixel, B,G,R,A.
struct Pixels {
  bool ok = false;
  int width = 0;
  int height = 0;
  std::vector<unsigned char> bgra;
  const unsigned char* at(int x, int y) const { return &bgra[(y * width + x) * 4]; }
};

Pixels decode(const std::string& bytes) {
  Pixels pixels;
  unsigned char* raw = nullptr;
  int size = 0;
  pixels.ok = convert_png_to_raw_data(reinterpret_cast<const unsigned char*>(bytes.data()),
                                      bytes.size(), &raw, &pixels.width, &pixels.height,
                                      &size) == 0;
  if (pixels.ok) pixels.bgra.assign(raw, raw + size);
  std::free(raw);
  return pixels;
}

// Colour type and width straight from the IHDR chunk.
int color_type(const std::string& png) {
  return png.size() > 25 ? static_cast<unsigned char>(png[25]) : -1;
}
unsigned ihdr_width(const std::string& png) {
  unsigned w = 0;
  for (size_t i = 16; i < 20 && i < png.size(); ++i) w = w << 8 | static_cast<unsigned char>(png[i]);
  return w;
}

std::string md5(const std::string& text) {
  gchar* d =
      g_compute_checksum_for_string(G_CHECKSUM_MD5, text.data(), static_cast<gssize>(text.size()));
  std::string hex = d;
  g_free(d);
  return hex;
}

struct ListedSite {
  std::string url;
  std::string color;
  bool specially_removed = false;
  std::vector<std::string> icons;
};

// Sites of an item list in document order (global first), and its itemCount.
std::vector<ListedSite> parse_list(const std::string& json, long* item_count) {
  std::vector<ListedSite> sites;
  std::unique_ptr<JsonParser, void (*)(gpointer)> parser(json_parser_new(), g_object_unref);
  if (!json_parser_load_from_data(parser.get(), json.data(), static_cast<gssize>(json.size()),
                                  nullptr)) {
    return sites;
  }
  JsonObject* root = json_node_get_object(json_parser_get_root(parser.get()));
  *item_count = static_cast<long>(json_object_get_int_member(root, "itemCount"));
  for (const char* section : {"global", "regional"}) {
    JsonArray* items =
        json_object_get_array_member(json_object_get_object_member(root, section), "items");
    for (guint i = 0; i < json_array_get_length(items); ++i) {
      JsonObject* body =
          json_object_get_object_member(json_array_get_object_element(items, i), "item");
      ListedSite site;
      site.url = json_object_get_string_member(body, "siteUrl");
      site.color = json_object_get_string_member(body, "predominantColor");
      site.specially_removed = json_object_get_boolean_member(body, "isSpeciallyRemoved");
      JsonArray* icons = json_object_get_array_member(body, "touchIcons");
      for (guint k = 0; k < json_array_get_length(icons); ++k) {
        site.icons.emplace_back(
            json_object_get_string_member(json_array_get_object_element(icons, k), "iconPath"));
      }
      sites.push_back(site);
    }
  }
  return sites;
}

const ListedSite* find_site(const std::vector<ListedSite>& sites, const std::string& url) {
  for (const ListedSite& s : sites) {
    if (s.url == url) return &s;
  }
  return nullptr;
}

class ContentServerTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(server.ok()); }
  HttpAnswer get_list(const std::vector<std::string>& headers = {}) {
    HttpRequest request;
    request.headers = headers;
    return http_get(server.signed_url(kQuery), request);
  }
  ContentServerProcess server;
};

TEST_F(ContentServerTest, SignedRequestGetsTheRegionsListWithEtagAndMaxAge) {
  const HttpAnswer answer = get_list({"User-Agent: sitedeck-test/1.0"});
  ASSERT_EQ(answer.curl_code, CURLE_OK);
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.header("ETag"), "\"" + md5(answer.body) + "\"");
  EXPECT_EQ(answer.header("Cache-Control"), "max-age=3600");
  long count = 0;
  const std::vector<ListedSite> sites = parse_list(answer.body, &count);
  EXPECT_EQ(count, static_cast<long>(sites.size()));
  EXPECT_EQ(sites.size(), 27u);  // 30 in the catalogue, minus two for Seoul and one for Pretoria
  EXPECT_NE(find_site(sites, "http://joburg-news.example/"), nullptr);
  EXPECT_EQ(find_site(sites, "http://seoul-metro.example/"), nullptr);
  EXPECT_EQ(sites.front().url, "http://daily-herald.example/");

  const auto stats = server.stats();
  EXPECT_EQ(stats.at("item_list_requests"), "1");
  EXPECT_EQ(stats.at("last_query"), std::string(kQuery) + "&hash=" + stand_in_signature(kQuery));
  EXPECT_EQ(stats.at("last_user_agent"), "sitedeck-test/1.0");
  EXPECT_EQ(stats.at("last_if_none_match"), "");
}

TEST_F(ContentServerTest, RefusesMissingOrWrongSignatures) {
  const std::string signed_text = "platform=Valto&";
  std::string upper = stand_in_signature(signed_text);
  for (char& c : upper) c = static_cast<char>(g_ascii_toupper(c));
  const struct {
    const char* name;
    std::string query;
    long status;
  } cases[] = {
      {"signed", signed_text + "&hash=" + stand_in_signature(signed_text), 200},
      {"fall-back query",
       "platform=Valto&&storage=s3&hash=" + stand_in_signature("platform=Valto&&storage=s3"), 200},
      {"no hash", signed_text, 403},
      {"empty hash", signed_text + "&hash=", 403},
      {"other key", signed_text + "&hash=" + stand_in_signature(signed_text, "OTHERKEY"), 403},
      {"upper-case digest", signed_text + "&hash=" + upper, 403},
      {"trailing ampersand not signed",
       signed_text + "&hash=" + stand_in_signature("platform=Valto"), 403},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(http_get(server.base_url() + "?" + c.query).status, c.status) << c.name;
  }
}

TEST_F(ContentServerTest, EtagAnswers304UntilTheCatalogueChanges) {
  const HttpAnswer first = get_list();
  const std::string etag = first.header("ETag");
  const HttpAnswer same = get_list({"If-None-Match: " + etag});
  EXPECT_EQ(same.status, 304);
  EXPECT_EQ(same.body, "");
  EXPECT_EQ(same.header("Cache-Control"), "max-age=3600");
  EXPECT_EQ(server.stats().at("last_if_none_match"), etag);

  const struct {
    const char* key;
    const char* value;
  } changes[] = {{"specially_removed", "http://daily-herald.example/"},
                 {"reverse", "1"},
                 {"remove", "http://weather-now.example/"},
                 {"add", "http://new-site.example/"},
                 {"touch", "http://shop-central.example/"},
                 {"bump", "1"}};
  std::string previous = etag;
  for (const auto& change : changes) {
    ASSERT_TRUE(server.control({{change.key, change.value}})) << change.key;
    const HttpAnswer changed = get_list({"If-None-Match: " + previous});
    EXPECT_EQ(changed.status, 200) << change.key;
    EXPECT_NE(changed.header("ETag"), previous) << change.key;
    previous = changed.header("ETag");
  }
  long count = 0;
  const std::string list = get_list().body;
  const std::vector<ListedSite> sites = parse_list(list, &count);
  EXPECT_NE(list.find("\"lastModified\":\"2030-01-01"), std::string::npos);  // touched
  EXPECT_TRUE(find_site(sites, "http://daily-herald.example/")->specially_removed);
  EXPECT_EQ(find_site(sites, "http://weather-now.example/"), nullptr);
  EXPECT_NE(find_site(sites, "http://new-site.example/"), nullptr);
  EXPECT_EQ(sites.front().url, "http://garden-life.example/");  // the last global site
  EXPECT_EQ(server.stats().at("version"), "6");

  ASSERT_TRUE(server.reset());
  EXPECT_EQ(get_list({"If-None-Match: " + etag}).status, 304);
}

TEST_F(ContentServerTest, EveryListedIconDecodesWithTheSiteColourAroundAnInverseSquare) {
  long count = 0;
  const std::vector<ListedSite> sites = parse_list(get_list().body, &count);
  int checked = 0;
  for (const ListedSite& site : sites) {
    for (const std::string& url : site.icons) {
      const HttpAnswer icon = http_get(url);
      ASSERT_EQ(icon.status, 200) << url;
      const Pixels pixels = decode(icon.body);
      ASSERT_TRUE(pixels.ok) << url;
      ASSERT_EQ(pixels.width, pixels.height) << url;
      const unsigned char* corner = pixels.at(0, 0);  // B, G, R, A
      const int type = color_type(icon.body);
      if (type == 0 || type == 4) {  // grey: one luminance per pixel
        EXPECT_TRUE(corner[0] == corner[1] && corner[1] == corner[2]) << url;
      } else {
        char expected[8];
        std::snprintf(expected, sizeof expected, "#%02X%02X%02X", corner[2], corner[1], corner[0]);
        EXPECT_EQ(site.color, expected) << url;
        EXPECT_EQ(pixels.at(pixels.width / 2, pixels.height / 2)[0], 255 - corner[0]) << url;
      }
      EXPECT_EQ(corner[3], 255) << url;
      ++checked;
    }
  }
  EXPECT_EQ(checked, 34);
  EXPECT_EQ(server.stats().at("icon_requests"), "34");
}

TEST_F(ContentServerTest, StatusFaultsAnswerTheirStatusForTheGivenNumberOfRequests) {
  const std::string moved = server.root_url() + "/v2/";
  const struct {
    std::vector<std::pair<std::string, std::string>> settings;
    long status;
    const char* location;  // nullptr: no Location header
  } cases[] = {
      {{{"status", "301"}, {"location", moved}}, 301, moved.c_str()},
      {{{"status", "302"}, {"location", ""}}, 302, nullptr},
      {{{"status", "404"}}, 404, nullptr},
      {{{"status", "500"}}, 500, nullptr},
      {{{"status", "503"}}, 503, nullptr},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(server.control(c.settings));
    const HttpAnswer answer = get_list();
    EXPECT_EQ(answer.status, c.status);
    EXPECT_EQ(answer.has_header("Location"), c.location != nullptr) << c.status;
    if (c.location != nullptr) {
      EXPECT_EQ(answer.header("Location"), c.location);
    }
  }
  // A one-time redirect, then the list at the new place, as a redirected pull sees it.
  ASSERT_TRUE(server.control({{"status", "302"}, {"location", moved}, {"times", "1"}}));
  EXPECT_EQ(get_list().status, 302);
  const std::string redirected =
      moved + "SiteDeck/getSubRegionalItems?" + kQuery + "&hash=" + stand_in_signature(kQuery);
  EXPECT_EQ(http_get(redirected).status, 200);
  EXPECT_EQ(server.stats().at("last_path"), "/v2/SiteDeck/getSubRegionalItems");
}

TEST_F(ContentServerTest, BodyFaultsCutStallOrInflateTheList) {
  const size_t full = get_list().body.size();

  ASSERT_TRUE(server.control({{"body", "cut"}, {"times", "1"}}));
  const HttpAnswer cut = get_list();
  EXPECT_EQ(cut.curl_code, CURLE_PARTIAL_FILE);
  EXPECT_EQ(cut.header("Content-Length"), std::to_string(full));
  EXPECT_EQ(cut.body.size(), full / 2);
  EXPECT_EQ(get_list().body.size(), full);  // times=1 used up

  ASSERT_TRUE(server.control({{"body", "stall"}}));
  HttpRequest bounded;
  bounded.timeout_ms = 1000;
  const HttpAnswer stalled = http_get(server.signed_url(kQuery), bounded);
  EXPECT_EQ(stalled.curl_code, CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(stalled.status, 200);
  EXPECT_EQ(stalled.body.size(), full / 2);

  ASSERT_TRUE(server.control({{"body", "huge"}, {"huge_mb", "32"}}));
  HttpRequest capped;
  capped.max_body = 1024 * 1024;
  const HttpAnswer huge = http_get(server.signed_url(kQuery), capped);
  EXPECT_EQ(huge.curl_code, CURLE_WRITE_ERROR);
  EXPECT_EQ(huge.header("Content-Length"), std::to_string(32 * 1024 * 1024));
}

TEST_F(ContentServerTest, DelayHoldsListsAndIcons) {
  ASSERT_TRUE(server.control({{"delay_ms", "60000"}}));
  HttpRequest bounded;
  bounded.timeout_ms = 300;
  EXPECT_EQ(http_get(server.signed_url(kQuery), bounded).curl_code, CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(http_get(server.icon_url("daily-herald/apple-touch-icon.png"), bounded).curl_code,
            CURLE_OPERATION_TIMEDOUT);
  EXPECT_EQ(http_get(server.root_url() + "/_control/stats", bounded).status, 200);
  ASSERT_TRUE(server.reset());
}

TEST_F(ContentServerTest, IconFaultsServeErrorsGarbageAndBrokenPngs) {
  const std::string file = "weather-now/apple-touch-icon.png";
  const std::string good = http_get(server.icon_url(file)).body;
  std::map<std::string, HttpAnswer> got;
  for (const char* fault : {"icon_404", "icon_garbage", "icon_huge", "icon_truncated", "icon_ok"}) {
    ASSERT_TRUE(server.control({{fault, file}}));
    got[fault] = http_get(server.icon_url(file));
    EXPECT_EQ(decode(got[fault].body).ok, std::string(fault) == "icon_ok") << fault;
  }
  EXPECT_EQ(got["icon_404"].status, 404);
  EXPECT_FALSE(got["icon_404"].body.empty());
  EXPECT_EQ(got["icon_garbage"].status, 200);
  EXPECT_EQ(got["icon_garbage"].body.compare(0, 6, "<html>"), 0);
  EXPECT_EQ(ihdr_width(got["icon_huge"].body), 100000u);
  const std::string& truncated = got["icon_truncated"].body;
  EXPECT_LT(truncated.size(), good.size());
  EXPECT_EQ(good.compare(0, truncated.size(), truncated), 0);
  EXPECT_EQ(got["icon_ok"].body, good);
  EXPECT_EQ(http_get(server.icon_url("no-such/icon.png")).status, 404);
}

TEST(ContentServerFlags, SetTheSameSettingsAsTheControlRoute) {
  ContentServerProcess server({"--status", "503", "--times", "1", "--max-age", "600", "--key",
                               "ANOTHERKEY0123456789ABCDEFGHIJKL"});
  ASSERT_TRUE(server.ok());
  const std::string query = "platform=Valto&";
  const std::string url = server.base_url() + "?" + query +
                          "&hash=" + stand_in_signature(query, "ANOTHERKEY0123456789ABCDEFGHIJKL");
  EXPECT_EQ(http_get(url).status, 503);
  const HttpAnswer answer = http_get(url);
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.header("Cache-Control"), "max-age=600");
  EXPECT_EQ(http_get(server.signed_url(query)).status, 403);  // signed with the default key
}

TEST(ContentServerFlags, SynthesisesTheRequestedNumberOfSites) {
  ContentServerProcess server({"--items", "500"});
  ASSERT_TRUE(server.ok());
  long count = 0;
  const std::vector<ListedSite> sites =
      parse_list(http_get(server.signed_url("platform=Valto&")).body, &count);
  EXPECT_EQ(count, 500);
  ASSERT_EQ(sites.size(), 500u);
  const ListedSite* last = find_site(sites, "http://site-0500.test/");
  ASSERT_NE(last, nullptr);
  ASSERT_EQ(last->icons.size(), 2u);
  const Pixels pixels = decode(http_get(last->icons[1]).body);
  ASSERT_TRUE(pixels.ok);
  EXPECT_EQ(pixels.width, 96);
}

}  // namespace
