// `sitedeck` against the real service with a seeded deck, the preview in a real
// browser; without a service: failures, help, bad usage, `status`.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json-glib/json-glib.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>
#include <optional>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "kdb.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"
#include "sitedeck-tool-output.h"
#include "support/json_match.h"
#include "support/png_maker.h"
#include "support/pull_env.h"
#include "support/run_process.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

namespace {

namespace fs = std::filesystem;

const std::string kTool = SITEDECK_BIN_DIR "/sitedeck";

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
    SeedItem five =
        seed_item(5, "https://five.example/", "A very long title that will not fit the column", 4);
    five.dominant_color = "#00FF00";
    five.favicon_exists = 1;
    SeedItem mail = seed_item(3, "https://mail.example/inbox", "Mail\033]2;x\007", 2);
    ASSERT_TRUE(seed_deck({news, mail, gone, five}));
    ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "7200"));
    ASSERT_TRUE(service_.start_activated(/*once=*/false));
  }
  ProcessResult sitedeck(const std::vector<std::string>& args) {
    return ::sitedeck(service_.socket_path(), args);
  }
  TempRoot root_;
  ServiceHarness service_;
};

// Off a terminal nothing is cut and no colour is used unless forced; control
// characters from the network never reach the terminal; JSON has every field,
// nulls for what is not stored; a failure is told on standard error and by the
// exit status, never as JSON.
TEST_F(SitedeckTool, EveryCommandPrintsExactlyWhatTheServiceHolds) {
  const std::string list =
      "ID  TITLE                                           URL                         "
      "COLOUR   ICON  FLAGS\n"
      "7   News                                            https://news.example/       "
      "#AA0000  4x3   touch,favicon\n"
      "3   Mail?]2;x?                                      https://mail.example/inbox  "
      "-        -     -\n"
      "5   A very long title that will not fit the column  https://five.example/       "
      "#00FF00  -     favicon\n";
  const std::string news =
      R"({"id": 7, "url": "https://news.example/", "title": "News", "dominant_color": "#AA0000",
          "icon_size": "4x3", "icon_width": 4, "icon_height": 3, "touch_icon_exists": true,
          "favicon_exists": true)";
  const std::string mail =
      R"({"id": 3, "url": "https://mail.example/inbox", "title": "Mail\u001b]2;x\u0007",
          "dominant_color": null,
          "icon_size": null, "icon_width": null, "icon_height": null,
          "touch_icon_exists": false, "favicon_exists": false)";
  const std::string json_list = R"({"items": [)" + news + "}, " + mail + "}, " +
                                R"({"id": 5, "url": "https://five.example/",
      "title": "A very long title that will not fit the column", "dominant_color": "#00FF00",
      "icon_size": null, "icon_width": null, "icon_height": null, "touch_icon_exists": false,
      "favicon_exists": true}]})";
  const std::string png = root_.dir() + "/news.png", none = root_.dir() + "/none.png";
  const std::string file = root_.dir() + "/plain-file", page = root_.dir() + "/out/preview";
  ASSERT_TRUE(write_file(file, "x"));
  const auto usage = [](const std::string& problem) {
    return "sitedeck: render: " + problem +
           "\nusage: sitedeck render OUT_DIR\nTry 'sitedeck render --help' for more information.\n";
  };
  const std::string answered = "sitedeck: the service answered ";
  const std::string not_found = answered + "8 SDS_ERROR_ID_NOT_FOUND: no item has this id\n";
  struct Case {
    std::vector<std::string> arguments;
    int exit_code;
    std::string out, err;
    enum { kExact, kJson, kHas } match = kExact;
  } cases[] = {
      {{"list"}, 0, list, ""},
      {{"show", "7"}, 0,
       "id:                7\nurl:               https://news.example/\ntitle:             News\n"
       "dominant colour:   #AA0000\nicon size:         4x3\ntouch icon exists: 1\n"
       "favicon exists:    1\nicon pixels:       4x3, 48 bytes\n", ""},
      {{"show", "3"}, 0,
       "id:                3\nurl:               https://mail.example/inbox\n"
       "title:             Mail?]2;x?\n"
       "dominant colour:   (none)\nicon size:         (none)\ntouch icon exists: 0\n"
       "favicon exists:    0\nicon pixels:       (none)\n", ""},
      {{"--json", "list"}, 0, json_list, "", Case::kJson},
      {{"show", "7", "--json"}, 0, news + R"(, "icon": {"width": 4, "height": 3, "bytes": 48}})",
       "", Case::kJson},
      {{"--json", "show", "3"}, 0, mail + R"(, "icon": null})", "", Case::kJson},
      {{"--color=always", "list"}, 0, "\033[48;2;170;0;0m  \033[0m #AA0000", "", Case::kHas},
      {{"show", "7", "--color", "always"}, 0,
       "\033[1mdominant colour:\033[0m   \033[48;2;170;0;0m", "", Case::kHas},
      {{"next-update"}, 0, "7200\n", ""},
      {{"--json", "next-update"}, 0, R"({"seconds": 7200})", "", Case::kJson},
      {{"icon", "7", "-o", png}, 0, png + ": 4x3, ", "", Case::kHas},
      {{"show", "99"}, 1, "", not_found},
      {{"icon", "3", "-o", none}, 1, "",
       answered + "6 SDS_ERROR_NO_DATA: nothing is stored for this request\n"},
      {{"render", page}, 0, page + "/index.html\n", ""},
      {{"render", page}, 0, page + "/index.html\n", ""},  // written again, whole
      {{"render"}, 2, "", usage("OUT_DIR is missing")},
      {{"render", "a", "b"}, 2, "", usage("unexpected argument b")},
      {{"render", "--bogus"}, 2, "", usage("\"--bogus\" is not a directory name")},
      {{"render", file}, 1, "", "sitedeck: render: cannot create " + file + ": Not a directory\n"},
      {{"--json", "release"}, 0, R"({"released": true})", "", Case::kJson},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::PrintToString(c.arguments));
    ProcessResult result = sitedeck(c.arguments);
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
  EXPECT_EQ(read_file(file), "x");
  struct stat st {};
  ASSERT_EQ(stat((page + "/index.html").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_EQ(std::distance(fs::directory_iterator(page), {}), 1);
  const std::string written = read_file(png);
  EXPECT_EQ(service_decode_png(written), seed_pixels(4, 3, 7));
  EXPECT_TRUE(IsJson(sitedeck({"--json", "icon", "7", "-o", png}).out,
                     R"({"file": ")" + png + R"(", "width": 4, "height": 3, "png_bytes": )" +
                         std::to_string(written.size()) + "}"));
  EXPECT_EQ(std::regex_replace(sitedeck({"hello"}).out, std::regex("\\d+"), "1"), "client id: 1\n");
  // On a terminal 60 columns wide: bold header, colour swatches, cells cut to fit.
  const std::string command = "stty cols 60 && env -u NO_COLOR TERM=xterm-256color " + kTool +
                              " --color=auto --socket " + service_.socket_path() + " list";
  const std::string out = run_process({"/usr/bin/script", "-qec", command, "/dev/null"}).out;
  EXPECT_NE(out.find("\033[1mID\033[0m"), std::string::npos) << out;
  EXPECT_NE(out.find("\033[48;2;170;0;0m  \033[0m #AA0000"), std::string::npos) << out;
  EXPECT_NE(out.find("\r\n5   A very lo\xE2\x80\xA6  https://fi\xE2\x80\xA6  "), std::string::npos);
  const std::regex escape("\033\\[[0-9;]*m");
  size_t lines = 0;
  for (size_t at = 0, end; (end = out.find("\r\n", at)) != out.npos; at = end + 2, ++lines) {
    const std::string line = std::regex_replace(out.substr(at, end - at), escape, "");
    EXPECT_LE(sds_tool_display_width(line), 60u) << line;
  }
  EXPECT_EQ(lines, 4u) << out;
  // A pull through the stand-in servers: "not modified" is as much a success.
  ContentServerProcess content;
  GeocoderProcess geocoder;
  ASSERT_TRUE(content.ok() && geocoder.ok());
  ASSERT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder.root_url().c_str()));
  ASSERT_TRUE(write_server_list({{1, content.base_url(), 0, 1, false}}));
  const std::vector<std::string> init = {"init", "--lat", "37.5", "--lon", "127", "--version", "9"};
  EXPECT_EQ(sitedeck(init).out, "pull result: 0 SDS_ERROR_NONE: a new item list was stored\n");
  EXPECT_NE(sitedeck({"list"}).out.find("\n10  Daily Herald "), std::string::npos);
  EXPECT_EQ(sitedeck(init).out,
            "pull result: 17 SDS_ERROR_HTTP_NOT_MODIFIED: the stored item list is current\n");
  std::vector<std::string> json_init = init;
  json_init.insert(json_init.begin(), "--json");
  EXPECT_TRUE(IsJson(sitedeck(json_init).out,
                     R"({"status": 17, "name": "SDS_ERROR_HTTP_NOT_MODIFIED",
                         "meaning": "the stored item list is current", "deck_current": true})"));
}

