// The merge of a downloaded item list into a real database file.
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "pull/sitedeck-service-db-merge.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-utils.h"
#include "support/db_session.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/png_maker.h"

namespace {

constexpr const char* kA = "https://a.example/";
constexpr const char* kB = "https://b.example/";
constexpr const char* kC = "https://c.example/";
constexpr const char* kD = "https://d.example/";

class Merge : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_NE(sds_db_handle, nullptr); }

  // Merges the global list built so far, then releases it for the next list.
  static int merge() {
    int result = insert_sitedeck_items_in_db(sds_item_list_head);
    sds_free_item_list();
    return result;
  }
  // url|title|colour|is_dirty|order_index of every row, by URL.
  static std::string table() {
    return DbSession::rows(
        "SELECT url, title, dominant_color, is_dirty, order_index FROM site_deck ORDER BY url");
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

// Each case merges its lists one after another into an empty table; after each
// merge the table reads as given.
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
      {"first merge numbers sites in list order; no title is the URL",
       {{{{kC, "C", "#333333"}, {kA}, {kB, "", "#222222"}},
         "https://a.example/|https://a.example/||1|2\n"
         "https://b.example/|https://b.example/|#222222|1|3\n"
         "https://c.example/|C|#333333|1|1"}}},
      {"specially removed site is kept, also when gone from the list, and comes back",
       {{{{kA, "A"}, {kB, "B"}}, "https://a.example/|A||1|1\nhttps://b.example/|B||1|2"},
        {{{kA, "A"}, {kB, "B", nullptr, 1}}, kRemovedB},
        {{{kA, "A"}}, kRemovedB},
        {{{kB, "B"}, {kA, "A"}}, "https://a.example/|A||1|2\nhttps://b.example/|B||1|1"}}},
      {"items without URL take no number",
       {{{{nullptr, "no url"}, {kA, "A"}, {"", "empty url"}, {kB, "B"}},
         "https://a.example/|A||1|1\nhttps://b.example/|B||1|2"}}},
      {"a duplicate URL leaves one row with the second occurrence",
       {{{{kA, "A1", "#111111"}, {kB, "B"}, {kA, "A2", "#999999"}},
         "https://a.example/|A2|#999999|1|3\nhttps://b.example/|B||1|2"}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(db_.exec("DELETE FROM site_deck"));
    for (const Step& step : c.steps) {
      for (const Listed& l : step.list) add_item(l.url, l.title, l.colour, l.removed);
      LogCapture log;
      EXPECT_EQ(merge(), 0);
      EXPECT_EQ(table(), step.table);
      EXPECT_FALSE(log.contains("Not able to delete one URL"));
    }
  }
}

TEST_F(Merge, RefreshReordersAndDeletesVanishedLiveSites) {
  add_item(kA, "A", "#111111")->fav_icon_exists = 1;
  add_item(kB, "B", "#222222");
  add_item(kC, "C", "#333333");
  ASSERT_EQ(merge(), 0);

  add_item(kC, "C2", nullptr);  // a null colour keeps the stored one
  sds_item* a = add_item(kA, "A2", "#999999");
  a->fav_icon_exists = 0;
  a->touch_icons_exists = 1;
  EXPECT_EQ(merge(), 0);
  EXPECT_EQ(table(), "https://a.example/|A2|#999999|1|2\nhttps://c.example/|C2|#333333|1|1");
  // The flags of a stored row keep the values of its first insert.
  EXPECT_EQ(db_.rows("SELECT favicon_exists, touch_icon_exists FROM site_deck WHERE url = '" +
                     std::string(kA) + "'"),
            "1|0");
}

TEST_F(Merge, AllSpeciallyRemovedEndsWithMinusOneAfterStoringTheFlags) {
  add_item(kA, "A", nullptr, 1);
  add_item(kB, "B", nullptr, 1);
  LogCapture log;
  EXPECT_EQ(merge(), -1);
  EXPECT_TRUE(log.contains("Error : 6"));
  // Stored for good: another connection sees the rows.
  EXPECT_EQ(rows_of_file(db_.db_path(), "SELECT url, is_dirty, order_index FROM site_deck"),
            "https://a.example/|-1|1\nhttps://b.example/|-1|2");
}

TEST_F(Merge, StoresDownloadedIconsAndKeepsStoredOnes) {
  sds_item* a = add_item(kA, "A");
  add_icon(a, "https://a.example/i.png", "2x2", "t1");
  char* path = get_icon_path("https://a.example/i.png");
  ASSERT_TRUE(png_write_file(path, png_pattern(2, 2, 6, 8)));
  ASSERT_EQ(merge(), 0);
  EXPECT_FALSE(file_exists(path));
  std::free(path);

  add_item(kA, "A");  // icon unchanged: no icons left on the item
  EXPECT_EQ(merge(), 0);
  EXPECT_EQ(db_.rows("SELECT icon_size, icon_path, image_last_updated, length(icon_data) FROM "
                     "site_deck"),
            "2x2|https://a.example/i.png|t1|16");
}

// The merge writes each item's columns in one UPDATE; the single-column
// accessors, one after another, must leave exactly the same rows.
TEST_F(Merge, ItemsWrittenInOneUpdateEndAsWithTheSingleColumnWrites) {
  const std::string dump = "SELECT * FROM site_deck ORDER BY url";
  const std::string seed =
      "DELETE FROM site_deck; INSERT INTO site_deck(id, url, title, dominant_color, icon_size, "
      "icon_path, image_last_updated, icon_data, order_index) VALUES (5, 'https://a.example/', "
      "'A0', '#AAAAAA', '4x4', 'https://a.example/old.png', 'old', x'00', 9)";
  // A: stored, refreshed with a new icon whose size text is wrong, no colour
  // and no time stamp. B: new, with an icon, specially removed. C: new, no icon.
  auto build_list = [] {
    sds_item* a = add_item(kA, "A1");
    add_icon(a, "https://a.example/new.png", "9x9", "");
    sds_item* b = add_item(kB, nullptr, "#BBBBBB", 1);
    add_icon(b, "https://b.example/i.png", "3x2", "tb");
    add_item(kC, "C", "#CCCCCC");
  };
  auto write_icons = [] {
    UniqueCStr a(get_icon_path("https://a.example/new.png"));
    UniqueCStr b(get_icon_path("https://b.example/i.png"));
    return png_write_file(a.get(), png_pattern(2, 2, 2, 8)) &&
           png_write_file(b.get(), png_pattern(3, 2, 6, 8));
  };

  std::string merged;
  for (bool by_merge : {true, false}) {
    ASSERT_TRUE(db_.exec(seed));
    build_list();
    ASSERT_TRUE(write_icons());
    if (by_merge) {
      ASSERT_EQ(merge(), 0);
      merged = db_.rows(dump);
    }
  }
  int order = 1;
  for (sds_item* item = sds_item_list_head; item != nullptr; item = item->next, ++order) {
    if (item->site_name == nullptr) item->site_name = strdup(item->site_url);
    int code = 0;
    int id =
        sds_db_check_duplicated_string(sds_db_handle, "site_deck", "url", item->site_url, &code);
    const bool stored = id >= 0;
    if (!stored) id = sds_db_create_site_deck_item(sds_db_handle, item, &code);
    if (item->ps_sds_icon_list != nullptr) {
      EXPECT_EQ(update_sitedeck_icon_to_db(id, item), SDS_ERROR_NONE);
    }
    EXPECT_EQ(update_sitedeck_order_index_to_db(id, &order), 0);
    if (stored) {
      EXPECT_EQ(update_sitedeck_title_to_db(id, item->site_name), 0);
      if (item->predominant_color != nullptr) {
        EXPECT_EQ(update_sitedeck_predominant_color_to_db(id, item->predominant_color), 0);
      }
    }
    EXPECT_EQ(update_sitedeck_is_specially_removed(id, item->is_specially_removed), 0);
  }
  sds_free_item_list();
  EXPECT_EQ(db_.rows(dump), merged);
  EXPECT_EQ(merged,
            "5|https://a.example/|A1|0|#AAAAAA|0|NULL|1|old|2x2|https://a.example/new.png|blob:16|"
            "1|NULL|NULL|NULL|NULL\n"
            "6|https://b.example/|https://b.example/|0|#BBBBBB|1|NULL|-1|tb|3x2|"
            "https://b.example/i.png|blob:24|2|NULL|NULL|NULL|NULL\n"
            "7|https://c.example/|C|0|#CCCCCC|0|NULL|1||||NULL|3|NULL|NULL|NULL|NULL");
}

TEST_F(Merge, EmptyListIsRefusedInsteadOfDeletingEverySite) {
  add_item(kA, "A");
  ASSERT_EQ(merge(), 0);
  EXPECT_EQ(insert_sitedeck_items_in_db(nullptr), SDS_MERGE_NOT_COMMITTED);
  EXPECT_EQ(db_.rows("SELECT count(*) FROM site_deck"), "1");
}

TEST_F(Merge, LongListIsMergedAndCleanedUp) {
  for (int i = 0; i < 2000; ++i) add_item(("https://s" + std::to_string(i) + ".example/").c_str());
  ASSERT_EQ(merge(), 0);
  for (int i = 1999; i >= 0; i -= 2)
    add_item(("https://s" + std::to_string(i) + ".example/").c_str());
  EXPECT_EQ(merge(), 0);
  EXPECT_EQ(db_.rows("SELECT count(*), min(order_index), max(order_index) FROM site_deck"),
            "1000|1|1000");
  EXPECT_EQ(db_.rows("SELECT url FROM site_deck WHERE order_index = 1"), "https://s1999.example/");
  EXPECT_EQ(db_.rows("SELECT count(*) FROM site_deck WHERE url LIKE '%0.example/'"), "0");
}

// Denies reads of order_index, which only the clean-up's id list does.
int deny_order_index(void*, int action, const char*, const char* column, const char*, const char*) {
  if (action == SQLITE_READ && column != nullptr && std::strcmp(column, "order_index") == 0) {
    return SQLITE_DENY;
  }
  return SQLITE_OK;
}

struct PauseState {
  int ready_fd;
  int changes;
  int pause_at;
};

// Signals the parent and stops for good after `pause_at` row changes.
void pause_after_changes(void* arg, int, const char*, const char*, sqlite3_int64) {
  auto* state = static_cast<PauseState*>(arg);
  if (++state->changes != state->pause_at) return;
  char byte = 'x';
  (void)!write(state->ready_fd, &byte, 1);
  for (;;) pause();
}

TEST_F(Merge, MergeCutInHalfIsNeverSeenAndNeverLeftBehind) {
  add_item(kA, "A");
  add_item(kB, "B");
  ASSERT_EQ(merge(), 0);
  const std::string dump = "SELECT * FROM site_deck ORDER BY id";
  std::string before = db_.rows(dump);
  DbSession::close_handle();

  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    // The child merges [D, A, C] on its own connection and freezes after
    // inserting D and renumbering A, as a process killed mid-way would.
    close(fds[0]);
    if (sds_ensure_db_open() != SDS_ERROR_NONE) _exit(2);
    PauseState state{fds[1], 0, 4};
    sqlite3_update_hook(sds_db_handle, pause_after_changes, &state);
    add_item(kD, "D");
    add_item(kA, "A2");
    add_item(kC, "C");
    (void)insert_sitedeck_items_in_db(sds_item_list_head);
    _exit(3);
  }
  close(fds[1]);
  pollfd ready{fds[0], POLLIN, 0};
  ASSERT_EQ(poll(&ready, 1, 60000), 1);
  char byte = 0;
  EXPECT_EQ(read(fds[0], &byte, 1), 1);
  close(fds[0]);

  // A reader during the merge sees the previous table.
  EXPECT_EQ(rows_of_file(db_.db_path(), dump), before);

  ASSERT_EQ(kill(pid, SIGKILL), 0);
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFSIGNALED(status));

  // The next opening rolls the cut merge back.
  ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_EQ(db_.rows(dump), before);
}

