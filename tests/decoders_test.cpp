// The readers of what the network and the disk hand the pull: the JSON reader
// and its guard, the item list, the geocoder's answer and the stored place,
// the server list and its rewrite, and PNG both ways. What the end-to-end
// suites cannot reach cheaply: hostile documents, refusals, injected faults.
#include <glib.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "pull/sitedeck-service-json-guard.h"
#include "pull/sitedeck-service-json-parser.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
#include "pull/sitedeck-service-utils.h"
#include "sitedeck-service-paths.h"
#include "support/log_capture.h"
#include "support/png_maker.h"
#include "support/temp_root.h"

namespace {

class JsonReader : public ::testing::Test {
 protected:
  // Writes `json` to a file of the scratch root and loads it into `root_`.
  void load(const std::string& json) {
    sds_json_parser_parse_buffer_free(&root_);
    ASSERT_TRUE(write_file(path_, json));
    sds_json_parser_parse_buffer(path_.c_str(), &root_);
  }
  void TearDown() override {
    sds_json_parser_parse_buffer_free(&root_);
    sds_free_item_list();
  }
  TempRoot root_dir_;
  std::string path_ = root_dir_.path(SDS_JSON_RESPONSE_PATH);
  sds_json_node root_;
};

// Nesting crashed the reader, and a flood of one member name stalled it for
// minutes: such documents, and any past a bound, are refused whole.
TEST_F(JsonReader, HostileDocumentsAreRefusedWhole) {
  std::string flood = "{";
  for (int i = 0; i < 3000; ++i) flood += "\"k" + std::to_string(i) + "\":0,";
  for (int i = 0; i < 3000; ++i) flood += "\"k2999\":0,";
  const struct {
    const char* name;
    std::string json;
    std::string logged;  // after the file's path
  } cases[] = {
      {"DeeplyNestedFileIsRefusedInsteadOfCrashing",
       std::string(200000, '[') + std::string(200000, ']'), " refused: nesting too deep"},
      {"RepeatedMemberNameFloodIsRefusedInsteadOfStalling", flood + "\"z\":0}",
       " refused: too many repeated member names"},
      {"larger than the reader takes", "[" + std::string(SDS_JSON_MAX_FILE_BYTES, ' ') + "]",
       " is larger than " + std::to_string(SDS_JSON_MAX_FILE_BYTES) + " bytes"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    load(c.json);
    EXPECT_EQ(root_.key, nullptr);
    EXPECT_TRUE(log.contains("[CRITICAL] " + path_ + c.logged));
    EXPECT_TRUE(log.contains("[CRITICAL] json_parser_load_from_data failed"));
  }
  load(std::string(SDS_JSON_MAX_DEPTH, '[') + std::string(SDS_JSON_MAX_DEPTH, ']'));
  EXPECT_STREQ(root_.key, "root");
  EXPECT_EQ(root_.type, SDS_JSON_ARRAY);

  // "\u006e0" and "n0\u0000x" both name "n0" once decoded: repeats all the same.
  std::string json = "{";
  for (int i = 0; i < 2000; ++i) json += "\"n" + std::to_string(i) + "\":0,";
  std::string escaped = json, distinct = json;
  for (int i = 0; i < 600; ++i) {
    escaped += "\"\\u006e0\":0,\"n0\\u0000" + std::to_string(i) + "\":0,";
  }
  for (int i = 0; i < 1200; ++i) distinct += "\"m\\t\\ud83d\\ude00" + std::to_string(i) + "\":0,";
  const char* reason = nullptr;
  EXPECT_EQ(sds_json_guard_check(escaped.data(), escaped.size(), &reason), -1);
  EXPECT_STREQ(reason, "too many repeated member names");
  EXPECT_EQ(sds_json_guard_check(distinct.data(), distinct.size(), &reason), 0);
}

TEST_F(JsonReader, WalkStepsOnOddNodes) {
  load("null");
  EXPECT_EQ(root_.type, SDS_JSON_NONE);
  load(R"({"a": [1, "s"], "neg": -2.5, "s": "text"})");
  sds_json_node child, array;
  ASSERT_EQ(sds_json_parser_get_member(&root_, &child, "s"), 1);
  EXPECT_STREQ(child.str, "text");
  ASSERT_EQ(sds_json_parser_get_member(&root_, &child, "neg"), 1);  // frees the text copy
  EXPECT_EQ(child.value, 0xFFFFFFFEu);
  ASSERT_EQ(sds_json_parser_get_member(&root_, &array, "a"), 1);
  EXPECT_EQ(sds_json_parser_get_member(&array, &child, "x"), -1);
  EXPECT_EQ(child.key, nullptr);
  EXPECT_EQ(sds_json_parser_get_nth(&array, &child, -1), 0);
}

std::string item(const std::string& url) { return R"({"site": {"siteUrl": ")" + url + R"("}})"; }

// A list cut short by a bound was stored as if whole, with its ETag: an
// answer the reader cannot read whole is refused whole instead.
TEST_F(JsonReader, ListsCutShortByABoundWereStoredAsIfWhole) {
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
      {"[" + item("a") + "]", "the answer is no JSON object"},
      {R"({"items": [)",
       "the answer is no JSON document the reader accepts (malformed, larger "
       "than 4194304 bytes, nested deeper than 64 or with too many repeated "
       "names)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.reason);
    ASSERT_TRUE(write_file(path_, c.json));
    LogCapture log;
    sds_last_error = SDS_ERROR_HTTP_OK;
    sds_parse_json_data(path_.c_str());
    EXPECT_EQ(sds_item_list_head, nullptr);
    EXPECT_EQ(sds_last_error, SDS_ERROR_SERVER_REQUEST_FAILED);
    EXPECT_STREQ(sds_item_list_refusal, c.reason);
    EXPECT_TRUE(log.contains(std::string("[CRITICAL] item list refused: ") + c.reason));
  }
  sds_last_error = SDS_ERROR_NONE;
}

struct Place : sds_server_req_args {
  Place() {
    latitude = 37.5;
    longitude = 127.0;
  }
  ~Place() {
    std::free(city);
    std::free(province);
  }
};

std::string data(const char* key, const std::string& text) {
  return std::string("<AdditionalData key=\"") + key + "\">" + text + "</AdditionalData>";
}

// The geocoder's answer is untrusted XML: no entity may read a local file or
// expand without bound; the stored place cannot be saved without its directory.
TEST(GeocoderAnswer, EntitiesNeitherReadFilesNorExpandAndAFailedSaveIsLogged) {
  TempRoot root;
  const std::string secret = root.path("/secret.txt");
  ASSERT_TRUE(write_file(secret, "TOP-SECRET"));
  std::string bomb = "<!DOCTYPE Search [<!ENTITY e0 \"aaaaaaaaaaaaaaaa\">";
  for (int level = 1; level <= 9; ++level) {
    bomb += "<!ENTITY e" + std::to_string(level) + " \"";
    for (int i = 0; i < 10; ++i) bomb += "&e" + std::to_string(level - 1) + ";";
    bomb += "\">";
  }
  const struct {
    const char* name;
    std::string answer;
    const char* place;  // result city|province, "-" for a text not set
  } cases[] = {
      {"external entity",
       "<!DOCTYPE Search [<!ENTITY leak SYSTEM \"file://" + secret + "\">]>\n<Search>" +
           data("CountyName", "&leak;") + data("StateName", "State &leak;") + "</Search>",
       "0 |State "},
      {"entity expansion bomb", bomb + "]><Search>" + data("CountyName", "&e9;") + "</Search>",
       "18 -|-"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(write_file(root.path(SDS_HERE_XML_PATH), c.answer));
    Place place;
    const int result = sds_parse_city_and_province(&place);
    EXPECT_EQ(std::to_string(result) + " " + (place.city ? place.city : "-") + "|" +
                  (place.province ? place.province : "-"),
              c.place);
  }
  Place place;
  place.city = strdup("Suwon");
  place.province = strdup("P");
  std::filesystem::remove_all(root.path(SDS_SERVER_DIR));
  LogCapture log;
  save_city_and_province(&place);
  EXPECT_TRUE(log.contains(
      "|xmlTextWriterEndDocument| failed. Couldn't save city and province information"));
}

// The rewrite after a 301 truncated the list first: a full disk or a crash
// in the middle left a cut list, and no pull could ever run again.
TEST(ServerList, RewriteCutShortByAFullDiskLostTheWholeServerList) {
  TempRoot root;
  const std::string path = root.path(SDS_SERVER_DATA_XML);
  const std::string original =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<values>\n<Server><Id>1</Id><Base-url>"
      "https://a.example/list</Base-url></Server><Server><Id>2</Id><Base-url>"
      "https://b.example/list</Base-url></Server>\n</values>\n";
  ASSERT_TRUE(write_file(path, original));
  // Writes limited to 64 bytes per file, as on a full disk; SIGXFSZ ignored
  // meanwhile so that a write past the limit just fails.
  struct rlimit saved {};
  ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &saved), 0);
  struct rlimit limited = saved;
  limited.rlim_cur = 64;
  auto* previous = std::signal(SIGXFSZ, SIG_IGN);
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limited), 0);
  LogCapture log;
  (void)sds_update_base_url(path.c_str(), 1, "https://moved.example/list");
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &saved), 0);
  std::signal(SIGXFSZ, previous);
  EXPECT_TRUE(log.contains("[CRITICAL] " + path + " could not be rewritten [File too large]"));
  // The list as it was, and no half-written file beside it.
  EXPECT_EQ(read_file(path), original);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(root.path(SDS_SERVER_DIR)),
                          std::filesystem::directory_iterator()),
            1);
}

