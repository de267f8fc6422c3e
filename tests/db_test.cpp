// The item database on a real file: what opening makes of each file found at
// its name, the codes, values and log lines of the row operations and item
// accessors, the icon store, and what the connection keeps between reads
// (statements, served columns), which must never answer stale.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstdlib>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt-cache.h"
#include "database/sitedeck-service-db.h"
#include "database/sitedeck-service-error.h"
#include "pull/sitedeck-service-db-merge.h"
#include "pull/sitedeck-service-utils.h"
#include "serve/sitedeck-service-default-deck-start.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/default_deck.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/png_maker.h"

namespace {

constexpr const char* kTableSql =
    "CREATE TABLE site_deck(id INTEGER UNIQUE PRIMARY KEY,url TEXT DEFAULT NULL,title TEXT "
    "DEFAULT NULL,favicon_exists  INTEGER DEFAULT 0,dominant_color TEXT DEFAULT "
    "NULL,touch_icon_exists INTEGER DEFAULT 0,touchicon TEXT,is_dirty INTEGER DEFAULT "
    "1,image_last_updated TEXT,icon_size TEXT,icon_path TEXT,icon_data BLOB,order_index INTEGER "
    "DEFAULT 0,sync1 TEXT DEFAULT NULL,sync2 TEXT DEFAULT NULL,sync3 TEXT DEFAULT NULL,sync4 TEXT "
    "DEFAULT NULL)";

// Runs `sql` on the file at `path` through a connection of its own, as another process would.
void change_file(const std::string& path, const std::string& sql) {
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &other), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(other, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK);
  sqlite3_close(other);
}

