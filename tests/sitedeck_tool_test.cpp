// The `sitedeck` command line against the real service under the activator,
// with a seeded database: the table of `list`, the fields of `show`, the PNG
// that `icon -o` writes, JSON and colours, and how failures are reported
// (bad usage is in sitedeck_tool_messages_test.cpp).
#include <gtest/gtest.h>
#include <json-glib/json-glib.h>

#include <memory>
#include <regex>
#include <string>
#include <vector>

#include "kdb.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-utils.h"
#include "sitedeck-tool-output.h"
#include "support/json_match.h"
#include "support/pull_env.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

class SitedeckTool : public ::testing::Test {
 protected:
  void SetUp() override {
    SeedItem news = seed_item(7, "https://news.example/", "News", 1);
    news.dominant_color = "#AA0000";
    news.icon_size = "4x3";
    news.touch_icon_exists = 1;
    news.favicon_exists = 1;
    news.icon_data = seed_pixels(4, 3, 7);
    SeedItem mail = seed_item(3, "https://mail.example/inbox", "Mail", 2);
    SeedItem gone = seed_item(9, "https://gone.example/", "Gone", 3);
    gone.dominant_color = "#000000";
    gone.is_dirty = -1;
    SeedItem long_title =
        seed_item(5, "https://five.example/", "A very long title that will not fit the column", 4);
    long_title.dominant_color = "#00FF00";
    long_title.favicon_exists = 1;
    const std::vector<SeedItem> items = {news, mail, gone, long_title};
    ASSERT_TRUE(seed_deck(items));
    ASSERT_TRUE(service_.start_activated(/*once=*/false));
  }

  ProcessResult sitedeck(const std::vector<std::string>& arguments) {
    std::vector<std::string> argv = {std::string(SITEDECK_BIN_DIR) + "/sitedeck", "--socket",
                                     service_.socket_path()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return run_process(argv);
  }

  TempRoot root_;
  ServiceHarness service_;
};

TEST_F(SitedeckTool, ListPrintsTheLiveItemsInDeckOrder) {
  ProcessResult result = sitedeck({"list"});
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  // Off a terminal nothing is cut: a script gets whole titles and URLs.
  EXPECT_EQ(result.out,
            "ID  TITLE                                           URL                         "
            "COLOUR   ICON  FLAGS\n"
            "7   News                                            https://news.example/       "
            "#AA0000  4x3   touch,favicon\n"
            "3   Mail                                            https://mail.example/inbox  "
            "-        -     -\n"
            "5   A very long title that will not fit the column  https://five.example/       "
            "#00FF00  -     favicon\n");
  EXPECT_EQ(result.err, "");
}

TEST_F(SitedeckTool, ShowPrintsEveryFieldAndNamesWhatIsNotStored) {
  ProcessResult result = sitedeck({"show", "3"});
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.out,
            "id:                3\n"
            "url:               https://mail.example/inbox\n"
            "title:             Mail\n"
            "dominant colour:   (none)\n"
            "icon size:         (none)\n"
            "touch icon exists: 0\n"
            "favicon exists:    0\n"
            "icon pixels:       (none)\n");
  result = sitedeck({"show", "7"});
  EXPECT_NE(result.out.find("icon pixels:       4x3, 48 bytes\n"), std::string::npos) << result.out;
}

TEST_F(SitedeckTool, IconWritesThePixelsBackAsPng) {
  const std::string path = root_.dir() + "/news.png";
  ProcessResult result = sitedeck({"icon", "7", "-o", path});
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.out.rfind(path + ": 4x3, ", 0), 0u) << result.out;

  std::string png = read_file(path);
  unsigned char* raw = nullptr;
  int width = 0, height = 0, size = 0;
  ASSERT_EQ(convert_png_to_raw_data(reinterpret_cast<const unsigned char*>(png.data()), png.size(),
                                    &raw, &width, &height, &size),
            0);
  UniqueMalloc<unsigned char> pixels(raw);
  EXPECT_EQ(width, 4);
  EXPECT_EQ(height, 3);
  EXPECT_EQ(std::vector<uint8_t>(raw, raw + size), seed_pixels(4, 3, 7));
}

