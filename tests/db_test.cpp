// The database file and connection: creation, rebuild, error mapping.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <filesystem>
#include <string>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/log_capture.h"

namespace {

constexpr const char* kTableSql =
    "CREATE TABLE site_deck(id INTEGER UNIQUE PRIMARY KEY,url TEXT DEFAULT NULL,title TEXT "
    "DEFAULT NULL,favicon_exists  INTEGER DEFAULT 0,dominant_color TEXT DEFAULT "
    "NULL,touch_icon_exists INTEGER DEFAULT 0,touchicon TEXT,is_dirty INTEGER DEFAULT "
    "1,image_last_updated TEXT,icon_size TEXT,icon_path TEXT,icon_data BLOB,order_index INTEGER "
    "DEFAULT 0,sync1 TEXT DEFAULT NULL,sync2 TEXT DEFAULT NULL,sync3 TEXT DEFAULT NULL,sync4 TEXT "
    "DEFAULT NULL)";

// Writes `sql` into the file at `path` through a connection of its own.
void make_file(const std::string& path, const std::string& sql) {
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &other), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(other, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK);
  sqlite3_close(other);
}

TEST(DbOpen, FirstStartCreatesTheTableWithAllColumnsAndDefaults) {
  LogCapture log;
  DbSession db;
  ASSERT_NE(sds_db_handle, nullptr);
  EXPECT_TRUE(file_exists(db.db_path()));
  EXPECT_EQ(db.rows("SELECT sql FROM sqlite_master WHERE name='site_deck'"), kTableSql);
  // The exact statement fixes every column, its type and its default.
  ASSERT_TRUE(db.exec("INSERT INTO site_deck(url) VALUES ('https://a.example/')"));
  EXPECT_EQ(db.rows("SELECT * FROM site_deck"),
            "1|https://a.example/|NULL|0|NULL|0|NULL|1|NULL|NULL|NULL|NULL|0|NULL|NULL|NULL|NULL");
  // A missing file is opened with a plain CANTOPEN first.
  EXPECT_TRUE(log.contains("database open error(14):unable to open database file"));
  EXPECT_FALSE(log.contains("errorcode : 0"));
}

// Merges look every listed site up by URL: without an index each lookup read
// the whole table, so a merge took time quadratic in the list's length.
TEST(DbOpen, UrlLookupsScannedTheWholeTable) {
  DbSession db;
  EXPECT_EQ(db.rows("SELECT name, tbl_name, sql FROM sqlite_master WHERE type = 'index' AND "
                    "name NOT LIKE 'sqlite_autoindex%'"),
            "site_deck_url_index|site_deck|CREATE INDEX site_deck_url_index ON site_deck(url)");
  EXPECT_NE(db.rows("EXPLAIN QUERY PLAN SELECT id FROM site_deck WHERE url IS 'u'")
                .find("SEARCH site_deck USING COVERING INDEX site_deck_url_index (url=?)"),
            std::string::npos);
}

TEST(DbOpen, FileMadeBeforeTheUrlIndexGetsItAndKeepsItsRows) {
  DbSession db(false);
  make_file(db.db_path(), std::string(kTableSql) + "; INSERT INTO site_deck(url) VALUES ('u')");
  LogCapture log;
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_EQ(db.rows("SELECT name FROM sqlite_master WHERE name = 'site_deck_url_index'"),
            "site_deck_url_index");
  EXPECT_EQ(db.rows("SELECT sql FROM sqlite_master WHERE name='site_deck'"), kTableSql);
  EXPECT_EQ(db.rows("SELECT url FROM site_deck"), "u");
  EXPECT_TRUE(log.lines().empty());

  // Opening it again finds the index there and changes nothing.
  DbSession::close_handle();
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_EQ(db.rows("SELECT count(*) FROM sqlite_master WHERE name = 'site_deck_url_index'"), "1");
}

int count_commit(void* commits) {
  ++*static_cast<int*>(commits);
  return 0;
}