TEST_F(Merge, FailedRowWritesWereCommittedAsIfTheListWasStored) {
  // Triggers make the writes fail as a disk that turned read-only would; with
  // no event, the clean-up's id list cannot be read: the previous table stays whole.
  const char* const kRow = "a row of the list could not be written";
  const struct {
    const char* event;
    const char* message;
  } cases[] = {{"INSERT", kRow},
               {"UPDATE OF order_index", kRow},
               {"DELETE", "Not able to delete one URL"},
               {nullptr, "Error : 5"}};
  add_item(kA, "A");
  add_item(kB, "B");
  ASSERT_EQ(merge(), 0);
  const std::string before = db_.rows("SELECT * FROM site_deck ORDER BY id");
  for (const auto& c : cases) {
    SCOPED_TRACE(c.event ? c.event : "clean-up");
    ASSERT_TRUE(c.event ? db_.exec(std::string("CREATE TRIGGER fail BEFORE ") + c.event +
                                   " ON site_deck BEGIN SELECT RAISE(ABORT, 'no'); END")
                        : sqlite3_set_authorizer(sds_db_handle, deny_order_index, nullptr) == 0);
    add_item(kC, "C");
    add_item(kA, "A");
    LogCapture log;
    EXPECT_EQ(merge(), SDS_MERGE_NOT_COMMITTED);
    EXPECT_TRUE(log.contains(c.message));
    sqlite3_set_authorizer(sds_db_handle, nullptr, nullptr);
    ASSERT_TRUE(!c.event || db_.exec("DROP TRIGGER fail"));
    EXPECT_EQ(db_.rows("SELECT * FROM site_deck ORDER BY id"), before);
  }
}

}  // namespace
