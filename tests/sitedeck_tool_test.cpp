// The `sitedeck` command line: against the real service under the activator
// with a seeded deck (its tables, fields, JSON, colours and PNG icons), after
// a real pull through the stand-in servers, and without a service (every
// reason a connection fails, a stand-in peer answering a chosen status, help,
// bad usage and output that cannot be written).
#include <gtest/gtest.h>
#include <json-glib/json-glib.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <optional>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "kdb.h"
#include "pull/sitedeck-service-utils.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool-status.h"
#include "support/json_match.h"
#include "support/pull_env.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

const std::string kTool = std::string(SITEDECK_BIN_DIR) + "/sitedeck";

ProcessResult sitedeck(const std::string& socket, const std::vector<std::string>& arguments) {
  std::vector<std::string> argv = {kTool, "--socket", socket};
  argv.insert(argv.end(), arguments.begin(), arguments.end());
  return run_process(argv);
}

class SitedeckTool : public ::testing::Test {
 protected:
  void SetUp() override {
    SeedItem news = seed_item(7, "https://news.example/", "News", 1);
    news.dominant_color = "#AA0000";
    news.icon_size = "4x3";
    news.touch_icon_exists = news.favicon_exists = 1;
    news.icon_data = seed_pixels(4, 3, 7);
    SeedItem gone = seed_item(9, "https://gone.example/", "Gone", 3);
    gone.is_dirty = -1;
    SeedItem five = seed_item(5, "https://five.example/", "A very long title that will not fit the column", 4);
    five.dominant_color = "#00FF00";
    five.favicon_exists = 1;
    ASSERT_TRUE(seed_deck({news, seed_item(3, "https://mail.example/inbox", "Mail", 2), gone, five}));
    ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "7200"));
    ASSERT_TRUE(service_.start_activated(/*once=*/false));
  }
  ProcessResult sitedeck(const std::vector<std::string>& arguments) {
    return ::sitedeck(service_.socket_path(), arguments);
  }
  TempRoot root_;
  ServiceHarness service_;
};