TEST(DbOpen, TableAndUrlIndexAreMadeInOneTransaction) {
  DbSession db(false);
  sqlite3* handle = nullptr;
  ASSERT_EQ(sqlite3_open(db.db_path().c_str(), &handle), SQLITE_OK);
  int commits = 0;
  sqlite3_commit_hook(handle, count_commit, &commits);
  EXPECT_EQ(__rebuild_site_deck_tables(handle), 0);
  EXPECT_EQ(commits, 1);
  EXPECT_NE(sqlite3_get_autocommit(handle), 0);
  sqlite3_close(handle);
  EXPECT_EQ(rows_of_file(db.db_path(), "SELECT type, name FROM sqlite_master ORDER BY name"),
            "table|site_deck\nindex|site_deck_url_index\nindex|sqlite_autoindex_site_deck_1");
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

TEST(DbOpen, FileThatIsNoDatabaseIsReplacedByAnEmptyTable) {
  DbSession db(false);
  ASSERT_TRUE(write_file(db.db_path(), std::string(4096, 'g') + "garbage, not a database"));
  ASSERT_TRUE(write_file(db.db_path() + "-journal", "stale journal"));
  LogCapture log;
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  ASSERT_NE(sds_db_handle, nullptr);
  EXPECT_EQ(db.rows("SELECT count(*) FROM site_deck"), "0");
  EXPECT_TRUE(log.contains("database open error(26):file is not a database"));
  EXPECT_FALSE(file_exists(db.db_path() + "-journal"));
}

TEST(DbOpen, ExistingFileWithoutTheTableIsLeftAsItIs) {
  DbSession db(false);
  make_file(db.db_path(), "CREATE TABLE other(x); INSERT INTO other VALUES (7)");
  LogCapture log;
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_EQ(__check_table(sds_db_handle, "site_deck"), -1);
  EXPECT_EQ(db.rows("SELECT name FROM sqlite_master"), "other");
  EXPECT_EQ(db.rows("SELECT x FROM other"), "7");
  EXPECT_TRUE(log.lines().empty());
}

TEST(DbOpen, MissingDatabaseDirectoryFailsWithNoSpace) {
  DbSession db(false);
  std::filesystem::remove_all(db.root().path(SDS_DATABASE_DIR));
  LogCapture log;
  sqlite3* handle = reinterpret_cast<sqlite3*>(0x1);
  EXPECT_EQ(sds_db_open(&handle), -1);
  EXPECT_EQ(handle, nullptr);
  EXPECT_TRUE(log.contains("database new error(14):unable to open database file"));
  EXPECT_TRUE(log.contains("errorcode : 14"));
  EXPECT_FALSE(file_exists(db.db_path()));

  // The worker tries again at its next call and succeeds once the directory is back.
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_DB_OPEN_FAILED);
  EXPECT_EQ(sds_db_handle, nullptr);
  std::filesystem::create_directories(db.root().path(SDS_DATABASE_DIR));
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_NE(sds_db_handle, nullptr);
}

TEST(DbOpen, CheckTableNeedsHandleAndName) {
  DbSession db;
  LogCapture log;
  EXPECT_EQ(__check_table(nullptr, "site_deck"), -1);
  EXPECT_EQ(__check_table(sds_db_handle, nullptr), -1);
  EXPECT_EQ(log.count("check handle or table name"), 2);
  EXPECT_EQ(__check_table(sds_db_handle, "site_deck"), 0);
  EXPECT_EQ(__check_table(sds_db_handle, "nothing"), -1);
}

TEST(DbErrorCode, MapsTheConnectionsLastResult) {
  DbSession db;
  LogCapture log;
  EXPECT_EQ(sds_db_get_errorcode(nullptr), SDS_ERROR_DISK_BUSY);
  EXPECT_TRUE(log.contains("check connection handle"));

  // A second connection without a busy timeout meets the lock at once.
  sqlite3* locker = nullptr;
  sqlite3* blocked = nullptr;
  ASSERT_EQ(sqlite3_open(db.db_path().c_str(), &locker), SQLITE_OK);
  ASSERT_EQ(sqlite3_open(db.db_path().c_str(), &blocked), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(locker, "BEGIN EXCLUSIVE", nullptr, nullptr, nullptr), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(blocked, "SELECT * FROM site_deck", nullptr, nullptr, nullptr),
            SQLITE_BUSY);
  EXPECT_EQ(sds_db_get_errorcode(blocked), SDS_ERROR_DISK_BUSY);
  EXPECT_TRUE(log.contains("DISK_BUSY database is locked"));
  sqlite3_exec(locker, "ROLLBACK", nullptr, nullptr, nullptr);

  // Errors without a specific reason map to none.
  ASSERT_EQ(sqlite3_exec(blocked, "SELECT nothing FROM site_deck", nullptr, nullptr, nullptr),
            SQLITE_ERROR);
  EXPECT_EQ(sds_db_get_errorcode(blocked), SDS_ERROR_NONE);
  sqlite3_close(locker);
  sqlite3_close(blocked);
}

