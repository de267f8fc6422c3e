// The network half of the location step against the stand-in reverse
// geocoder: the exact request, reuse of the stored answer, status lines and
// refusals, and the stored ETag that a new place drops.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "kdb.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-request-server.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

constexpr const char* kStoredEtag = "\"list-etag\"\r\n";

class Location : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(geocoder_.ok());
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
    ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), kStoredEtag));
  }

  // Runs the location step for a fresh record: "RESULT CITY/PROVINCE", each
  // text "<none>" when not set.
  static std::string resolve(double latitude, double longitude) {
    sds_server_req_args args{};
    args.latitude = latitude;
    args.longitude = longitude;
    const int result = sds_get_city_and_province(&args);
    const std::string place = std::to_string(result) + " " + (args.city ? args.city : "<none>") +
                              "/" + (args.province ? args.province : "<none>");
    std::free(args.city);
    std::free(args.province);
    return place;
  }
  std::string requests() const { return geocoder_.stats()["request_count"]; }

  TempRoot root_;
  GeocoderProcess geocoder_;
};

TEST_F(Location, NewPlaceIsAskedExactlyStoredAndDropsTheListEtag) {
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
}

TEST_F(Location, SamePositionReusesTheStoredAnswerAndAnotherOneAsksAgain) {
  (void)resolve(37.5, 127.0);
  ASSERT_EQ(requests(), "1");
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), kStoredEtag));
  EXPECT_EQ(resolve(37.5000001, 127.0), "0 Gangnam-gu/Seoul");  // the same to six decimals
  EXPECT_EQ(requests(), "1");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);
  // This answer names two counties: the last one wins.
  EXPECT_EQ(resolve(-25.7479, 28.2293), "0 Pretoria/Gauteng");
  EXPECT_EQ(requests(), "2");
  EXPECT_EQ(geocoder_.stats()["last_query"].substr(0, 26), "prox=-25.747900,28.229300&");
}

TEST_F(Location, AnswerWithoutCityStoresNothingAndKeepsTheEtag) {
  EXPECT_EQ(resolve(51.5074, -0.1278), "0 <none>/England");
  EXPECT_EQ(root_file_or_none(SDS_LOCATION_INFO_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);
}

TEST_F(Location, RefusingStatusLinesAre18AndNamedInTheLog) {
  struct Case {
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
    ASSERT_TRUE(geocoder_.reset());
    // Credentials the geocoder does not know are what gives a real 401.
    ASSERT_TRUE(std::string(c.status) == "401"
                    ? geocoder_.control({{"app_id", "SomeoneElsesAppId123"}})
                    : geocoder_.control({{"status", c.status}}));
    LogCapture log;
    EXPECT_EQ(resolve(37.5, 127.0), "18 <none>/<none>");
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

TEST_F(Location, ErrorDocumentIs18AndKeepsTheAnswerFile) {
  ASSERT_TRUE(geocoder_.control({{"error_root", "1"}}));
  LogCapture log;
  EXPECT_EQ(resolve(37.5, 127.0), "18 <none>/<none>");
  EXPECT_TRUE(log.contains("[CRITICAL] Here service returned error"));
  EXPECT_NE(root_file_or_none(SDS_HERE_XML_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);
}

TEST_F(Location, StalledGeocoderIsGivenUp) {
  set_stall_seconds(1);
  ASSERT_TRUE(geocoder_.control({{"delay_ms", "600000"}}));
  EXPECT_EQ(resolve(37.5, 127.0).substr(0, 3), "18 ");
  ASSERT_TRUE(geocoder_.release());
}

}  // namespace
