// Statements kept for reuse while an SdsDbStatementScope lives.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt-cache.h"
#include "support/db_session.h"
#include "support/log_capture.h"

namespace {

int live_statements() {
  int count = 0;
  for (sqlite3_stmt* s = sqlite3_next_stmt(sds_db_handle, nullptr); s != nullptr;
       s = sqlite3_next_stmt(sds_db_handle, s)) {
    ++count;
  }
  return count;
}

// Reads by URL: the serving reads by id are kept by the connection for good
// and never go through a scope.
std::string read(int id, const char* column) {
  const std::string url = id == 1 ? "https://a.example/" : id == 2 ? "https://b.example/" : "none";
  char* value = nullptr;
  int code = sds_get_string_for_url_from_db(url.c_str(), &value, column);
  std::string text = code == SDS_ERROR_NONE ? value : "<" + std::to_string(code) + ">";
  std::free(value);
  return text;
}

class StatementScope : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(sds_db_handle, nullptr);
    ASSERT_TRUE(
        db_.exec("INSERT INTO site_deck(id, url, title) VALUES (1, 'https://a.example/', "
                 "'A'), (2, 'https://b.example/', 'B')"));
  }
  DbSession db_;
};

TEST_F(StatementScope, KeepsOneStatementPerTextUntilItEnds) {
  EXPECT_EQ(read(1, "url"), "https://a.example/");
  EXPECT_EQ(live_statements(), 0);
  {
    SdsDbStatementScope scope(sds_db_handle);
    EXPECT_EQ(read(1, "url"), "https://a.example/");
    EXPECT_EQ(read(2, "url"), "https://b.example/");
    EXPECT_EQ(read(9, "url"), "<8>");
    EXPECT_EQ(live_statements(), 1);
    EXPECT_EQ(read(2, "title"), "B");
    EXPECT_EQ(live_statements(), 2);
  }
  EXPECT_EQ(live_statements(), 0);
  EXPECT_EQ(read(2, "title"), "B");
}

TEST_F(StatementScope, ScopeInsideAScopeLeavesTheOuterOneInCharge) {
  SdsDbStatementScope outer(sds_db_handle);
  {
    SdsDbStatementScope inner(sds_db_handle);
    EXPECT_EQ(read(1, "title"), "A");
  }
  EXPECT_EQ(live_statements(), 1);
  EXPECT_EQ(read(1, "title"), "A");
  EXPECT_EQ(live_statements(), 1);
}

TEST_F(StatementScope, StatementInUseIsNotHandedOutTwice) {
  SdsDbStatementScope scope(sds_db_handle);
  const char* sql = "SELECT title FROM site_deck WHERE id IS ?";
  sqlite3_stmt* first = nullptr;
  ASSERT_EQ(sqlite3_prepare_v2(sds_db_handle, sql, -1, &first, nullptr), SQLITE_OK);
  ASSERT_TRUE(sds_db_stmt_cache_keep(sds_db_handle, sql, first));
  EXPECT_EQ(sds_db_stmt_cache_take(sds_db_handle, sql), nullptr);
  ASSERT_EQ(sqlite3_bind_int(first, 1, 2), SQLITE_OK);
  ASSERT_EQ(sqlite3_step(first), SQLITE_ROW);
  EXPECT_TRUE(sds_db_stmt_cache_give_back(first));

  // Given back: reset, with its binding cleared, and handed out again.
  sqlite3_stmt* again = sds_db_stmt_cache_take(sds_db_handle, sql);
  EXPECT_EQ(again, first);
  EXPECT_EQ(sqlite3_step(again), SQLITE_DONE);  // "id IS NULL": nothing bound
  EXPECT_TRUE(sds_db_stmt_cache_give_back(again));

  sqlite3_stmt* other = nullptr;
  ASSERT_EQ(sqlite3_prepare_v2(sds_db_handle, "SELECT 1", -1, &other, nullptr), SQLITE_OK);
  EXPECT_FALSE(sds_db_stmt_cache_give_back(other));
  sqlite3_finalize(other);
  EXPECT_EQ(sds_db_stmt_cache_take(nullptr, sql), nullptr);
}

TEST_F(StatementScope, FailedStepIsLoggedAsOutsideAndTheStatementServesAgain) {
  const int taken = 2;
  int code = 0;
  std::vector<LogLine> outside;
  {
    LogCapture log;
    EXPECT_EQ(sds_db_column_replace(sds_db_handle, 1, "site_deck", "id", &taken, 0,
                                    SDS_DB_COLUMN_TYPE_INT, &code),
              -1);
    outside = log.lines();
  }
  SdsDbStatementScope scope(sds_db_handle);
  LogCapture inside;
  EXPECT_EQ(sds_db_column_replace(sds_db_handle, 1, "site_deck", "id", &taken, 0,
                                  SDS_DB_COLUMN_TYPE_INT, &code),
            -1);
  EXPECT_EQ(code, SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(inside.contains("sqlite3_finalize:UNIQUE constraint failed: site_deck.id"));
  ASSERT_EQ(inside.lines().size(), outside.size());
  for (size_t i = 0; i < outside.size(); ++i) {
    EXPECT_EQ(inside.lines()[i].message, outside[i].message);
  }

  const int free_id = 7;
  EXPECT_EQ(sds_db_column_replace(sds_db_handle, 1, "site_deck", "id", &free_id, 0,
                                  SDS_DB_COLUMN_TYPE_INT, &code),
            0);
  EXPECT_EQ(live_statements(), 1);
  EXPECT_EQ(db_.rows("SELECT id, title FROM site_deck ORDER BY id"), "2|B\n7|A");
}

TEST_F(StatementScope, ReadTransactionSpansItsReadsAndLeavesAnOuterOneOpen) {
  {
    SdsDbReadTransaction reading(sds_db_handle);
    EXPECT_EQ(sqlite3_get_autocommit(sds_db_handle), 0);
    EXPECT_EQ(read(1, "title"), "A");
    EXPECT_EQ(read(2, "title"), "B");
  }
  EXPECT_NE(sqlite3_get_autocommit(sds_db_handle), 0);

  ASSERT_TRUE(db_.exec("BEGIN IMMEDIATE; UPDATE site_deck SET title = 'A2' WHERE id = 1"));
  {
    SdsDbReadTransaction reading(sds_db_handle);
    EXPECT_EQ(read(1, "title"), "A2");
  }
  EXPECT_EQ(sqlite3_get_autocommit(sds_db_handle), 0);
  ASSERT_TRUE(db_.exec("ROLLBACK"));
  EXPECT_EQ(read(1, "title"), "A");
}

std::string mapping_size() { return DbSession::rows("PRAGMA mmap_size"); }

// A pull read the whole file through the memory mapping (the quick check, a
// merge of 5000 icons) and kept every page of it in its resident memory.
TEST_F(StatementScope, PulledFileStayedResidentThroughTheMapping) {
  const std::string configured = mapping_size();
  ASSERT_NE(configured, "0");
  {
    SdsDbFileMappingPause unmapped(sds_db_handle);
    EXPECT_EQ(mapping_size(), "0");
    EXPECT_EQ(read(2, "title"), "B");
    {
      SdsDbFileMappingPause again(sds_db_handle);  // nothing mapped: nothing to do
      EXPECT_EQ(mapping_size(), "0");
    }
    EXPECT_EQ(mapping_size(), "0");
  }
  EXPECT_EQ(mapping_size(), configured);
  EXPECT_EQ(read(2, "title"), "B");
}

}  // namespace
