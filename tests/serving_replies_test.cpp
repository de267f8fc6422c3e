// The request handlers' ways of answering faster: a reply goes out in one
// write, and the icon requests share one mapping of the shared-memory
// object. Neither may show: a reply to a peer that has gone away fails once,
// with one log line, and ends the connection; an object removed or made anew
// by someone else is met exactly as a fresh mapping would meet it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "serve/sitedeck-service-request-handler-internal.h"
#include "serve/sitedeck-service-shm.h"
#include "support/db_session.h"
#include "support/log_capture.h"
#include "support/socket_pair.h"

namespace {

constexpr int kIconBytes = 2 * 3 * 4;  // the seeded icon is 2x3
constexpr int kAttempts = 5;
const std::vector<int32_t> kServed = {0, kIconBytes, 2, 3};  // status, bytes, width, height

// The identity of the object now behind the name; 0 when there is none.
ino_t object_inode() {
  struct stat named {};
  return stat(SDS_SHM_FILE_PATH, &named) == 0 ? named.st_ino : 0;
}

// Mappings of the shared-memory object in this process.
int shm_mappings() {
  std::ifstream maps("/proc/self/maps");
  std::string line;
  int count = 0;
  while (std::getline(maps, line)) {
    if (line.find(SDS_SHM_FILE_PATH) != std::string::npos) ++count;
  }
  return count;
}

std::vector<unsigned char> shm_prefix(size_t length) {
  std::vector<unsigned char> bytes;
  UniqueFd fd(shm_open(SDS_SHM_NAME, O_RDONLY, 0));
  if (!fd) return bytes;
  void* address = mmap(nullptr, length, PROT_READ, MAP_SHARED, fd.get(), 0);
  if (address == MAP_FAILED) return bytes;
  auto* start = static_cast<const unsigned char*>(address);
  bytes.assign(start, start + length);
  (void)munmap(address, length);
  return bytes;
}

class ServingReplies : public ::testing::Test {
 protected:
  void SetUp() override {
    (void)shm_unlink(SDS_SHM_NAME);
    ASSERT_EQ(sds_alloc_shm(), 1);
    std::string pixels;
    for (unsigned char byte : icon()) pixels += format("%02x", byte);
    ASSERT_TRUE(db_.exec(
        "INSERT INTO site_deck(id, url, title, touch_icon_exists, icon_size, icon_data) VALUES "
        "(1, 'https://a.example/', 'A', 1, '2x3', x'" +
        pixels + "')"));
  }
  void TearDown() override {
    sds_shm_drop_kept_mapping();
    (void)shm_unlink(SDS_SHM_NAME);
  }
  // The object's name is machine-wide: test runs elsewhere on the machine
  // remove the object and make it anew at any time. A case therefore notes
  // whether the object it worked with stayed behind the name, and an attempt
  // that another party disturbed is made again.
  template <typename Observe>
  auto observe_undisturbed(Observe observe) -> decltype(observe()) {
    decltype(observe()) seen;
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
      sds_shm_drop_kept_mapping();
      EXPECT_EQ(sds_alloc_shm(), 1);
      drain();
      seen = observe();
      if (seen.undisturbed) break;
    }
    return seen;
  }
  // Discards whatever an interrupted attempt left unread on the socket.
  void drain() {
    char buffer[256];
    while (readable_now(pair_.peer.get()) && read(pair_.peer.get(), buffer, sizeof buffer) > 0) {
    }
  }
  // Serves command 7 for item 1 and reads a reply of `words` 32-bit items.
  std::vector<int32_t> icon_reply(size_t words = 4) {
    (void)_sds_get_blob(pair_.service.get(), 1);
    return read_reply(words);
  }
  // Reads one reply of `words` 32-bit items from the peer's end.
  std::vector<int32_t> read_reply(size_t words) {
    std::vector<int32_t> out(words, -1);
    if (!readable_now(pair_.peer.get()) ||
        read(pair_.peer.get(), out.data(), words * 4) != static_cast<ssize_t>(words * 4)) {
      return {};
    }
    return out;
  }
  static std::vector<unsigned char> icon() {
    std::vector<unsigned char> bytes;
    for (int i = 0; i < kIconBytes; ++i) bytes.push_back(static_cast<unsigned char>(0x10 + i));
    return bytes;
  }

  DbSession db_;
  SocketPair pair_;
};

