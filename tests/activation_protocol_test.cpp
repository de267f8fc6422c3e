// The service reads the socket-activation protocol itself; these cases hold
// it against libsystemd's own sd_listen_fds and sd_is_socket_unix on the same
// inputs: same counts and verdicts, errors on the same inputs (the error
// numbers themselves may differ), and the variables gone afterwards.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>

#include "serve/sitedeck-service-activation.h"
#include "sitedeck-service-raii.h"
#include "support/temp_root.h"

namespace {

// Negative, zero or positive: what the callers tell apart.
int sign(int value) { return value < 0 ? -1 : (value > 0 ? 1 : 0); }

void set_or_unset(const char* name, const std::optional<std::string>& value) {
  if (value) {
    ASSERT_EQ(setenv(name, value->c_str(), 1), 0);
  } else {
    ASSERT_EQ(unsetenv(name), 0);
  }
}

// Puts a socket on descriptor 3 for the lifetime of the object, giving back
// whatever was there before.
class DescriptorThree {
 public:
  DescriptorThree() {
    saved_ = fcntl(3, F_DUPFD_CLOEXEC, 10);
    UniqueFd sock(socket(AF_UNIX, SOCK_STREAM, 0));
    placed_ = sock && dup2(sock.get(), 3) == 3;
    // The new socket may have got descriptor 3 itself; it stays there.
    if (sock.get() == 3) (void)sock.release();
  }
  ~DescriptorThree() {
    if (saved_ >= 0) {
      (void)dup3(saved_, 3, O_CLOEXEC);
      (void)close(saved_);
    } else {
      (void)close(3);
    }
  }
  bool placed() const { return placed_; }
  static void clear_cloexec() { (void)fcntl(3, F_SETFD, 0); }
  static bool cloexec() { return (fcntl(3, F_GETFD) & FD_CLOEXEC) != 0; }

 private:
  int saved_ = -1;
  bool placed_ = false;
};

TEST(ActivationProtocol, ListenFdsCountsLikeLibsystemdAndKeepsTheVariablesWhenAsked) {
  DescriptorThree three;
  ASSERT_TRUE(three.placed());
  const std::string self = std::to_string(getpid());
  const std::string other = std::to_string(getpid() + 1);
  struct listen_case {
    const char* name;
    std::optional<std::string> pid, fds;
    int expected;  // exact when not negative, else any error
  } cases[] = {
      {"nothing passed", std::nullopt, std::nullopt, 0},
      {"for another process", other, "1", 0},
      {"one for us", self, "1", 1},
      {"pid without count", self, std::nullopt, 0},
      {"count of zero", self, "0", -1},
      {"count not a number", self, "1x", -1},
      {"negative count", self, "-1", -1},
      {"pid not a number", "12ab", "1", -1},
      {"pid of zero", "0", "1", -1},
  };
  for (const auto& c : cases) {
    for (bool ours : {true, false}) {
      DescriptorThree::clear_cloexec();
      set_or_unset("LISTEN_PID", c.pid);
      set_or_unset("LISTEN_FDS", c.fds);
      ASSERT_EQ(setenv("LISTEN_FDNAMES", "sock", 1), 0);
      int result = ours ? sds_listen_fds(1) : sd_listen_fds(1);
      const char* who = ours ? "ours" : "libsystemd";
      if (c.expected < 0) {
        EXPECT_LT(result, 0) << c.name << " " << who;
      } else {
        EXPECT_EQ(result, c.expected) << c.name << " " << who;
      }
      if (c.expected > 0) {
        EXPECT_TRUE(DescriptorThree::cloexec()) << c.name << " " << who;
      }
      EXPECT_EQ(std::getenv("LISTEN_PID"), nullptr) << c.name << " " << who;
      EXPECT_EQ(std::getenv("LISTEN_FDS"), nullptr) << c.name << " " << who;
      EXPECT_EQ(std::getenv("LISTEN_FDNAMES"), nullptr) << c.name << " " << who;
    }
  }
  // Asked to keep the variables, it keeps them.
  ASSERT_EQ(setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1), 0);
  ASSERT_EQ(setenv("LISTEN_FDS", "1", 1), 0);
  EXPECT_EQ(sds_listen_fds(0), 1);
  EXPECT_NE(std::getenv("LISTEN_PID"), nullptr);
  EXPECT_NE(std::getenv("LISTEN_FDS"), nullptr);
  (void)unsetenv("LISTEN_PID");
  (void)unsetenv("LISTEN_FDS");
}