// Every file a first start, a crash or a damaged disk leaves at the name. The
// open, the deck step after the worker's first open and the sound check that
// begins every pull leave the table with its URL index and the rows that can
// be kept; the default deck only in a table this open created; the stored
// ETag only beside stored rows (else the next pull was answered 304).
TEST(DbOpen, EveryFileAtTheNameEndsAsAUsableTable) {
  constexpr const char* kDeck =
      "https://news.example.org/\nhttps://mail.example.net/\nhttps://maps.example.com/";
  const struct {
    const char* name;
    void (*prepare)(const std::string& db_path);
    const char* urls;  // in deck order afterwards
    bool etag_kept;
    const char* logged;
  } cases[] = {
      {"first start: no file", [](const std::string&) {}, kDeck, false,
       "database open error(14):unable to open database file"},
      {"EmptyFileWasNeverGivenTheTable",
       [](const std::string& db) { ASSERT_TRUE(write_file(db, "")); }, kDeck, false,
       "no items stored: the stored ETag is dropped"},
      {"a file that is no database, beside a stale journal",
       [](const std::string& db) {
         ASSERT_TRUE(write_file(db, std::string(4096, 'g')));
         ASSERT_TRUE(write_file(db + "-journal", "stale journal"));
       },
       kDeck, false, "database open error(26):file is not a database"},
      {"StoredEtagOutlivedTheItemsSoTheNextPullWasAnsweredNotModified: a table without rows",
       [](const std::string& db) { change_file(db, kTableSql); }, "", false,
       "no items stored: the stored ETag is dropped"},
      {"a file with rows made before the URL index (UrlLookupsScannedTheWholeTable)",
       [](const std::string& db) {
         change_file(db, std::string(kTableSql) + "; INSERT INTO site_deck(url) VALUES ('u')");
       },
       "u", true, ""},
      {"DamagedPageOfAnOpenedDatabaseWasKeptForGood: damage the open does not notice",
       [](const std::string& db) {
         ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
         ASSERT_TRUE(DbSession::exec(
             "INSERT INTO site_deck(url, icon_data) VALUES ('a', randomblob(20000)), ('b', "
             "randomblob(20000))"));
         DbSession::close_handle();
         std::string content = read_file(db);
         ASSERT_GT(content.size(), 16384u);
         ASSERT_TRUE(write_file(db, content.replace(8192, 4096, std::string(4096, 'Z'))));
       },
       "", false, "database is damaged: it is made afresh"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    DbSession db(false);
    ASSERT_TRUE(write_deck(small_deck()));
    c.prepare(db.db_path());
    const std::string etag = db.root().path(SDS_ETAG_PATH);
    ASSERT_TRUE(write_file(etag, "\"v1\"\r\n"));
    LogCapture log;
    ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
    sds_default_deck_load_if_created();
    EXPECT_EQ(sds_ensure_db_sound(), SDS_ERROR_NONE);
    EXPECT_EQ(db.rows("SELECT url FROM site_deck ORDER BY order_index"), c.urls);
    EXPECT_EQ(file_exists(etag), c.etag_kept);
    EXPECT_TRUE(*c.logged == '\0' || log.contains(c.logged));
    EXPECT_EQ(log.contains("default deck loaded: 3 items (0 icon files missing)"), c.urls == kDeck);
    EXPECT_FALSE(file_exists(db.db_path() + "-journal"));
    EXPECT_EQ(db.rows("SELECT sql FROM sqlite_master WHERE name = 'site_deck'"), kTableSql);
    EXPECT_EQ(db.rows("PRAGMA integrity_check"), "ok");
    // Merges look every listed site up by URL: without the index, each lookup
    // read the whole table and a merge took time quadratic in the list.
    EXPECT_NE(db.rows("EXPLAIN QUERY PLAN SELECT id FROM site_deck WHERE url IS 'u'")
                  .find("SEARCH site_deck USING COVERING INDEX site_deck_url_index (url=?)"),
              std::string::npos);
  }
}

TEST(DbOpen, TableThatCannotBeMadeLeavesNoTransactionOpen) {
  DbSession db(false);
  ASSERT_TRUE(write_file(db.db_path(), ""));
  sqlite3* handle = nullptr;
  ASSERT_EQ(sqlite3_open_v2(db.db_path().c_str(), &handle, SQLITE_OPEN_READONLY, nullptr),
            SQLITE_OK);
  LogCapture log;
  EXPECT_EQ(__rebuild_site_deck_tables(handle), -1);
  EXPECT_TRUE(log.contains("create tables:8 error:attempt to write a readonly database"));
  EXPECT_NE(sqlite3_get_autocommit(handle), 0);
  sqlite3_close(handle);
}

TEST(DbErrorCode, LockIsDiskBusyOtherFailuresNoneAndCodesHaveNames) {
  DbSession db;
  // A second connection without a busy time-out meets the lock at once.
  sqlite3* locker = nullptr;
  sqlite3* blocked = nullptr;
  ASSERT_EQ(sqlite3_open(db.db_path().c_str(), &locker), SQLITE_OK);
  ASSERT_EQ(sqlite3_open(db.db_path().c_str(), &blocked), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(locker, "BEGIN EXCLUSIVE", nullptr, nullptr, nullptr), SQLITE_OK);
  LogCapture log;
  ASSERT_EQ(sqlite3_exec(blocked, "SELECT * FROM site_deck", nullptr, nullptr, nullptr),
            SQLITE_BUSY);
  EXPECT_EQ(sds_db_get_errorcode(blocked), SDS_ERROR_DISK_BUSY);
  EXPECT_TRUE(log.contains("DISK_BUSY database is locked"));
  sqlite3_exec(locker, "ROLLBACK", nullptr, nullptr, nullptr);
  ASSERT_EQ(sqlite3_exec(blocked, "SELECT nothing FROM site_deck", nullptr, nullptr, nullptr),
            SQLITE_ERROR);
  EXPECT_EQ(sds_db_get_errorcode(blocked), SDS_ERROR_NONE);
  sqlite3_close(locker);
  sqlite3_close(blocked);
  const std::pair<int, const char*> names[] = {
      {0, "SDS_ERROR_NONE"},     {1, "SDS_ERROR_IO_ERROR"},
      {2, "SDS_ERROR_UNKNOWN"},  {-1, "SDS_ERROR_UNKNOWN"},
      {15, "SDS_ERROR_UNKNOWN"}, {18, "SDS_ERROR_SERVER_REQUEST_FAILED"}};
  for (auto [code, name] : names) EXPECT_STREQ(sds_error_string(code), name) << code;
}

// The outcome of one call as its caller sees it: result, code, the value it
// delivered ("-" when the output was left alone) and its log lines.
struct Outcome {
  int result = 0;
  int code = 0;
  std::string value = "-";
  std::string log;
  bool operator==(const Outcome&) const = default;
};

std::ostream& operator<<(std::ostream& out, const Outcome& o) {
  return out << o.result << " code " << o.code << " '" << o.value << "' [" << o.log << "]";
}

// Runs `call(&code, &value)` and collects its outcome.
template <typename Call>
Outcome run(Call call) {
  LogCapture log;
  Outcome o;
  o.code = -5;
  o.result = call(&o.code, &o.value);
  for (const LogLine& line : log.lines()) o.log += (o.log.empty() ? "" : "; ") + line.message;
  return o;
}

char* const kUntouched = reinterpret_cast<char*>(0x1);

// Moves a delivered text into `value` and frees it.
void take(char* text, std::string* value) {
  if (text == kUntouched) return;
  *value = text != nullptr ? text : "(null)";
  std::free(text);
}

Outcome text(int id, const char* column, bool output = true) {
  return run([&](int* code, std::string* value) {
    char* text = kUntouched;
    int r = sds_db_get_property_string(sds_db_handle, id, "site_deck", column,
                                       output ? &text : nullptr, code);
    take(text, value);
    return r;
  });
}

Outcome by_url(const char* url, const char* column) {
  return run([&](int* code, std::string* value) {
    char* text = kUntouched;
    int r =
        sds_db_get_property_string_for_url(sds_db_handle, url, "site_deck", column, &text, code);
    take(text, value);
    return r;
  });
}

Outcome integer(int id, const char* column) {
  return run([&](int* code, std::string* value) {
    sds_db_value number{};
    number.i64 = 77;
    int r = sds_db_get_property_int(sds_db_handle, id, "site_deck", column, &number, code);
    if (number.i64 != 77) *value = std::to_string(number.i64);
    return r;
  });
}

Outcome blob(int id) {
  return run([&](int* code, std::string* value) {
    unsigned char* bytes = nullptr;
    int size = 99;
    int r = sds_db_get_property_blob(sds_db_handle, id, "site_deck", "icon_data", &bytes, &size,
                                     code);
    if (bytes != nullptr) {
      *value = "";
      for (int i = 0; i < size; ++i) {
        *value += "0123456789abcdef"[bytes[i] >> 4];
        *value += "0123456789abcdef"[bytes[i] & 15];
      }
      std::free(bytes);
    }
    return r;
  });
}

Outcome ids(const char* column, const void* condition, int type) {
  return run([&](int* code, std::string* value) {
    int* list = nullptr;
    int count = 0;
    int r = sds_db_get_all_dirty_ids(sds_db_handle, &list, &count, column, condition, type, code);
    if (list != nullptr) {
      *value = "";
      for (int i = 0; i < count; ++i) *value += (i ? "," : "") + std::to_string(list[i]);
      std::free(list);
    }
    return r;
  });
}

// Writes is_dirty and then `second` of `id` in one update.
Outcome write_two(int id, sds_db_column_value second) {
  return run([&](int* code, std::string*) {
    const int five = 5;
    const sds_db_column_value values[] = {{"is_dirty", &five, 0, SDS_DB_COLUMN_TYPE_INT}, second};
    return sds_db_columns_replace(sds_db_handle, id, "site_deck", values, 2, code);
  });
}

class DbRows : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(sds_db_handle, nullptr);
    ASSERT_TRUE(db_.exec(
        "INSERT INTO site_deck(id, url, title, dominant_color, icon_size, favicon_exists, "
        "order_index, icon_data, icon_path) VALUES (1, 'https://a.example/', NULL, '', '96x64', 1, "
        "2.5, x'0102', 'https://a.example/i.png'), (2, 'b', 'B', NULL, NULL, 0, 1, x'03', NULL), "
        "(3, 'x'' OR ''1''=''1', 'C', NULL, NULL, 0, 3, NULL, NULL)"));
  }
  DbSession db_;
  ItemListGuard guard_;
};