TEST_F(SitedeckTool, FailuresNameTheStatusAndExitWithOne) {
  struct Case {
    std::vector<std::string> arguments;
    std::string err;
  } cases[] = {
      {{"show", "99"},
       "sitedeck: the service answered 8 SDS_ERROR_ID_NOT_FOUND: no item has this id\n"},
      {{"icon", "3", "-o", root_.dir() + "/none.png"},
       "sitedeck: the service answered 6 SDS_ERROR_NO_DATA: nothing is stored for this request\n"},
      // A failure is told on stderr and by the exit status, never as JSON.
      {{"--json", "show", "99"},
       "sitedeck: the service answered 8 SDS_ERROR_ID_NOT_FOUND: no item has this id\n"},
  };
  for (const auto& c : cases) {
    ProcessResult result = sitedeck(c.arguments);
    ASSERT_TRUE(result.finished) << c.arguments[1];
    EXPECT_EQ(result.exit_code, 1) << c.arguments[1];
    EXPECT_EQ(result.err, c.err);
    EXPECT_EQ(result.out, "") << c.arguments[1];
  }
  EXPECT_FALSE(file_exists(root_.dir() + "/none.png"));

  // The service serves one connection at a time: a second client waits in
  // the socket's backlog without a greeting, and says so once it gives up.
  SdsConnection first;
  ASSERT_EQ(service_.connect(&first), SDS_ERROR_NONE);
  ProcessResult busy = sitedeck({"--timeout", "300", "hello"});
  EXPECT_EQ(busy.exit_code, 1);
  EXPECT_EQ(busy.err, "sitedeck: cannot reach the site deck service at " + service_.socket_path() +
                          ": the service is busy with another connection; it serves one "
                          "connection at a time, try again when that one ends\n");
}

// Whole values and nulls for what is not stored; the option may follow the
// command as well; `show` adds the icon's size.
TEST_F(SitedeckTool, JsonOfListAndShowHasEveryFieldWithNullsForWhatIsNotStored) {
  const std::string news =
      R"({"id": 7, "url": "https://news.example/", "title": "News", "dominant_color": "#AA0000",
          "icon_size": "4x3", "icon_width": 4, "icon_height": 3, "touch_icon_exists": true,
          "favicon_exists": true)";
  const std::string mail =
      R"({"id": 3, "url": "https://mail.example/inbox", "title": "Mail", "dominant_color": null,
          "icon_size": null, "icon_width": null, "icon_height": null,
          "touch_icon_exists": false, "favicon_exists": false)";
  struct Case {
    std::vector<std::string> arguments;
    std::string json;
  } cases[] = {
      {{"--json", "list"},
       R"({"items": [)" + news + "}, " + mail + "}, " +
           R"({"id": 5, "url": "https://five.example/",
               "title": "A very long title that will not fit the column",
               "dominant_color": "#00FF00", "icon_size": null, "icon_width": null,
               "icon_height": null, "touch_icon_exists": false, "favicon_exists": true}]})"},
      {{"show", "7", "--json"}, news + R"(, "icon": {"width": 4, "height": 3, "bytes": 48}})"},
      {{"--json", "show", "3"}, mail + R"(, "icon": null})"},
  };
  for (const auto& c : cases) {
    ProcessResult result = sitedeck(c.arguments);
    ASSERT_TRUE(result.finished) << c.json;
    EXPECT_EQ(result.exit_code, 0) << result.err;
    EXPECT_TRUE(IsJson(result.out, c.json));
  }
}

TEST_F(SitedeckTool, NextUpdatePrintsTheSecondsAndTheSimpleCommandsHaveJson) {
  ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "7200"));
  ProcessResult result = sitedeck({"next-update"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.out, "7200\n");
  EXPECT_TRUE(IsJson(sitedeck({"--json", "next-update"}).out, R"({"seconds": 7200})"));
  EXPECT_TRUE(IsJson(sitedeck({"--json", "release"}).out, R"({"released": true})"));
  // The client id is the service's choice.
  EXPECT_TRUE(IsJson(std::regex_replace(sitedeck({"--json", "hello"}).out, std::regex("\\d+"), "1"),
                     R"({"client_id": 1})"));
  const std::string png = root_.dir() + "/news.png";
  result = sitedeck({"--json", "icon", "7", "-o", png});
  EXPECT_TRUE(IsJson(result.out, R"({"file": ")" + png + R"(", "width": 4, "height": 3,
                                    "png_bytes": )" +
                                     std::to_string(read_file(png).size()) + "}"));
}