int bound_socket(int type, const std::string& path, bool listening) {
  int fd = socket(AF_UNIX, type, 0);
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  if (fd < 0 || bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0 ||
      (listening && listen(fd, 1) != 0)) {
    if (fd >= 0) (void)close(fd);
    return -1;
  }
  return fd;
}

TEST(ActivationProtocol, IsSocketUnixJudgesLikeLibsystemd) {
  TempRoot root;
  const std::string path = root.dir() + "/listening.sock";
  UniqueFd listening(bound_socket(SOCK_STREAM, path, true));
  UniqueFd bound_only(bound_socket(SOCK_STREAM, root.dir() + "/bound.sock", false));
  UniqueFd datagram(bound_socket(SOCK_DGRAM, root.dir() + "/datagram.sock", false));
  UniqueFd abstract(bound_socket(SOCK_STREAM, std::string("\0abstract-sitedeck", 18), true));
  int pair[2] = {-1, -1};
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
  UniqueFd pair_a(pair[0]), pair_b(pair[1]);
  UniqueFd inet(socket(AF_INET, SOCK_STREAM, 0));
  UniqueFd file(open(path.c_str(), O_PATH));
  UniqueFd regular(open("/proc/self/status", O_RDONLY));
  ASSERT_TRUE(listening && bound_only && datagram && abstract && inet && regular);
  int closed = dup(regular.get());
  ASSERT_GE(closed, 0);
  (void)close(closed);

  struct judge_case {
    const char* name;
    int fd;
    int type;
    int listening;
    const char* path;
  } cases[] = {
      {"listening at the path", listening.get(), SOCK_STREAM, 1, path.c_str()},
      {"listening, any path", listening.get(), SOCK_STREAM, 1, nullptr},
      {"listening, another path", listening.get(), SOCK_STREAM, 1, "/elsewhere.sock"},
      {"listening, path prefix", listening.get(), SOCK_STREAM, 1, root.dir().c_str()},
      {"listening, asked for datagram", listening.get(), SOCK_DGRAM, 1, path.c_str()},
      {"listening, asked for not listening", listening.get(), SOCK_STREAM, 0, nullptr},
      {"listening, any type and state", listening.get(), 0, -1, nullptr},
      {"bound, not listening", bound_only.get(), SOCK_STREAM, 1, nullptr},
      {"bound, not listening, asked so", bound_only.get(), SOCK_STREAM, 0, nullptr},
      {"datagram", datagram.get(), SOCK_DGRAM, -1, nullptr},
      {"abstract name", abstract.get(), SOCK_STREAM, 1, path.c_str()},
      {"socket pair", pair_a.get(), SOCK_STREAM, 0, nullptr},
      {"socket pair with a path", pair_a.get(), SOCK_STREAM, 0, path.c_str()},
      {"internet socket", inet.get(), SOCK_STREAM, -1, nullptr},
      {"regular file", regular.get(), SOCK_STREAM, 1, path.c_str()},
      {"closed descriptor", closed, SOCK_STREAM, 1, path.c_str()},
  };
  for (const auto& c : cases) {
    int ours = sds_is_socket_unix(c.fd, c.type, c.listening, c.path);
    int reference = sd_is_socket_unix(c.fd, c.type, c.listening, c.path, 0);
    EXPECT_EQ(sign(ours), sign(reference)) << c.name;
    if (reference >= 0) {
      EXPECT_EQ(ours, reference > 0 ? 1 : 0) << c.name;
    }
  }
}

}  // namespace