TEST_F(DbRows, CallsGiveTheirCodesValuesAndLogLines) {
  constexpr int kNone = SDS_ERROR_NONE, kNoData = SDS_ERROR_NO_DATA,
                kInvalid = SDS_ERROR_INVALID_PARAMETER, kNotFound = SDS_ERROR_ID_NOT_FOUND;
  constexpr const char* kWritten = "Before write finalize, sqlite response code 101";
  constexpr const char* kMaterials = "check materials for query id:1";
  constexpr const char* kUnprepared = "Before finalize, sqlite response code 1";
  const int64_t big = 5000000000;
  const int one = 1;
  const unsigned char bytes[3] = {9, 0, 9};
  sds_item* item = add_item("https://n.example/", "N", "#112233");
  add_icon(item, "https://n.example/i.png", "123456789012", "2024-01-01 and more than fits");
  item->fav_icon_exists = 1;
  const struct {
    const char* name;
    Outcome got, expected;
  } cases[] = {
      {"text", text(1, "url"), {0, kNone, "https://a.example/", ""}},
      {"null text", text(1, "title"), {0, kNoData, "-", "check column type:5"}},
      {"empty text", text(1, "dominant_color"), {0, kNoData, "-", ""}},
      {"column not kept", text(1, "icon_path"), {0, kNone, "https://a.example/i.png", ""}},
      {"real as text", text(1, "order_index"), {0, kNoData, "-", "check column type:2"}},
      {"unknown id", text(99, "url"), {-1, kNotFound, "-", ""}},
      {"id 0", text(0, "url"), {-1, kInvalid, "-", "check id:0"}},
      {"unknown column", text(1, "nothing"), {-1, kInvalid, "-", kUnprepared}},
      {"no output", text(1, "url", false), {-1, kInvalid, "-", kMaterials}},
      {"integer", integer(1, "favicon_exists"), {0, kNone, "1", ""}},
      {"real over all eight bytes", integer(1, "order_index"), {0, kNone, "2", ""}},
      {"integer of an unknown id", integer(99, "is_dirty"), {0, kNoData, "-", ""}},
      {"null as integer", integer(1, "title"), {0, kNoData, "-", "check column type:5"}},
      {"blob", blob(1), {0, kNone, "0102", ""}},
      {"null blob", blob(3), {0, kNoData, "-", "check column type:5"}},
      {"blob of an unknown id", blob(9), {-1, kNotFound, "-", ""}},
      {"text by URL", by_url("https://a.example/", "icon_size"), {0, kNone, "96x64", ""}},
      {"unknown URL", by_url("https://other/", "icon_size"), {-1, kNotFound, "-", ""}},
      {"empty URL", by_url("", "url"), {-1, kInvalid, "-", "Url is null or empty"}},
      {"ids in order_index order", ids(nullptr, nullptr, 0), {0, kNone, "2,1,3", ""}},
      {"ids by text", ids("url", "b", SDS_DB_COND_TYPE_TEXT), {0, kNone, "2", ""}},
      {"ids by integer", ids("favicon_exists", &one, SDS_DB_COND_TYPE_INT), {0, kNone, "1", ""}},
      {"no ids", ids("url", "none", SDS_DB_COND_TYPE_TEXT), {0, kNoData, "-", ""}},
      {"ids by an unknown type", ids("url", "b", 7), {-1, kInvalid, "-", "invalid type:7"}},
      {"integer duplicate", run([](int* code, std::string*) {
         return sds_db_check_duplicated_int(sds_db_handle, "site_deck", "favicon_exists", 0, code);
       }),
       {2, kNone, "-", ""}},
      {"duplicate in an unknown column", run([](int* code, std::string*) {
         return sds_db_check_duplicated_string(sds_db_handle, "site_deck", "nothing", "u", code);
       }),
       {-1, kInvalid, "-", kUnprepared}},
      {"new id", run([](int* code, std::string* value) {
         int id = 0;
         int r = sds_db_create_site_deck_id(sds_db_handle, &id, code);
         *value = std::to_string(id);
         return r;
       }),
       {0, kNone, "4", kWritten}},
      {"insert of an item with an icon", run([&](int* code, std::string*) {
         return sds_db_create_site_deck_item(sds_db_handle, item, code);
       }),
       {5, kNone, "-", kWritten}},
      {"one column", run([](int* code, std::string*) {
         return sds_db_column_replace(sds_db_handle, 2, "site_deck", "title", "T", 0,
                                      SDS_DB_COLUMN_TYPE_TEXT, code);
       }),
       {0, kNone, "-", kWritten}},
      {"three columns", run([&](int* code, std::string*) {
         const sds_db_column_value values[] = {{"sync1", &big, 0, SDS_DB_COLUMN_TYPE_INT64},
                                               {"icon_data", bytes, 3, SDS_DB_COLUMN_TYPE_BLOB},
                                               {"title", "Later", 0, SDS_DB_COLUMN_TYPE_TEXT}};
         return sds_db_columns_replace(sds_db_handle, 2, "site_deck", values, 3, code);
       }),
       {0, kNone, "-", kWritten}},
      {"id without a row", write_two(42, {"title", "T", 0, SDS_DB_COLUMN_TYPE_TEXT}),
       {0, kNone, "-", kWritten}},
      {"write of id 0", write_two(0, {"title", "T", 0, SDS_DB_COLUMN_TYPE_TEXT}),
       {-1, kInvalid, "-", "check id:0"}},
      {"negative blob length", write_two(1, {"icon_data", "T", -1, SDS_DB_COLUMN_TYPE_BLOB}),
       {-1, kInvalid, "-", kMaterials}},
      {"unknown value type", write_two(1, {"title", "T", 0, 9}),
       {-1, kInvalid, "-", "invalid type:9"}},
      {"delete of a URL with quotes", run([](int* code, std::string*) {
         return sds_db_delete_url(sds_db_handle, "x' OR '1'='1", "site_deck", code);
       }),
       {0, kNone, "-", ""}},
  };
  for (const auto& c : cases) EXPECT_EQ(c.got, c.expected) << c.name;
  // Refused writes wrote nothing; icon texts are cut at their fields.
  EXPECT_EQ(db_.rows("SELECT id, url, title, favicon_exists, dominant_color, is_dirty, sync1, "
                     "hex(icon_data), icon_size, image_last_updated, icon_path FROM site_deck"),
            "1|https://a.example/|NULL|1||1|NULL|0102|96x64|NULL|https://a.example/i.png\n"
            "2|b|Later|0|NULL|1|5000000000|090009|NULL|NULL|NULL\n"
            "4||NULL|0|NULL|1|NULL||NULL|NULL|NULL\n"
            "5|https://n.example/|N|1|#112233|1|NULL||12345678901|2024-01-01 and more tha|"
            "https://n.example/i.png");
}

