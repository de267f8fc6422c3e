// The default deck: loaded into a database created empty, through the same
// parse and merge as a downloaded list, replaced by the first pull, never
// loaded into a database that already existed, and harmless when damaged.
#include "support/default_deck.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "kdb.h"
#include "sitedeck-client-deck.h"
#include "pull/sitedeck-service-default-deck.h"
#include "serve/sitedeck-service-default-deck-start.h"
#include "pull/sitedeck-service-json-parser.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "support/db_session.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"

namespace {

// Every column a reader sees, in list order; the row ids are left out
// because two databases number their rows independently.
constexpr const char* kDeckDump =
    "SELECT url, title, dominant_color, is_dirty, order_index, icon_size, icon_path, "
    "image_last_updated, hex(icon_data) FROM site_deck ORDER BY order_index, url";
constexpr const char* kUrlsAndIcons =
    "SELECT url, is_dirty, order_index, icon_size, icon_data IS NOT NULL FROM site_deck "
    "ORDER BY order_index";

// Opens the database as the worker does and runs the deck step after it.
void open_like_the_worker() {
  ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  sds_default_deck_load_if_created();
}

class DefaultDeckService : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(content_.ok());
    ASSERT_TRUE(geocoder_.ok());
  }
  void prepare_pull() const {
    ASSERT_TRUE(write_server_list({{1, content_.base_url(), 0, 1, false}}));
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder_.root_url().c_str()));
  }
  // The table after one pull into a root without a deck: what the server's
  // list alone gives.
  std::string table_after_plain_pull(std::string* etag) const {
    TempRoot root;
    prepare_pull();
    ServiceHarness service;
    if (!service.start_activated()) return "<not started>";
    SdsConnection connection;
    if (service.connect(&connection) != SDS_ERROR_NONE) return "<not connected>";
    if (sds_client_initialize(connection, kLatitude, kLongitude, "2.0") != SDS_ERROR_NONE) {
      return "<pull failed>";
    }
    connection.close();
    int status = 0;
    (void)service.wait_exit(&status);
    *etag = read_file(root.path(SDS_ETAG_PATH));
    return rows_of_file(root.path(SDS_DB_PATH), kDeckDump);
  }

  static constexpr double kLatitude = -26.2041;
  static constexpr double kLongitude = 28.0473;
  ContentServerProcess content_;
  GeocoderProcess geocoder_;
};

TEST_F(DefaultDeckService, FirstStartServesTheDeckAndTheFirstPullReplacesIt) {
  TempRoot root;
  prepare_pull();
  std::vector<DeckSite> deck = small_deck();
  // A site the server lists too, under another title and icon, and one it
  // does not list at all.
  deck[0].url = "http://daily-herald.example/";
  deck[0].name = "Herald from the deck";
  ASSERT_TRUE(write_deck(deck));

  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  sds_client_ids ids;
  ASSERT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_NONE) << service.output();
  ASSERT_EQ(ids.count, static_cast<int32_t>(deck.size()));
  for (size_t i = 0; i < deck.size(); ++i) {
    sds_client_item item;
    ASSERT_EQ(sds_client_read_item(connection, ids.ids.get()[i], true, &item), SDS_ERROR_NONE);
    EXPECT_STREQ(item.url.get(), deck[i].url.c_str()) << i;
    EXPECT_STREQ(item.title.get(), deck[i].name.c_str()) << i;
    EXPECT_STREQ(item.dominant_color.get(), deck[i].color.c_str()) << i;
    ASSERT_EQ(item.icon_status, SDS_ERROR_NONE) << deck[i].url;
    EXPECT_EQ(item.icon.width, deck[i].image.width) << i;
    EXPECT_EQ(item.icon.height, deck[i].image.height) << i;
    const unsigned char* pixels = item.icon.pixels.get();
    EXPECT_EQ(std::vector<uint8_t>(pixels, pixels + item.icon.byte_count),
              png_expected_bgra(deck[i].image))
        << i;
  }
  EXPECT_TRUE(service.has_message("default deck loaded: 3 items (0 icon files missing)"))
      << service.output();
  // Nothing claims the deck came from a server: the first pull is unconditional.
  EXPECT_FALSE(file_exists(root.path(SDS_ETAG_PATH)));
  EXPECT_FALSE(file_exists(root.path(SDS_NEXT_UPDATE_DURATION_PATH)));
  // The copied icon files are gone once stored, as downloaded ones are.
  EXPECT_TRUE(std::filesystem::is_empty(root.path(SDS_IMAGES_DIR)));

  ASSERT_EQ(sds_client_initialize(connection, kLatitude, kLongitude, "2.0"), SDS_ERROR_NONE)
      << service.output();
  EXPECT_EQ(content_.stats()["last_if_none_match"], "");
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
  const std::string after_deck = rows_of_file(root.path(SDS_DB_PATH), kDeckDump);
  const std::string etag = read_file(root.path(SDS_ETAG_PATH));

  std::string plain_etag;
  EXPECT_EQ(after_deck, table_after_plain_pull(&plain_etag));
  EXPECT_FALSE(etag.empty());
  EXPECT_EQ(etag, plain_etag);
  EXPECT_EQ(after_deck.find("deck"), std::string::npos) << after_deck;
}