// Off a terminal nothing is cut and no colour is used unless forced; JSON has
// every field, with nulls for what is not stored; a failure is told on
// standard error and by the exit status, never as JSON.
TEST_F(SitedeckTool, EveryCommandPrintsExactlyWhatTheServiceHolds) {
  const std::string list =
      "ID  TITLE                                           URL                         COLOUR   ICON  FLAGS\n"
      "7   News                                            https://news.example/       #AA0000  4x3   touch,favicon\n"
      "3   Mail                                            https://mail.example/inbox  -        -     -\n"
      "5   A very long title that will not fit the column  https://five.example/       #00FF00  -     favicon\n";
  const std::string news =
      R"({"id": 7, "url": "https://news.example/", "title": "News", "dominant_color": "#AA0000",
          "icon_size": "4x3", "icon_width": 4, "icon_height": 3, "touch_icon_exists": true,
          "favicon_exists": true)";
  const std::string mail =
      R"({"id": 3, "url": "https://mail.example/inbox", "title": "Mail", "dominant_color": null,
          "icon_size": null, "icon_width": null, "icon_height": null,
          "touch_icon_exists": false, "favicon_exists": false)";
  const std::string json_list = R"({"items": [)" + news + "}, " + mail + "}, " +
                                R"({"id": 5, "url": "https://five.example/",
      "title": "A very long title that will not fit the column", "dominant_color": "#00FF00",
      "icon_size": null, "icon_width": null, "icon_height": null, "touch_icon_exists": false,
      "favicon_exists": true}]})";
  const std::string show_7 =
      "id:                7\nurl:               https://news.example/\ntitle:             News\n"
      "dominant colour:   #AA0000\nicon size:         4x3\ntouch icon exists: 1\n"
      "favicon exists:    1\nicon pixels:       4x3, 48 bytes\n";
  const std::string png = root_.dir() + "/news.png", none = root_.dir() + "/none.png";
  const std::string not_found = "sitedeck: the service answered 8 SDS_ERROR_ID_NOT_FOUND: no item has this id\n";
  struct Case {
    std::vector<std::string> arguments;
    int exit_code;
    std::string out, err;
    enum { kExact, kJson, kHas } match = kExact;
  } cases[] = {
      {{"list"}, 0, list, ""},
      {{"--color=auto", "list"}, 0, list, ""},
      {{"--color=never", "list"}, 0, list, ""},
      {{"show", "7"}, 0, show_7, ""},
      {{"show", "3"}, 0,
       "id:                3\nurl:               https://mail.example/inbox\ntitle:             Mail\n"
       "dominant colour:   (none)\nicon size:         (none)\ntouch icon exists: 0\n"
       "favicon exists:    0\nicon pixels:       (none)\n", ""},
      {{"--json", "list"}, 0, json_list, "", Case::kJson},
      {{"--json", "--color=always", "list"}, 0, json_list, "", Case::kJson},
      {{"show", "7", "--json"}, 0, news + R"(, "icon": {"width": 4, "height": 3, "bytes": 48}})", "", Case::kJson},
      {{"--json", "show", "3"}, 0, mail + R"(, "icon": null})", "", Case::kJson},
      {{"--color=always", "list"}, 0, "\033[48;2;170;0;0m  \033[0m #AA0000", "", Case::kHas},
      {{"show", "7", "--color", "always"}, 0, "\033[1mdominant colour:\033[0m   \033[48;2;170;0;0m", "",
       Case::kHas},
      {{"next-update"}, 0, "7200\n", ""},
      {{"--json", "next-update"}, 0, R"({"seconds": 7200})", "", Case::kJson},
      {{"icon", "7", "-o", png}, 0, png + ": 4x3, ", "", Case::kHas},
      {{"show", "99"}, 1, "", not_found},
      {{"--json", "show", "99"}, 1, "", not_found},
      {{"icon", "3", "-o", none}, 1, "",
       "sitedeck: the service answered 6 SDS_ERROR_NO_DATA: nothing is stored for this request\n"},
      {{"--json", "release"}, 0, R"({"released": true})", "", Case::kJson},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::PrintToString(c.arguments));
    ProcessResult result = sitedeck(c.arguments);
    ASSERT_TRUE(result.finished);
    EXPECT_EQ(result.exit_code, c.exit_code) << result.err;
    EXPECT_EQ(result.err, c.err);
    if (c.match == Case::kJson) {
      EXPECT_TRUE(IsJson(result.out, c.out));
    } else if (c.match == Case::kHas) {
      EXPECT_NE(result.out.find(c.out), std::string::npos) << result.out;
    } else {
      EXPECT_EQ(result.out, c.out);
    }
  }
  EXPECT_FALSE(file_exists(none));
  unsigned char* raw = nullptr;
  int width = 0, height = 0, size = 0;
  const std::string written = read_file(png);
  ASSERT_EQ(convert_png_to_raw_data(reinterpret_cast<const unsigned char*>(written.data()),
                                    written.size(), &raw, &width, &height, &size),
            0);
  UniqueMalloc<unsigned char> pixels(raw);
  EXPECT_EQ(width, 4);
  EXPECT_EQ(height, 3);
  EXPECT_EQ(std::vector<uint8_t>(raw, raw + size), seed_pixels(4, 3, 7));
  EXPECT_TRUE(IsJson(sitedeck({"--json", "icon", "7", "-o", png}).out,
                     R"({"file": ")" + png + R"(", "width": 4, "height": 3, "png_bytes": )" +
                         std::to_string(written.size()) + "}"));
  // The client id is the service's choice.
  const std::regex id("\\d+");
  EXPECT_EQ(std::regex_replace(sitedeck({"hello"}).out, id, "1"), "client id: 1\n");
  EXPECT_TRUE(IsJson(std::regex_replace(sitedeck({"--json", "hello"}).out, id, "1"), R"({"client_id": 1})"));
  // The service serves one connection at a time: a second client waits in
  // the backlog without a greeting, and says so once it gives up.
  SdsConnection first;
  ASSERT_EQ(service_.connect(&first), SDS_ERROR_NONE);
  ProcessResult busy = sitedeck({"--timeout", "300", "hello"});
  EXPECT_EQ(busy.exit_code, 1);
  EXPECT_EQ(busy.err, "sitedeck: cannot reach the site deck service at " + service_.socket_path() +
                          ": the service is busy with another connection; it serves one "
                          "connection at a time, try again when that one ends\n");
}