// The log lines since the last call, joined; clears them.
std::string drain(LogCapture& log) {
  std::string joined;
  for (const LogLine& line : log.lines()) joined += (joined.empty() ? "" : "; ") + line.message;
  log.clear();
  return joined;
}

TEST_F(DbRows, AccessorsRefuseMissingOutputsAndLogCodesByName) {
  unsigned char* bytes = nullptr;
  unsigned char* none = nullptr;
  int n = 0;
  char* text = nullptr;
  sds_item item;
  constexpr int kInvalid = SDS_ERROR_INVALID_PARAMETER;
  LogCapture log;
  // Missing outputs are refused, never written through.
  for (int refused :
       {sds_get_blob_from_db(1, nullptr, nullptr, nullptr, nullptr),
        sds_get_blob_from_db(1, &n, nullptr, nullptr, &bytes),
        sds_get_blob_from_db(1, &n, nullptr, &n, &bytes), sds_get_string_from_db(1, nullptr, "url"),
        sds_get_int_from_db(1, nullptr, "is_dirty"),
        sds_get_all_ids_from_db(nullptr, &n, nullptr, nullptr, 0),
        sds_get_string_for_url_from_db(nullptr, &text, "url"),
        sds_get_string_for_url_from_db("u", nullptr, "url"), get_sitedeck_url_from_db(1, nullptr),
        delete_sitedeck_item_from_db(nullptr), get_sitedeck_title_from_db(1, nullptr),
        get_sitedeck_icon_path_from_db(1, nullptr), get_sitedeck_icon_size_from_db(1, nullptr),
        get_sitedeck_icon_data_from_db(1, nullptr, &n),
        get_sitedeck_icon_data_from_db(1, &bytes, nullptr),
        get_sitedeck_icon_dominant_color(1, nullptr), get_sitedeck_icon_time_stamp(1, nullptr),
        get_sitedeck_item_from_db(1, nullptr)}) {
    EXPECT_EQ(refused, kInvalid);
  }
  log.clear();
  // Each call, then its log lines: the initializers run in this order.
  const struct {
    int result, expected;
    const char* messages;
    std::string logged;
  } cases[] = {
      {get_sitedeck_item_from_db(1, &item), SDS_ERROR_NONE, "", drain(log)},
      {sds_db_get_errorcode(nullptr), SDS_ERROR_DISK_BUSY, "check connection handle", drain(log)},
      {update_sitedeck_title_to_db(1, nullptr), -1,
       "check materials for query id:1; Error : SDS_ERROR_INVALID_PARAMETER", drain(log)},
      {get_sitedeck_title_from_db(9, &text), SDS_ERROR_ID_NOT_FOUND,
       "Error : SDS_ERROR_ID_NOT_FOUND", drain(log)},
      {sds_get_blob_from_db(9, &n, &n, &n, &none), SDS_ERROR_ID_NOT_FOUND,
       "Error : SDS_ERROR_ID_NOT_FOUND", drain(log)},
      // Pixels without a size text: handed out all the same, with the code.
      {sds_get_blob_from_db(2, &n, &n, &n, &bytes), SDS_ERROR_NO_DATA,
       "check column type:5; Error : SDS_ERROR_NO_DATA", drain(log)},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.result, c.expected) << c.messages;
    EXPECT_EQ(c.logged, c.messages);
  }
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(none, nullptr);
  ASSERT_NE(bytes, nullptr);
  EXPECT_EQ(bytes[0], 3);
  std::free(bytes);

  int order = 7, width = -1, height = -1;
  EXPECT_EQ(update_sitedeck_order_index_to_db(1, &order), 0);
  EXPECT_EQ(update_sitedeck_title_to_db(1, "New"), 0);
  EXPECT_EQ(update_sitedeck_predominant_color_to_db(1, "#abcdef"), 0);
  EXPECT_EQ(update_sitedeck_is_specially_removed(1, 1), 0);
  EXPECT_EQ(db_.rows("SELECT order_index, title, dominant_color, is_dirty FROM site_deck "
                     "WHERE id = 1"),
            "7|New|#abcdef|-1");
  ASSERT_EQ(get_sitedeck_title_from_db(1, &text), SDS_ERROR_NONE);
  EXPECT_STREQ(text, "New");
  std::free(text);
  ASSERT_EQ(sds_get_blob_from_db(1, &n, &height, &width, &bytes), SDS_ERROR_NONE);
  EXPECT_EQ(std::string(reinterpret_cast<char*>(bytes), n), "\x01\x02");
  EXPECT_EQ(width, 96);
  EXPECT_EQ(height, 64);
  std::free(bytes);
}

