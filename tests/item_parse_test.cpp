#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-request-server.h"
#include "support/log_capture.h"
#include "support/temp_root.h"

namespace {

class ItemParseTest : public ::testing::Test {
 protected:
  void TearDown() override {
    sds_free_item_list();
    sds_last_error = SDS_ERROR_NONE;
  }
  // Saves `json` as the server's answer and parses it.
  void parse(const std::string& json) {
    path_ = root_.path(SDS_JSON_RESPONSE_PATH);
    ASSERT_TRUE(write_file(path_, json));
    sds_parse_json_data(path_.c_str());
  }
  static std::vector<sds_item*> items() {
    std::vector<sds_item*> all;
    for (sds_item* i = sds_item_list_head; i != nullptr; i = i->next) all.push_back(i);
    return all;
  }
  static std::vector<std::string> urls() {
    std::vector<std::string> all;
    for (sds_item* i : items()) all.push_back(i->site_url != nullptr ? i->site_url : "(none)");
    return all;
  }
  static std::vector<sds_icon*> icons(const sds_item* item) {
    std::vector<sds_icon*> all;
    for (sds_icon* i = item->ps_sds_icon_list; i != nullptr; i = i->next) all.push_back(i);
    return all;
  }

  TempRoot root_;
  std::string path_;
};

std::string item(const std::string& url) { return R"({"site": {"siteUrl": ")" + url + R"("}})"; }

TEST_F(ItemParseTest, SectionsChooseTheItemArrays) {
  using V = std::vector<std::string>;
  struct Case {
    const char* name;
    std::string json;
    V expected;
  } cases[] = {
      {"global then regional",
       R"({"regional": {"items": [)" + item("r1") + R"(]}, "itemCount": 3,
           "global": {"items": [)" +
           item("g1") + "," + item("g2") + "]}}",
       V{"g1", "g2", "r1"}},
      {"regional only", R"({"regional": {"items": [)" + item("r1") + "]}}", V{"r1"}},
      {"global only, read once", R"({"global": {"items": [)" + item("g1") + "]}}", V{"g1"}},
      {"root items without sections", R"({"items": [)" + item("i1") + "]}", V{"i1"}},
      {"a section hides root items",
       R"({"items": [)" + item("i1") + R"(], "regional": {"items": [)" + item("r1") + "]}}",
       V{"r1"}},
      {"section without items", R"({"global": {}, "items": [)" + item("i1") + "]}", V{}},
      {"section that is no object", R"({"global": [1], "items": [)" + item("i1") + "]}", V{}},
      {"items an object", R"({"items": {"a": )" + item("x") + "}}", V{}},
      {"items a string", R"({"items": "x"})", V{}},
      {"items null", R"({"items": null})", V{}},
      {"number elements skipped", R"({"items": [1, )" + item("a") + ", \"s\", " + item("b") + "]}",
       V{"a", "b"}},
      {"body that is no object", R"({"items": [{"s": "text"}, {"s": [1, 2]}, )" + item("c") + "]}",
       V{"(none)", "(none)", "c"}},
  };
  for (const auto& c : cases) {
    sds_free_item_list();
    parse(c.json);
    EXPECT_EQ(urls(), c.expected) << c.name;
    EXPECT_EQ(sds_last_error, 0) << c.name;
  }
}

TEST_F(ItemParseTest, MemberNamesMatchByPrefixButTouchIconsWholly) {
  parse(R"({"items": [{"site": {"siteUrlX": "https://x.example/", "siteNameplate": "X",
        "touchIconsList": [{"id": 1}], "touchIconsExists": 1, "favIconExistsToo": true,
        "predominantColor": "#102030"}}]})");
  auto all = items();
  ASSERT_EQ(all.size(), 1u);
  EXPECT_STREQ(all[0]->site_url, "https://x.example/");
  EXPECT_STREQ(all[0]->site_name, "X");
  EXPECT_STREQ(all[0]->predominant_color, "#102030");
  EXPECT_EQ(all[0]->ps_sds_icon_list, nullptr);
  EXPECT_EQ(all[0]->touch_icons_exists, 1);
  EXPECT_EQ(all[0]->fav_icon_exists, 1);
}

TEST_F(ItemParseTest, NumericAndStringMembersByType) {
  parse(R"({"items": [
      {"a": {"isSpeciallyRemoved": true, "numberOfTouchIcons": 2.7, "favIconExists": "yes",
             "touchIconsExists": null, "siteName": 5}},
      {"b": {"numberOfTouchIcons": 4294967297, "touchIconsExists": -1, "favIconExists": [1]}},
      {"c": {"siteUrl": "u"}}]})");
  auto all = items();
  ASSERT_EQ(all.size(), 3u);
  EXPECT_EQ(all[0]->is_specially_removed, 1);
  EXPECT_EQ(all[0]->number_of_touch_icons, 2);
  EXPECT_EQ(all[0]->fav_icon_exists, 0);
  EXPECT_EQ(all[0]->touch_icons_exists, 0);
  EXPECT_EQ(all[0]->site_name, nullptr);
  EXPECT_EQ(all[1]->number_of_touch_icons, 1);  // cut to its low 32 bits
  EXPECT_EQ(all[1]->touch_icons_exists, -1);
  EXPECT_EQ(all[1]->fav_icon_exists, 0);
  EXPECT_EQ(all[2]->is_specially_removed, 0);
}