UniqueFd bound_socket(const std::string& path) {
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  bool bound = fd && bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  return bound ? std::move(fd) : UniqueFd();
}

// Greets one client with `greeting` (then id 5 after a 0; -1: hangs up), and
// answers one request with `status` unless it is negative.
class StandInPeer {
 public:
  StandInPeer(const std::string& path, int32_t greeting, int32_t status)
      : listener_(bound_socket(path)) {
    if (listener_ && listen(listener_.get(), 4) == 0) {
      thread_ = std::thread([=, this] { serve(greeting, status); });
    }
  }
  ~StandInPeer() { command(); }
  int32_t command() {
    if (thread_.joinable()) thread_.join();
    return header_.cmd;
  }

 private:
  void serve(int32_t greeting, int32_t status) {
    struct pollfd entry = {listener_.get(), POLLIN, 0};
    if (poll(&entry, 1, 20000) != 1) return;
    UniqueFd client(accept(listener_.get(), nullptr, nullptr));
    int32_t hello[2] = {greeting, 5};
    if (!client || greeting < 0 || write(client.get(), hello, greeting == 0 ? 8 : 4) < 0) return;
    entry = {client.get(), POLLIN, 0};
    if (status < 0 || poll(&entry, 1, 20000) != 1) return;
    if (read(client.get(), &header_, 12) == 12) (void)write(client.get(), &status, 4);
  }
  UniqueFd listener_;
  std::thread thread_;
  sds_command header_;
};