// The icon columns are written only with pixels decoded from the icon file,
// whose size text they take; the file is removed whatever became of it.
TEST_F(DbRows, IconStoreTakesOnlyDecodedPixelsAndRemovesTheFile) {
  const std::string png = png_encode_image(png_pattern(5, 4, 6, 8));
  const std::string before = "96x64|https://a.example/i.png|NULL|2";
  const struct {
    const char* name;
    const char* url;   // of the item; null: no item
    const char* icon;  // the icon's URL
    std::optional<std::string> file;
    int code;
    const char* logged;
    std::string columns;  // icon_size|icon_path|image_last_updated|length(icon_data) after
  } cases[] = {
      {"stored, its size text taken from the pixels", "https://a.example/",
       "https://a.example/new.png", png, SDS_ERROR_NONE, "", "5x4|https://a.example/new.png|s|80"},
      {"never downloaded", "https://a.example/", "https://a.example/i.png", std::nullopt,
       SDS_ERROR_IO_ERROR, "Failed to open file", before},
      {"empty file", "https://a.example/", "https://a.example/i.png", "", SDS_ERROR_IO_ERROR,
       "ftell failed", before},
      {"no item", nullptr, nullptr, std::nullopt, SDS_ERROR_INVALID_PARAMETER, "NULL check::item",
       before},
      {"no site URL", nullptr, "https://a.example/i.png", std::nullopt, SDS_ERROR_INVALID_PARAMETER,
       "NULL check::item->site_url", before},
      {"icon URL without a slash", "https://a.example/", "icon.png", std::nullopt,
       SDS_ERROR_INVALID_PARAMETER, "NULL check::icon_path", before},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(db_.exec("UPDATE site_deck SET icon_size = '96x64', icon_path = "
                         "'https://a.example/i.png', image_last_updated = NULL, icon_data = "
                         "x'0102' WHERE id = 1"));
    sds_item* item = c.url != nullptr || c.icon != nullptr ? add_item(c.url, "A") : nullptr;
    if (item != nullptr) add_icon(item, c.icon, "192x192", "s");
    char* path = get_icon_path(c.icon);
    ASSERT_TRUE(!c.file || write_file(path, *c.file));
    LogCapture log;
    EXPECT_EQ(update_sitedeck_icon_to_db(1, item), c.code);
    EXPECT_TRUE(*c.logged == '\0' || log.contains(c.logged));
    EXPECT_EQ(db_.rows("SELECT icon_size, icon_path, image_last_updated, length(icon_data) "
                       "FROM site_deck WHERE id = 1"),
              c.columns);
    EXPECT_TRUE(path == nullptr || !file_exists(path));
    std::free(path);
  }
}

