// The network half of the location step against the stand-in reverse
// geocoder: the exact request, reuse of the stored answer, status lines and
// refusals, and the stored ETag that a new place drops.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "kdb.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-request-server.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

constexpr const char* kStoredEtag = "\"list-etag\"\r\n";

struct Place {
  std::string city = "<none>";
  std::string province = "<none>";
};

class Location : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(geocoder_.ok());
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
    ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), kStoredEtag));
  }

  // Runs the location step for a fresh record; its result goes to `*result`.
  static Place resolve(double latitude, double longitude, int* result) {
    sds_server_req_args args{};
    args.latitude = latitude;
    args.longitude = longitude;
    *result = sds_get_city_and_province(&args);
    Place place;
    if (args.city != nullptr) place.city = args.city;
    if (args.province != nullptr) place.province = args.province;
    std::free(args.city);
    std::free(args.province);
    return place;
  }
  std::string requests() const { return geocoder_.stats()["request_count"]; }

  TempRoot root_;
  GeocoderProcess geocoder_;
};

TEST_F(Location, NewPlaceIsAskedExactlyStoredAndDropsTheListEtag) {
  int result = -1;
  Place place = resolve(37.5, 127.0, &result);
  EXPECT_EQ(result, SDS_ERROR_NONE);
  EXPECT_EQ(place.city, "Gangnam-gu");
  EXPECT_EQ(place.province, "Seoul");
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
  int result = -1;
  (void)resolve(37.5, 127.0, &result);
  ASSERT_EQ(requests(), "1");
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), kStoredEtag));

  Place again = resolve(37.5000001, 127.0, &result);  // the same to six decimals
  EXPECT_EQ(result, SDS_ERROR_NONE);
  EXPECT_EQ(again.city, "Gangnam-gu");
  EXPECT_EQ(again.province, "Seoul");
  EXPECT_EQ(requests(), "1");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);

  // This answer names two counties: the last one wins.
  Place other = resolve(-25.7479, 28.2293, &result);
  EXPECT_EQ(result, SDS_ERROR_NONE);
  EXPECT_EQ(other.city, "Pretoria");
  EXPECT_EQ(other.province, "Gauteng");
  EXPECT_EQ(requests(), "2");
  EXPECT_EQ(geocoder_.stats()["last_query"].substr(0, 26), "prox=-25.747900,28.229300&");
}

TEST_F(Location, AnswerWithoutCityStoresNothingAndKeepsTheEtag) {
  int result = -1;
  Place place = resolve(51.5074, -0.1278, &result);
  EXPECT_EQ(result, SDS_ERROR_NONE);
  EXPECT_EQ(place.city, "<none>");
  EXPECT_EQ(place.province, "England");
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
    ASSERT_TRUE(geocoder_.reset());
    // Credentials the geocoder does not know are what gives a real 401.
    if (std::string(c.status) == "401") {
      ASSERT_TRUE(geocoder_.control({{"app_id", "SomeoneElsesAppId123"}}));
    } else {
      ASSERT_TRUE(geocoder_.control({{"status", c.status}}));
    }
    LogCapture log;
    int result = -1;
    Place place = resolve(37.5, 127.0, &result);
    EXPECT_EQ(result, SDS_ERROR_SERVER_REQUEST_FAILED) << c.status;
    EXPECT_EQ(place.city, "<none>") << c.status;
    std::vector<std::string> seen;
    for (const LogLine& line : log.lines()) {
      if (line.message.rfind("Here Service", 0) == 0 || line.message.rfind("Check app_", 0) == 0) {
        seen.push_back(line.message);
      }
    }
    EXPECT_EQ(seen, c.logged) << c.status;
    // The platform log keeps the leading line feed and drops the final one.
    EXPECT_TRUE(log.contains("\nNot Parsing XML")) << c.status;
    EXPECT_EQ(root_file_or_none(SDS_LOCATION_INFO_PATH), "<none>") << c.status;
    EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag) << c.status;
  }
}

TEST_F(Location, ErrorDocumentIs18AndKeepsTheAnswerFile) {
  ASSERT_TRUE(geocoder_.control({{"error_root", "1"}}));
  LogCapture log;
  int result = -1;
  Place place = resolve(37.5, 127.0, &result);
  EXPECT_EQ(result, SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_EQ(place.city, "<none>");
  EXPECT_TRUE(log.contains("[CRITICAL] Here service returned error"));
  EXPECT_NE(root_file_or_none(SDS_HERE_XML_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), kStoredEtag);
}

TEST_F(Location, StalledGeocoderIsGivenUp) {
  set_stall_seconds(1);
  ASSERT_TRUE(geocoder_.control({{"delay_ms", "600000"}}));
  int result = -1;
  (void)resolve(37.5, 127.0, &result);
  EXPECT_EQ(result, SDS_ERROR_SERVER_REQUEST_FAILED);
  ASSERT_TRUE(geocoder_.release());
}

}  // namespace