TEST_F(ItemParseTest, IconEntriesFillTheirFields) {
  parse(R"({"items": [{"s": {"touchIcons": [
      {"id": 7, "iconPath": "https://i.example/a.png", "iconSize": "11111x11111",
       "lastModified": "2014-01-02T03:04:05.678", "isAdministered": true, "extra": 1},
      3,
      {"identity": 9, "iconSize": 12}]}}]})");
  auto all = items();
  ASSERT_EQ(all.size(), 1u);
  auto list = icons(all[0]);
  ASSERT_EQ(list.size(), 3u);
  EXPECT_EQ(list[0]->id, 7);
  EXPECT_STREQ(list[0]->icon_path, "https://i.example/a.png");
  EXPECT_STREQ(list[0]->icon_size, "11111x11111");
  EXPECT_STREQ(list[0]->last_modified, "2014-01-02T03:04:05.678");
  EXPECT_EQ(list[0]->is_administered, 1);
  // An entry that is a number yields an icon with no field set.
  EXPECT_EQ(list[1]->id, 0);
  EXPECT_EQ(list[1]->icon_path, nullptr);
  EXPECT_STREQ(list[1]->icon_size, "");
  EXPECT_EQ(list[2]->id, 9);
  EXPECT_STREQ(list[2]->icon_size, "");

  // An object gives one icon per member.
  sds_free_item_list();
  parse(R"({"items": [{"s": {"touchIcons": {"small": {"id": 3}, "large": {"id": 4}}}}]})");
  list = icons(items().at(0));
  ASSERT_EQ(list.size(), 2u);
  EXPECT_EQ(list[0]->id, 3);
  EXPECT_EQ(list[1]->id, 4);
}

TEST_F(ItemParseTest, OverlongIconSizeAndLastModifiedAreCutAtFieldSize) {
  parse(R"({"items": [{"s": {"touchIcons": [{"iconSize": "123456789012345678901234567890",
      "lastModified": "Tue, 15 Nov 1994 12:45:26 GMT and then some more text"}]}}]})");
  auto list = icons(items().at(0));
  ASSERT_EQ(list.size(), 1u);
  EXPECT_STREQ(list[0]->icon_size, "12345678901");
  EXPECT_STREQ(list[0]->last_modified, "Tue, 15 Nov 1994 12:45:");
}

TEST_F(ItemParseTest, SecondCallLeavesTheExistingListAlone) {
  parse(R"({"items": [)" + item("first") + "]}");
  sds_item* head = sds_item_list_head;
  parse(R"({"items": [)" + item("second") + "," + item("third") + "]}");
  EXPECT_EQ(sds_item_list_head, head);
  EXPECT_EQ(urls(), std::vector<std::string>{"first"});
}

TEST_F(ItemParseTest, MissingPathOrFileBuildsNoList) {
  LogCapture log;
  sds_parse_json_data(nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] File path is null"));
  sds_parse_json_data(root_.path("/nothing.json").c_str());
  EXPECT_TRUE(log.contains("[CRITICAL] parent.key is null"));
  EXPECT_EQ(sds_item_list_head, nullptr);
}

// A list cut short by a bound was stored as if whole, with its ETag: an
// answer the reader cannot read whole is refused whole instead.
TEST_F(ItemParseTest, ListsCutShortByABoundWereStoredAsIfWhole) {
  std::string many_items = R"({"items": [)";
  for (int i = 0; i < 100000; ++i) many_items += R"({"s":{}},)";
  many_items += R"({"s":{}}]})";
  std::string many_icons = R"({"items": [{"s": {"touchIcons": [)";
  for (int i = 0; i < 64; ++i) many_icons += "{\"id\": " + std::to_string(i) + "},";
  many_icons += R"({}]}}]})";
  const struct {
    std::string json;
    const char* reason;
  } cases[] = {
      {many_items, "the list holds more than 100000 items"},
      {many_icons, "an item lists more than 64 touch icons"},
      {R"({"items": [)" + item("a") + ", {}, " + item("c") + "]}",
       "an item element without a body"},
      {R"([)" + item("a") + "]", "the answer is no JSON object"},
      {R"({"items": [)", "the answer is no JSON document the reader accepts (malformed, larger "
                          "than 4194304 bytes, nested deeper than 64 or with too many repeated "
                          "names)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.reason);
    LogCapture log;
    sds_last_error = SDS_ERROR_HTTP_OK;
    parse(c.json);
    EXPECT_EQ(sds_item_list_head, nullptr);
    EXPECT_EQ(sds_last_error, SDS_ERROR_SERVER_REQUEST_FAILED);
    EXPECT_STREQ(sds_item_list_refusal, c.reason);
    EXPECT_TRUE(log.contains(std::string("[CRITICAL] item list refused: ") + c.reason));
  }
}

TEST_F(ItemParseTest, LargeItemBodyIsParsed) {
  // Walking an object by index must stay linear: 50000 members would take
  // minutes if every step listed the members afresh.
  std::string json = R"({"items": [{"s": {)";
  for (int i = 0; i < 50000; ++i) json += "\"m" + std::to_string(i) + "\": 0, ";
  json += R"("siteUrl": "last"}}]})";
  parse(json);
  EXPECT_EQ(urls(), std::vector<std::string>{"last"});
}

}  // namespace