TEST(DbOpen, EmptyFileWasNeverGivenTheTable) {
  // What a first start leaves when the disk is full or the process dies
  // between creating the file and writing the table.
  DbSession db(false);
  ASSERT_TRUE(write_file(db.db_path(), ""));
  EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_EQ(__check_table(sds_db_handle, "site_deck"), 0);
  EXPECT_EQ(db.rows("SELECT count(*) FROM site_deck"), "0");
}

TEST(DbOpen, StoredEtagOutlivedTheItemsSoTheNextPullWasAnsweredNotModified) {
  const struct {
    const char* name;
    const char* setup_sql;  // null: no file; "garbage": not a database
    bool etag_kept;
  } cases[] = {
      {"no database file", nullptr, false},
      {"a file that is no database", "garbage", false},
      {"a table without rows", kTableSql, false},
      {"a table with rows", "", true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    DbSession db(false);
    if (c.setup_sql != nullptr && std::string(c.setup_sql) == "garbage") {
      ASSERT_TRUE(write_file(db.db_path(), std::string(8192, 'g')));
    } else if (c.setup_sql != nullptr) {
      make_file(db.db_path(),
                c.setup_sql[0] != '\0'
                    ? std::string(c.setup_sql)
                    : std::string(kTableSql) + "; INSERT INTO site_deck(url) VALUES ('u')");
    }
    const std::string etag = db.root().path(SDS_ETAG_PATH);
    ASSERT_TRUE(write_file(etag, "\"v1\"\r\n"));
    LogCapture log;
    EXPECT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
    EXPECT_EQ(file_exists(etag), c.etag_kept);
    EXPECT_EQ(log.contains("no items stored: the stored ETag is dropped"), !c.etag_kept);
  }
}

TEST(DbSound, DamagedPageOfAnOpenedDatabaseWasKeptForGood) {
  DbSession db;
  ASSERT_TRUE(
      db.exec("INSERT INTO site_deck(url, icon_data) VALUES ('https://a.example/', "
              "randomblob(20000)), ('https://b.example/', randomblob(20000))"));
  DbSession::close_handle();
  // Damage past the first pages: opening the file does not notice it.
  std::string content = read_file(db.db_path());
  ASSERT_GT(content.size(), 16384u);
  content.replace(8192, 4096, std::string(4096, 'Z'));
  ASSERT_TRUE(write_file(db.db_path(), content));
  const std::string etag = db.root().path(SDS_ETAG_PATH);
  ASSERT_TRUE(write_file(etag, "\"v1\"\r\n"));
  ASSERT_EQ(sds_ensure_db_open(), SDS_ERROR_NONE);
  EXPECT_TRUE(file_exists(etag));

  LogCapture log;
  EXPECT_EQ(sds_ensure_db_sound(), SDS_ERROR_NONE);
  EXPECT_TRUE(log.contains("database is damaged: it is made afresh"));
  EXPECT_EQ(db.rows("SELECT count(*) FROM site_deck"), "0");
  EXPECT_EQ(db.rows("PRAGMA integrity_check"), "ok");
  EXPECT_FALSE(file_exists(etag));

  // A sound database is left as it is.
  ASSERT_TRUE(db.exec("INSERT INTO site_deck(url) VALUES ('https://c.example/')"));
  EXPECT_EQ(sds_ensure_db_sound(), SDS_ERROR_NONE);
  EXPECT_EQ(db.rows("SELECT url FROM site_deck"), "https://c.example/");
}

}  // namespace
