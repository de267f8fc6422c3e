// The client library against a scripted peer on a socket pair: the bytes
// each call sends, how it treats replies a real service would not give (an
// icon beyond the shared memory, an id count beyond reason, a reply cut
// short), and the long wait of initialize. The peer's replies are queued
// before the call; the socket holds them until the client reads.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

#include "client/sitedeck-client-internal.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/socket_pair.h"
#include "support/temp_root.h"

namespace {

constexpr int32_t kClientId = 77;

std::string words(std::initializer_list<int32_t> values) {
  return std::string(reinterpret_cast<const char*>(std::data(values)), values.size() * 4);
}

std::string position_bytes(double latitude, double longitude) {
  const double position[2] = {latitude, longitude};
  return std::string(reinterpret_cast<const char*>(position), sizeof position);
}

// Tells initialize to wait on, and at tick `release_after` queues `result`.
struct Ticks {
  int count = 0;
  bool keep_waiting = true;
  int release_after = 0;
  int peer = -1;
  int32_t result = 0;
};

bool tick(void* user) {
  auto* ticks = static_cast<Ticks*>(user);
  if (++ticks->count == ticks->release_after) (void)write_int(ticks->peer, ticks->result);
  return ticks->keep_waiting;
}

class ClientTest : public ::testing::Test {
 protected:
  void SetUp() override { open(); }
  // A fresh connection on a new pair, as if the greeting {0, kClientId} had come.
  void open() {
    connection_.close();
    pair_ = SocketPair();
    SdsConnectionAccess::adopt(connection_, pair_.service.release(), kClientId);
  }
  void queue(const std::string& bytes) {
    ASSERT_TRUE(write_all(pair_.peer.get(), bytes.data(), bytes.size()));
  }
  // Everything the client has sent.
  std::string sent() {
    std::string out;
    char buffer[256];
    for (ssize_t n; readable_now(pair_.peer.get()) &&
                    (n = read(pair_.peer.get(), buffer, sizeof buffer)) > 0;) {
      out.append(buffer, static_cast<size_t>(n));
    }
    return out;
  }

