// The merge of an item list into a real database file, and the default deck
// that goes through the same parse and merge: loaded at a first start, served
// through the socket, replaced by the first pull, harmless when damaged.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "pull/sitedeck-service-db-merge.h"
#include "pull/sitedeck-service-default-deck.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "sitedeck-client-deck.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/default_deck.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/pull_env.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"

namespace {

constexpr const char* kA = "https://a.example/";
constexpr const char* kB = "https://b.example/";
constexpr const char* kC = "https://c.example/";

class Merge : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_NE(sds_db_handle, nullptr); }
  // Merges the global list built so far, then releases it for the next list.
  static int merge() {
    int result = insert_sitedeck_items_in_db(sds_item_list_head);
    sds_free_item_list();
    return result;
  }
  DbSession db_;
  ItemListGuard guard_;
};

struct Listed {
  const char* url;
  const char* title = nullptr;
  const char* colour = nullptr;
  int removed = 0;
};

// Each case merges its lists in turn into an empty table, which then reads
// url|title|colour|is_dirty|order_index by URL as given.
TEST_F(Merge, ListsEndAsTheirTables) {
  struct Step {
    std::vector<Listed> list;
    const char* table;
  };
  const char* const kRemovedB = "https://a.example/|A||1|1\nhttps://b.example/|B||-1|2";
  const struct {
    const char* name;
    std::vector<Step> steps;
  } cases[] = {
      {"sites numbered in list order, without URL none, a title missing is the URL",
       {{{{kC, "C", "#333333"}, {nullptr, "no url"}, {kA}, {"", "empty"}, {kB, "", "#222222"}},
         "https://a.example/|https://a.example/||1|2\n"
         "https://b.example/|https://b.example/|#222222|1|3\nhttps://c.example/|C|#333333|1|1"}}},
      {"a specially removed site stays, also when gone from the list, and comes back",
       {{{{kA, "A"}, {kB, "B", nullptr, 1}}, kRemovedB},
        {{{kA, "A"}}, kRemovedB},
        {{{kB, "B"}, {kA, "A"}}, "https://a.example/|A||1|2\nhttps://b.example/|B||1|1"}}},
      {"a repeated URL leaves one row with its last entry, and vanished sites go",
       {{{{kA, "A"}, {kC, "C"}}, "https://a.example/|A||1|1\nhttps://c.example/|C||1|2"},
        {{{kA, "A1", "#111111"}, {kB, "B"}, {kA, "A2", "#999999"}},
         "https://a.example/|A2|#999999|1|3\nhttps://b.example/|B||1|2"}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(db_.exec("DELETE FROM site_deck"));
    for (const Step& step : c.steps) {
      for (const Listed& l : step.list) add_item(l.url, l.title, l.colour, l.removed);
      EXPECT_EQ(merge(), 0);
      EXPECT_EQ(db_.rows("SELECT url, title, dominant_color, is_dirty, order_index FROM site_deck "
                         "ORDER BY url"),
                step.table);
    }
  }
}

// Denies reads of order_index, which only the clean-up's id list does.
int deny_order_index(void*, int action, const char*, const char* column, const char*, const char*) {
  return action == SQLITE_READ && column != nullptr && std::strcmp(column, "order_index") == 0
             ? SQLITE_DENY
             : SQLITE_OK;
}

// A merge whose row writes failed (a disk turned read-only or full) was
// committed as if whole, with its ETag; a list without sites deleted them all.
TEST_F(Merge, FailedRowWritesWereCommittedAsIfTheListWasStored) {
  const char* const kRow = "a row of the list could not be written";
  const struct {
    const char* name;
    const char* trigger;  // the write the trigger fails; null: none
    bool deny_ids;        // the clean-up's id list cannot be read
    bool empty;           // the list has no site (EmptyListIsRefusedInsteadOfDeletingEverySite)
    const char* message;
  } cases[] = {{"insert", "INSERT", false, false, kRow},
               {"renumbering", "UPDATE OF order_index", false, false, kRow},
               {"delete", "DELETE", false, false, "Not able to delete one URL"},
               {"clean-up", nullptr, true, false, "Error : 5"},
               {"EmptyListIsRefusedInsteadOfDeletingEverySite", nullptr, false, true,
                "NULL check::item"}};
  add_item(kA, "A");
  add_item(kB, "B");
  ASSERT_EQ(merge(), 0);
  const std::string before = db_.rows("SELECT * FROM site_deck ORDER BY id");
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.trigger != nullptr) {
      ASSERT_TRUE(db_.exec(std::string("CREATE TRIGGER fail BEFORE ") + c.trigger +
                           " ON site_deck BEGIN SELECT RAISE(ABORT, 'no'); END"));
    }
    if (c.deny_ids) sqlite3_set_authorizer(sds_db_handle, deny_order_index, nullptr);
    if (!c.empty) {
      add_item(kC, "C");
      add_item(kA, "A");
    }
    LogCapture log;
    EXPECT_EQ(merge(), SDS_MERGE_NOT_COMMITTED);
    EXPECT_TRUE(log.contains(c.message));
    sqlite3_set_authorizer(sds_db_handle, nullptr, nullptr);
    ASSERT_TRUE(c.trigger == nullptr || db_.exec("DROP TRIGGER fail"));
    EXPECT_EQ(db_.rows("SELECT * FROM site_deck ORDER BY id"), before);
  }
}