// On a pseudo-terminal 60 columns wide (util-linux's script), as a person
// sees it: a bold header, colour swatches, and cells cut to fit.
TEST_F(SitedeckTool, OnATerminalTheTableFitsItsWidthAndHasColours) {
  const std::string out = run_process({"/usr/bin/script", "-qec",
                                       "stty cols 60 && env -u NO_COLOR TERM=xterm-256color " + kTool +
                                           " --socket " + service_.socket_path() + " list",
                                       "/dev/null"})
                              .out;
  EXPECT_NE(out.find("\033[1mID\033[0m"), std::string::npos) << out;
  EXPECT_NE(out.find("\033[48;2;170;0;0m  \033[0m #AA0000"), std::string::npos) << out;
  EXPECT_NE(out.find("\r\n5   A very lo\xE2\x80\xA6  https://fi\xE2\x80\xA6  "), std::string::npos) << out;
  size_t lines = 0;
  for (size_t start = 0, end; (end = out.find("\r\n", start)) != std::string::npos; start = end + 2) {
    std::string line = std::regex_replace(out.substr(start, end - start), std::regex("\033\\[[0-9;]*m"), "");
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
  const std::vector<std::string> init = {"init", "--lat", "37.5", "--lon", "127", "--version", "9.0"};
  ProcessResult result = sitedeck(service.socket_path(), init);
  EXPECT_EQ(result.exit_code, 0) << result.err << service.output();
  EXPECT_EQ(result.out, "pull result: 0 SDS_ERROR_NONE: a new item list was stored\n");
  result = sitedeck(service.socket_path(), {"list"});
  EXPECT_NE(result.out.find("\n1   Daily Herald "), std::string::npos) << result.out;
  result = sitedeck(service.socket_path(), init);
  EXPECT_EQ(result.out, "pull result: 17 SDS_ERROR_HTTP_NOT_MODIFIED: the stored item list is current\n");
  std::vector<std::string> json_init = init;
  json_init.insert(json_init.begin(), "--json");
  EXPECT_TRUE(IsJson(sitedeck(service.socket_path(), json_init).out,
                     R"({"status": 17, "name": "SDS_ERROR_HTTP_NOT_MODIFIED",
                         "meaning": "the stored item list is current", "deck_current": true})"));
}

UniqueFd bound_socket(const std::string& path) {
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  return fd && bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 ? std::move(fd)
                                                                                           : UniqueFd();
}

// Greets one client with `greeting` (and client id 5 after a 0), then, if
// `status` is not negative, reads one request header and answers `status`
// alone. A greeting of -1 closes the connection without a word.
class StandInPeer {
 public:
  StandInPeer(const std::string& path, int32_t greeting, int32_t status) : listener_(bound_socket(path)) {
    if (listener_ && listen(listener_.get(), 4) == 0) thread_ = std::thread([=, this] { serve(greeting, status); });
  }
  ~StandInPeer() {
    if (thread_.joinable()) thread_.join();
  }
  bool ok() const { return thread_.joinable(); }
  sds_command header;  // the request answered

 private:
  void serve(int32_t greeting, int32_t status) {
    struct pollfd entry = {listener_.get(), POLLIN, 0};
    if (poll(&entry, 1, 20000) != 1) return;
    UniqueFd client(accept(listener_.get(), nullptr, nullptr));
    int32_t hello[2] = {greeting, 5};
    if (!client || greeting < 0 || write(client.get(), hello, greeting == 0 ? 8 : 4) < 0) return;
    entry = {client.get(), POLLIN, 0};
    if (status < 0 || poll(&entry, 1, 20000) != 1) return;
    if (read(client.get(), &header, sizeof header) == sizeof header) (void)write(client.get(), &status, 4);
  }
  UniqueFd listener_;
  std::thread thread_;
};

class SitedeckToolMessages : public ::testing::Test {
 protected:
  ProcessResult sitedeck(const std::vector<std::string>& arguments) { return ::sitedeck(socket_, arguments); }
  TempRoot root_;
  const std::string socket_ = root_.dir() + "/peer.sock";
};

// Every reason a connection can fail before the service says a word: an
// absent socket, one left behind by a listener that is gone, one closed to
// the user, a listener that never takes the connection (as the service does
// while it serves another), a backlog so full that connect() itself waits, a
// peer that hangs up before its greeting, and a greeting that refuses.
TEST_F(SitedeckToolMessages, AnUnreachableServiceIsNamedWithTheReasonAndExitsWithOne) {
  const std::string unreachable = "sitedeck: cannot reach the site deck service at " + socket_;
  const std::string hint = "; is the socket unit running?\n";
  enum Peer { kNone, kGone, kDenied, kBusy, kFull, kHangsUp, kRefuses };
  struct Case {
    Peer peer;
    std::string err;
  } cases[] = {
      {kNone, unreachable + ": there is no socket file (No such file or directory)" + hint},
      {kGone, unreachable + ": nobody is listening on the socket (Connection refused)" + hint},
      {kDenied, unreachable + ": permission to use the socket was denied (Permission denied)\n"},
      {kBusy, unreachable + ": the service is busy with another connection; it serves one connection at a "
                            "time, try again when that one ends\n"},
      {kFull, unreachable + ": connecting to the service timed out (Resource temporarily unavailable)\n"},
      {kHangsUp, unreachable + ": the service closed the connection before its greeting\n"},
      {kRefuses, "sitedeck: the service refused the connection: 2 SDS_ERROR_SHM_FAILED: the "
                 "shared-memory object for icon pixels could not be created, mapped or removed\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.peer);
    ASSERT_TRUE(unlink(socket_.c_str()) == 0 || errno == ENOENT);
    UniqueFd bound = c.peer >= kGone && c.peer <= kFull ? bound_socket(socket_) : UniqueFd();
    // A backlog of 0 holds one waiting connection; the tool's is the second.
    ASSERT_TRUE(!bound || c.peer == kGone || listen(bound.get(), 0) == 0);
    ASSERT_TRUE(c.peer != kDenied || chmod(socket_.c_str(), 0) == 0);
    UniqueFd waiting(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (c.peer == kFull) {
      struct sockaddr_un address {};
      address.sun_family = AF_UNIX;
      std::memcpy(address.sun_path, socket_.c_str(), socket_.size() + 1);
      ASSERT_EQ(connect(waiting.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    }
    std::optional<StandInPeer> peer;
    if (c.peer >= kHangsUp) peer.emplace(socket_, c.peer == kHangsUp ? -1 : SDS_ERROR_SHM_FAILED, -1);
    ASSERT_TRUE(!peer || peer->ok());
    std::vector<std::string> argv = {kTool, "--socket", socket_, "--timeout", "300", "hello"};
    ProcessResult result = run_process(c.peer == kDenied ? without_root(argv) : argv);
    EXPECT_EQ(result.exit_code, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, c.err);
  }
}

// A status is told by number, name and meaning; 1 as the connection lost.
TEST_F(SitedeckToolMessages, EveryNonZeroStatusIsToldByNumberNameAndMeaning) {
  const std::string answered = "sitedeck: the service answered ";
  for (const auto& [status, told] : std::vector<std::pair<int32_t, std::string>>{
           {1, "sitedeck: lost the connection to the service: 1 SDS_ERROR_IO_ERROR: a socket read or "
               "write failed or the connection was closed\n"},
           {9, answered + "9 SDS_ERROR_UNKNOWN: a status number the service does not use\n"},
           {18, answered + "18 SDS_ERROR_SERVER_REQUEST_FAILED: a server request failed or got an "
                           "unexpected answer\n"}}) {
    ASSERT_TRUE(unlink(socket_.c_str()) == 0 || errno == ENOENT);
    StandInPeer peer(socket_, 0, status);
    ASSERT_TRUE(peer.ok()) << status;
    ProcessResult result = sitedeck({"next-update"});
    EXPECT_EQ(result.exit_code, 1) << status;
    EXPECT_EQ(result.out, "") << status;
    EXPECT_EQ(result.err, told);
    EXPECT_EQ(peer.header.cmd, SDS_CMD_GET_NEXT_UPDATE_DURATION) << status;
  }
}

TEST_F(SitedeckToolMessages, EverySubcommandHasHelpThatNeedsNoService) {
  const std::vector<std::string> commands = {"hello", "list", "show", "icon", "release", "init", "status",
                                             "next-update"};
  ProcessResult all = sitedeck({"--help"});
  EXPECT_EQ(all.exit_code, 0);
  for (const auto& name : commands) {
    EXPECT_NE(all.out.find("\n  " + name + " "), std::string::npos) << name;
    for (const auto& arguments : std::vector<std::vector<std::string>>{
             {name, "--help"}, {name, "-h"}, {"help", name}, {name, "1", "--help"}}) {
      SCOPED_TRACE(testing::PrintToString(arguments));
      ProcessResult result = sitedeck(arguments);
      EXPECT_EQ(result.exit_code, 0);
      EXPECT_EQ(result.err, "");
      EXPECT_EQ(result.out.rfind("usage: sitedeck [OPTIONS] " + name, 0), 0u) << result.out;
      EXPECT_NE(result.out.find("\nexample:\n  sitedeck "), std::string::npos);
      EXPECT_NE(result.out.find("\nexit status:\n  0  "), std::string::npos);
    }
  }
}

// No service listens here: the arguments are judged before connecting, so
// bad usage is never reported as an unreachable service.
TEST_F(SitedeckToolMessages, BadUsageNamesTheWrongArgumentAndExitsWithTwo) {
  const std::string hint = "Try 'sitedeck --help' for more information.\n";
  auto usage = [](const std::string& command, const std::string& synopsis, const std::string& problem) {
    return "sitedeck: " + command + ": " + problem + "\nusage: sitedeck " + command + synopsis +
           "\nTry 'sitedeck " + command + " --help' for more information.\n";
  };
  const std::string init = " --lat LAT --lon LON [--version V]";
  struct Case {
    std::vector<std::string> arguments;
    std::string err;
  } cases[] = {
      {{"frobnicate"}, "sitedeck: unknown command frobnicate\n" + hint},
      {{"--frobnicate", "list"}, "sitedeck: unknown option --frobnicate\n" + hint},
      {{"--timeout", "soon", "list"}, "sitedeck: --timeout needs milliseconds (a whole number), not soon\n" + hint},
      {{"--color=sometimes", "list"}, "sitedeck: --color takes auto, always or never\n" + hint},
      {{"list", "--color"}, "sitedeck: --color takes auto, always or never\n" + hint},
      {{"help", "frobnicate"}, "sitedeck: no help for frobnicate: not a command\n" + hint},
      {{"status", "extra"}, usage("status", "", "unexpected argument extra")},
      {{"list", "extra"}, usage("list", "", "unexpected argument extra")},
      {{"show", "x"}, usage("show", " ID", "x is not an item id (a whole number from 0)")},
      {{"show", "-1"}, usage("show", " ID", "-1 is not an item id (a whole number from 0)")},
      {{"icon", "3"}, usage("icon", " ID -o FILE", "-o FILE is missing")},
      {{"icon", "3", "-o"}, usage("icon", " ID -o FILE", "-o needs a FILE")},
      {{"init", "--lat", "1"}, usage("init", init, "--lon LON is missing")},
      {{"init", "--lat", "north", "--lon", "1"}, usage("init", init, "--lat needs degrees (a number), not north")},
      {{"init", "--lat", "90.5", "--lon", "1"}, usage("init", init, "latitude 90.5 is outside -90..90")},
      {{"init", "--lat", "1", "--lon", "-181"}, usage("init", init, "longitude -181 is outside -180..180")},
  };
  for (const auto& c : cases) {
    ProcessResult result = sitedeck(c.arguments);
    EXPECT_EQ(result.exit_code, 2) << c.err;
    EXPECT_EQ(result.out, "") << c.err;
    EXPECT_EQ(result.err, c.err);
  }
  ProcessResult alone = sitedeck({});  // alone, the tool shows its whole usage
  EXPECT_EQ(alone.exit_code, 2);
  EXPECT_EQ(alone.err.rfind("usage: sitedeck [OPTIONS] COMMAND [ARGUMENTS]\n", 0), 0u) << alone.err;
}

// As coreutils do: output that cannot be written (here a full disk) fails
// the command with a message.
TEST_F(SitedeckToolMessages, OutputThatCannotBeWrittenExitsWithOne) {
  ProcessResult result = run_process({"/bin/sh", "-c", kTool + " --version >/dev/full; echo $?"});
  EXPECT_EQ(result.out, "1\n");
  EXPECT_EQ(result.err, "sitedeck: write error: No space left on device\n");
  EXPECT_EQ(run_process({kTool, "--version"}).out, "sitedeck " SITEDECK_VERSION "\n");
  const std::string service = std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service";
  EXPECT_EQ(run_process({service, "--version"}).out, "browser-sitedeck-service " SITEDECK_VERSION "\n");
  EXPECT_NE(run_process({service, "--help"}).out.find("started by its socket unit"), std::string::npos);
}

// Text from the network cannot reach the terminal as control characters.
TEST(ToolOutput, ControlCharactersFromTheNetworkCannotReachTheTerminal) {
  sds_tool_table table;
  table.header = {"ID", "TITLE"};
  table.rows = {{{"1"}, {"Evil\033]2;owned\007 \xC2\x9B" "31m\xFFTitle"}}};
  EXPECT_EQ(sds_tool_format_table(table, sds_tool_settings{}), "ID  TITLE\n1   Evil?]2;owned? ?31m?Title\n");
  EXPECT_EQ(sds_tool_format_fields({{"city", {"Jongno\r\n-gu"}}, {"dominant colour", {"#0F0", true}}},
                                   sds_tool_settings{}),
            "city:            Jongno?" "?-gu\ndominant colour: #0F0\n");
}

TEST(ToolOutput, AgesInWords) {
  struct Case {
    long long seconds;
    const char* text;
  } cases[] = {
      {-5, "in the future"},      {0, "0 s ago"},         {59, "59 s ago"},
      {60, "1 min ago"},          {3599, "59 min ago"},   {11520, "3 h 12 min ago"},
      {86399, "23 h 59 min ago"}, {86400, "1 d 0 h ago"}, {200000, "2 d 7 h ago"},
  };
  for (const auto& c : cases) EXPECT_EQ(sds_tool_format_age(c.seconds), c.text) << c.seconds;
}

}  // namespace
