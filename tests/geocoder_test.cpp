// The stand-in reverse geocoder through the test harness: known places,
// credentials, and its faults.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

// An answer as the service reads it: 18 for an Error root, else 0 with the
// last CountyName and StateName ("" when absent).
struct Reading {
  int result = -1;
  std::string city;
  std::string province;
};

Reading read_answer(const std::string& xml) {
  EXPECT_TRUE(write_file(sds_path(SDS_HERE_XML_PATH), xml));
  sds_server_req_args args{};
  Reading r;
  r.result = sds_parse_city_and_province(&args);
  r.city = args.city != nullptr ? args.city : "";
  r.province = args.province != nullptr ? args.province : "";
  std::free(args.city);
  std::free(args.province);
  return r;
}

size_t count_of(const std::string& text, const std::string& part) {
  size_t n = 0;
  for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++n;
  return n;
}

class GeocoderTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(geocoder.ok()); }
  TempRoot root;
  GeocoderProcess geocoder;
};

TEST_F(GeocoderTest, KnownPlacesGiveTheirCountyAndStateAndUnknownOnesNeither) {
  const struct {
    const char* prox;
    const char* city;
    const char* province;
    size_t counties;
  } cases[] = {
      {"37.500000,127.000000", "Gangnam-gu", "Seoul", 1},
      {"-26.204100,28.047300", "Johannesburg", "Gauteng", 1},
      {"-25.747900,28.229300", "Pretoria", "Gauteng", 2},  // the later of two wins
      {"51.507400,-0.127800", "", "England", 0},
      {"37.500001,127.000000", "", "", 0},
  };
  for (const auto& c : cases) {
    const HttpAnswer answer = http_get(geocoder.request_url(c.prox));
    ASSERT_EQ(answer.status, 200) << c.prox;
    EXPECT_EQ(count_of(answer.body, "\"CountyName\""), c.counties) << c.prox;
    const Reading r = read_answer(answer.body);
    EXPECT_EQ(r.result, 0) << c.prox;
    EXPECT_EQ(r.city, c.city) << c.prox;
    EXPECT_EQ(r.province, c.province) << c.prox;
  }
  const auto stats = geocoder.stats();
  EXPECT_EQ(stats.at("request_count"), "5");
  EXPECT_EQ(stats.at("last_query"),
            "prox=37.500001,127.000000&mode=retrieveAddresses&app_id=Vb7Qm2Lx9Tr4Kp6Ws1Nd"
            "&app_code=Hk3Pz8Rt_Wm5Yc2Nq7Lv4J&gen=1");
}

TEST_F(GeocoderTest, WrongCredentialsAre401Unauthorized) {
  const struct {
    const char* name;
    std::string url;
  } cases[] = {
      {"wrong id", geocoder.request_url("37.500000,127.000000", "Xb7Qm2Lx9Tr4Kp6Ws1Nd")},
      {"wrong code", geocoder.request_url("37.500000,127.000000", "Vb7Qm2Lx9Tr4Kp6Ws1Nd", "x")},
      {"none", geocoder.base_url() + "?prox=37.500000,127.000000&mode=retrieveAddresses&gen=1"},
  };
  for (const auto& c : cases) {
    const HttpAnswer answer = http_get(c.url);
    EXPECT_EQ(answer.status, 401) << c.name;
    EXPECT_EQ(answer.head.rfind("HTTP/1.1 401 Unauthorized\r\n", 0), 0u) << c.name;
  }
}

TEST_F(GeocoderTest, FaultsGiveTheStatusLinesAndRootsTheServiceRecognises) {
  const struct {
    const char* key;
    const char* value;
    const char* status_line;
    int result;  // 18: an Error root
  } cases[] = {
      {"status", "400", "HTTP/1.1 400 Bad Request\r\n", 18},
      {"status", "404", "HTTP/1.1 404 Not Found\r\n", 18},
      {"status", "503", "HTTP/1.1 503 Service Unavailable\r\n", 18},
      {"error_root", "1", "HTTP/1.1 200 OK\r\n", 18},
      {"namespace", "1", "HTTP/1.1 200 OK\r\n", 0},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(geocoder.reset());
    ASSERT_TRUE(geocoder.control({{c.key, c.value}})) << c.key;
    const HttpAnswer answer = http_get(geocoder.request_url("-26.204100,28.047300"));
    EXPECT_EQ(answer.head.rfind(c.status_line, 0), 0u) << c.key << "=" << c.value;
    EXPECT_EQ(read_answer(answer.body).result, c.result) << c.key << "=" << c.value;
  }
  EXPECT_EQ(read_answer(http_get(geocoder.request_url("-26.204100,28.047300")).body).province,
            "Gauteng");  // namespaced answers carry the same data

  ASSERT_TRUE(geocoder.control({{"status", "503"}, {"times", "1"}}));
  EXPECT_EQ(http_get(geocoder.request_url("-26.204100,28.047300")).status, 503);
  EXPECT_EQ(http_get(geocoder.request_url("-26.204100,28.047300")).status, 200);

  ASSERT_TRUE(geocoder.control({{"delay_ms", "60000"}}));
  HttpRequest bounded;
  bounded.timeout_ms = 300;
  EXPECT_EQ(http_get(geocoder.request_url("-26.204100,28.047300"), bounded).curl_code,
            CURLE_OPERATION_TIMEDOUT);
  EXPECT_FALSE(geocoder.control({{"status", "abc"}}));
}

TEST(GeocoderFlags, AppIdAndCodeReplaceTheDefaults) {
  GeocoderProcess geocoder({"--app-id", "OtherId", "--app-code", "OtherCode"});
  ASSERT_TRUE(geocoder.ok());
  EXPECT_EQ(http_get(geocoder.request_url("37.500000,127.000000")).status, 401);
  EXPECT_EQ(http_get(geocoder.request_url("37.500000,127.000000", "OtherId", "OtherCode")).status,
            200);
}

}  // namespace
