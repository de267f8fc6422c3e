// The stand-in reverse geocoder through the test harness: known places,
// credentials, and its faults.
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <cstring>
#include <memory>
#include <string>

#include "support/stand_in_servers.h"

namespace {

struct Reading {
  std::string root;      // local name of the root element
  std::string city;      // last AdditionalData key="CountyName"
  std::string province;  // last AdditionalData key="StateName"
  int counties = 0;
};

void walk(xmlNode* node, Reading* r) {
  for (; node != nullptr; node = node->next) {
    if (node->type == XML_ELEMENT_NODE &&
        std::strcmp(reinterpret_cast<const char*>(node->name), "AdditionalData") == 0) {
      std::unique_ptr<xmlChar, void (*)(void*)> key(xmlGetProp(node, BAD_CAST "key"), xmlFree);
      std::unique_ptr<xmlChar, void (*)(void*)> text(xmlNodeGetContent(node), xmlFree);
      const std::string value = text ? reinterpret_cast<const char*>(text.get()) : "";
      if (key && std::strcmp(reinterpret_cast<const char*>(key.get()), "CountyName") == 0) {
        r->city = value;
        ++r->counties;
      }
      if (key && std::strcmp(reinterpret_cast<const char*>(key.get()), "StateName") == 0) {
        r->province = value;
      }
    }
    walk(node->children, r);
  }
}

Reading read_answer(const std::string& xml) {
  Reading r;
  std::unique_ptr<xmlDoc, void (*)(xmlDoc*)> doc(
      xmlReadMemory(xml.data(), static_cast<int>(xml.size()), "answer.xml", nullptr,
                    XML_PARSE_NONET),
      xmlFreeDoc);
  if (!doc) return r;
  xmlNode* root = xmlDocGetRootElement(doc.get());
  if (root == nullptr) return r;
  r.root = reinterpret_cast<const char*>(root->name);
  walk(root, &r);
  return r;
}

class GeocoderTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(geocoder.ok()); }
  GeocoderProcess geocoder;
};

TEST_F(GeocoderTest, KnownPlacesGiveTheirCountyAndStateAndUnknownOnesNeither) {
  const struct {
    const char* prox;
    const char* city;
    const char* province;
    int counties;
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
    const Reading r = read_answer(answer.body);
    EXPECT_EQ(r.root, "Search") << c.prox;
    EXPECT_EQ(r.city, c.city) << c.prox;
    EXPECT_EQ(r.province, c.province) << c.prox;
    EXPECT_EQ(r.counties, c.counties) << c.prox;
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
    const char* root;
  } cases[] = {
      {"status", "400", "HTTP/1.1 400 Bad Request\r\n", "Error"},
      {"status", "404", "HTTP/1.1 404 Not Found\r\n", "Error"},
      {"status", "503", "HTTP/1.1 503 Service Unavailable\r\n", "Error"},
      {"error_root", "1", "HTTP/1.1 200 OK\r\n", "Error"},
      {"namespace", "1", "HTTP/1.1 200 OK\r\n", "Search"},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(geocoder.reset());
    ASSERT_TRUE(geocoder.control({{c.key, c.value}})) << c.key;
    const HttpAnswer answer = http_get(geocoder.request_url("-26.204100,28.047300"));
    EXPECT_EQ(answer.head.rfind(c.status_line, 0), 0u) << c.key << "=" << c.value;
    EXPECT_EQ(read_answer(answer.body).root, c.root) << c.key << "=" << c.value;
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
