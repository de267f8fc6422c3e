// The item accessors, icon storage included, on a real database file.
#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>
#include <string>
#include <vector>

#include "pull/sitedeck-service-db-merge.h"
#include "pull/sitedeck-service-utils.h"
#include "support/db_session.h"
#include "support/items.h"
#include "support/log_capture.h"
#include "support/png_maker.h"

namespace {

class DbInterface : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(sds_db_handle, nullptr);
    ASSERT_TRUE(db_.exec(
        "INSERT INTO site_deck(id, url, title, icon_size, icon_path, image_last_updated, "
        "icon_data) VALUES (1, 'https://a.example/', 'A', '2x1', 'https://a.example/old.png', "
        "'old-stamp', x'0102030405060708')"));
  }
  // Writes `image` where the download of `icon_url` would have put it.
  static std::string place_icon(const char* icon_url, const PngImage& image) {
    char* path = get_icon_path(icon_url);
    std::string out = path;
    std::free(path);
    EXPECT_TRUE(png_write_file(out, image));
    return out;
  }
  std::string icon_columns() {
    return db_.rows(
        "SELECT icon_size, icon_path, image_last_updated, length(icon_data) FROM site_deck "
        "WHERE id = 1");
  }
  DbSession db_;
  ItemListGuard guard_;
};

TEST_F(DbInterface, BlobComesWithWidthAndHeightOfItsSizeText) {
  const struct {
    const char* size_sql;
    int result, width, height;  // -1: the caller's value stays
  } cases[] = {{"'2x1'", SDS_ERROR_NONE, 2, 1},
               {"' 96x64'", SDS_ERROR_NONE, 96, 64},
               {"'96'", SDS_ERROR_NONE, -1, -1},  // without an x
               {"NULL", SDS_ERROR_NO_DATA, -1, -1}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.size_sql);
    ASSERT_TRUE(db_.exec(std::string("UPDATE site_deck SET icon_size = ") + c.size_sql));
    LogCapture log;
    unsigned char* bytes = nullptr;
    int length = 0, height = -1, width = -1;
    EXPECT_EQ(sds_get_blob_from_db(1, &length, &height, &width, &bytes), c.result);
    // The pixels are handed out all the same.
    ASSERT_NE(bytes, nullptr);
    EXPECT_EQ(std::string(reinterpret_cast<char*>(bytes), length),
              "\x01\x02\x03\x04\x05\x06\x07\x08");
    EXPECT_EQ(width, c.width);
    EXPECT_EQ(height, c.height);
    EXPECT_EQ(log.contains("Error : SDS_ERROR_NO_DATA"), c.result == SDS_ERROR_NO_DATA);
    std::free(bytes);
  }
  unsigned char* bytes = nullptr;
  int length = 0, height = -1, width = -1;
  EXPECT_EQ(sds_get_blob_from_db(7, &length, &height, &width, &bytes), SDS_ERROR_ID_NOT_FOUND);
  EXPECT_EQ(bytes, nullptr);
}

TEST_F(DbInterface, NullOutputsAreRefusedInOrder) {
  unsigned char* bytes = nullptr;
  int n = 0;
  char* text = nullptr;
  struct Case {
    int result;
    const char* message;
  };
  LogCapture log;
  const Case cases[] = {
      {sds_get_blob_from_db(1, nullptr, nullptr, nullptr, nullptr), "NULL check::value"},
      {sds_get_blob_from_db(1, nullptr, nullptr, nullptr, &bytes), "NULL check::blob_length"},
      {sds_get_blob_from_db(1, &n, nullptr, nullptr, &bytes), "NULL check::blob_width"},
      {sds_get_blob_from_db(1, &n, nullptr, &n, &bytes), "NULL check::blob_height"},
      {sds_get_string_from_db(1, nullptr, "url"), "NULL check::value"},
      {sds_get_int_from_db(1, nullptr, "is_dirty"), "NULL check::value"},
      {sds_get_all_ids_from_db(nullptr, &n, nullptr, nullptr, 0), "NULL check::dirty_ids"},
      {sds_get_string_for_url_from_db(nullptr, &text, "url"), "NULL check::url"},
      {sds_get_string_for_url_from_db("u", nullptr, "url"), "NULL check::value"},
      {get_sitedeck_url_from_db(1, nullptr), "NULL check::url"},
      {delete_sitedeck_item_from_db(nullptr), "NULL check::url"},
      {get_sitedeck_title_from_db(1, nullptr), "NULL check::title"},
      {get_sitedeck_icon_path_from_db(1, nullptr), "NULL check::path"},
      {get_sitedeck_icon_size_from_db(1, nullptr), "NULL check::size"},
      {get_sitedeck_icon_data_from_db(1, nullptr, &n), "NULL check::data"},
      {get_sitedeck_icon_data_from_db(1, &bytes, nullptr), "NULL check::data_size"},
      {get_sitedeck_icon_dominant_color(1, nullptr), "NULL check::color"},
      {get_sitedeck_icon_time_stamp(1, nullptr), "NULL check::time_stamp"},
      {get_sitedeck_item_from_db(1, nullptr), "NULL check::item"},
  };
  std::vector<LogLine> lines = log.lines();
  ASSERT_EQ(lines.size(), std::size(cases));
  for (size_t i = 0; i < std::size(cases); ++i) {
    SCOPED_TRACE(i);
    EXPECT_EQ(cases[i].result, SDS_ERROR_INVALID_PARAMETER);
    EXPECT_EQ(lines[i].message, cases[i].message);
  }
  sds_item item;
  EXPECT_EQ(get_sitedeck_item_from_db(1, &item), SDS_ERROR_NONE);
}