class SitedeckToolMessages : public ::testing::Test {
 protected:
  ProcessResult sitedeck(const std::vector<std::string>& args) { return ::sitedeck(socket_, args); }
  TempRoot root_;
  const std::string socket_ = root_.dir() + "/peer.sock";
};

// Every reason a connection fails before the service says a word (no socket,
// nobody listening, no permission, busy with another connection, a backlog so
// full that connect() waits, a hang-up, a refusal); then a status by number,
// name and meaning.
TEST_F(SitedeckToolMessages, AnUnreachableServiceIsNamedWithTheReasonAndExitsWithOne) {
  const std::string unreachable = "sitedeck: cannot reach the site deck service at " + socket_;
  const std::string hint = "; is the socket unit running?\n";
  const std::string answered = "sitedeck: the service answered ";
  enum Peer { kNone, kGone, kDenied, kBusy, kFull, kHangsUp, kRefuses, kAnswers };
  struct Case {
    Peer peer;
    std::string err;
    int32_t status = -1;
  } cases[] = {
      {kNone, unreachable + ": there is no socket file (No such file or directory)" + hint},
      {kGone, unreachable + ": nobody is listening on the socket (Connection refused)" + hint},
      {kDenied, unreachable + ": permission to use the socket was denied (Permission denied)\n"},
      {kBusy, unreachable + ": the service is busy with another connection; it serves one "
                            "connection at a time, try again when that one ends\n"},
      {kFull,
       unreachable + ": connecting to the service timed out (Resource temporarily unavailable)\n"},
      {kHangsUp, unreachable + ": the service closed the connection before its greeting\n"},
      {kRefuses, "sitedeck: the service refused the connection: 2 SDS_ERROR_SHM_FAILED: the "
                 "shared-memory object for icon pixels could not be created, mapped or removed\n"},
      {kAnswers,
       "sitedeck: lost the connection to the service: 1 SDS_ERROR_IO_ERROR: a socket read or "
       "write failed or the connection was closed\n", 1},
      {kAnswers, answered + "9 SDS_ERROR_UNKNOWN: a status number the service does not use\n", 9},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.err);
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
    if (c.peer >= kHangsUp) {
      peer.emplace(socket_, c.peer == kHangsUp ? -1 : c.peer == kRefuses ? 2 : 0, c.status);
    }
    std::vector<std::string> argv = {kTool, "--socket", socket_, "--timeout", "300", "next-update"};
    ProcessResult result = run_process(c.peer == kDenied ? without_root(argv) : argv);
    EXPECT_EQ(result.exit_code, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, c.err);
    EXPECT_TRUE(c.peer != kAnswers || peer->command() == SDS_CMD_GET_NEXT_UPDATE_DURATION);
  }
}

