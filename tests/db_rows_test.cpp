// The generic row and column operations on a real database file.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db.h"
#include "pull/sitedeck-service-request-server.h"
#include "support/db_session.h"
#include "support/items.h"
#include "support/log_capture.h"

namespace {

class DbRows : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(sds_db_handle, nullptr);
    // id 1: every kind of value the reads meet.
    ASSERT_TRUE(db_.exec(
        "INSERT INTO site_deck(id, url, title, dominant_color, icon_size, favicon_exists, "
        "order_index, icon_data) VALUES (1, 'https://a.example/', NULL, '', '96x64', 1, 2.5, "
        "x'0102')"));
  }
  DbSession db_;
};

char* const kUntouched = reinterpret_cast<char*>(0x1);

struct TextRead {
  const char* name;
  int id;
  const char* column;
  int result;
  int code;
  const char* value;    // null: output untouched
  const char* message;  // expected log line, or null for none
};

TEST_F(DbRows, TextReadsTellMissingRowsFromMissingValues) {
  const TextRead cases[] = {
      {"value", 1, "url", 0, SDS_ERROR_NONE, "https://a.example/", nullptr},
      {"null value", 1, "title", 0, SDS_ERROR_NO_DATA, nullptr, "check column type:5"},
      {"empty text", 1, "dominant_color", 0, SDS_ERROR_NO_DATA, nullptr, nullptr},
      {"integer column", 1, "favicon_exists", 0, SDS_ERROR_NO_DATA, nullptr, "check column type:1"},
      {"unknown id", 99, "url", -1, SDS_ERROR_ID_NOT_FOUND, nullptr, nullptr},
      {"id 0", 0, "url", -1, SDS_ERROR_INVALID_PARAMETER, nullptr, "check id:0"},
      {"bad column", 1, "nothing", -1, SDS_ERROR_INVALID_PARAMETER, nullptr,
       "Before finalize, sqlite response code 1"},
  };
  for (const TextRead& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    char* value = kUntouched;
    int code = -5;
    EXPECT_EQ(sds_db_get_property_string(sds_db_handle, c.id, "site_deck", c.column, &value, &code),
              c.result);
    EXPECT_EQ(code, c.code);
    if (c.value != nullptr) {
      ASSERT_NE(value, kUntouched);
      EXPECT_STREQ(value, c.value);
      std::free(value);
    } else {
      EXPECT_EQ(value, kUntouched);
    }
    if (c.message != nullptr) {
      EXPECT_TRUE(log.contains(c.message));
    } else {
      EXPECT_TRUE(log.lines().empty());
    }
  }
  LogCapture log;
  int code = 0;
  EXPECT_EQ(sds_db_get_property_string(sds_db_handle, 1, "site_deck", "url", nullptr, &code), -1);
  EXPECT_EQ(code, SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log.contains("check materials for query id:1"));
  EXPECT_EQ(sds_db_get_property_string(nullptr, 1, "site_deck", "url", nullptr, &code), -1);
  EXPECT_TRUE(log.contains("check connection handle"));
}

TEST_F(DbRows, IntegerAndBlobReads) {
  ASSERT_TRUE(db_.exec("INSERT INTO site_deck(id, url) VALUES (2, 'b')"));
  sds_db_value value{};
  int code = -5;
  EXPECT_EQ(sds_db_get_property_int(sds_db_handle, 1, "site_deck", "order_index", &value, &code),
            0);
  EXPECT_EQ(code, SDS_ERROR_NONE);
  EXPECT_EQ(value.i64, 2);  // a REAL arrives converted over all eight bytes
  LogCapture log;
  value.i64 = 77;
  for (auto [id, column] : {std::pair{99, "is_dirty"}, std::pair{2, "title"}}) {
    EXPECT_EQ(sds_db_get_property_int(sds_db_handle, id, "site_deck", column, &value, &code), 0);
    EXPECT_EQ(code, SDS_ERROR_NO_DATA);
  }
  EXPECT_EQ(log.count("check column type:5"), 1);
  EXPECT_EQ(value.i64, 77);

  const struct {
    int id, result, code;
    std::string bytes;
  } blobs[] = {{1, 0, SDS_ERROR_NONE, "\x01\x02"},
               {2, 0, SDS_ERROR_NO_DATA, ""},
               {9, -1, SDS_ERROR_ID_NOT_FOUND, ""}};
  for (const auto& c : blobs) {
    SCOPED_TRACE(c.id);
    unsigned char* bytes = nullptr;
    int size = 99;
    EXPECT_EQ(sds_db_get_property_blob(sds_db_handle, c.id, "site_deck", "icon_data", &bytes, &size,
                                       &code),
              c.result);
    EXPECT_EQ(code, c.code);
    ASSERT_EQ(size, int(c.bytes.size()));
    EXPECT_EQ(bytes == nullptr, c.bytes.empty());
    EXPECT_EQ(bytes ? std::string(reinterpret_cast<char*>(bytes), size) : "", c.bytes);
    std::free(bytes);
  }
}