TEST_F(DbInterface, ReadsReportNoDataAndUnknownIdsAsErrors) {
  ASSERT_TRUE(db_.exec("INSERT INTO site_deck(id, url, favicon_exists) VALUES (2, 'b', 1)"));
  LogCapture log;
  char* text = reinterpret_cast<char*>(0x1);
  EXPECT_EQ(sds_get_string_from_db(2, &text, "title"), SDS_ERROR_NO_DATA);
  EXPECT_EQ(text, reinterpret_cast<char*>(0x1));
  EXPECT_TRUE(log.contains("Error : SDS_ERROR_NO_DATA"));
  EXPECT_EQ(sds_get_string_from_db(9, &text, "title"), SDS_ERROR_ID_NOT_FOUND);
  EXPECT_TRUE(log.contains("Error : SDS_ERROR_ID_NOT_FOUND"));

  sds_db_value value{};
  EXPECT_EQ(sds_get_int_from_db(2, &value, "favicon_exists"), SDS_ERROR_NONE);
  EXPECT_EQ(value.i32, 1);
  EXPECT_EQ(sds_get_int_from_db(9, &value, "favicon_exists"), SDS_ERROR_NO_DATA);

  EXPECT_EQ(get_sitedeck_title_from_db(1, &text), SDS_ERROR_NONE);
  EXPECT_STREQ(text, "A");
  std::free(text);
}

TEST_F(DbInterface, SingleColumnWrites) {
  int order = 7;
  EXPECT_EQ(update_sitedeck_order_index_to_db(1, &order), 0);
  EXPECT_EQ(update_sitedeck_title_to_db(1, "New"), 0);
  EXPECT_EQ(update_sitedeck_predominant_color_to_db(1, "#abcdef"), 0);
  EXPECT_EQ(update_sitedeck_is_specially_removed(1, 1), 0);
  EXPECT_EQ(db_.rows("SELECT order_index, title, dominant_color, is_dirty FROM site_deck"),
            "7|New|#abcdef|-1");
  EXPECT_EQ(update_sitedeck_is_specially_removed(1, 0), 0);
  EXPECT_EQ(db_.rows("SELECT is_dirty FROM site_deck"), "1");

  LogCapture log;
  EXPECT_EQ(update_sitedeck_title_to_db(1, nullptr), -1);
  EXPECT_EQ(update_sitedeck_order_index_to_db(-1, &order), -1);
  EXPECT_EQ(log.count("Error : SDS_ERROR_INVALID_PARAMETER"), 2);
  EXPECT_EQ(delete_sitedeck_item_from_db("not stored"), 0);
  EXPECT_EQ(delete_sitedeck_item_from_db("https://a.example/"), 0);
  EXPECT_EQ(db_.rows("SELECT count(*) FROM site_deck"), "0");
}

