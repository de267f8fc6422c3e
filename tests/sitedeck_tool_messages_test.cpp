// What the `sitedeck` tool tells a person when things go wrong, without the
// real service: every reason a connection fails, a stand-in peer that speaks
// the greeting and answers one request with a chosen status, bad usage and
// output that cannot be written. Also that every subcommand has its help,
// which needs no service.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"
#include "support/run_process.h"
#include "support/temp_root.h"

namespace {

// Bound on every wait of the stand-in peer for the tool.
constexpr int kPeerWaitMs = 20000;

UniqueFd BoundSocket(const std::string& path) {
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  if (!fd || bind(fd.get(), reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0) {
    return UniqueFd();
  }
  return fd;
}

bool WaitReadable(int fd) {
  struct pollfd entry = {fd, POLLIN, 0};
  return poll(&entry, 1, kPeerWaitMs) == 1;
}

// Greets one client with `greeting` (and client id 5 after a 0), then, if
// `status` is not negative, reads one request header and answers `status`
// alone. A greeting of -1 closes the connection without a word.
class StandInPeer {
 public:
  StandInPeer(const std::string& path, int32_t greeting, int32_t status)
      : listener_(BoundSocket(path)) {
    if (listener_ && listen(listener_.get(), 4) == 0) {
      thread_ = std::thread([this, greeting, status] { serve(greeting, status); });
    }
  }
  ~StandInPeer() {
    if (thread_.joinable()) thread_.join();
  }
  bool ok() const { return thread_.joinable(); }
  // The command number of the request the peer answered.
  int32_t command() const { return header_.cmd; }

 private:
  void serve(int32_t greeting, int32_t status) {
    if (!WaitReadable(listener_.get())) return;
    UniqueFd client(accept(listener_.get(), nullptr, nullptr));
    if (!client || greeting < 0) return;
    int32_t hello[2] = {greeting, 5};
    if (write(client.get(), hello, greeting == 0 ? sizeof hello : sizeof hello[0]) < 0) return;
    if (status < 0 || !WaitReadable(client.get())) return;
    if (read(client.get(), &header_, sizeof header_) != sizeof header_) return;
    (void)write(client.get(), &status, sizeof status);
  }

  UniqueFd listener_;
  std::thread thread_;
  sds_command header_;
};

class SitedeckToolMessages : public ::testing::Test {
 protected:
  ProcessResult sitedeck(const std::vector<std::string>& arguments) {
    std::vector<std::string> argv = {std::string(SITEDECK_BIN_DIR) + "/sitedeck", "--socket",
                                     socket_};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return run_process(argv);
  }

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
      {kBusy, unreachable +
                  ": the service is busy with another connection; it serves one connection at a "
                  "time, try again when that one ends\n"},
      {kFull, unreachable +
                  ": connecting to the service timed out (Resource temporarily unavailable)\n"},
      {kHangsUp, unreachable + ": the service closed the connection before its greeting\n"},
      {kRefuses,
       "sitedeck: the service refused the connection: 2 SDS_ERROR_SHM_FAILED: the "
       "shared-memory object for icon pixels could not be created, mapped or removed\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.peer);
    ASSERT_TRUE(unlink(socket_.c_str()) == 0 || errno == ENOENT);
    UniqueFd bound = c.peer >= kGone && c.peer <= kFull ? BoundSocket(socket_) : UniqueFd();
    // A backlog of 0 holds one waiting connection; the tool's is the second.
    UniqueFd waiting;
    if (bound && c.peer != kGone) {
      ASSERT_EQ(listen(bound.get(), 0), 0);
    }
    if (c.peer == kDenied) {
      ASSERT_EQ(chmod(socket_.c_str(), 0), 0);
    }
    if (c.peer == kFull) {
      waiting = UniqueFd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
      struct sockaddr_un address {};
      address.sun_family = AF_UNIX;
      std::memcpy(address.sun_path, socket_.c_str(), socket_.size() + 1);
      ASSERT_EQ(connect(waiting.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    }
    std::optional<StandInPeer> peer;
    if (c.peer >= kHangsUp) {
      peer.emplace(socket_, c.peer == kHangsUp ? -1 : SDS_ERROR_SHM_FAILED, -1);
      ASSERT_TRUE(peer->ok());
    }
    std::vector<std::string> argv = {std::string(SITEDECK_BIN_DIR) + "/sitedeck", "--socket",
                                     socket_, "--timeout", "300", "hello"};
    ProcessResult result = run_process(c.peer == kDenied ? without_root(argv) : argv);
    ASSERT_TRUE(result.finished);
    EXPECT_EQ(result.exit_code, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, c.err);
  }
}

TEST_F(SitedeckToolMessages, EveryNonZeroStatusIsToldByNumberNameAndMeaning) {
  // After the number; nullptr: a number the service does not use.
  const char* told[] = {
      nullptr,
      "SDS_ERROR_IO_ERROR: a socket read or write failed or the connection was closed",
      "SDS_ERROR_SHM_FAILED: the shared-memory object for icon pixels could not be created, "
      "mapped or removed",
      "SDS_ERROR_IO_EAGAIN: a socket operation would have blocked",
      "SDS_ERROR_IO_EINTR: a socket operation was interrupted",
      "SDS_ERROR_INVALID_PARAMETER: the request had a bad argument or could not be used",
      "SDS_ERROR_NO_DATA: nothing is stored for this request",
      "SDS_ERROR_OUT_OF_MEMORY: the service ran out of memory",
      "SDS_ERROR_ID_NOT_FOUND: no item has this id",
      nullptr,
      nullptr,
      nullptr,
      "SDS_ERROR_DISK_BUSY: the database is busy or locked, a value is too big, or there is no "
      "connection to it",
      nullptr,
      "SDS_ERROR_NO_SPACE: the database is full",
      "SDS_ERROR_DB_OPEN_FAILED: the database could not be opened",
      "SDS_ERROR_HTTP_OK: the content server answered HTTP 200",
      "SDS_ERROR_HTTP_NOT_MODIFIED: the content server answered HTTP 304: the stored item list is "
      "current",
      "SDS_ERROR_SERVER_REQUEST_FAILED: a server request failed or got an unexpected answer",
      "SDS_ERROR_HTTP_MOVED_PERMANENTLY: the content server answered HTTP 301 (moved permanently)",
      "SDS_ERROR_HTTP_FOUND: the content server answered HTTP 302 (found elsewhere)",
      "SDS_ERROR_DATA_PULL_FAILED: the data pull could not run (no server list, request URL or "
      "response header file)",
  };
  for (int32_t status = 1; status <= 21; ++status) {
    ASSERT_TRUE(unlink(socket_.c_str()) == 0 || errno == ENOENT);
    StandInPeer peer(socket_, 0, status);
    ASSERT_TRUE(peer.ok()) << status;
    ProcessResult result = sitedeck({"next-update"});
    ASSERT_TRUE(result.finished) << status;
    EXPECT_EQ(result.exit_code, 1) << status;
    EXPECT_EQ(result.out, "") << status;
    EXPECT_EQ(result.err,
              (status == 1 ? "sitedeck: lost the connection to the service: "
                           : "sitedeck: the service answered ") +
                  std::to_string(status) + " " +
                  (told[status] != nullptr
                       ? told[status]
                       : "SDS_ERROR_UNKNOWN: a status number the service does not use") +
                  "\n")
        << status;
    EXPECT_EQ(peer.command(), SDS_CMD_GET_NEXT_UPDATE_DURATION) << status;
  }
}

const std::vector<std::string> kSubcommands = {"hello",   "list", "show",   "icon",
                                               "release", "init", "status", "next-update"};

TEST_F(SitedeckToolMessages, EverySubcommandHasHelpThatNeedsNoService) {
  for (const auto& name : kSubcommands) {
    for (const auto& arguments : std::vector<std::vector<std::string>>{
             {name, "--help"}, {name, "-h"}, {"help", name}, {name, "1", "--help"}}) {
      ProcessResult result = sitedeck(arguments);
      ASSERT_TRUE(result.finished) << name;
      EXPECT_EQ(result.exit_code, 0) << name << " " << arguments[1];
      EXPECT_EQ(result.err, "") << name;
      EXPECT_EQ(result.out.rfind("usage: sitedeck [OPTIONS] " + name, 0), 0u) << result.out;
      EXPECT_NE(result.out.find("\nexample:\n  sitedeck "), std::string::npos) << name;
      EXPECT_NE(result.out.find("\nexit status:\n  0  "), std::string::npos) << name;
    }
  }
  ProcessResult result = sitedeck({"--help"});
  EXPECT_EQ(result.exit_code, 0);
  for (const auto& name : kSubcommands) {
    EXPECT_NE(result.out.find("\n  " + name + " "), std::string::npos) << name;
  }
}

TEST_F(SitedeckToolMessages, BadUsageNamesTheWrongArgumentAndExitsWithTwo) {
  const std::string hint = "Try 'sitedeck --help' for more information.\n";
  auto usage = [](const std::string& command, const std::string& synopsis,
                  const std::string& problem) {
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
      {{"--timeout", "soon", "list"},
       "sitedeck: --timeout needs milliseconds (a whole number), not soon\n" + hint},
      {{"--color=sometimes", "list"}, "sitedeck: --color takes auto, always or never\n" + hint},
      {{"list", "--color"}, "sitedeck: --color takes auto, always or never\n" + hint},
      {{"help", "frobnicate"}, "sitedeck: no help for frobnicate: not a command\n" + hint},
      {{"status", "extra"}, usage("status", "", "unexpected argument extra")},
      // No service listens here: the arguments are judged before connecting,
      // so bad usage is never reported as an unreachable service.
      {{"show", "x"}, usage("show", " ID", "x is not an item id (a whole number from 0)")},
      {{"show", "-1"}, usage("show", " ID", "-1 is not an item id (a whole number from 0)")},
      {{"icon", "3"}, usage("icon", " ID -o FILE", "-o FILE is missing")},
      {{"icon", "3", "-o"}, usage("icon", " ID -o FILE", "-o needs a FILE")},
      {{"init", "--lat", "1"}, usage("init", init, "--lon LON is missing")},
      {{"init", "--lat", "north", "--lon", "1"},
       usage("init", init, "--lat needs degrees (a number), not north")},
      {{"init", "--lat", "90.5", "--lon", "1"}, usage("init", init, "latitude 90.5 is outside -90..90")},
      {{"init", "--lat", "1", "--lon", "-181"},
       usage("init", init, "longitude -181 is outside -180..180")},
      {{"list", "extra"}, usage("list", "", "unexpected argument extra")},
      {{"render"}, usage("render", " OUT_DIR", "OUT_DIR is missing")},
  };
  for (const auto& c : cases) {
    ProcessResult result = sitedeck(c.arguments);
    ASSERT_TRUE(result.finished);
    EXPECT_EQ(result.exit_code, 2) << c.err;
    EXPECT_EQ(result.out, "") << c.err;
    EXPECT_EQ(result.err, c.err);
  }
  // Alone, the tool shows its whole usage.
  ProcessResult alone = sitedeck({});
  EXPECT_EQ(alone.exit_code, 2);
  EXPECT_EQ(alone.err.rfind("usage: sitedeck [OPTIONS] COMMAND [ARGUMENTS]\n", 0), 0u) << alone.err;
}

// As coreutils do: output that cannot be written (here a full disk) fails the
// command with a message.
TEST_F(SitedeckToolMessages, OutputThatCannotBeWrittenExitsWithOne) {
  const std::string tool = std::string(SITEDECK_BIN_DIR) + "/sitedeck";
  ProcessResult result = run_process({"/bin/sh", "-c", tool + " --version >/dev/full; echo $?"});
  ASSERT_TRUE(result.finished);
  EXPECT_EQ(result.out, "1\n");
  EXPECT_EQ(result.err, "sitedeck: write error: No space left on device\n");
  EXPECT_EQ(run_process({tool, "--version"}).out, "sitedeck " SITEDECK_VERSION "\n");
  const std::string service = std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service";
  EXPECT_EQ(run_process({service, "--version"}).out,
            "browser-sitedeck-service " SITEDECK_VERSION "\n");
  EXPECT_NE(run_process({service, "--help"}).out.find("started by its socket unit"),
            std::string::npos);
}

}  // namespace
