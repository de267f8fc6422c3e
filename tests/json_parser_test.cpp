#include <glib.h>
#include <gtest/gtest.h>

#include <string>

#include "pull/sitedeck-service-json-guard.h"
#include "pull/sitedeck-service-json-parser.h"
#include "support/log_capture.h"
#include "support/temp_root.h"

namespace {

// Collects what the reader prints with g_print while the object lives.
class PrintCapture {
 public:
  PrintCapture() { previous_ = g_set_print_handler(&PrintCapture::collect); }
  ~PrintCapture() {
    g_set_print_handler(previous_);
    text().clear();
  }
  static std::string& text() {
    static std::string collected;
    return collected;
  }

 private:
  static void collect(const gchar* s) { text() += s; }
  GPrintFunc previous_ = nullptr;
};

class JsonParserTest : public ::testing::Test {
 protected:
  // Writes `json` to a file in the scratch root and loads it into `root_`.
  void load(const std::string& json) {
    path_ = root_dir_.dir() + "/doc.json";
    ASSERT_TRUE(write_file(path_, json));
    sds_json_parser_parse_buffer(path_.c_str(), &root_);
  }
  void TearDown() override { sds_json_parser_parse_buffer_free(&root_); }

  TempRoot root_dir_;
  std::string path_;
  sds_json_node root_;
};

TEST_F(JsonParserTest, RootOfEachKind) {
  struct Case {
    const char* json;
    int type;
    const char* str;
  } cases[] = {{"[]", SDS_JSON_ARRAY, nullptr},
               {"{}", SDS_JSON_OBJECT, nullptr},
               {"null", SDS_JSON_NONE, nullptr},
               {"true", SDS_JSON_BOOLEAN, nullptr},
               {"\"hello\"", SDS_JSON_STRING, "hello"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.json);
    sds_json_parser_parse_buffer_free(&root_);
    load(c.json);
    ASSERT_NE(root_.key, nullptr);
    EXPECT_STREQ(root_.key, "root");
    EXPECT_EQ(root_.type, c.type);
    if (c.str != nullptr) {
      EXPECT_STREQ(root_.str, c.str);
    }
  }
  EXPECT_EQ(root_.value, 0u);
}

TEST_F(JsonParserTest, MissingOrUnparsableFileLeavesKeyNull) {
  LogCapture log;
  sds_json_parser_parse_buffer((root_dir_.dir() + "/absent.json").c_str(), &root_);
  EXPECT_EQ(root_.key, nullptr);
  EXPECT_EQ(log.count("[CRITICAL] json_parser_load_from_data failed"), 1);
  load("{\"a\": ");
  EXPECT_EQ(root_.key, nullptr);
  EXPECT_EQ(log.count("[CRITICAL] json_parser_load_from_data failed"), 2);
  sds_json_parser_parse_buffer(nullptr, &root_);
  EXPECT_TRUE(log.contains("[CRITICAL] Invalid data"));
}

TEST_F(JsonParserTest, OversizeFileIsRefusedAsALoadFailure) {
  LogCapture log;
  load("[" + std::string(SDS_JSON_MAX_FILE_BYTES, ' ') + "]");
  EXPECT_EQ(root_.key, nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] " + path_ + " is larger than " +
                           std::to_string(SDS_JSON_MAX_FILE_BYTES) + " bytes"));
  EXPECT_TRUE(log.contains("[CRITICAL] json_parser_load_from_data failed"));
}

TEST_F(JsonParserTest, DeeplyNestedFileIsRefusedInsteadOfCrashing) {
  LogCapture log;
  load(std::string(200000, '[') + std::string(200000, ']'));
  EXPECT_EQ(root_.key, nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] " + path_ + " refused: nesting too deep"));
  sds_json_parser_parse_buffer_free(&root_);
  load(std::string(SDS_JSON_MAX_DEPTH, '[') + std::string(SDS_JSON_MAX_DEPTH, ']'));
  EXPECT_STREQ(root_.key, "root");
}