TEST_F(DbRows, TextReadByUrl) {
  char* value = nullptr;
  int code = -5;
  EXPECT_EQ(sds_db_get_property_string_for_url(sds_db_handle, "https://a.example/", "site_deck",
                                               "icon_size", &value, &code),
            0);
  EXPECT_EQ(code, SDS_ERROR_NONE);
  EXPECT_STREQ(value, "96x64");
  std::free(value);
  value = kUntouched;
  LogCapture log;
  const struct {
    const char *url, *column;
    int code;
    const char* message;
  } cases[] = {
      {"https://other/", "icon_size", SDS_ERROR_ID_NOT_FOUND, nullptr},
      {"", "url", SDS_ERROR_INVALID_PARAMETER, "Url is null or empty"},
      {"u", nullptr, SDS_ERROR_INVALID_PARAMETER, "check materials for query for url = u"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.url);
    EXPECT_EQ(sds_db_get_property_string_for_url(sds_db_handle, c.url, "site_deck", c.column,
                                                 &value, &code),
              -1);
    EXPECT_TRUE(c.message == nullptr || log.contains(c.message));
  }
  EXPECT_EQ(value, kUntouched);
}

std::string ids_of(const char* cond_column, const void* cond_value, int cond_type, int* result,
                   int* code) {
  int* ids = nullptr;
  int count = -1;
  *result = sds_db_get_all_dirty_ids(sds_db_handle, &ids, &count, cond_column, cond_value,
                                     cond_type, code);
  if (ids == nullptr) return count == -1 ? "<untouched>" : "<count only>";
  std::string out;
  for (int i = 0; i < count; ++i) out += (i ? "," : "") + std::to_string(ids[i]);
  std::free(ids);
  return out;
}

TEST_F(DbRows, IdListsComeInOrderIndexOrder) {
  ASSERT_TRUE(db_.exec(
      "INSERT INTO site_deck(id, url, order_index, is_dirty) VALUES (2, 'b', 3, 1), (3, 'c', 1, "
      "1), (4, 'd', 0, -1), (5, 'e', 4, 1)"));
  int result = 0;
  int code = 0;
  EXPECT_EQ(ids_of(nullptr, nullptr, 0, &result, &code), "3,1,2,5");
  EXPECT_EQ(result, 0);
  EXPECT_EQ(code, SDS_ERROR_NONE);
  int removed = -1;
  EXPECT_EQ(ids_of("is_dirty", &removed, SDS_DB_COND_TYPE_INT, &result, &code), "4");
  EXPECT_EQ(ids_of("url", "c", SDS_DB_COND_TYPE_TEXT, &result, &code), "3");
  // A column without a value is compared with 1.
  EXPECT_EQ(ids_of("favicon_exists", nullptr, 7, &result, &code), "1");

  LogCapture log;
  EXPECT_EQ(ids_of("url", "c", 7, &result, &code), "<untouched>");
  EXPECT_EQ(result, -1);
  EXPECT_EQ(code, SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log.contains("invalid type:7"));

  // No matching row: no data, outputs untouched.
  ASSERT_TRUE(db_.exec("UPDATE site_deck SET is_dirty = -1"));
  result = -5;
  EXPECT_EQ(ids_of(nullptr, nullptr, 0, &result, &code), "<untouched>");
  EXPECT_EQ(result, 0);
  EXPECT_EQ(code, SDS_ERROR_NO_DATA);
}

