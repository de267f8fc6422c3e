// The built service started as systemd starts it: systemd's own
// systemd-socket-activate listens on the socket, waits for the first
// connection and execs the service with the listening socket as descriptor 3
// (as the socket unit does with Accept=no). The client library then
// completes the handshake and queries a seeded deck, and the service ends
// with its connection.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <filesystem>
#include <string>
#include <vector>

#include "sitedeck-client-commands.h"
#include "sitedeck-client.h"
#include "sitedeck-service-paths.h"
#include "support/seeded_deck.h"
#include "support/staged_install.h"
#include "support/temp_root.h"

namespace {

constexpr int kBoundMs = 20000;

// One program run with its standard error read through a pipe, so that a
// line it prints can be waited for; killed and reaped when still running.
class Child {
 public:
  explicit Child(std::vector<std::string> argv) {
    int err[2];
    if (pipe2(err, O_CLOEXEC) != 0) return;
    std::vector<char*> args;
    for (auto& a : argv) args.push_back(a.data());
    args.push_back(nullptr);
    pid_ = fork();
    if (pid_ == 0) {
      (void)dup2(err[1], STDERR_FILENO);
      execv(args[0], args.data());
      _exit(127);
    }
    (void)close(err[1]);
    err_ = err[0];
  }
  ~Child() {
    if (pid_ > 0) (void)kill(pid_, SIGKILL);
    if (pid_ > 0) (void)waitpid(pid_, nullptr, 0);
    if (err_ >= 0) (void)close(err_);
  }

  // Reads standard error until it holds `text` or ends; each read is bounded.
  bool wait_for_output(const std::string& text) {
    while (output_.find(text) == std::string::npos && read_some()) {
    }
    return output_.find(text) != std::string::npos;
  }

  // Reads standard error to its end (the program's), then reaps the program:
  // its exit status, or -1 when it did not exit by itself or the end was not
  // reached within the bound.
  int wait_exit() {
    while (read_some()) {
    }
    struct pollfd entry = {err_, POLLIN, 0};
    int status = 0;
    if (pid_ <= 0 || poll(&entry, 1, 0) != 1 || waitpid(pid_, &status, 0) != pid_) return -1;
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  bool started() const { return pid_ > 0 && err_ >= 0; }
  const std::string& output() const { return output_; }

 private:
  // False at the end of the pipe, on an error or when nothing came within the bound.
  bool read_some() {
    char buffer[4096];
    struct pollfd entry = {err_, POLLIN, 0};
    if (poll(&entry, 1, kBoundMs) != 1) return false;
    ssize_t got = read(err_, buffer, sizeof buffer);
    if (got <= 0) return got < 0 && errno == EINTR;
    output_.append(buffer, static_cast<size_t>(got));
    return true;
  }

  pid_t pid_ = -1;
  int err_ = -1;
  std::string output_;
};

TEST(SocketActivate, ServiceUnderSystemdActivationServesOneConnectionAndEnds) {
  std::string activate = find_program("systemd-socket-activate");
  if (activate.empty()) {
    if (systemd_tools_required()) FAIL() << "systemd-socket-activate is missing (package systemd)";
    GTEST_SKIP() << "systemd-socket-activate is not installed (package systemd); skipped";
  }
  TempRoot root;
  ASSERT_TRUE(seed_deck({seed_item(7, "https://seven.example/", "Seven", 1),
                         seed_item(3, "https://three.example/", "Three", 0)}));
  std::string socket_path = root.path(SDS_SOCKET_PATH);
  // The socket unit makes the socket's directory; the tool does not.
  std::filesystem::create_directories(std::filesystem::path(socket_path).parent_path());

  // The tool hands the service a fresh environment: the root, and the
  // sanitizers' settings when a sanitizer build runs this, are passed on.
  std::vector<std::string> argv = {activate, "-l", socket_path, "-E",
                                   "SITEDECK_ROOT=" + root.dir()};
  for (const char* name : {"ASAN_OPTIONS", "UBSAN_OPTIONS", "LSAN_OPTIONS"}) {
    const char* value = std::getenv(name);
    if (value != nullptr) {
      argv.emplace_back("-E");
      argv.emplace_back(std::string(name) + "=" + value);
    }
  }
  argv.push_back(std::string(SITEDECK_BIN_DIR) + "/browser-sitedeck-service");
  Child child(argv);
  ASSERT_TRUE(child.started());
  ASSERT_TRUE(child.wait_for_output("Listening on " + socket_path)) << child.output();

  SdsConnection connection;
  ASSERT_EQ(sds_client_connect(socket_path, connection, {kBoundMs, kBoundMs}), SDS_ERROR_NONE)
      << child.output();
  EXPECT_GT(connection.cid(), 0);
  sds_client_ids ids;
  ASSERT_EQ(sds_client_get_full_ids(connection, &ids), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<int32_t>(ids.ids.get(), ids.ids.get() + ids.count),
            (std::vector<int32_t>{3, 7}));
  SdsClientText title;
  ASSERT_EQ(sds_client_get_title(connection, 7, &title), SDS_ERROR_NONE);
  EXPECT_STREQ(title.get(), "Seven");
  int32_t seconds = 0;
  ASSERT_EQ(sds_client_get_next_update_duration(connection, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(seconds, 86400);

  // Releasing the icon object ends the connection. The tool execs the
  // service in its own process: the process that then ends is the one started.
  EXPECT_EQ(sds_client_release_shm(connection), SDS_ERROR_NONE);
  EXPECT_EQ(child.wait_exit(), 0) << child.output();
  EXPECT_NE(child.output().find("listen systemd socket:3"), std::string::npos) << child.output();
}

}  // namespace
