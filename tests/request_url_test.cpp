#include <glib.h>
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "kdb.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "support/temp_root.h"

namespace {

constexpr const char* kKey = "SITEDECKTESTKEY0123456789ABCDEFG";
constexpr const char* kNetworkKey = "memory/telephony/network_name";

std::string glib_md5(const std::string& text) {
  gchar* hex = g_compute_checksum_for_string(G_CHECKSUM_MD5, text.c_str(), -1);
  std::string out = hex;
  g_free(hex);
  return out;
}

// The URL the content server expects for `query`, signed as a whole.
std::string signed_url(const std::string& base, const std::string& query) {
  return base + "?" + query + "&hash=" + glib_md5(query + kKey);
}

struct UrlCase {
  const char* name;
  const char* country;  // null: key absent
  const char* network;  // null: no network name
  const char* city;
  const char* province;
  const char* version;
  bool with_args;
  int fall_back;
  const char* query;
  const char* base = "https://cs.example/v1/list";
};

TEST(RequestUrl, QueryPartsAndSignature) {
  const UrlCase cases[] = {
      {"ZA and vodacom", "ZA", "vodacom", nullptr, nullptr, "2.0", true, 0,
       "country=ZA&operator=VDC&platform=Valto&browserversion=2.0&"},
      {"ZA and MTN", "ZA", "MTN", nullptr, nullptr, nullptr, true, 0,
       "country=ZA&operator=MTN&platform=Valto&"},
      {"ZA and an unknown network", "ZA", "Cell C", nullptr, nullptr, nullptr, true, 0,
       "country=ZA&platform=Valto&"},
      {"ZA without telephony", "ZA", nullptr, nullptr, nullptr, nullptr, true, 0,
       "country=ZA&platform=Valto&"},
      {"za in lower case", "za", "MTN", nullptr, nullptr, nullptr, true, 0,
       "country=za&platform=Valto&"},
      {"no country, no args", nullptr, "MTN", nullptr, nullptr, nullptr, false, 0,
       "platform=Valto&"},
      {"empty country", "", nullptr, "", "", "", true, 0, "platform=Valto&"},
      {"fall-back server", nullptr, nullptr, nullptr, nullptr, nullptr, false, 1,
       "platform=Valto&&storage=s3"},
      {"empty city with province", nullptr, nullptr, "", "Gauteng", nullptr, true, 0,
       "platform=Valto&province=Gauteng&"},
      {"everything", "KR", nullptr, "Seoul", "Gyeonggi-do", "3.1", true, 1,
       "country=KR&platform=Valto&city=Seoul&province=Gyeonggi-do&browserversion=3.1&&storage=s3"},
      {"empty base URL: the URL starts with the query", nullptr, nullptr, nullptr, nullptr, nullptr,
       false, 0, "platform=Valto&", ""},
  };
  for (const auto& c : cases) {
    TempRoot root;
    ASSERT_TRUE(c.country == nullptr || kdb_write("db/csc/country_iso", c.country));
    ASSERT_TRUE(c.network == nullptr || kdb_write(kNetworkKey, c.network));
    sds_server_req_args args;
    args.city = const_cast<char*>(c.city);
    args.province = const_cast<char*>(c.province);
    args.browser_version = const_cast<char*>(c.version);
    sds_server_data server;
    server.base_url = const_cast<char*>(c.base);
    server.fall_back = c.fall_back;
    UniqueCStr url(sds_get_request_url(&server, c.with_args ? &args : nullptr));
    ASSERT_TRUE(url) << c.name;
    EXPECT_EQ(std::string(url.get()), signed_url(c.base, c.query)) << c.name;
  }
  EXPECT_EQ(sds_get_request_url(nullptr, nullptr), nullptr);
}

TEST(RequestUrl, CountryAndOperator) {
  TempRoot root;
  EXPECT_EQ(sds_get_country_iso(), nullptr);
  EXPECT_EQ(sds_get_operator_code(), nullptr);
  ASSERT_TRUE(kdb_write("db/csc/country_iso", "ZA"));
  ASSERT_TRUE(kdb_write(kNetworkKey, "mtn"));
  UniqueCStr country(sds_get_country_iso());
  EXPECT_STREQ(country.get(), "ZA");
  EXPECT_STREQ(sds_get_operator_code(), "MTN");
}

}  // namespace
