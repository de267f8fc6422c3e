// Command 1 end to end: the real service under the activator, a client on its
// socket, and the stand-in content server and geocoder behind the pull.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "kdb.h"
#include "sitedeck-client.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
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
  // A scratch root for one service run, with the server list and the
  // geocoder address in it.
  void prepare_root() const {
    ASSERT_TRUE(write_server_list({{1, content_.base_url(), 0, 1, false}}));
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
  }

  ContentServerProcess content_;
  GeocoderProcess geocoder_;
};

// Command 11 with flag 6: every listed item id.
std::vector<int> full_ids(const SdsConnection& connection) {
  std::vector<int> ids;
  int32_t flag = 6;
  if (sds_client_send_header(connection, SDS_CMD_GET_FULL_IDS, 0) != SDS_ERROR_NONE ||
      sds_ipc_send_custom_type(connection.fd(), &flag, sizeof flag) != 0 ||
      sds_ipc_read_errorcode(connection.fd()) != SDS_ERROR_NONE) {
    return ids;
  }
  int count = sds_ipc_read_errorcode(connection.fd());
  if (count <= 0 || count > 1000) return ids;
  ids.resize(static_cast<size_t>(count));
  if (sds_ipc_read_blob(connection.fd(), ids.data(), ids.size() * sizeof(int)) != 0) ids.clear();
  return ids;
}

// Command 3: the item's URL, or "<status N>".
std::string url_of(const SdsConnection& connection, int id) {
  int status = sds_client_request(connection, SDS_CMD_GET_URL, id);
  if (status != SDS_ERROR_NONE) return "<status " + std::to_string(status) + ">";
  UniqueCStr url(sds_ipc_read_string(connection.fd()));
  return url ? url.get() : "<no string>";
}

TEST_F(Initialize, FullExchangeRunsThePullAndTheListCanBeRead) {
  TempRoot root;
  prepare_root();
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  const std::string version = "2.0";
  InitializeReply reply =
      run_initialize(connection.fd(), connection.cid(), -26.2041, 28.0473, 0, &version);
  EXPECT_EQ(reply.ready, SDS_ERROR_NONE);
  EXPECT_EQ(reply.received, SDS_ERROR_NONE);
  EXPECT_EQ(reply.final, SDS_ERROR_NONE) << service.output();
  EXPECT_EQ(content_.stats()["last_query"],
            raw_query("platform=Valto&city=Johannesburg&province=Gauteng&browserversion=2.0&"));
  EXPECT_EQ(geocoder_.stats()["request_count"], "1");

  const std::string db = sds_path(SDS_DB_PATH);
  std::vector<int> ids = full_ids(connection);
  std::vector<int> sorted = ids;
  std::sort(sorted.begin(), sorted.end());
  std::string listed;
  for (int id : sorted) listed += (listed.empty() ? "" : "\n") + std::to_string(id);
  // Every site but the one the server withdrew.
  EXPECT_EQ(listed, rows_of_file(db,
                                 "SELECT id FROM site_deck WHERE url != "
                                 "'http://old-portal.example/' ORDER BY id"));
  for (int id : ids) {
    EXPECT_EQ(url_of(connection, id),
              rows_of_file(db, "SELECT url FROM site_deck WHERE id = " + std::to_string(id)));
  }
  EXPECT_NE(rows_of_file(db,
                         "SELECT count(*) FROM site_deck WHERE url = "
                         "'http://joburg-news.example/'"),
            "0");
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
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
    ASSERT_TRUE(content_.reset());
    ASSERT_TRUE(geocoder_.reset());
    TempRoot root;
    prepare_root();
    ServiceHarness service;
    ASSERT_TRUE(service.start_activated()) << c.name;
    SdsConnection connection;
    ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << c.name;
    InitializeReply reply =
        run_initialize(connection.fd(), connection.cid(), c.latitude, 28.0473, c.flag, c.version);
    EXPECT_EQ(reply.final, SDS_ERROR_NONE) << c.name << "\n" << service.output();
    EXPECT_EQ(content_.stats()["last_query"], raw_query(c.query)) << c.name;
    EXPECT_EQ(geocoder_.stats()["request_count"], c.geocoder_requests) << c.name;
    connection.close();
    int status = 0;
    ASSERT_TRUE(service.wait_exit(&status)) << c.name;
    if (c.logged != nullptr) {
      EXPECT_TRUE(service.has_message(c.logged)) << c.name;
    }
    EXPECT_FALSE(service.has_message("[CRITICAL] sds_ipc_read_custom_type failed")) << c.name;
  }
}

// The browser never learnt the result: its next pull must be a full one.
TEST_F(Initialize, ClientGoneBeforeTheResultDropsTheEtagAndAsksAgainInADay) {
  TempRoot root;
  prepare_root();
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

  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE);
  ASSERT_TRUE(send_initialize(connection.fd(), connection.cid(), 91.0, 0.0, 6, nullptr));
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
  EXPECT_EQ(content_.stats()["last_if_none_match"], etag);
  EXPECT_EQ(root_file_or_none(SDS_ETAG_PATH), "<none>");
  EXPECT_EQ(root_file_or_none(SDS_NEXT_UPDATE_DURATION_PATH), "86400");
}

}  // namespace