TEST_F(SitedeckTool, NoColourEscapesUnlessStdoutIsATerminalOrColoursAreForced) {
  for (const auto& arguments : std::vector<std::vector<std::string>>{
           {"show", "7"}, {"--color=auto", "list"}, {"--json", "--color=always", "list"}}) {
    ProcessResult result = sitedeck(arguments);
    EXPECT_EQ(result.exit_code, 0) << arguments[0];
    EXPECT_EQ(result.out.find('\033'), std::string::npos) << arguments[0] << result.out;
  }
  ProcessResult result = sitedeck({"--color=always", "list"});
  EXPECT_NE(result.out.find("\033[48;2;170;0;0m  \033[0m #AA0000"), std::string::npos)
      << result.out;
  result = sitedeck({"show", "7", "--color", "always"});
  EXPECT_NE(result.out.find("\033[1mdominant colour:\033[0m   \033[48;2;170;0;0m"),
            std::string::npos)
      << result.out;
}

// Runs the tool on a pseudo-terminal 60 columns wide (util-linux's script),
// as a person would; what it printed there, line ends as the terminal makes them.
std::string RunOnTerminal(const std::string& arguments) {
  return run_process({"/usr/bin/script", "-qec",
                      "stty cols 60 && env -u NO_COLOR TERM=xterm-256color " +
                          std::string(SITEDECK_BIN_DIR) + "/sitedeck " + arguments,
                      "/dev/null"})
      .out;
}

TEST_F(SitedeckTool, OnATerminalTheTableFitsItsWidthAndHasColours) {
  const std::string out = RunOnTerminal("--socket " + service_.socket_path() + " list");
  EXPECT_NE(out.find("\033[1mID\033[0m"), std::string::npos) << out;
  EXPECT_NE(out.find("\033[48;2;170;0;0m  \033[0m #AA0000"), std::string::npos) << out;
  EXPECT_NE(out.find("\r\n5   A very lo\xE2\x80\xA6  https://fi\xE2\x80\xA6  "), std::string::npos)
      << out;
  size_t lines = 0;
  const std::regex escape("\033\\[[0-9;]*m");
  for (size_t start = 0, end; (end = out.find("\r\n", start)) != std::string::npos;
       start = end + 2) {
    std::string line = std::regex_replace(out.substr(start, end - start), escape, "");
    EXPECT_LE(sds_tool_display_width(line), 60u) << line;
    ++lines;
  }
  EXPECT_EQ(lines, 4u) << out;
}

// A pull through the stand-in servers: the result is printed by name, and
// "not modified" counts as success as much as a new list does.
TEST(SitedeckToolInit, PrintsThePullResultAndListsWhatWasPulled) {
  TempRoot root;
  ContentServerProcess content;
  GeocoderProcess geocoder;
  ASSERT_TRUE(content.ok() && geocoder.ok());
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder.root_url().c_str()));
  ASSERT_TRUE(write_server_list({{1, content.base_url(), 0, 1, false}}));
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated(/*once=*/false));
  const std::string tool = std::string(SITEDECK_BIN_DIR) + "/sitedeck";
  const std::string socket = service.socket_path();
  const std::vector<std::string> init = {tool,   "--socket", socket, "init",      "--lat",
                                         "37.5", "--lon",    "127",  "--version", "9.0"};

  ProcessResult result = run_process(init);
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.exit_code, 0) << result.err << service.output();
  EXPECT_EQ(result.out, "pull result: 0 SDS_ERROR_NONE: a new item list was stored\n");
  result = run_process({tool, "--socket", socket, "list"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_NE(result.out.find("\n1   Daily Herald "), std::string::npos) << result.out;

  result = run_process(init);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.out,
            "pull result: 17 SDS_ERROR_HTTP_NOT_MODIFIED: the stored item list is current\n");

  std::vector<std::string> json_init = init;
  json_init.insert(json_init.begin() + 1, "--json");
  result = run_process(json_init);
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_TRUE(IsJson(result.out, R"({"status": 17, "name": "SDS_ERROR_HTTP_NOT_MODIFIED",
                                      "meaning": "the stored item list is current",
                                      "deck_current": true})"));
}

}  // namespace