// No service listens here: the arguments are judged before connecting, so
// bad usage is never reported as an unreachable service.
TEST_F(SitedeckToolMessages, BadUsageNamesTheWrongArgumentAndExitsWithTwoAndHelpNeedsNoService) {
  const std::string hint = "Try 'sitedeck --help' for more information.\n";
  auto usage = [](const std::string& c, const std::string& synopsis, const std::string& problem) {
    return "sitedeck: " + c + ": " + problem + "\nusage: sitedeck " + c + synopsis +
           "\nTry 'sitedeck " + c + " --help' for more information.\n";
  };
  const auto init = [&](const char* problem) {
    return usage("init", " --lat LAT --lon LON [--version V]", problem);
  };
  struct Case {
    std::vector<std::string> arguments;
    std::string err;
  } cases[] = {
      {{"frobnicate"}, "sitedeck: unknown command frobnicate\n" + hint},
      {{"--frobnicate", "list"}, "sitedeck: unknown option --frobnicate\n" + hint},
      {{"--timeout", "soon", "list"},
       "sitedeck: --timeout needs milliseconds (a whole number), not soon\n" + hint},
      {{"--color=sometimes", "list"}, "sitedeck: --color takes auto, always or never\n" + hint},
      {{"help", "frobnicate"}, "sitedeck: no help for frobnicate: not a command\n" + hint},
      {{"status", "extra"}, usage("status", "", "unexpected argument extra")},
      {{"show", "x"}, usage("show", " ID", "x is not an item id (a whole number from 0)")},
      {{"icon", "3"}, usage("icon", " ID -o FILE", "-o FILE is missing")},
      {{"icon", "3", "-o"}, usage("icon", " ID -o FILE", "-o needs a FILE")},
      {{"init", "--lat", "1"}, init("--lon LON is missing")},
      {{"init", "--lat", "north", "--lon", "1"}, init("--lat needs degrees (a number), not north")},
      {{"init", "--lat", "90.5", "--lon", "1"}, init("latitude 90.5 is outside -90..90")},
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
  // Every subcommand has its help, which needs no service either.
  ProcessResult all = sitedeck({"--help"});
  EXPECT_EQ(all.exit_code, 0);
  for (const std::string name :
       {"hello", "list", "show", "icon", "release", "init", "status", "next-update"}) {
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

// As coreutils do: output that cannot be written (a full disk) fails the command.
TEST_F(SitedeckToolMessages, OutputThatCannotBeWrittenExitsWithOne) {
  ProcessResult result = run_process({"/bin/sh", "-c", kTool + " --version >/dev/full; echo $?"});
  EXPECT_EQ(result.out, "1\n");
  EXPECT_EQ(result.err, "sitedeck: write error: No space left on device\n");
  EXPECT_EQ(run_process({kTool, "--version"}).out, "sitedeck " SITEDECK_VERSION "\n");
  const auto service = [](const char* option) {
    return run_process({SITEDECK_BIN_DIR "/browser-sitedeck-service", option}).out;
  };
  EXPECT_EQ(service("--version"), "browser-sitedeck-service " SITEDECK_VERSION "\n");
  EXPECT_NE(service("--help").find("started by its socket unit"), std::string::npos);
}


constexpr char kPullEnded[] = "1765051200";  // 2025-12-06 20:00:00 UTC

// Size and modification time of every file below `dir`.
std::map<std::string, std::pair<uintmax_t, fs::file_time_type>> Snapshot(const std::string& dir) {
  std::map<std::string, std::pair<uintmax_t, fs::file_time_type>> files;
  for (const auto& e : fs::recursive_directory_iterator(dir)) {
    files[e.path()] = {e.is_regular_file() ? e.file_size() : 0, e.last_write_time()};
  }
  return files;
}

// The database's age grows with the clock: above zero, then taken as 1.
::testing::AssertionResult IsStatusJson(const std::string& text, const std::string& expected) {
  return IsJson(text, expected, [](JsonNode* printed) {
    JsonObject* top = JSON_NODE_HOLDS_OBJECT(printed) ? json_node_get_object(printed) : nullptr;
    JsonNode* db = top != nullptr ? json_object_get_member(top, "database") : nullptr;
    if (db == nullptr || !JSON_NODE_HOLDS_OBJECT(db)) return top != nullptr;
    if (json_object_get_int_member(json_node_get_object(db), "age_seconds") <= 0) return false;
    json_object_set_int_member(json_node_get_object(db), "age_seconds", 1);
    return true;
  });
}

class SitedeckStatus : public ::testing::Test {
 protected:
  // Time stamps are printed in local time; the tool inherits the zone.
  void SetUp() override { setenv("TZ", "UTC", 1); }
  void TearDown() override { unsetenv("TZ"); }

  void Seed() {
    ASSERT_TRUE(write_server_list({{1, "http://127.0.0.1:8080/", 500, 3, false},
                                   {2, "https://backup.example/deck/", 60000, 1, true}}));
    ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "3600"));
    ASSERT_TRUE(write_file(root_.path(SDS_LOCATION_INFO_PATH),
                           "<Location><LatitudeLongitude>37.500000,127.000000</LatitudeLongitude>"
                           "<City>Jongno-gu</City><Province>Seoul</Province></Location>"));
    SeedItem hidden = seed_item(9, "https://gone.example/", "Gone", 3);
    hidden.is_dirty = -1;
    ASSERT_TRUE(seed_deck({seed_item(7, "https://news.example/", "News", 1),
                           seed_item(3, "https://mail.example/", "Mail", 2), hidden}));
    // After the database: a newly created one drops any stored ETag.
    ASSERT_TRUE(write_file(root_.path(SDS_ETAG_PATH), "\"v1-abc\"\n"));
    ASSERT_TRUE(write_file(root_.path(SDS_LAST_PULL_PATH),
                           std::string("time ") + kPullEnded + "\nstatus 0\nstored " + kPullEnded +
                               "\ncity Jongno-gu\nprovince Seoul\n"));
    struct timespec times[2] = {{1577836800, 0}, {1577836800, 0}};  // 2020-01-01 00:00:00 UTC
    ASSERT_EQ(utimensat(AT_FDCWD, root_.path(SDS_DB_PATH).c_str(), times, 0), 0);
  }
  ProcessResult Status(const std::vector<std::string>& options = {}) {
    std::vector<std::string> argv = {SITEDECK_BIN_DIR "/sitedeck"};
    argv.insert(argv.end(), options.begin(), options.end());
    argv.push_back("status");
    return run_process(argv);
  }

  TempRoot root_;
  const std::string data_ = root_.path(SDS_DATA_DIR);
};

// After a good pull every stored fact is shown, nothing written; a user who may
// not read server/ is told "permission denied" for its files, and it fails.
TEST_F(SitedeckStatus, SeededRootShowsEveryStoredFactAndChangesNothing) {
  Seed();
  const auto before = Snapshot(root_.dir());
  ProcessResult result = Status();
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(result.err, "");
  const std::string head = "data directory: " + data_ +
                           "\nservers:        2 configured\n"
                           "  ID  BASE URL                      WAIT      RETRIES  FALLBACK\n"
                           "  1   http://127.0.0.1:8080/        500 ms    3        no\n"
                           "  2   https://backup.example/deck/  60000 ms  1        yes\n"
                           "stored ETag:    \"v1-abc\"\nnext update:    3600 s\n"
                           "last pull:      2025-12-06 20:00:00 UTC, SDS_ERROR_NONE\n"
                           "next due:       2025-12-06 21:00:00 UTC\n"
                           "last position:  37.500000,127.000000 (Jongno-gu, Seoul)\n"
                           "items:          2 live, 1 withdrawn\ndatabase:       modified ";
  ASSERT_EQ(result.out.substr(0, head.size()), head);
  // The age grows with the clock; its form and the time stamp do not.
  EXPECT_TRUE(std::regex_match(result.out.substr(head.size()),
                               std::regex("\\d+ d \\d+ h ago \\(2020-01-01 00:00:00 UTC\\)\n")))
      << result.out;
  result = Status({"--json"});
  EXPECT_EQ(result.exit_code, 0) << result.err;
  EXPECT_EQ(Snapshot(root_.dir()), before);
  EXPECT_TRUE(IsStatusJson(result.out, R"({"data_directory": ")" + data_ + R"(",
      "servers": [
        {"id": 1, "base_url": "http://127.0.0.1:8080/", "wait_time_ms": 500, "retry_count": 3,
         "fall_back": false},
        {"id": 2, "base_url": "https://backup.example/deck/", "wait_time_ms": 60000,
         "retry_count": 1, "fall_back": true}],
      "etag": "\"v1-abc\"", "next_update": {"stored": "3600", "seconds": 3600},
      "last_pull": {"time": 1765051200, "status": 0, "name": "SDS_ERROR_NONE"},
      "next_due": 1765054800, "permission_denied": [],
      "location": {"position": "37.500000,127.000000", "city": "Jongno-gu", "province": "Seoul"},
      "database": {"path": ")" + root_.path(SDS_DB_PATH) + R"(", "live_items": 2,
                   "withdrawn_items": 1, "modified": 1577836800, "age_seconds": 1}})"));
  ASSERT_EQ(chmod(root_.dir().c_str(), 0755), 0);
  ASSERT_EQ(chmod(root_.path(SDS_SERVER_DIR).c_str(), 0), 0);
  result = run_process(without_root({SITEDECK_BIN_DIR "/sitedeck", "status"}));
  ASSERT_EQ(chmod(root_.path(SDS_SERVER_DIR).c_str(), 0750), 0);
  EXPECT_EQ(result.exit_code, 1);
  for (const char* line :
       {"servers:        permission denied (no usable server list at ",
        "stored ETag:    permission denied\n", "last pull:      permission denied\n",
        "last position:  permission denied\n"}) {
    EXPECT_NE(result.out.find(line), std::string::npos) << line << "\n" << result.out;
  }
  EXPECT_EQ(result.err, "sitedeck: status: permission denied: 5 file(s) under " + data_ +
                            " cannot be read by this user (first: " +
                            root_.path(SDS_SERVER_DATA_XML) + ")\n");
}

// Missing or broken files are told, not failures (the broken last-pull record
// has its lines in another order and a later key); no data directory is one.
TEST_F(SitedeckStatus, EmptyRootAndBrokenFilesAnswerNoneAndCreateNothing) {
  struct Case {
    const char* name;
    bool broken;
    std::string next_update, last_pull, database, stored;  // `stored`: as JSON
    std::string last_pull_json;
  } cases[] = {
      {"empty root", false, "none", "none (no pull has run)", "", "null",
       R"("last_pull": null, "next_due": null)"},
      {"broken files", true, "\"0\" is not above 0",
       "2025-12-06 20:00:00 UTC, SDS_ERROR_SERVER_REQUEST_FAILED\n"
       "next due:       2025-12-07 20:00:00 UTC",
       ": file is not a database", "\"0\"",
       R"("last_pull": {"time": 1765051200, "status": 18,
           "name": "SDS_ERROR_SERVER_REQUEST_FAILED"}, "next_due": 1765137600)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.broken) {
      ASSERT_TRUE(write_file(root_.path(SDS_SERVER_DATA_XML), "<values><Server>"));
      ASSERT_TRUE(write_file(root_.path(SDS_NEXT_UPDATE_DURATION_PATH), "0\n"));
      ASSERT_TRUE(write_file(root_.path(SDS_LOCATION_INFO_PATH), "not xml"));
      ASSERT_TRUE(write_file(root_.path(SDS_DB_PATH), "this is not an SQLite database file"));
      ASSERT_TRUE(write_file(root_.path(SDS_LAST_PULL_PATH),
                             std::string("status 18\nattempts 3\ntime ") + kPullEnded + "\n"));
    }
    const auto before = Snapshot(root_.dir());
    ProcessResult result = Status();
    EXPECT_EQ(result.exit_code, 0) << result.err;
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, "data directory: " + data_ +
                              "\nservers:        none (no usable server list at " +
                              root_.path(SDS_SERVER_DATA_XML) + ")\nstored ETag:    none\n" +
                              "next update:    " + c.next_update + " (86400 s is used)\n" +
                              "last pull:      " + c.last_pull + "\n" +
                              "last position:  none\nitems:          none\n" +
                              "database:       no database at " + root_.path(SDS_DB_PATH) +
                              c.database + "\n");
    result = Status({"--json"});
    EXPECT_TRUE(IsStatusJson(result.out, R"({"data_directory": ")" + data_ +
                                             R"(", "servers": null, "etag": null, "location": null,
                                       "database": null, "permission_denied": [], )" +
                                             c.last_pull_json + R"(, "next_update": {"stored": )" +
                                             c.stored + R"(, "seconds": 86400}})"));
    EXPECT_EQ(Snapshot(root_.dir()), before);
    EXPECT_EQ(file_exists(root_.path(SDS_DB_PATH)), c.broken);
  }
  std::filesystem::remove_all(data_);
  ProcessResult result = Status();
  EXPECT_EQ(result.exit_code, 1);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err,
            "sitedeck: status: no data directory at " + data_ + " (is the service installed?)\n");
}