TEST_F(JsonParserTest, RepeatedMemberNameFloodIsRefusedInsteadOfStalling) {
  LogCapture log;
  std::string json = "{";
  for (int i = 0; i < 3000; ++i) json += "\"k" + std::to_string(i) + "\":0,";
  for (int i = 0; i < 3000; ++i) json += "\"k2999\":0,";
  load(json + "\"z\":0}");
  EXPECT_EQ(root_.key, nullptr);
  EXPECT_TRUE(log.contains("[CRITICAL] " + path_ + " refused: too many repeated member names"));
}

TEST(JsonGuard, RepeatsSpelledWithEscapesStillCount) {
  std::string json = "{";
  for (int i = 0; i < 2000; ++i) json += "\"n" + std::to_string(i) + "\":0,";
  std::string escaped = json, distinct = json;
  // "\u006e0" and "n\u0000x" both name "n0" once json-glib has decoded them.
  for (int i = 0; i < 600; ++i)
    escaped += "\"\\u006e0\":0,\"n0\\u0000" + std::to_string(i) + "\":0,";
  for (int i = 0; i < 1200; ++i) distinct += "\"m" + std::to_string(i) + "\":0,";
  escaped += "\"z\":0}";
  distinct += "\"z\":0}";
  const char* reason = nullptr;
  EXPECT_EQ(sds_json_guard_check(escaped.data(), escaped.size(), &reason), -1);
  EXPECT_STREQ(reason, "too many repeated member names");
  EXPECT_EQ(sds_json_guard_check(distinct.data(), distinct.size(), &reason), 0);
}

TEST_F(JsonParserTest, ScalarMembersThroughLookup) {
  load(R"({"t": true, "f": false, "d": 2.9, "m": -1, "big": 4294967297, "s": "text",
           "neg": -2.5, "huge": 1e300})");
  struct Case {
    const char* name;
    int type;
    uint32_t value;
  } cases[] = {{"t", SDS_JSON_BOOLEAN, 1},
               {"f", SDS_JSON_BOOLEAN, 0},
               {"d", SDS_JSON_DOUBLE, 2},
               {"m", SDS_JSON_INT, 0xFFFFFFFFu},
               {"big", SDS_JSON_INT, 1},
               {"s", SDS_JSON_STRING, 0},
               {"neg", SDS_JSON_DOUBLE, 0xFFFFFFFEu},
               {"huge", SDS_JSON_DOUBLE, 0}};
  for (const auto& c : cases) {
    sds_json_node child;
    EXPECT_EQ(sds_json_parser_get_member(&root_, &child, c.name), 1) << c.name;
    EXPECT_STREQ(child.key, c.name);
    EXPECT_EQ(child.type, c.type) << c.name;
    EXPECT_EQ(child.value, c.value) << c.name;
    if (c.type == SDS_JSON_STRING) {
      EXPECT_STREQ(child.str, "text");
    }
    sds_json_parser_parse_buffer_free_value(&child);
  }
}

TEST_F(JsonParserTest, MemberLookupFailures) {
  load(R"({"a": [1, 2], "n": null})");
  sds_json_node child;
  EXPECT_EQ(sds_json_parser_get_member(&root_, &child, "absent"), -1);
  EXPECT_STREQ(child.key, "absent");
  EXPECT_EQ(child.node, nullptr);
  EXPECT_EQ(sds_json_parser_get_member(&root_, &child, "n"), -1);

  sds_json_node array;
  ASSERT_EQ(sds_json_parser_get_member(&root_, &array, "a"), 1);
  EXPECT_EQ(array.type, SDS_JSON_ARRAY);
  EXPECT_EQ(sds_json_parser_get_member(&array, &child, "x"), -1);
  EXPECT_EQ(child.key, nullptr);
  EXPECT_EQ(child.node, nullptr);

  PrintCapture print;
  EXPECT_EQ(sds_json_parser_get_member(&root_, &child, nullptr), -1);
  EXPECT_EQ(PrintCapture::text(), "Invalid Input Parameters\n");
}

