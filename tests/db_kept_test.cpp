// What the connection keeps between reads: prepared statements, and the
// served columns of the rows it read lately. Kept or not, a read must give
// the same codes, values and log lines, and see every committed change, by
// this connection or any other, at once.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db.h"
#include "support/db_session.h"
#include "support/log_capture.h"

namespace {

// The outcome of one read as a caller sees it.
struct read_outcome {
  int result = 0;
  int code = 0;
  std::string value;
  std::vector<std::string> log;

  bool operator==(const read_outcome&) const = default;
};

std::ostream& operator<<(std::ostream& out, const read_outcome& o) {
  out << "result " << o.result << " code " << o.code << " value '" << o.value << "' log:";
  for (const auto& line : o.log) out << " [" << line << "]";
  return out;
}

// A text read, or with `as_int` an integer read shown as its eight bytes.
read_outcome read(int id, const char* column, bool as_int) {
  LogCapture log;
  read_outcome outcome;
  char* text = nullptr;
  sds_db_value value{};
  outcome.result = as_int ? sds_db_get_property_int(sds_db_handle, id, "site_deck", column, &value,
                                                    &outcome.code)
                          : sds_db_get_property_string(sds_db_handle, id, "site_deck", column,
                                                       &text, &outcome.code);
  outcome.value = as_int ? std::to_string(value.i64) : text != nullptr ? text : "";
  std::free(text);
  for (const auto& line : log.lines()) outcome.log.push_back(line.message);
  return outcome;
}
read_outcome read_text(int id, const char* column) { return read(id, column, false); }
read_outcome read_int(int id, const char* column) { return read(id, column, true); }

// The same read inside a transaction, where nothing kept is used.
template <typename Read>
read_outcome read_from_table(Read read) {
  EXPECT_TRUE(DbSession::exec("BEGIN"));
  read_outcome outcome = read();
  EXPECT_TRUE(DbSession::exec("COMMIT"));
  return outcome;
}

// Changes the table through a connection of its own, as another process would.
void change_elsewhere(const std::string& path, const std::string& sql) {
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open_v2(path.c_str(), &other, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(other, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
      << sqlite3_errmsg(other);
  sqlite3_close(other);
}

class DbKept : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(sds_db_handle, nullptr);
    ASSERT_TRUE(db_.exec(
        "INSERT INTO site_deck(id, url, title, dominant_color, icon_size, touch_icon_exists, "
        "favicon_exists) VALUES (1, 'https://a.example/', 'A', '#010203', '2x1', 1, 0), "
        "(2, NULL, '', 5, x'00', 2.75, 'text'), (3, 'https://c.example/', 'C', NULL, NULL, NULL, "
        "4294967297)"));
  }
  DbSession db_;
};

TEST_F(DbKept, KeptColumnsReadAsTheTableDoes) {
  const std::pair<const char*, bool> columns[] = {{"url", false},
                                                  {"title", false},
                                                  {"dominant_color", false},
                                                  {"icon_size", false},
                                                  {"touch_icon_exists", true},
                                                  {"favicon_exists", true}};
  for (int id : {1, 2, 3, 9}) {
    for (const auto& entry : columns) {
      // Named copies: clang 14 can't capture structured bindings in a lambda.
      const char* column = entry.first;
      const bool as_int = entry.second;
      SCOPED_TRACE(std::to_string(id) + " " + column);
      read_outcome from_table = read_from_table([&] { return read(id, column, as_int); });
      // The first read fills what is kept, the second is answered from it.
      EXPECT_EQ(read(id, column, as_int), from_table);
      EXPECT_EQ(read(id, column, as_int), from_table);
    }
  }
  // A few of the outcomes themselves, should both ways be wrong alike.
  EXPECT_EQ(read_text(1, "title"), (read_outcome{0, SDS_ERROR_NONE, "A", {}}));
  EXPECT_EQ(read_text(2, "url"), (read_outcome{0, SDS_ERROR_NO_DATA, "", {"check column type:5"}}));
  EXPECT_EQ(read_text(2, "title"), (read_outcome{0, SDS_ERROR_NO_DATA, "", {}}));
  EXPECT_EQ(read_text(9, "url"), (read_outcome{-1, SDS_ERROR_ID_NOT_FOUND, "", {}}));
  // An INTEGER arrives in the first four bytes, a REAL converted over eight.
  EXPECT_EQ(read_int(3, "favicon_exists"), (read_outcome{0, SDS_ERROR_NONE, "1", {}}));
  EXPECT_EQ(read_int(2, "touch_icon_exists"), (read_outcome{0, SDS_ERROR_NONE, "2", {}}));
}

TEST_F(DbKept, CommitsOfAnotherConnectionAreSeenAtOnce) {
  ASSERT_EQ(read_text(1, "title").value, "A");
  ASSERT_EQ(read_int(1, "touch_icon_exists").value, "1");
  change_elsewhere(db_.db_path(), "UPDATE site_deck SET title = 'A2', touch_icon_exists = 0");
  EXPECT_EQ(read_text(1, "title").value, "A2");
  EXPECT_EQ(read_int(1, "touch_icon_exists").value, "0");

  change_elsewhere(db_.db_path(), "DELETE FROM site_deck WHERE id = 1");
  EXPECT_EQ(read_text(1, "title").code, SDS_ERROR_ID_NOT_FOUND);
  change_elsewhere(db_.db_path(), "INSERT INTO site_deck(id, title) VALUES (1, 'back')");
  EXPECT_EQ(read_text(1, "title").value, "back");
}

TEST_F(DbKept, WritesOfThisConnectionAreSeenAndItsOpenTransactionToo) {
  ASSERT_EQ(read_text(1, "title").value, "A");
  EXPECT_EQ(update_sitedeck_title_to_db(1, "written"), 0);
  EXPECT_EQ(read_text(1, "title").value, "written");

  ASSERT_TRUE(db_.exec("BEGIN"));
  ASSERT_TRUE(db_.exec("UPDATE site_deck SET title = 'not yet' WHERE id = 1"));
  EXPECT_EQ(read_text(1, "title").value, "not yet");
  ASSERT_TRUE(db_.exec("ROLLBACK"));
  EXPECT_EQ(read_text(1, "title").value, "written");
}

TEST_F(DbKept, ClosingTheConnectionFinalizesWhatItKept) {
  sds_db_close(nullptr);  // no connection: nothing to do
  __db_finalize(nullptr);
  ASSERT_EQ(read_text(1, "url").value, "https://a.example/");
  unsigned char* bytes = nullptr;
  int length = 0, height = 0, width = 0;
  ASSERT_TRUE(db_.exec("UPDATE site_deck SET icon_data = x'0102' WHERE id = 1"));
  ASSERT_EQ(sds_get_blob_from_db(1, &length, &height, &width, &bytes), SDS_ERROR_NONE);
  std::free(bytes);
  LogCapture log;
  sds_db_close(sds_db_handle);  // logs "check sqlite close" when statements are left
  sds_db_handle = nullptr;
  EXPECT_TRUE(log.lines().empty());
}

}  // namespace