  TempRoot root_;
  SocketPair pair_;
  SdsConnection connection_;
};

TEST_F(ClientTest, InitializeSendsPositionThenVersionAndWaitsOutTheResult) {
  queue(words({0, 0}));
  // The result comes only once the client has been told twice to wait.
  Ticks ticks{0, true, 2, pair_.peer.get(), SDS_ERROR_HTTP_NOT_MODIFIED};
  EXPECT_EQ(sds_client_initialize(connection_, 37.5, 127.25, "1.2.3", tick, &ticks, 1),
            SDS_ERROR_HTTP_NOT_MODIFIED);
  EXPECT_GE(ticks.count, 2);
  EXPECT_TRUE(connection_.is_open());
  EXPECT_EQ(sent(), words({SDS_CMD_INITIALIZE, kClientId, 0}) + position_bytes(37.5, 127.25) +
                        words({0, 5}) + "1.2.3");
}

// Without a version the flag is 6 and no string follows; a version the wire
// can't carry is refused unsent; the first status that is not 0 ends the call.
TEST_F(ClientTest, InitializeSendsNoVersionAsFlagSixAndStopsAtTheFirstStatusThatIsNotZero) {
  const std::string header = words({SDS_CMD_INITIALIZE, kClientId, 0});
  const std::string without_version = header + position_bytes(-90, 180) + words({6});
  const std::string overlong(4097, 'v');
  struct Case {
    const char* name;
    std::string replies;
    const char* version;
    bool keep_waiting;
    int status;
    std::string sent;
    bool open_after;
  } cases[] = {
      {"no version", words({0, 0, 0}), nullptr, true, SDS_ERROR_NONE, without_version, true},
      {"empty version", words({0, 0, 0}), "", true, SDS_ERROR_NONE, without_version, true},
      {"status 15 first", words({15}), "9", true, SDS_ERROR_DB_OPEN_FAILED, header, true},
      {"gave up waiting", words({0, 0}), nullptr, false, SDS_ERROR_IO_EINTR, without_version, false},
      {"overlong version", "", overlong.c_str(), true, SDS_ERROR_INVALID_PARAMETER, "", true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    open();
    queue(c.replies);
    Ticks ticks{0, c.keep_waiting};
    EXPECT_EQ(sds_client_initialize(connection_, -90, 180, c.version, tick, &ticks, 1), c.status);
    EXPECT_EQ(ticks.count, c.keep_waiting ? 0 : 1);
    EXPECT_EQ(connection_.is_open(), c.open_after);
    EXPECT_EQ(sent(), c.sent);
  }
}

// Id requests carry their condition words; a negative item id is refused
// unsent; release closes the connection only when the service ends it.
TEST_F(ClientTest, RequestsCarryExactlyTheirWords) {
  queue(words({0, 2, 9, 4, SDS_ERROR_NO_DATA, 0, 600, SDS_ERROR_SHM_FAILED, 0}));
  sds_client_ids ids, dirty;
  ASSERT_EQ(sds_client_get_full_ids(connection_, &ids), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<int32_t>(ids.ids.get(), ids.ids.get() + ids.count), (std::vector<int32_t>{9, 4}));
  EXPECT_EQ(sds_client_get_ids_by_dirty(connection_, -1, &dirty), SDS_ERROR_NO_DATA);
  SdsClientText url;
  int32_t value = 0;
  sds_client_icon icon;
  EXPECT_EQ(sds_client_get_url(connection_, -3, &url), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(sds_client_get_favicon_exists(connection_, -3, &value), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(sds_client_get_icon(connection_, -3, &icon), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &value), SDS_ERROR_NONE);
  EXPECT_EQ(value, 600);
  EXPECT_EQ(sds_client_release_shm(connection_), SDS_ERROR_SHM_FAILED);
  EXPECT_TRUE(connection_.is_open());
  EXPECT_EQ(sds_client_release_shm(connection_), SDS_ERROR_NONE);
  EXPECT_FALSE(connection_.is_open());
  const uint16_t selector = SITE_DECK_ADAPTOR_O_DIRTY;
  EXPECT_EQ(sent(), words({SDS_CMD_GET_FULL_IDS, kClientId, 0, SDS_ERROR_NO_DATA}) +
                        words({SDS_CMD_GET_FULL_IDS, kClientId, 0, 0}) +
                        std::string(reinterpret_cast<const char*>(&selector), 2) + words({-1}) +
                        words({SDS_CMD_GET_NEXT_UPDATE_DURATION, kClientId, 0}) +
                        words({SDS_CMD_FREE_SHM, kClientId, 0, SDS_CMD_FREE_SHM, kClientId, 0}));
}

// An icon reply that does not describe a fitting image is read whole and
// refused. Ids would follow an out-of-bounds count, and after status 15 the
// service left the flag unread: the stream can't be trusted any more, nor
// after a reply cut short, and the connection is closed.
TEST_F(ClientTest, RepliesThatDoNotFitAreRefusedBeforeAnyAllocation) {
  const auto icon = [](SdsConnection& c) {
    sds_client_icon out;
    int status = sds_client_get_icon(c, 3, &out);
    EXPECT_TRUE(!out.pixels && out.byte_count == 0);
    return status;
  };
  const auto ids = [](SdsConnection& c) {
    sds_client_ids out;
    int status = sds_client_get_full_ids(c, &out);
    EXPECT_FALSE(out.ids);
    return status;
  };
  const auto title = [](SdsConnection& c) {
    SdsClientText out;
    int status = sds_client_get_title(c, 1, &out);
    EXPECT_FALSE(out);
    return status;
  };
  const std::string icon_sent = words({SDS_CMD_GET_ICON, kClientId, 3});
  const std::string ids_sent = words({SDS_CMD_GET_FULL_IDS, kClientId, 0, 6});
  struct Case {
    const char* name;
    std::string reply;
    std::function<int(SdsConnection&)> call;
    int status;
    bool open_after;
    std::string sent;
  } cases[] = {
      {"icon larger than the shared memory", words({0, 1024 * 769 * 4, 1024, 769}), icon, 5, true, icon_sent},
      {"not four bytes per pixel", words({0, 27, 3, 3}), icon, 5, true, icon_sent},
      {"zero width", words({0, 0, 0, 5}), icon, 5, true, icon_sent},
      {"negative byte count", words({0, -16, -2, 2}), icon, 5, true, icon_sent},
      {"id count over the maximum", words({0, SDS_CLIENT_MAX_IDS + 1}), ids, 5, false, ids_sent},
      {"negative id count", words({0, -1}), ids, 5, false, ids_sent},
      {"status 15", words({SDS_ERROR_DB_OPEN_FAILED}), ids, 15, false, ids_sent},
      {"a ten-byte string, three sent", words({0, 10}) + "abc", title, SDS_ERROR_IO_ERROR, false,
       words({SDS_CMD_GET_TITLE, kClientId, 1})},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    open();
    queue(c.reply);
    ASSERT_EQ(shutdown(pair_.peer.get(), SHUT_WR), 0);  // nothing more comes
    EXPECT_EQ(c.call(connection_), c.status);
    EXPECT_EQ(connection_.is_open(), c.open_after);
    EXPECT_EQ(sent(), c.sent);
  }
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &seconds), SDS_ERROR_IO_ERROR);
}

// The path follows the service's root rule; the library tells why it failed
// only to a log callback, and keeps the errno.
TEST_F(ClientTest, SocketPathFollowsTheRootAndFailuresGoOnlyToTheLogCallback) {
  EXPECT_EQ(sds_client_socket_path(), sds_path(SDS_SOCKET_PATH));
  EXPECT_EQ(sds_client_socket_path(), root_.dir() + SDS_CLIENT_SOCKET_PATH);
  std::vector<std::string> lines;
  sds_client_set_log(
      [](void* user, const char* line) { static_cast<std::vector<std::string>*>(user)->push_back(line); },
      &lines);
  SdsConnection connection;
  EXPECT_EQ(sds_client_connect(root_.dir() + "/absent.sock", connection), SDS_CLIENT_ERROR_NO_SOCKET);
  sds_client_set_log(nullptr, nullptr);
  EXPECT_EQ(connection.error_number(), ENOENT);
  EXPECT_EQ(lines, std::vector<std::string>{"connect " + root_.dir() +
                                            "/absent.sock: No such file or directory"});
}

}  // namespace
