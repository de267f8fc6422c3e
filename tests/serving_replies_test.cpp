// The request handlers' ways of answering faster: a reply goes out in one
// write, and the icon requests share one mapping of the shared-memory
// object. Neither may show: a peer that has gone away sees the item-by-item
// writes fail as before, with the same log lines, and an object removed or
// made anew by someone else is met exactly as a fresh mapping would meet it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-request-handler-internal.h"
#include "sitedeck-service-shm.h"
#include "support/db_session.h"
#include "support/log_capture.h"
#include "support/socket_pair.h"

namespace {

constexpr int kIconBytes = 2 * 3 * 4;  // the seeded icon is 2x3

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
  // Reads one reply of `words` 32-bit items from the peer's end.
  std::vector<int32_t> reply(size_t words) {
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

TEST_F(ServingReplies, RepliesToAGonePeerFailItemByItemAsBefore) {
  struct gone_case {
    const char* name;
    std::function<int(int sock)> handle;
    int failed_writes;  // one log line per item the reply would have had
  } cases[] = {
      {"text", [](int sock) { return _sds_get_string(sock, 1, "url"); }, 2},
      {"flag", [](int sock) { return _sds_get_int(sock, 1, "touch_icon_exists"); }, 2},
      {"icon", [](int sock) { return _sds_get_blob(sock, 1); }, 1},
      {"next update", [](int sock) { return _sds_get_next_update_duration(sock); }, 2},
  };
  for (const auto& c : cases) {
    SocketPair pair;
    pair.peer.reset();
    LogCapture log;
    EXPECT_EQ(c.handle(pair.service.get()), SDS_ERROR_NONE) << c.name;
    EXPECT_EQ(log.count(format("[IPC.Write] exception sock:%d [%s]", pair.service.get(),
                               strerror(EPIPE))),
              c.failed_writes)
        << c.name;
    EXPECT_EQ(log.lines().size(), static_cast<size_t>(c.failed_writes)) << c.name;
  }
}

TEST_F(ServingReplies, IconsShareOneMappingOfTheObject) {
  int before = shm_mappings();
  for (int i = 0; i < 20; ++i) {
    ASSERT_EQ(_sds_get_blob(pair_.service.get(), 1), SDS_ERROR_NONE);
    ASSERT_EQ(reply(4), (std::vector<int32_t>{0, kIconBytes, 2, 3}));
  }
  EXPECT_EQ(shm_mappings(), before + 1);
  EXPECT_EQ(shm_prefix(kIconBytes), icon());
}

TEST_F(ServingReplies, IconWhileTheObjectIsGoneIsStatusTwoAndServedAgainOnceItIsBack) {
  ASSERT_EQ(_sds_get_blob(pair_.service.get(), 1), SDS_ERROR_NONE);
  ASSERT_EQ(reply(4), (std::vector<int32_t>{0, kIconBytes, 2, 3}));
  ASSERT_EQ(shm_unlink(SDS_SHM_NAME), 0);

  LogCapture log;
  EXPECT_EQ(_sds_get_blob(pair_.service.get(), 1), SDS_ERROR_NONE);
  EXPECT_EQ(reply(1), std::vector<int32_t>{SDS_ERROR_SHM_FAILED});
  EXPECT_TRUE(log.contains("[CRITICAL] Unknown error"));

  ASSERT_EQ(sds_alloc_shm(), 1);
  EXPECT_EQ(_sds_get_blob(pair_.service.get(), 1), SDS_ERROR_NONE);
  EXPECT_EQ(reply(4), (std::vector<int32_t>{0, kIconBytes, 2, 3}));
  EXPECT_EQ(shm_prefix(kIconBytes), icon());
}

TEST_F(ServingReplies, ReleaseLetsTheMappingGoAndTheNextObjectGetsTheIcon) {
  ASSERT_EQ(_sds_get_blob(pair_.service.get(), 1), SDS_ERROR_NONE);
  ASSERT_EQ(reply(4), (std::vector<int32_t>{0, kIconBytes, 2, 3}));
  int with_mapping = shm_mappings();
  sds_client slot;
  slot.client_id = 5;
  slot.sock = pair_.service.get();
  ASSERT_EQ(_sds_release_shm(&slot), SDS_ERROR_NONE);
  ASSERT_EQ(reply(1), std::vector<int32_t>{SDS_ERROR_NONE});
  EXPECT_EQ(shm_mappings(), with_mapping - 1);

  ASSERT_EQ(sds_alloc_shm(), 1);
  EXPECT_EQ(_sds_get_blob(pair_.service.get(), 1), SDS_ERROR_NONE);
  EXPECT_EQ(reply(4), (std::vector<int32_t>{0, kIconBytes, 2, 3}));
  EXPECT_EQ(shm_prefix(kIconBytes), icon());
}

}  // namespace
