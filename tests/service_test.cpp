// The acceptor and the worker inside the test process: client ids, the header
// check, the worker loop and the handshake over real Unix sockets.
#include <glib.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cstring>
#include <string>
#include <vector>

#include "serve/sitedeck-service-ipc.h"
#include "serve/sitedeck-service-main.h"
#include "sitedeck-service-paths.h"
#include "support/log_capture.h"
#include "support/socket_pair.h"
#include "support/temp_root.h"

namespace {

TEST(ClientId, FollowsTheTimeArithmetic) {
  struct Case {
    int32_t seconds;
    int32_t microseconds;
    int32_t id;
  } cases[] = {
      {1700000000, 123456, 1787962982},
      {1700000000, 999, 1700403098},   // three digits: factor 10
      {1700000000, 1000, 1700413500},  // four digits: factor 100
      {1700000000, 0, 1700105222},     // no microseconds: low 12 bits of the seconds
  };
  for (const auto& c : cases) {
    EXPECT_EQ(sds_client_id_from_time(c.seconds, c.microseconds), c.id)
        << c.seconds << " s " << c.microseconds << " us";
  }
}

// The sum wraps below zero for large microsecond values; such an id would be
// refused by the service's own header check.
TEST(ClientId, WrappedNegativeIdsAreFoldedIntoThePositiveRange) {
  EXPECT_EQ(sds_client_id_from_time(1700000000, 999999), 265006536);  // wrapped: -1882477112
  EXPECT_EQ(sds_client_id_from_time(2147483236, 1), 1);               // wrapped: INT_MIN
  for (int32_t us = 0; us < 1000000; us += 997) {
    ASSERT_GT(sds_client_id_from_time(1700000000, us), 0) << us;
  }
}

TEST(ClientId, GeneratedIdsArePositiveAndNeverRepeatTheLastOne) {
  int32_t previous = sds_generate_client_id();
  for (int i = 0; i < 2000; ++i) {
    int32_t id = sds_generate_client_id();
    ASSERT_GT(id, 0);
    ASSERT_NE(id, previous);
    previous = id;
  }
}

// Each case owns the process-wide main loop the worker ends.
class WorkerTest : public ::testing::Test {
 protected:
  void SetUp() override { sds_main_loop = g_main_loop_new(nullptr, FALSE); }
  void TearDown() override {
    g_main_loop_unref(sds_main_loop);
    sds_main_loop = nullptr;
  }

  // Runs the main loop until something quits it; false when a guard of
  // `seconds` had to end it instead (the worker never did).
  static bool run_main_loop_until_quit(unsigned seconds = 10) {
    bool guard_fired = false;
    guint guard = g_timeout_add_seconds(
        seconds,
        [](gpointer fired) -> gboolean {
          *static_cast<bool*>(fired) = true;
          g_main_loop_quit(sds_main_loop);
          return G_SOURCE_REMOVE;
        },
        &guard_fired);
    g_main_loop_run(sds_main_loop);
    if (!guard_fired) g_source_remove(guard);
    return !guard_fired;
  }

