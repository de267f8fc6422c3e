// The data-pull job over the server list: attempts, waits and fall-back
// servers, 304, 301 and 302, capped redirects, missing lists and entries
// without attempts, and the location step's part in the query.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "kdb.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-request-server.h"
#include "support/db_session.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/stand_in_servers.h"

namespace {

constexpr const char* kNowhere = "http://127.0.0.1:1/SiteDeck/getSubRegionalItems";

std::string raw_query(const std::string& signed_text) {
  return signed_text + "&hash=" + stand_in_signature(signed_text);
}

class PullJob : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(a_.ok());
    ASSERT_TRUE(b_.ok());
  }
  static std::string requests(const ContentServerProcess& server) {
    return server.stats()["item_list_requests"];
  }
  static std::string server_list() { return read_file(sds_path(SDS_SERVER_DATA_XML)); }
  static std::string rows() { return DbSession::rows("SELECT count(*) FROM site_deck"); }

  DbSession db_;
  ContentServerProcess a_;
  ContentServerProcess b_;
  ItemListGuard guard_;
};

TEST_F(PullJob, FailingServerGetsItsAttemptsWithWaitsThenTheFallBackServerIsAsked) {
  ASSERT_TRUE(a_.control({{"status", "503"}}));
  ASSERT_TRUE(
      write_server_list({{1, a_.base_url(), 1200, 3, false}, {2, b_.base_url(), 0, 1, true}}));
  LogCapture log;
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_NONE);
  EXPECT_EQ(requests(a_), "3");
  EXPECT_EQ(requests(b_), "1");
  EXPECT_EQ(b_.stats()["last_query"], raw_query("platform=Valto&&storage=s3"));
  std::vector<std::string> waits;
  for (const LogLine& line : log.lines()) {
    if (line.message.rfind("Server Request Failed so waiting", 0) == 0 ||
        line.message.rfind("Remaining retries", 0) == 0) {
      waits.push_back(line.message);
    }
  }
  const std::string waiting =
      "Server Request Failed so waiting (1200) milliseconds before next reqest";
  EXPECT_EQ(waits,
            (std::vector<std::string>{waiting, "Remaining retries = 2", waiting,
                                      "Remaining retries = 1", waiting, "Remaining retries = 0"}));
  EXPECT_NE(rows(), "0");
}

TEST_F(PullJob, NegativeWaitTimeMeansNoPause) {
  ASSERT_TRUE(a_.control({{"status", "503"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), -2000, 2, false}}));
  LogCapture log;
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_EQ(requests(a_), "2");
  EXPECT_EQ(log.count("Server Request Failed so waiting (-2000) milliseconds before next reqest"),
            2);
}

// The pull reads and writes the file without the memory mapping, which
// would keep every page it touched resident; serving maps it again after.
TEST_F(PullJob, PullLeavesTheFileMappedForServingAsBefore) {
  const std::string mapped = DbSession::rows("PRAGMA mmap_size");
  ASSERT_NE(mapped, "0");
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 1, false}}));
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_NONE);
  EXPECT_NE(rows(), "0");
  EXPECT_EQ(DbSession::rows("PRAGMA mmap_size"), mapped);
}

TEST_F(PullJob, FirstServerNotModifiedEndsThePullWithoutAskingTheNext) {
  ASSERT_TRUE(a_.control({{"status", "304"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 3, false}, {2, b_.base_url(), 0, 1, true}}));
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_EQ(requests(a_), "1");
  EXPECT_EQ(requests(b_), "0");
}

TEST_F(PullJob, FoundRedirectsThisPullOnly) {
  ASSERT_TRUE(a_.control({{"status", "302"}, {"location", b_.root_url() + "/"}, {"times", "1"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 1, false}}));
  const std::string before = server_list();
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_NONE);
  EXPECT_EQ(requests(a_), "1");
  EXPECT_EQ(requests(b_), "1");
  EXPECT_EQ(b_.stats()["last_path"], "/SiteDeck/getSubRegionalItems");
  EXPECT_EQ(server_list(), before);
  EXPECT_NE(rows(), "0");
}

TEST_F(PullJob, MovedPermanentlyRewritesTheServerListAndFollowsIt) {
  ASSERT_TRUE(a_.control({{"status", "301"}, {"location", b_.root_url() + "/"}, {"times", "1"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 1, false}, {2, kNowhere, 0, 1, true}}));
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_NONE);
  EXPECT_EQ(requests(a_), "1");
  EXPECT_EQ(requests(b_), "1");
  const std::string list = server_list();
  EXPECT_NE(list.find("<Base-url>" + b_.base_url() + "</Base-url>"), std::string::npos) << list;
  EXPECT_EQ(list.find(a_.base_url()), std::string::npos) << list;
  EXPECT_NE(list.find(std::string("<Base-url>") + kNowhere + "</Base-url>"), std::string::npos);

  // Later pulls start from the new address.
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_EQ(requests(a_), "1");
  EXPECT_EQ(requests(b_), "2");
}

