// Command 1 end to end: the real service under the activator, a client on its
// socket, and the stand-in content server and geocoder behind the pull.
#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "kdb.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

std::string raw_query(const std::string& signed_text) {
  return signed_text + "&hash=" + stand_in_signature(signed_text);
}

class Initialize : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(content_.ok());
    ASSERT_TRUE(geocoder_.ok());
  }
  // A fresh scratch root with the server list and the geocoder address in it.
  void new_root() {
    service_.reset();
    root_.reset();
    root_ = std::make_unique<TempRoot>();
    ASSERT_TRUE(write_server_list({{1, content_.base_url(), 0, 1, false}}));
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
  }
  void start_service() {
    service_ = std::make_unique<ServiceHarness>();
    ASSERT_TRUE(service_->start_activated());
    ASSERT_EQ(service_->connect(&connection_), SDS_ERROR_NONE) << service_->output();
  }
  // Closes the connection; the service's exit code, -1 when it did not end.
  int end_service() {
    connection_.close();
    int status = 0;
    return service_->wait_exit(&status) ? exit_code_of(status) : -1;
  }

  ContentServerProcess content_;
  GeocoderProcess geocoder_;
  std::unique_ptr<TempRoot> root_;
  std::unique_ptr<ServiceHarness> service_;
  SdsConnection connection_;
};

TEST_F(Initialize, FullExchangeRunsThePullAndTheListCanBeRead) {
  new_root();
  start_service();
  const std::string version = "2.0";
  InitializeReply reply =
      run_initialize(connection_.fd(), connection_.cid(), -26.2041, 28.0473, 0, &version);
  EXPECT_EQ(reply.ready, SDS_ERROR_NONE);
  EXPECT_EQ(reply.received, SDS_ERROR_NONE);
  EXPECT_EQ(reply.final, SDS_ERROR_NONE) << service_->output();
  EXPECT_EQ(content_.stats()["last_query"],
            raw_query("platform=Valto&city=Johannesburg&province=Gauteng&browserversion=2.0&"));
  EXPECT_EQ(geocoder_.stats()["request_count"], "1");

  const std::string db = sds_path(SDS_DB_PATH);
  sds_client_ids ids;
  ASSERT_EQ(sds_client_get_full_ids(connection_, &ids), SDS_ERROR_NONE);
  std::vector<int32_t> sorted(ids.ids.get(), ids.ids.get() + ids.count);
  std::sort(sorted.begin(), sorted.end());
  std::string listed;
  for (int32_t id : sorted) listed += (listed.empty() ? "" : "\n") + std::to_string(id);
  // Every site but the one the server withdrew.
  EXPECT_EQ(listed, rows_of_file(db,
                                 "SELECT id FROM site_deck WHERE url != "
                                 "'http://old-portal.example/' ORDER BY id"));
  for (int32_t id : sorted) {
    SdsClientText url;
    ASSERT_EQ(sds_client_get_url(connection_, id, &url), SDS_ERROR_NONE);
    EXPECT_EQ(url.get(),
              rows_of_file(db, "SELECT url FROM site_deck WHERE id = " + std::to_string(id)));
  }
  EXPECT_NE(rows_of_file(db, "SELECT count(*) FROM site_deck WHERE url = "
                             "'http://joburg-news.example/'"),
            "0");
  EXPECT_EQ(end_service(), 0) << service_->output();
}

TEST_F(Initialize, VersionAndPositionChecks) {
  const std::string empty;
  const std::string version = "2.0";
  struct Case {
    const char* name;
    double latitude;
    int flag;
    const std::string* version;
    const char* logged;
    const char* query;
    const char* geocoder_requests;
  } cases[] = {
      {"version of length 0", -26.2041, 0, &empty, "No Browser version info",
       "platform=Valto&city=Johannesburg&province=Gauteng&", "1"},
      {"flag 6, no string", -26.2041, 6, nullptr, "No Browser version info",
       "platform=Valto&city=Johannesburg&province=Gauteng&", "1"},
      {"latitude 90.000001", 90.000001, 0, &version,
       "Invalid Location data: latitude = 90.000001 longitude = 28.047300", "platform=Valto&", "0"},
      {"latitude 90", 90.0, 0, &version, nullptr, "platform=Valto&browserversion=2.0&", "1"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(content_.reset());
    ASSERT_TRUE(geocoder_.reset());
    new_root();
    start_service();
    InitializeReply reply =
        run_initialize(connection_.fd(), connection_.cid(), c.latitude, 28.0473, c.flag, c.version);
    EXPECT_EQ(reply.final, SDS_ERROR_NONE) << service_->output();
    EXPECT_EQ(content_.stats()["last_query"], raw_query(c.query));
    EXPECT_EQ(geocoder_.stats()["request_count"], c.geocoder_requests);
    EXPECT_NE(end_service(), -1);
    if (c.logged != nullptr) {
      EXPECT_TRUE(service_->has_message(c.logged));
    }
    EXPECT_FALSE(service_->has_message("[CRITICAL] sds_ipc_read_custom_type failed"));
  }
}

// The browser never learnt the result: its next pull must be a full one.
TEST_F(Initialize, ClientGoneBeforeTheResultDropsTheEtagAndAsksAgainInADay) {
  new_root();
  // A stored ETag the server will confirm (304), so that nothing but the
  // lost result can remove it.
  const std::string etag = http_get(content_.signed_url("platform=Valto&")).header("ETag");
  ASSERT_FALSE(etag.empty());
  // The ETag names a stored list; without any stored item it would be dropped.
  ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  ASSERT_TRUE(
      DbSession::exec("INSERT INTO site_deck(url) VALUES ('http://daily-herald.example/')"));
  DbSession::close_handle();
  ASSERT_TRUE(write_file(sds_path(SDS_ETAG_PATH), etag + "\r\n"));
  // The answer waits long enough for the client to be gone.
  ASSERT_TRUE(content_.control({{"delay_ms", "1000"}}));

  start_service();
  ASSERT_TRUE(send_initialize(connection_.fd(), connection_.cid(), 91.0, 0.0, 6, nullptr));
  EXPECT_EQ(end_service(), 0) << service_->output();
  EXPECT_EQ(content_.stats()["last_if_none_match"], etag);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "86400");
}

}  // namespace