TEST_F(JsonParserTest, WalkByIndexOverObjectAndArray) {
  load(R"({"one": 1, "two": {"x": 0}, "three": [true, "s"]})");
  sds_json_node child, number;
  ASSERT_EQ(sds_json_parser_get_nth(&root_, &child, 1), 1);
  EXPECT_STREQ(child.key, "two");
  EXPECT_EQ(child.type, SDS_JSON_OBJECT);
  EXPECT_EQ(sds_json_parser_get_nth(&root_, &child, 3), 0);

  sds_json_node array;
  ASSERT_EQ(sds_json_parser_get_nth(&root_, &array, 2), 1);
  EXPECT_STREQ(array.key, "three");
  ASSERT_EQ(sds_json_parser_get_nth(&array, &child, 1), 1);
  EXPECT_EQ(child.key, nullptr);
  EXPECT_EQ(child.type, SDS_JSON_STRING);
  EXPECT_STREQ(child.str, "s");
  sds_json_parser_parse_buffer_free_value(&child);
  EXPECT_EQ(sds_json_parser_get_nth(&array, &child, 2), 0);

  // A negative index, and a scalar record that has no node left to walk.
  ASSERT_EQ(sds_json_parser_get_member(&root_, &number, "one"), 1);
  PrintCapture print;
  EXPECT_EQ(sds_json_parser_get_nth(&array, &child, -1), 0);
  EXPECT_EQ(sds_json_parser_get_nth(&number, &child, 0), 0);
  EXPECT_EQ(PrintCapture::text(), "Invalid Input Parameters\nInvalid Input Parameters\n");
}

TEST_F(JsonParserTest, MemberLookupKeyCopyIsFreedWhenTheRecordIsReused) {
  load(R"({"a": 1, "b": "x"})");
  sds_json_node child;
  for (int i = 0; i < 3; ++i) {
    ASSERT_EQ(sds_json_parser_get_member(&root_, &child, "b"), 1);
    ASSERT_EQ(sds_json_parser_get_member(&root_, &child, "a"), 1);  // frees the "b" copy
    ASSERT_EQ(sds_json_parser_get_nth(&root_, &child, 1), 1);       // frees the "a" copy
    EXPECT_STREQ(child.key, "b");
  }
  // The leak checker of the sanitizer build would report any copy left behind.
}

TEST_F(JsonParserTest, ReleasingAStringValueTwiceIsHarmless) {
  load(R"({"s": "text"})");
  sds_json_node child;
  ASSERT_EQ(sds_json_parser_get_member(&root_, &child, "s"), 1);
  sds_json_parser_parse_buffer_free_value(&child);
  EXPECT_EQ(child.str, nullptr);
  sds_json_parser_parse_buffer_free_value(&child);
  EXPECT_EQ(child.str, nullptr);

  LogCapture log;
  sds_json_parser_parse_buffer_free_value(nullptr);
  sds_json_parser_parse_buffer_free(nullptr);
  // The log drops the message's trailing line feed.
  EXPECT_EQ(log.count("Invalid Input Parameters"), 2);
}

TEST_F(JsonParserTest, WalkAfterReloadSeesTheNewDocument) {
  load(R"({"x": 1, "y": 2})");
  sds_json_node child;
  ASSERT_EQ(sds_json_parser_get_nth(&root_, &child, 1), 1);
  EXPECT_STREQ(child.key, "y");
  sds_json_parser_parse_buffer_free(&root_);
  load(R"({"p": 1, "q": 2, "r": 3})");
  ASSERT_EQ(sds_json_parser_get_nth(&root_, &child, 2), 1);
  EXPECT_STREQ(child.key, "r");
}

TEST_F(JsonParserTest, LargeObjectIsWalkedWhole) {
  // Quadratic per-step member listing would take minutes here; the cached
  // name list makes the whole walk linear.
  constexpr int kMembers = 50000;
  std::string json = "{";
  for (int i = 0; i < kMembers; ++i)
    json += "\"m" + std::to_string(i) + "\":" + std::to_string(i) + ",";
  json.back() = '}';
  load(json);
  sds_json_node child;
  int walked = 0;
  while (sds_json_parser_get_nth(&root_, &child, walked) != 0) {
    ASSERT_EQ(child.value, static_cast<uint32_t>(walked));
    ++walked;
  }
  EXPECT_EQ(walked, kMembers);
  EXPECT_EQ(child.key, nullptr);
}

}  // namespace