constexpr const char* kUrlsAndIcons =
    "SELECT url, is_dirty, order_index, icon_size, icon_data IS NOT NULL FROM site_deck "
    "ORDER BY order_index";

// Each damage leaves what the merge makes of the rest, and says what it was.
TEST(DefaultDeck, DamagedDecks) {
  const struct {
    const char* name;
    void (*damage)(std::vector<DeckSite>* sites);  // before the deck is written
    void (*after)();                               // after it is written
    int missing;      // icon files the load line counts; -1: nothing loaded
    int site;         // the site whose row (kUrlsAndIcons) differs from an intact load
    const char* row;  // that row
    const char* logged;
  } cases[] = {
      {"list is not JSON", nullptr, [] { ASSERT_TRUE(write_deck_list("{\"global\": [")); }, -1, 0,
       "", "[CRITICAL] parent.key is null"},
      {"icon file missing", [](std::vector<DeckSite>* s) { (*s)[1].write_icon = false; }, nullptr,
       1, 1, "https://mail.example.net/|1|2||0",
       "default deck: no icon file mail.png for https://mail.example.net/"},
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
  for (const auto& c : cases) {
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
  }
}

// The sample deck shipped for installation is served whole at a first start,
// every site with its icon; nothing claims it came from a server, so the
// first pull is unconditional and replaces it.
TEST(DefaultDeck, ShippedDeckIsServedAtAFirstStartAndTheFirstPullReplacesIt) {
  TempRoot root;
  ContentServerProcess content;
  ASSERT_TRUE(content.ok());
  ASSERT_TRUE(write_server_list({{1, content.base_url()}}));
  const std::filesystem::path shipped =
      std::filesystem::path(SITEDECK_SOURCE_DIR) / "packaging" / "default-deck";
  std::filesystem::copy(shipped, root.path(SDS_DEFAULT_DECK_DIR));
  int icon_files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(shipped)) {
    icon_files += entry.path().extension() == ".png";
  }
  ASSERT_GE(icon_files, 6);

  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  sds_client_ids ids;
  ASSERT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_NONE) << service.output();
  ASSERT_EQ(ids.count, icon_files);
  for (int i = 0; i < icon_files; ++i) {
    sds_client_item item;
    ASSERT_EQ(sds_client_read_item(connection, ids.ids.get()[i], true, &item), SDS_ERROR_NONE);
    EXPECT_STRNE(item.title.get(), item.url.get()) << i;
    ASSERT_EQ(item.icon_status, SDS_ERROR_NONE) << item.url.get();
    EXPECT_EQ(std::to_string(item.icon.width) + "x" + std::to_string(item.icon.height), "96x96");
  }
  EXPECT_TRUE(service.has_message("default deck loaded: " + std::to_string(icon_files) +
                                  " items (0 icon files missing)"));
  EXPECT_FALSE(file_exists(root.path(SDS_ETAG_PATH)));
  EXPECT_TRUE(std::filesystem::is_empty(root.path(SDS_IMAGES_DIR)));

  ASSERT_EQ(sds_client_initialize(connection, 1000.0, 0, "2.0"), SDS_ERROR_NONE);
  EXPECT_EQ(content.stats()["last_if_none_match"], "");
  connection.close();
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
  EXPECT_EQ(rows_of_file(root.path(SDS_DB_PATH),
                         "SELECT count(*), sum(url NOT LIKE '%.example/') FROM site_deck"),
            "25|0");
}

}  // namespace