TEST_F(DbRows, ColumnReplaceOfAnIdWithoutARowUpdatesNothing) {
  const std::string before = db_.rows("SELECT * FROM site_deck");
  int value = 5;
  int code = -5;
  LogCapture log;
  EXPECT_EQ(sds_db_column_replace(sds_db_handle, 42, "site_deck", "is_dirty", &value, 0, 0, &code),
            0);
  EXPECT_EQ(code, SDS_ERROR_NONE);
  EXPECT_TRUE(log.contains("Before write finalize, sqlite response code 101"));
  EXPECT_EQ(db_.rows("SELECT * FROM site_deck"), before);
}

// Also the single-column writes of every value type, which must end as the one UPDATE.
TEST_F(DbRows, SeveralColumnsInOneUpdateEndAsSingleWritesWould) {
  ASSERT_TRUE(db_.exec("INSERT INTO site_deck(id, url) VALUES (2, 'https://a.example/')"));
  int small = -1;
  int64_t big = 5000000000;
  const unsigned char blob[3] = {9, 0, 9};
  const sds_db_column_value values[] = {
      {"is_dirty", &small, 0, SDS_DB_COLUMN_TYPE_INT},
      {"sync1", &big, 0, SDS_DB_COLUMN_TYPE_INT64},
      {"title", "T", 99, SDS_DB_COLUMN_TYPE_TEXT},
      {"icon_data", blob, 3, SDS_DB_COLUMN_TYPE_BLOB},
      {"title", "Later", 0, SDS_DB_COLUMN_TYPE_TEXT},
  };
  int code = -5;
  for (const sds_db_column_value& v : values) {
    code = -5;
    ASSERT_EQ(sds_db_column_replace(sds_db_handle, 1, "site_deck", v.column, v.value, v.length,
                                    v.value_type, &code),
              0);
    EXPECT_EQ(code, SDS_ERROR_NONE);
  }
  LogCapture log;
  EXPECT_EQ(sds_db_columns_replace(sds_db_handle, 2, "site_deck", values, 5, &code), 0);
  EXPECT_EQ(code, SDS_ERROR_NONE);
  EXPECT_EQ(log.count("Before write finalize, sqlite response code 101"), 1);
  const std::string columns = "is_dirty, sync1, title, hex(icon_data), icon_size, order_index";
  EXPECT_EQ(db_.rows("SELECT " + columns + " FROM site_deck ORDER BY id DESC"),
            "-1|5000000000|Later|090009|NULL|0\n-1|5000000000|Later|090009|96x64|2.5");
}

// Each refusal also for the single-column write.
TEST_F(DbRows, SeveralColumnsRefusedWriteNone) {
  const std::string before = db_.rows("SELECT * FROM site_deck");
  int value = 5;
  const char* const kMaterials = "check materials for query id:1";
  const struct {
    int id;
    sds_db_column_value second;
    const char* message;
  } cases[] = {
      {0, {"title", "T", 0, SDS_DB_COLUMN_TYPE_TEXT}, "check id:0"},
      {1, {"title", nullptr, 0, SDS_DB_COLUMN_TYPE_TEXT}, kMaterials},
      {1, {nullptr, "T", 0, SDS_DB_COLUMN_TYPE_TEXT}, kMaterials},
      {1, {"title", "T", 0, 9}, "invalid type:9"},
      {1, {"icon_data", "T", -1, SDS_DB_COLUMN_TYPE_BLOB}, kMaterials},  // negative blob length
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(&c - cases);
    const sds_db_column_value values[] = {{"is_dirty", &value, 0, SDS_DB_COLUMN_TYPE_INT},
                                          c.second};
    LogCapture log;
    int code = -5;
    EXPECT_EQ(sds_db_columns_replace(sds_db_handle, c.id, "site_deck", values, 2, &code), -1);
    EXPECT_EQ(code, SDS_ERROR_INVALID_PARAMETER);
    EXPECT_TRUE(log.contains(c.message));
    // The same column alone, through the single-column write.
    LogCapture single_log;
    code = -5;
    const sds_db_column_value& v = c.second;
    EXPECT_EQ(sds_db_column_replace(sds_db_handle, c.id, "site_deck", v.column, v.value, v.length,
                                    v.value_type, &code),
              -1);
    EXPECT_EQ(code, SDS_ERROR_INVALID_PARAMETER);
    EXPECT_TRUE(single_log.contains(c.message));
    EXPECT_EQ(db_.rows("SELECT * FROM site_deck"), before);
  }
  int code = -5;
  EXPECT_EQ(sds_db_columns_replace(sds_db_handle, 1, "site_deck", nullptr, 0, &code), -1);
}

