// The client library against a scripted peer on a real Unix socket: the bytes
// each call sends, how it treats replies a real service would not give (an
// icon beyond the shared memory, an id count beyond reason, a reply cut
// short), and the long wait of initialize.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "sitedeck-client-commands.h"
#include "sitedeck-service-types.h"
#include "sitedeck-service-paths.h"
#include "support/socket_pair.h"
#include "support/temp_root.h"

namespace {

constexpr int kBoundMs = 10000;
constexpr int32_t kClientId = 77;

// Appends exactly `length` bytes read within the bound to `out`; with
// `until_end`, everything until the stream ends instead.
bool read_into(int fd, size_t length, std::string* out, bool until_end = false) {
  while (until_end || length > 0) {
    struct pollfd entry = {fd, POLLIN, 0};
    if (poll(&entry, 1, kBoundMs) != 1) return false;
    char buffer[256];
    ssize_t n = read(fd, buffer, until_end ? sizeof buffer : std::min(length, sizeof buffer));
    if (n <= 0) return until_end;
    out->append(buffer, static_cast<size_t>(n));
    length -= until_end ? 0 : static_cast<size_t>(n);
  }
  return true;
}

// Everything the client sends until it closes (bounded).
std::string read_until_end(int fd) {
  std::string out;
  return read_into(fd, 0, &out, true) ? out : out + "<no end>";
}

template <typename... Words>
std::string words(Words... values) {
  std::string out;
  for (int32_t value : {static_cast<int32_t>(values)...}) {
    out.append(reinterpret_cast<const char*>(&value), sizeof value);
  }
  return out;
}

// A script that, step by step, reads `bytes` and answers `reply`, then (with
// `to_end`) records everything else the client sends until it closes.
struct Step {
  size_t bytes;
  std::string reply;
};
std::function<void(int, std::string*)> exchange(std::vector<Step> steps, bool to_end = true) {
  return [steps = std::move(steps), to_end](int fd, std::string* got) {
    for (const Step& s : steps) {
      if (!read_into(fd, s.bytes, got) || !write_all(fd, s.reply.data(), s.reply.size())) return;
    }
    if (to_end) got->append(read_until_end(fd));
  };
}

std::string position_bytes(double latitude, double longitude) {
  const double position[2] = {latitude, longitude};
  return std::string(reinterpret_cast<const char*>(position), sizeof position);
}

// A stand-in service on the socket of the current root: accepts one client,
// sends the handshake {0, kClientId} and runs `script` on the connection,
// which records what it received in `received`.
class ScriptedService {
 public:
  explicit ScriptedService(std::function<void(int fd, std::string* received)> script)
      : path_(sds_path(SDS_SOCKET_PATH)) {
    struct sockaddr_un address {};
    address.sun_family = AF_UNIX;
    (void)unlink(path_.c_str());
    std::memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
    listening_.reset(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (bind(listening_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        listen(listening_.get(), 1) != 0) {
      return;
    }
    thread_ = std::thread([this, script = std::move(script)] {
      struct pollfd entry = {listening_.get(), POLLIN, 0};
      if (poll(&entry, 1, kBoundMs) != 1) return;
      UniqueFd client(accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC));
      if (!client) return;
      std::string handshake = words(0, kClientId);
      if (!write_all(client.get(), handshake.data(), handshake.size())) return;
      script(client.get(), &received_);
    });
  }
  ~ScriptedService() { finish(); }

  // Waits for the script to end; what it received is then stable.
  const std::string& finish() {
    if (thread_.joinable()) thread_.join();
    return received_;
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  UniqueFd listening_;
  std::string received_;
  std::thread thread_;
};

class ClientTest : public ::testing::Test {
 protected:
  // Starts `script` and connects to it.
  void serve(std::function<void(int fd, std::string* received)> script) {
    service_.reset();
    service_ = std::make_unique<ScriptedService>(std::move(script));
    ASSERT_EQ(sds_client_connect(service_->path(), connection_, {kBoundMs, kBoundMs}), SDS_ERROR_NONE);
    ASSERT_EQ(connection_.cid(), kClientId);
  }
  // Closes the client's end and returns everything the script received.
  std::string received() {
    connection_.close();
    return service_->finish();
  }

  TempRoot root_;
  std::unique_ptr<ScriptedService> service_;
  SdsConnection connection_;
};

struct Ticks {
  int count = 0;
  int release_after = 0;  // write a byte to `release_fd` at this tick
  int release_fd = -1;
  bool keep_waiting = true;
};

bool tick(void* user) {
  auto* ticks = static_cast<Ticks*>(user);
  if (++ticks->count == ticks->release_after) (void)write_int(ticks->release_fd, 1);
  return ticks->keep_waiting;
}

TEST_F(ClientTest, InitializeSendsPositionThenVersionAndWaitsOutTheResult) {
  int release[2];
  ASSERT_EQ(pipe(release), 0);
  UniqueFd release_read(release[0]), release_write(release[1]);
  serve([&](int fd, std::string* got) {
    exchange({{12, words(0)}, {16, words(0)}}, false)(fd, got);
    if (!read_into(fd, 4 + 4 + 5, got)) return;
    // The result comes only once the client has been told twice to wait.
    std::string token;
    if (!read_into(release_read.get(), 4, &token)) return;
    exchange({{0, words(SDS_ERROR_HTTP_NOT_MODIFIED)}})(fd, got);
  });
  Ticks ticks{0, 2, release_write.get(), true};
  EXPECT_EQ(sds_client_initialize(connection_, 37.5, 127.25, "1.2.3", tick, &ticks, 1),
            SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_GE(ticks.count, 2);
  EXPECT_TRUE(connection_.is_open());
  EXPECT_EQ(received(), words(SDS_CMD_INITIALIZE, kClientId, 0) + position_bytes(37.5, 127.25) +
                            words(0, 5) + "1.2.3");
}

TEST_F(ClientTest, InitializeWithoutVersionSendsFlagSixAndNoString) {
  for (const char* version : {static_cast<const char*>(nullptr), ""}) {
    serve(exchange({{12, words(0)}, {16, words(0)}, {4, words(SDS_ERROR_NONE)}}));
    EXPECT_EQ(sds_client_initialize(connection_, -90, 180, version), SDS_ERROR_NONE);
    EXPECT_EQ(received(), words(SDS_CMD_INITIALIZE, kClientId, 0) + position_bytes(-90, 180) +
                              words(SDS_ERROR_NO_DATA));
  }
}

TEST_F(ClientTest, InitializeStopsAtTheFirstStatusThatIsNotZero) {
  serve(exchange({{12, words(SDS_ERROR_DB_OPEN_FAILED)}}));
  EXPECT_EQ(sds_client_initialize(connection_, 1, 2, "9"), SDS_ERROR_DB_OPEN_FAILED);
  EXPECT_EQ(received(), words(SDS_CMD_INITIALIZE, kClientId, 0));
}

TEST_F(ClientTest, InitializeThatGivesUpWaitingClosesTheConnection) {
  serve(exchange({{12, words(0)}, {16, words(0)}, {4, ""}}));  // never answers
  Ticks ticks;
  ticks.keep_waiting = false;
  EXPECT_EQ(sds_client_initialize(connection_, 1, 2, nullptr, tick, &ticks, 1), SDS_ERROR_IO_EINTR);
  EXPECT_EQ(ticks.count, 1);
  EXPECT_FALSE(connection_.is_open());
  EXPECT_EQ(service_->finish().size(), 12u + 16u + 4u);
}

TEST_F(ClientTest, InitializeRefusesAVersionTheWireCannotCarry) {
  serve(exchange({}));
  EXPECT_EQ(sds_client_initialize(connection_, 1, 2, std::string(4097, 'v').c_str()),
            SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(received(), "");
}

TEST_F(ClientTest, IdRequestsCarryTheirConditionWords) {
  serve(exchange({{12 + 4, words(0, 2, 9, 4)}, {12 + 4 + 2 + 4, words(SDS_ERROR_NO_DATA)}}));
  sds_client_ids ids;
  ASSERT_EQ(sds_client_get_full_ids(connection_, &ids), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<int32_t>(ids.ids.get(), ids.ids.get() + ids.count),
            (std::vector<int32_t>{9, 4}));
  sds_client_ids dirty;
  EXPECT_EQ(sds_client_get_ids_by_dirty(connection_, -1, &dirty), SDS_ERROR_NO_DATA);
  const uint16_t selector = SITE_DECK_ADAPTOR_O_DIRTY;
  EXPECT_EQ(received(), words(SDS_CMD_GET_FULL_IDS, kClientId, 0, SDS_ERROR_NO_DATA) +
                            words(SDS_CMD_GET_FULL_IDS, kClientId, 0, 0) +
                            std::string(reinterpret_cast<const char*>(&selector), 2) + words(-1));
}

// The ids would follow an out-of-bounds count; after status 15 the service
// left the flag unread, to be taken for the next header. Either way the stream
// can't be trusted any more.
TEST_F(ClientTest, IdCountOutOfBoundsIsRefusedBeforeAnyAllocation) {
  struct Case {
    const char* name;
    std::string reply;
    int status;
  } cases[] = {
      {"count over the maximum", words(0, SDS_CLIENT_MAX_IDS + 1), SDS_ERROR_INVALID_PARAMETER},
      {"negative count", words(0, -1), SDS_ERROR_INVALID_PARAMETER},
      {"status 15", words(SDS_ERROR_DB_OPEN_FAILED), SDS_ERROR_DB_OPEN_FAILED},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    serve(exchange({{16, c.reply}}));
    sds_client_ids ids;
    EXPECT_EQ(sds_client_get_full_ids(connection_, &ids), c.status);
    EXPECT_FALSE(ids.ids);
    EXPECT_FALSE(connection_.is_open());
    received();
  }
}

TEST_F(ClientTest, IconRepliesThatDoNotDescribeAFittingImageAreRefused) {
  struct Case {
    const char* name;
    int32_t byte_count, width, height;
  } cases[] = {
      {"larger than the shared memory", 1024 * 769 * 4, 1024, 769},
      {"not four bytes per pixel", 27, 3, 3},
      {"zero width", 0, 0, 5},
      {"negative byte count", -16, -2, 2},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    serve(exchange({{12, words(0, c.byte_count, c.width, c.height)}}));
    sds_client_icon icon;
    EXPECT_EQ(sds_client_get_icon(connection_, 3, &icon), SDS_ERROR_INVALID_PARAMETER);
    EXPECT_FALSE(icon.pixels);
    EXPECT_EQ(icon.byte_count, 0);
    EXPECT_TRUE(connection_.is_open());  // the whole reply was read
    EXPECT_EQ(received(), words(SDS_CMD_GET_ICON, kClientId, 3));
  }
}

TEST_F(ClientTest, ReplyCutShortClosesTheConnection) {
  serve(exchange({{12, words(0, 10) + "abc"}}, false));  // a ten-byte string, three sent
  SdsClientText title;
  EXPECT_EQ(sds_client_get_title(connection_, 1, &title), SDS_ERROR_IO_ERROR);
  EXPECT_FALSE(title);
  EXPECT_FALSE(connection_.is_open());
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &seconds), SDS_ERROR_IO_ERROR);
}

TEST_F(ClientTest, NegativeItemIdIsRefusedWithoutSending) {
  serve(exchange({{12, words(0, 600)}}));
  SdsClientText url;
  int32_t value = 0;
  sds_client_icon icon;
  EXPECT_EQ(sds_client_get_url(connection_, -3, &url), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(sds_client_get_favicon_exists(connection_, -3, &value), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(sds_client_get_icon(connection_, -3, &icon), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &value), SDS_ERROR_NONE);
  EXPECT_EQ(value, 600);
  EXPECT_EQ(received(), words(SDS_CMD_GET_NEXT_UPDATE_DURATION, kClientId, 0));
}

TEST_F(ClientTest, ReleaseClosesTheConnectionOnlyWhenTheServiceEndsIt) {
  serve(exchange({{12, words(SDS_ERROR_SHM_FAILED)}, {12, words(SDS_ERROR_NONE)}}));
  EXPECT_EQ(sds_client_release_shm(connection_), SDS_ERROR_SHM_FAILED);
  EXPECT_TRUE(connection_.is_open());
  EXPECT_EQ(sds_client_release_shm(connection_), SDS_ERROR_NONE);
  EXPECT_FALSE(connection_.is_open());
  EXPECT_EQ(service_->finish(),
            words(SDS_CMD_FREE_SHM, kClientId, 0) + words(SDS_CMD_FREE_SHM, kClientId, 0));
}

// The path follows the service's root rule; the library tells why it failed
// only to a log callback, and keeps the errno.
TEST_F(ClientTest, SocketPathFollowsTheRootAndFailuresGoOnlyToTheLogCallback) {
  EXPECT_EQ(sds_client_socket_path(), sds_path(SDS_SOCKET_PATH));
  EXPECT_EQ(sds_client_socket_path(), root_.dir() + SDS_CLIENT_SOCKET_PATH);
  std::vector<std::string> lines;
  sds_client_set_log(
      [](void* user, const char* line) {
        static_cast<std::vector<std::string>*>(user)->push_back(line);
      },
      &lines);
  SdsConnection connection;
  EXPECT_EQ(sds_client_connect(root_.dir() + "/absent.sock", connection),
            SDS_CLIENT_ERROR_NO_SOCKET);
  sds_client_set_log(nullptr, nullptr);
  EXPECT_EQ(connection.error_number(), ENOENT);
  EXPECT_EQ(lines, std::vector<std::string>{"connect " + root_.dir() +
                                            "/absent.sock: No such file or directory"});
}

}  // namespace