TEST_F(DefaultDeckService, DamagedDeckLeavesAnEmptyDeckAndTheServiceServes) {
  TempRoot root;
  ASSERT_TRUE(write_deck_list("{\"global\": {\"items\": [ {\"item\": "));
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  sds_client_ids ids;
  EXPECT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_NO_DATA);
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(seconds, 86400);
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
  EXPECT_TRUE(service.has_message("default deck not loaded: no item list in " +
                                  root.path(SDS_DEFAULT_DECK_JSON_PATH)))
      << service.output();
}

// When the deck is loaded depends only on whether this open created the table.
TEST(DefaultDeck, LoadedOnlyIntoATableCreatedAtThisOpen) {
  struct Case {
    const char* name;
    void (*prepare)(const std::string& db_path);
    bool loaded;
    const char* rows;  // the URLs afterwards
  };
  constexpr const char* kDeckUrls =
      "https://news.example.org/\nhttps://mail.example.net/\nhttps://maps.example.com/";
  const Case cases[] = {
      {"no database file", [](const std::string&) {}, true, kDeckUrls},
      {"an empty file", [](const std::string& db) { ASSERT_TRUE(write_file(db, "")); }, true,
       kDeckUrls},
      {"a file that is no database",
       [](const std::string& db) { ASSERT_TRUE(write_file(db, std::string(4096, 'x'))); }, true,
       kDeckUrls},
      {"a table with the rows of an earlier pull",
       [](const std::string&) {
         ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
         ASSERT_TRUE(DbSession::exec("INSERT INTO site_deck(url) VALUES('http://kept.example/')"));
         DbSession::close_handle();
       },
       false, "http://kept.example/"},
      {"a table an earlier pull left without rows",
       [](const std::string&) {
         ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
         DbSession::close_handle();
       },
       false, ""},
      // Without a deck the open is as ever: not a line about one.
      {"a new file but no default deck",
       [](const std::string&) { std::filesystem::remove_all(sds_path(SDS_DEFAULT_DECK_DIR)); },
       false, ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    DbSession session(false);
    ASSERT_TRUE(write_deck(small_deck()));
    c.prepare(session.db_path());
    LogCapture log;
    open_like_the_worker();
    EXPECT_EQ(DbSession::rows("SELECT url FROM site_deck ORDER BY order_index"), c.rows);
    EXPECT_EQ(log.count("default deck loaded: 3 items (0 icon files missing)"), c.loaded ? 1 : 0);
    for (const LogLine& line : log.lines()) {
      EXPECT_TRUE(c.loaded || line.message.find("default deck") == std::string::npos)
          << line.message;
    }
    // Without a deck, loading one finds nothing.
    if (!file_exists(sds_path(SDS_DEFAULT_DECK_DIR))) {
      EXPECT_EQ(sds_default_deck_load(), SDS_ERROR_NO_DATA);
    }
  }
}

TEST(DefaultDeck, NotLoadedAgainWhenTheDatabaseIsReopened) {
  DbSession session(false);
  ASSERT_TRUE(write_deck(small_deck()));
  open_like_the_worker();
  ASSERT_EQ(DbSession::rows("SELECT count(*) FROM site_deck"), "3");
  ASSERT_TRUE(DbSession::exec("DELETE FROM site_deck"));
  DbSession::close_handle();
  LogCapture log;
  open_like_the_worker();
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck"), "0");
  // A second take of the same open finds nothing either.
  sds_default_deck_load_if_created();
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck"), "0");
  EXPECT_TRUE(log.lines().empty());
}

// Each damage leaves what the merge makes of the rest, and says what it was.
TEST(DefaultDeck, DamagedDecks) {
  struct Case {
    const char* name;
    void (*damage)(std::vector<DeckSite>* sites);  // before the deck is written
    void (*after)();                               // after it is written
    int missing;      // icon files the load line counts; -1: nothing loaded
    int site;         // the site whose row (kUrlsAndIcons) differs from an intact load
    const char* row;  // that row
    const char* logged;
  };
  const Case cases[] = {
      {"list is not JSON", nullptr, [] { ASSERT_TRUE(write_deck_list("{\"global\": [")); }, -1, 0,
       "", "[CRITICAL] parent.key is null"},
      {"list larger than the parser takes", nullptr,
       [] {
         std::string json = deck_json(small_deck());
         json.append(static_cast<size_t>(SDS_JSON_MAX_FILE_BYTES) + 1 - json.size(), ' ');
         ASSERT_TRUE(write_deck_list(json));
       },
       -1, 0, "", ""},
      {"icon file missing", [](std::vector<DeckSite>* s) { (*s)[1].write_icon = false; }, nullptr,
       1, 1, "https://mail.example.net/|1|2||0",
       "default deck: no icon file mail.png for https://mail.example.net/"},
      {"icon file is no PNG", nullptr,
       [] { ASSERT_TRUE(write_file(sds_path(SDS_DEFAULT_DECK_DIR) + "/maps.png", "GIF89a")); }, 0,
       2, "https://maps.example.com/|1|3||0", "some error occured while converting data"},
      {"icon file larger than an icon may be", nullptr,
       [] {
         ASSERT_TRUE(write_file(sds_path(SDS_DEFAULT_DECK_DIR) + "/news.png",
                                std::string(SDS_MAX_ICON_BYTES + 1, 'x')));
       },
       1, 0, "https://news.example.org/|1|1||0",
       "default deck: no icon file news.png for https://news.example.org/"},
      {"icon URL without a file name",
       [](std::vector<DeckSite>* s) {
         (*s)[2].icon = "..";
         (*s)[2].write_icon = false;
       },
       nullptr, 1, 2, "https://maps.example.com/|1|3||0",
       "default deck: no icon file (none) for https://maps.example.com/"},
      {"specially removed site", [](std::vector<DeckSite>* s) { (*s)[0].specially_removed = true; },
       nullptr, 0, 0, "https://news.example.org/|-1|1||0", ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    DbSession session(false);
    std::vector<DeckSite> sites = small_deck();
    if (c.damage != nullptr) c.damage(&sites);
    ASSERT_TRUE(write_deck(sites));
    if (c.after != nullptr) c.after();
    ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
    LogCapture log;
    EXPECT_EQ(sds_default_deck_load(), c.missing < 0 ? SDS_ERROR_NO_DATA : SDS_ERROR_NONE);
    std::vector<std::string> rows = {"https://news.example.org/|1|1|16x16|1",
                                     "https://mail.example.net/|1|2|12x10|1",
                                     "https://maps.example.com/|1|3|9x9|1"};
    rows[c.site] = c.row;
    EXPECT_EQ(DbSession::rows(kUrlsAndIcons),
              c.missing < 0 ? "" : rows[0] + "\n" + rows[1] + "\n" + rows[2]);
    EXPECT_TRUE(*c.logged == '\0' || log.contains(c.logged)) << c.logged;
    EXPECT_TRUE(log.contains(c.missing < 0
                                 ? "default deck not loaded: no item list in " +
                                       sds_path(SDS_DEFAULT_DECK_JSON_PATH)
                                 : "default deck loaded: 3 items (" + std::to_string(c.missing) +
                                       " icon files missing)"));
    EXPECT_TRUE(std::filesystem::is_empty(sds_path(SDS_IMAGES_DIR)));
    EXPECT_FALSE(file_exists(sds_path(SDS_ETAG_PATH)));
  }
}

// The sample deck shipped for installation loads whole: every site with its icon.
TEST(DefaultDeck, ShippedSampleDeckLoadsCompletely) {
  DbSession session(false);
  const std::filesystem::path shipped =
      std::filesystem::path(SITEDECK_SOURCE_DIR) / "packaging" / "default-deck";
  std::filesystem::copy(shipped, sds_path(SDS_DEFAULT_DECK_DIR));
  int icon_files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(shipped)) {
    if (entry.path().extension() == ".png") ++icon_files;
  }
  LogCapture log;
  open_like_the_worker();
  const std::string count = std::to_string(icon_files);
  EXPECT_TRUE(log.contains("default deck loaded: " + count + " items (0 icon files missing)"));
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck WHERE is_dirty = 1 AND "
                            "icon_data IS NOT NULL AND icon_size = '96x96' AND title != url"),
            count);
  EXPECT_EQ(DbSession::rows("SELECT count(*) FROM site_deck"), count);
  EXPECT_GE(icon_files, 6);
}

}  // namespace