  TempRoot root_;  // the worker opens the item database first
  LogCapture log_;
};

sds_client slot_on(const SocketPair& pair, int32_t client_id) {
  sds_client slot;
  slot.client_id = client_id;
  slot.sock = pair.service.get();
  return slot;
}

TEST_F(WorkerTest, HeaderCheckEndsTheConnectionOnUnusableHeaders) {
  struct Case {
    const char* name;
    std::vector<int32_t> words;  // what the client sends in one write; none: it closes
    int result;
    int client_id_after;
    const char* message;  // the "[Closed Peer]" line's cmd/cid part, if any
  } cases[] = {
      {"unknown command", {12, 9, 0}, SDS_ERROR_NONE, 9, nullptr},
      {"command 0", {0, 9, 0}, SDS_ERROR_IO_ERROR, -1, "cmd 0 cid 9 "},
      {"cid 0", {3, 0, 0}, SDS_ERROR_IO_ERROR, -1, "cmd 3 cid 0 "},
      {"negative cid", {3, -4, 0}, SDS_ERROR_IO_ERROR, -1, "cmd 3 cid -4 "},
      {"only the first 4 bytes", {3}, SDS_ERROR_IO_ERROR, -1, "cmd 3 cid 0 "},
      {"peer closed", {}, SDS_ERROR_IO_ERROR, -1, nullptr},
  };
  for (const auto& c : cases) {
    SocketPair pair;
    sds_client slot = slot_on(pair, 9);
    ASSERT_TRUE(write_all(pair.peer.get(), c.words.data(), c.words.size() * sizeof(int32_t)));
    if (c.words.empty()) pair.peer.reset();
    EXPECT_EQ(__sds_handle_client_request(&slot), c.result) << c.name;
    EXPECT_EQ(slot.client_id, c.client_id_after) << c.name;
    if (c.message != nullptr) {
      EXPECT_TRUE(log_.contains(format("[Closed Peer] sock:%d %s", slot.sock, c.message)))
          << c.name;
    }
    if (pair.peer) {
      EXPECT_FALSE(readable_now(pair.peer.get())) << c.name;
    }
  }
}

// A quit issued before the main thread enters the loop used to be lost, which
// left the process running with nothing to end it.
TEST_F(WorkerTest, WorkerEndingBeforeTheLoopRunsStillEndsTheLoop) {
  SocketPair pair;
  sds_client slot = slot_on(pair, 7);
  pair.peer.reset();
  pthread_t worker{};
  ASSERT_EQ(pthread_create(&worker, nullptr, sds_client_thread_idle, &slot), 0);
  ASSERT_EQ(pthread_join(worker, nullptr), 0);
  EXPECT_TRUE(log_.contains(format("disconnect client:-1 sock:%d", slot.sock)));
  EXPECT_TRUE(run_main_loop_until_quit());
}

TEST_F(WorkerTest, WorkerServesRequestsUntilABadHeader) {
  SocketPair pair;
  sds_client slot = slot_on(pair, 7);
  const int32_t requests[] = {12, 7, 0, 0, 7, 0};  // unknown command, then command 0
  ASSERT_TRUE(write_all(pair.peer.get(), requests, sizeof requests));
  pthread_t worker{};
  ASSERT_EQ(pthread_create(&worker, nullptr, sds_client_thread_idle, &slot), 0);
  bool ended = run_main_loop_until_quit();
  if (!ended) (void)shutdown(pair.peer.get(), SHUT_RDWR);
  ASSERT_EQ(pthread_join(worker, nullptr), 0);
  EXPECT_TRUE(ended);
  EXPECT_TRUE(log_.contains(format("[Closed Peer] sock:%d cmd 0 cid 7 ", slot.sock)));
  EXPECT_TRUE(log_.contains(format("disconnect client:-1 sock:%d", slot.sock)));
  EXPECT_FALSE(readable_now(pair.peer.get()));  // the unknown command got no reply
}

TEST_F(WorkerTest, AcceptorRefusesMissingContextAndSocketAndReportsAFailedAccept) {
  EXPECT_EQ(sds_main_thread(nullptr), -1);
  EXPECT_TRUE(log_.contains("[CRITICAL] Invalid Address"));
  sds_server_context context;
  context.listen_sock = -1;
  EXPECT_EQ(sds_main_thread(&context), -1);
  EXPECT_TRUE(log_.contains("[CRITICAL] Invalid File Discriptor"));
  UniqueFd not_listening(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  context.listen_sock = not_listening.get();
  EXPECT_EQ(sds_main_thread(&context), -1);
  EXPECT_TRUE(log_.contains("[CRITICAL] accept Sitedeck service was crashed ?"));
  EXPECT_EQ(context.client.thread, pthread_t{});
}

TEST_F(WorkerTest, AcceptorSendsTheHandshakeAndTheWorkerEndsTheLoopWhenTheClientLeaves) {
  TempRoot root;
  (void)shm_unlink(SDS_SHM_NAME);
  std::string path = sds_path(SDS_SOCKET_PATH);
  struct sockaddr_un address {};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  UniqueFd listening(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ASSERT_EQ(bind(listening.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(listen(listening.get(), 4), 0);
  UniqueFd client(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ASSERT_EQ(connect(client.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);

  sds_server_context context;
  context.listen_sock = listening.get();
  ASSERT_EQ(sds_main_thread(&context), 0);
  UniqueFd accepted(context.client.sock);

  int32_t handshake[2] = {-1, -1};
  ASSERT_EQ(sds_ipc_read_blob(client.get(), handshake, sizeof handshake), 0);
  EXPECT_EQ(handshake[0], SDS_ERROR_NONE);
  EXPECT_GT(handshake[1], 0);
  EXPECT_EQ(handshake[1], context.client.client_id);
  EXPECT_NE(context.client.thread, pthread_t{});
  bool warned = false;
  for (const auto& line : log_.lines())
    warned |= line.message == "sds_main_thread end" && line.prio == 5;
  EXPECT_TRUE(warned);
  struct stat st {};
  EXPECT_EQ(stat(SDS_SHM_FILE_PATH, &st), 0);

  client.reset();
  EXPECT_TRUE(run_main_loop_until_quit());
  EXPECT_TRUE(log_.contains(format("disconnect client:-1 sock:%d", accepted.get())));
  (void)shm_unlink(SDS_SHM_NAME);
}

}  // namespace