TEST_F(DbRows, DeleteOfUrlWithQuoteDeletesExactlyThatRow) {
  ASSERT_TRUE(db_.exec(
      "INSERT INTO site_deck(url) VALUES ('https://q.example/a''b'), ('https://q.example/a'), "
      "('x'' OR ''1''=''1'), ('https://q.example/a''b')"));
  int code = -5;
  EXPECT_EQ(sds_db_delete_url(sds_db_handle, "https://q.example/a'b", "site_deck", &code), 0);
  EXPECT_EQ(code, SDS_ERROR_NONE);
  EXPECT_EQ(db_.rows("SELECT url FROM site_deck ORDER BY id"),
            "https://a.example/\nhttps://q.example/a\nx' OR '1'='1");
  EXPECT_EQ(sds_db_delete_url(sds_db_handle, "x' OR '1'='1", "site_deck", &code), 0);
  EXPECT_EQ(sds_db_delete_url(sds_db_handle, "not stored", "site_deck", &code), 0);
  EXPECT_EQ(db_.rows("SELECT url FROM site_deck ORDER BY id"),
            "https://a.example/\nhttps://q.example/a");
  LogCapture log;
  EXPECT_EQ(sds_db_delete_url(sds_db_handle, "u", nullptr, &code), -1);
  EXPECT_TRUE(log.contains("check materials for delete"));
}

TEST_F(DbRows, DuplicateChecks) {
  const struct {
    const char* column;
    const char* text;  // null: the integer check with `number`
    int number, result, code;
  } cases[] = {{"url", "https://a.example/", 0, 1, SDS_ERROR_NONE},
               {"url", "unknown", 0, -1, SDS_ERROR_NONE},
               {"favicon_exists", nullptr, 1, 1, SDS_ERROR_NONE},
               {"favicon_exists", nullptr, 0, 0, SDS_ERROR_NONE},
               {"nothing", "u", 0, -1, SDS_ERROR_INVALID_PARAMETER}};
  for (const auto& c : cases) {
    SCOPED_TRACE(&c - cases);
    int code = -5;
    EXPECT_EQ(
        c.text != nullptr
            ? sds_db_check_duplicated_string(sds_db_handle, "site_deck", c.column, c.text, &code)
            : sds_db_check_duplicated_int(sds_db_handle, "site_deck", c.column, c.number, &code),
        c.result);
    EXPECT_EQ(code, c.code);
  }
}

TEST_F(DbRows, InsertOfItems) {
  ItemListGuard guard;
  sds_item* bare = add_item("https://b.example/", nullptr, nullptr);
  bare->fav_icon_exists = 1;
  sds_item* full = add_item("https://c.example/", "C", "#112233");
  add_icon(full, "https://c.example/i.png", "192x192", "2024-01-01");
  add_icon(full, "https://c.example/j.png", "64", "other");
  add_icon(add_item(nullptr, "no url"), nullptr, "1x1", "t");

  int code = -5;
  int expected_id = 2;
  for (sds_item* item = sds_item_list_head; item != nullptr; item = item->next) {
    EXPECT_EQ(sds_db_create_site_deck_item(sds_db_handle, item, &code), expected_id++);
    EXPECT_EQ(code, SDS_ERROR_NONE);
  }
  EXPECT_EQ(db_.rows("SELECT id, url, title, favicon_exists, dominant_color, touch_icon_exists, "
                     "icon_size, image_last_updated, icon_path, is_dirty, order_index, icon_data "
                     "FROM site_deck WHERE id > 1"),
            "2|https://b.example/|NULL|1||0||||1|0|NULL\n"
            "3|https://c.example/|C|0|#112233|1|192x192|2024-01-01|https://c.example/i.png|1|0|"
            "NULL\n"
            "4|NULL|no url|0||1|1x1|t|NULL|1|0|NULL");

  int id = 0;
  EXPECT_EQ(sds_db_create_site_deck_id(sds_db_handle, &id, &code), 0);
  EXPECT_EQ(id, 5);
  EXPECT_EQ(db_.rows("SELECT quote(url), is_dirty FROM site_deck WHERE id = 5"), "''|1");

  EXPECT_EQ(sds_db_create_site_deck_item(nullptr, full, &code), -1);
  EXPECT_EQ(code, SDS_ERROR_NONE);
}

}  // namespace