TEST_F(DbInterface, IconStoreWritesPixelsSizePathAndStampThenRemovesTheFile) {
  sds_item* item = add_item("https://a.example/", "A");
  add_icon(item, "https://a.example/new.png", "3x2", "new-stamp");
  PngImage image = png_pattern(3, 2, 6, 8);
  std::string file = place_icon("https://a.example/new.png", image);

  EXPECT_EQ(update_sitedeck_icon_to_db(1, item), SDS_ERROR_NONE);
  EXPECT_EQ(icon_columns(), "3x2|https://a.example/new.png|new-stamp|24");
  EXPECT_FALSE(file_exists(file));

  unsigned char* bytes = nullptr;
  int length = 0, height = 0, width = 0;
  ASSERT_EQ(sds_get_blob_from_db(1, &length, &height, &width, &bytes), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<uint8_t>(bytes, bytes + length), png_expected_bgra(image));
  std::free(bytes);

  // An empty time stamp keeps the stored one.
  sds_item* again = add_item("https://a.example/", "A");
  add_icon(again, "https://a.example/i.png", "1x1", "");
  place_icon("https://a.example/i.png", png_pattern(1, 1, 6, 8));
  EXPECT_EQ(update_sitedeck_icon_to_db(1, again), SDS_ERROR_NONE);
  EXPECT_EQ(icon_columns(), "1x1|https://a.example/i.png|new-stamp|4");
}

TEST_F(DbInterface, IconSizeTextThatDisagreesWithThePixelsIsReplaced) {
  struct Case {
    const char* text;
    const char* stored;
  };
  const Case cases[] = {{"192x192", "5x4"}, {"", "5x4"},    {"5", "5x4"},
                        {"4x5", "5x4"},     {"5x4", "5x4"}, {"05x4", "05x4"}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text);
    sds_item* item = add_item("https://a.example/", "A");
    add_icon(item, "https://a.example/i.png", c.text, "s");
    place_icon("https://a.example/i.png", png_pattern(5, 4, 2, 8));
    EXPECT_EQ(update_sitedeck_icon_to_db(1, item), SDS_ERROR_NONE);
    EXPECT_EQ(icon_columns(), std::string(c.stored) + "|https://a.example/i.png|s|80");

    unsigned char* bytes = nullptr;
    int length = 0, height = 0, width = 0;
    ASSERT_EQ(sds_get_blob_from_db(1, &length, &height, &width, &bytes), SDS_ERROR_NONE);
    EXPECT_EQ(length, width * height * 4);
    std::free(bytes);
  }
}

// Also an icon that was never downloaded: no file, nothing changes.
TEST_F(DbInterface, BrokenIconFilesAreRefusedAndRemoved) {
  struct Case {
    const char* name;
    std::optional<std::string> content;  // none: no file
    const char* message;
  };
  std::string png = png_encode_image(png_pattern(8, 8, 6, 8));
  const Case cases[] = {
      {"never downloaded", std::nullopt, "Failed to open file"},
      {"empty", "", "ftell failed"},
      {"error page", "<html>404</html>", "some error occured while converting data"},
      {"truncated", png.substr(0, png.size() / 2), "some error occured while converting data"},
  };
  std::string before = db_.rows("SELECT * FROM site_deck");
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    sds_item* item = add_item("https://a.example/", "A");
    add_icon(item, "https://a.example/i.png", "8x8", "new");
    char* path = get_icon_path("https://a.example/i.png");
    ASSERT_TRUE(!c.content || write_file(path, *c.content));
    LogCapture log;
    EXPECT_EQ(update_sitedeck_icon_to_db(1, item), SDS_ERROR_IO_ERROR);
    EXPECT_TRUE(log.contains(c.message));
    EXPECT_FALSE(file_exists(path));
    std::free(path);
  }
  EXPECT_EQ(db_.rows("SELECT * FROM site_deck"), before);
}

TEST_F(DbInterface, IconStoreArgumentChecks) {
  LogCapture log;
  sds_item item;
  EXPECT_EQ(update_sitedeck_icon_to_db(1, nullptr), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(update_sitedeck_icon_to_db(1, &item), SDS_ERROR_INVALID_PARAMETER);
  sds_item* no_icons = add_item("https://a.example/");
  EXPECT_EQ(update_sitedeck_icon_to_db(1, no_icons), SDS_ERROR_INVALID_PARAMETER);
  sds_item* bad_path = add_item("https://a.example/");
  add_icon(bad_path, "no-slash");
  EXPECT_EQ(update_sitedeck_icon_to_db(1, bad_path), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log.contains("NULL check::item"));
  EXPECT_TRUE(log.contains("NULL check::item->site_url"));
  EXPECT_TRUE(log.contains("NULL check::item->ps_sds_icon_list"));
  EXPECT_TRUE(log.contains("NULL check::icon_path"));
}

}  // namespace