TEST_F(PullJob, RedirectsWithoutEndAreCappedPerPull) {
  ASSERT_TRUE(a_.control({{"status", "302"}, {"location", a_.root_url() + "/"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 2, false}}));
  LogCapture log;
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_SERVER_REQUEST_FAILED);
  // Five redirects followed, then both attempts of the last address fail.
  EXPECT_EQ(requests(a_), "7");
  EXPECT_TRUE(log.contains("Too many redirects (6) in one pull"));
  EXPECT_TRUE(log.contains("Too many redirects (7) in one pull"));
  EXPECT_EQ(sds_redirect_base_url, nullptr);
}

// A 301 rewrote the server list before the new address had answered: a move
// to an address that never answers cut the device off for good.
TEST_F(PullJob, PermanentRedirectRewroteTheListBeforeTheNewAddressAnswered) {
  ASSERT_TRUE(a_.control({{"status", "301"}, {"location", a_.root_url() + "/v2/"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 1, false}}));
  const std::string before = server_list();
  LogCapture log;
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_SERVER_REQUEST_FAILED);
  EXPECT_EQ(requests(a_), "6");
  EXPECT_TRUE(log.contains("Too many redirects (6) in one pull"));
  EXPECT_EQ(server_list(), before);
}

TEST_F(PullJob, FirstEntryWithoutAttemptsEndsThePullUnasked) {
  ASSERT_TRUE(
      write_server_list({{1, a_.base_url(), 0, 0, false}, {2, b_.base_url(), 0, 1, false}}));
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_DATA_PULL_FAILED);
  EXPECT_EQ(requests(a_), "0");
  EXPECT_EQ(requests(b_), "0");
}

TEST_F(PullJob, EntryWithoutAttemptsAfterFailuresIsPassedOver) {
  ASSERT_TRUE(a_.control({{"status", "503"}}));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 1, false},
                                 {2, kNowhere, 0, 0, false},
                                 {3, b_.base_url(), 0, 1, false}}));
  EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_NONE);
  EXPECT_EQ(requests(b_), "1");
}

TEST_F(PullJob, WithoutAServerListNothingIsAsked) {
  for (const char* content : {static_cast<const char*>(nullptr), "<values/>", "not xml"}) {
    if (content != nullptr) {
      ASSERT_TRUE(write_file(sds_path(SDS_SERVER_DATA_XML), content));
    }
    LogCapture log;
    EXPECT_EQ(sds_check_data_pull_required(nullptr), SDS_ERROR_DATA_PULL_FAILED);
    EXPECT_TRUE(log.contains("[CRITICAL]  Failed to get the server list"));
  }
  EXPECT_EQ(requests(a_), "0");
}

struct ArgsOwner {
  sds_server_req_args args{};
  ArgsOwner(double latitude, double longitude, const char* version) {
    args.latitude = latitude;
    args.longitude = longitude;
    args.browser_version = version != nullptr ? strdup(version) : nullptr;
  }
  ~ArgsOwner() {
    std::free(args.city);
    std::free(args.province);
    std::free(args.browser_version);
  }
};

TEST_F(PullJob, LocationStepDecidesTheQuery) {
  GeocoderProcess geocoder;
  ASSERT_TRUE(geocoder.ok());
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder.root_url().c_str()));
  ASSERT_TRUE(write_server_list({{1, a_.base_url(), 0, 1, false}}));
  struct Case {
    const char* name;
    double latitude;
    double longitude;
    bool no_args;
    const char* geocoder_status;  // null: answers normally
    const char* query;
    const char* geocoder_requests;
  } cases[] = {
      {"known place", -26.2041, 28.0473, false, nullptr,
       "platform=Valto&city=Johannesburg&province=Gauteng&browserversion=2.0&", "1"},
      {"failed location step", 37.5, 127.0, false, "503", "platform=Valto&browserversion=2.0&",
       "1"},
      {"latitude out of range", 90.000001, 28.0473, false, nullptr,
       "platform=Valto&browserversion=2.0&", "0"},
      {"longitude not a number", 10.0, std::nan(""), false, nullptr,
       "platform=Valto&browserversion=2.0&", "0"},
      {"no arguments", 0, 0, true, nullptr, "platform=Valto&", "0"},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(geocoder.reset());
    if (c.geocoder_status != nullptr) {
      ASSERT_TRUE(geocoder.control({{"status", c.geocoder_status}}));
    }
    (void)std::remove(sds_path(SDS_LOCATION_INFO_PATH).c_str());
    ArgsOwner owner(c.latitude, c.longitude, "2.0");
    (void)sds_check_data_pull_required(c.no_args ? nullptr : &owner.args);
    EXPECT_EQ(a_.stats()["last_query"], raw_query(c.query)) << c.name;
    EXPECT_EQ(geocoder.stats()["request_count"], c.geocoder_requests) << c.name;
  }
}

}  // namespace