// A tile with stored pixels as the service keeps them after downloading `icon`.
SeedItem tile(int id, int order, const char* url, std::optional<std::string> title,
              const char* color, const PngImage* icon = nullptr) {
  SeedItem item = seed_item(id, url, "", order);
  item.title = std::move(title);
  item.dominant_color = color;
  if (icon != nullptr) {
    item.icon_data = service_decode_png(png_encode_image(*icon));
    item.icon_size = std::to_string(icon->width) + "x" + std::to_string(icon->height);
    item.touch_icon_exists = 1;
  }
  return item;
}


TEST(RenderTool, BrowserShowsTheLiveTilesInServerOrder) {
  constexpr char kChromium[] = "/usr/bin/chromium";
  if (access(kChromium, X_OK) != 0) {
    const char* require = std::getenv("SITEDECK_REQUIRE_BROWSER");
    if (require != nullptr && std::string(require) == "1") FAIL() << kChromium << " is missing";
    GTEST_SKIP() << kChromium << " is missing";
  }
  TempRoot root;
  ServiceHarness service;
  const PngImage big = png_pattern(48, 48, 6, 8), grey = png_pattern(16, 16, 0, 8),
                 rgba = png_pattern(32, 32, 6, 8), palette = png_pattern(100, 60, 3, 8),
                 deep = png_pattern(24, 36, 2, 16);
  // Ids out of step with the order: the page's order can only come from order_index.
  SeedItem gone = tile(5, 4, "https://gone.example/", "Gone", "#FFEB3B", &rgba);
  gone.is_dirty = -1;
  ASSERT_TRUE(seed_deck({tile(20, 1, "https://news.example/", "News", "#E53935", &big),
                         tile(3, 2, "https://marked.example/", "<b>&\"'", "#1E88E5", &grey),
                         tile(8, 3, "https://mail.example/inbox", "Mail", "#3c3"), gone,
                         tile(11, 5, "https://maps.example:8443/x", {}, "tomato", &palette),
                         tile(12, 6, "javascript:alert(1)", "Script", "#8E24AA", &deep)}));
  ASSERT_TRUE(service.start_activated(/*once=*/false));
  const std::string page = root.dir() + "/preview/index.html";
  ProcessResult rendered = sitedeck(service.socket_path(), {"render", root.dir() + "/preview"});
  ASSERT_EQ(rendered.exit_code, 0) << rendered.err << service.output();
  EXPECT_EQ(rendered.out + rendered.err, page + "\n");
  // The virtual time budget lets the page load and decode, in the browser's own clock.
  ProcessResult dom = run_process(
      {kChromium, "--headless", "--no-sandbox", "--disable-gpu", "--no-first-run",
       "--user-data-dir=" + root.dir() + "/profile", "--disable-extensions",
       "--disable-background-networking", "--virtual-time-budget=10000", "--dump-dom",
       "file://" + page},
      120000);
  ASSERT_EQ(dom.exit_code, 0) << dom.err;
  EXPECT_NE(dom.out.find("<body data-ready=\"\">"), std::string::npos) << dom.out;
  // No pull has stored a list in this root; the one withdrawn site is left out.
  EXPECT_NE(dom.out.find("<span class=\"count\">5 sites</span>"), std::string::npos);
  EXPECT_NE(dom.out.find("<span class=\"origin\">from the installed default deck (no pull has "
                         "stored a list yet)</span> · <span class=\"withdrawn\">1 withdrawn "
                         "site left out</span>"),
            std::string::npos);
  EXPECT_EQ(dom.out.find("<b>"), std::string::npos) << "a title became markup";
  // Each tile: id, link, icon size once decoded (or a letter instead), title.
  std::string tiles;
  const std::string open = "<li class=\"tile\" data-id=\"";
  for (size_t at = dom.out.find(open), next; at != std::string::npos; at = next) {
    next = dom.out.find(open, at + 1);
    const std::string li = dom.out.substr(at, next - at);
    const auto field = [&li](const char* pattern) {
      std::smatch m;
      return std::regex_search(li, m, std::regex(pattern)) ? m[1].str() : "";
    };
    tiles += field("data-id=\"([0-9]+)\"") + " " + field("<a href=\"([^\"]*)\"") + " " +
             (li.find("icon letter") != std::string::npos ? "letter"
                                                          : field("data-loaded=\"([^\"]*)\"")) +
             " " + field("<span class=\"title\">([^<]*)</span>") + "\n";
  }
  EXPECT_EQ(tiles,
            "20 https://news.example/ 48x48 News\n"
            "3 https://marked.example/ 16x16 &lt;b&gt;&amp;\"'\n"
            "8 https://mail.example/inbox letter Mail\n"
            "11 https://maps.example:8443/x 100x60 maps.example\n"
            "12  24x36 Script\n");
}

}  // namespace