TEST(Png, EveryColourTypeDecodesToBgraAndPixelsEncodeBackWhole) {
  const struct {
    const char* name;
    int color_type, bit_depth;
    bool trns, interlaced;
  } cases[] = {
      {"GreyWithoutTransparencyNoLongerGivesThreeBytesPerPixel", 0, 8, false, false},
      {"grey 1 bit", 0, 1, false, false},
      {"grey 16 bits with tRNS", 0, 16, true, false},
      {"RGB 8 bits with tRNS", 2, 8, true, false},
      {"RGB 16 bits", 2, 16, false, false},
      {"palette 4 bits with a short tRNS", 3, 4, true, false},
      {"grey and alpha", 4, 8, false, false},
      {"RGBA 16 bits", 6, 16, false, false},
      {"RGBA interlaced", 6, 8, false, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    PngImage image = png_pattern(9, 7, c.color_type, c.bit_depth, c.interlaced);
    if (c.trns) {
      // The first pixel's value is the transparent one; the palette's
      // later entries stay opaque.
      image.has_trns = true;
      image.trns_grey = image.trns_red = image.samples[0];
      image.trns_green = image.samples[1];
      image.trns_blue = image.samples[2];
      image.trns_alpha = {0, 64, 128, 200, 7};
    }
    int width = 0, height = 0;
    EXPECT_EQ(service_decode_png(png_encode_image(image), &width, &height),
              png_expected_bgra(image));
    EXPECT_EQ(std::to_string(width) + "x" + std::to_string(height), "9x7");
  }
  // IncompressiblePixelsNoLongerOverrunTheOutputBuffer: pixels that do not
  // compress give a PNG longer than the buffer first guessed.
  const std::vector<uint8_t> noise = noise_bytes(64 * 64 * 4, 42);
  unsigned char* png = nullptr;
  int size = 0;
  ASSERT_EQ(convert_raw_data_to_png(noise.data(), 64, 64, &png, &size), 0);
  EXPECT_GT(size_t(size), noise.size());
  EXPECT_EQ(service_decode_png(std::string(reinterpret_cast<char*>(png), size)), noise);
  std::free(png);
  EXPECT_EQ(convert_raw_data_to_png(noise.data(), 0, 2, &png, &size), -1);
  EXPECT_EQ(service_decode_png("GIF89a-not-a-png-at-all"), std::vector<uint8_t>{});
}

}  // namespace