std::string read_title(int id) {
  char* value = nullptr;
  int code = 0;
  (void)sds_db_get_property_string(sds_db_handle, id, "site_deck", "title", &value, &code);
  std::string text = value != nullptr ? value : "<" + std::to_string(code) + ">";
  std::free(value);
  return text;
}

// Served columns are read from the rows the connection read lately: a change
// committed by another connection shows at the next read all the same.
TEST_F(DbRows, KeptRowsNeverAnswerStale) {
  ASSERT_EQ(read_title(2), "B");
  change_file(db_.db_path(), "UPDATE site_deck SET title = 'B2' WHERE id = 2");
  EXPECT_EQ(read_title(2), "B2");
  change_file(db_.db_path(), "DELETE FROM site_deck WHERE id = 2");
  EXPECT_EQ(read_title(2), "<8>");
  ASSERT_TRUE(db_.exec("BEGIN; INSERT INTO site_deck(id, title) VALUES (2, 'not yet')"));
  EXPECT_EQ(read_title(2), "not yet");
  ASSERT_TRUE(db_.exec("ROLLBACK"));
  EXPECT_EQ(read_title(2), "<8>");
  // Closing finalizes what the connection kept; a statement left would fail the close.
  LogCapture log;
  sds_db_close(nullptr);
  sds_db_close(sds_db_handle);
  sds_db_handle = nullptr;
  EXPECT_TRUE(log.lines().empty());
}

// A pull read the whole file through the memory mapping (the quick check, a
// merge of 5000 icons) and kept every page of it in its resident memory.
TEST_F(DbRows, PulledFileStayedResidentThroughTheMapping) {
  const std::string configured = db_.rows("PRAGMA mmap_size");
  ASSERT_NE(configured, "0");
  {
    SdsDbFileMappingPause unmapped(sds_db_handle);
    EXPECT_EQ(db_.rows("PRAGMA mmap_size"), "0");
    EXPECT_EQ(read_title(2), "B");
    SdsDbFileMappingPause again(sds_db_handle);  // nothing mapped: nothing to do
  }
  EXPECT_EQ(db_.rows("PRAGMA mmap_size"), configured);
}

}  // namespace