// Every item of a reply to a gone peer was tried and logged, and the handler
// answered success, so that the connection went on to fail again.
TEST_F(ServingReplies, ReplyToAGonePeerWasTriedAndLoggedItemByItem) {
  struct gone_case {
    const char* name;
    std::function<int(int sock)> handle;
  } cases[] = {
      {"text", [](int sock) { return _sds_get_string(sock, 1, "url"); }},
      {"flag", [](int sock) { return _sds_get_int(sock, 1, "touch_icon_exists"); }},
      {"icon", [](int sock) { return _sds_get_blob(sock, 1); }},
      {"next update", [](int sock) { return _sds_get_next_update_duration(sock); }},
  };
  for (const auto& c : cases) {
    struct seen_t {
      bool undisturbed = false;
      int result = -1;
      int write_failures = 0;
      std::vector<std::string> log;
    };
    seen_t seen = observe_undisturbed([&] {
      seen_t now;
      ino_t object = object_inode();
      SocketPair pair;
      pair.peer.reset();
      LogCapture log;
      now.result = c.handle(pair.service.get());
      now.write_failures = log.count(
          format("[IPC.Write] exception sock:%d [%s]", pair.service.get(), strerror(EPIPE)));
      for (const auto& line : log.lines()) now.log.push_back(line.message);
      now.undisturbed = object_inode() == object;
      return now;
    });
    EXPECT_EQ(seen.result, SDS_ERROR_IO_ERROR) << c.name;
    EXPECT_EQ(seen.write_failures, 1) << c.name;
    EXPECT_EQ(seen.log.size(), 1u) << c.name;
  }
}

TEST_F(ServingReplies, IconsShareOneMappingOfTheObject) {
  struct seen_t {
    bool undisturbed = false;
    std::vector<std::vector<int32_t>> replies;
    int added_mappings = -1;
    std::vector<unsigned char> pixels;
  };
  seen_t seen = observe_undisturbed([&] {
    seen_t now;
    ino_t object = object_inode();
    int before = shm_mappings();
    for (int i = 0; i < 20; ++i) now.replies.push_back(icon_reply());
    now.added_mappings = shm_mappings() - before;
    now.pixels = shm_prefix(kIconBytes);
    now.undisturbed = object_inode() == object;
    return now;
  });
  for (const auto& r : seen.replies) EXPECT_EQ(r, kServed);
  EXPECT_EQ(seen.added_mappings, 1);
  EXPECT_EQ(seen.pixels, icon());
}

TEST_F(ServingReplies, IconWhileTheObjectIsGoneIsStatusTwoAndServedAgainOnceItIsBack) {
  struct seen_t {
    bool undisturbed = false;
    std::vector<int32_t> first, while_gone, once_back;
    bool logged_why = false;
    std::vector<unsigned char> pixels;
  };
  seen_t seen = observe_undisturbed([&] {
    seen_t now;
    ino_t object = object_inode();
    now.first = icon_reply();
    bool ours = object_inode() == object && shm_unlink(SDS_SHM_NAME) == 0;
    {
      LogCapture log;
      now.while_gone = icon_reply(1);
      now.logged_why = log.contains("[CRITICAL] Unknown error");
    }
    ours = ours && object_inode() == 0 && sds_alloc_shm() == 1;
    object = object_inode();
    now.once_back = icon_reply();
    now.pixels = shm_prefix(kIconBytes);
    now.undisturbed = ours && object_inode() == object;
    return now;
  });
  EXPECT_EQ(seen.first, kServed);
  EXPECT_EQ(seen.while_gone, std::vector<int32_t>{SDS_ERROR_SHM_FAILED});
  EXPECT_TRUE(seen.logged_why);
  EXPECT_EQ(seen.once_back, kServed);
  EXPECT_EQ(seen.pixels, icon());
}

TEST_F(ServingReplies, ReleaseLetsTheMappingGoAndTheNextObjectGetsTheIcon) {
  struct seen_t {
    bool undisturbed = false;
    std::vector<int32_t> first, release, once_back;
    int released = -1;
    int mappings_dropped = -1;
    std::vector<unsigned char> pixels;
  };
  seen_t seen = observe_undisturbed([&] {
    seen_t now;
    ino_t object = object_inode();
    now.first = icon_reply();
    int with_mapping = shm_mappings();
    sds_client slot;
    slot.client_id = 5;
    slot.sock = pair_.service.get();
    bool ours = object_inode() == object;
    now.released = _sds_release_shm(&slot);
    now.release = read_reply(1);
    now.mappings_dropped = with_mapping - shm_mappings();
    ours = ours && sds_alloc_shm() == 1;
    object = object_inode();
    now.once_back = icon_reply();
    now.pixels = shm_prefix(kIconBytes);
    now.undisturbed = ours && object_inode() == object;
    return now;
  });
  EXPECT_EQ(seen.first, kServed);
  EXPECT_EQ(seen.released, SDS_ERROR_NONE);
  EXPECT_EQ(seen.release, std::vector<int32_t>{SDS_ERROR_NONE});
  EXPECT_EQ(seen.mappings_dropped, 1);
  EXPECT_EQ(seen.once_back, kServed);
  EXPECT_EQ(seen.pixels, icon());
}

}  // namespace
