#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <string>

#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "serve/sitedeck-service-shm.h"
#include "sitedeck-service-types.h"
#include "support/log_capture.h"

namespace {

int open_descriptor_count() {
  int count = 0;
  DIR* dir = opendir("/proc/self/fd");
  if (dir == nullptr) return -1;
  while (readdir(dir) != nullptr) ++count;
  closedir(dir);
  return count;
}

// The object's name is machine-wide: every case starts and ends without it.
class ShmTest : public ::testing::Test {
 protected:
  void SetUp() override { (void)shm_unlink(SDS_SHM_NAME); }
  void TearDown() override { (void)shm_unlink(SDS_SHM_NAME); }
  LogCapture log_;
};

// The owner is the "app" account only where it exists.
TEST_F(ShmTest, CreatingTwiceGivesTheFullSizeWithOpenPermissions) {
  ASSERT_EQ(sds_alloc_shm(), 1);
  ASSERT_EQ(sds_alloc_shm(), 1);
  struct stat st {};
  ASSERT_EQ(stat(SDS_SHM_FILE_PATH, &st), 0);
  EXPECT_EQ(static_cast<size_t>(st.st_size), SDS_SHM_SIZE);
  EXPECT_EQ(st.st_mode & 07777, 0666u);
  const struct passwd* user = getpwnam("app");
  const struct group* group = getgrnam("app");
  bool app_exists = user != nullptr && group != nullptr;
  EXPECT_EQ(st.st_uid, app_exists ? user->pw_uid : geteuid());
  EXPECT_EQ(st.st_gid, app_exists ? group->gr_gid : getegid());
}

// Sets a kernel switch under /proc/sys; false when it can't.
bool write_sysctl(const char* path, const std::string& value) {
  UniqueFd fd(open(path, O_WRONLY));
  return fd && write(fd.get(), value.data(), value.size()) == static_cast<ssize_t>(value.size());
}

// A connection after the first finds the object handed to the browser's
// account. Under fs.protected_regular the kernel refuses even root an O_CREAT
// open of it, and every later connection failed its handshake with status 2.
TEST_F(ShmTest, ObjectOwnedByAnotherAccountIsReopenedUnderProtectedRegular) {
  constexpr const char* kSwitch = "/proc/sys/fs/protected_regular";
  const struct passwd* other = getpwnam("nobody");
  std::string before;
  if (geteuid() != 0 || other == nullptr || !(std::ifstream(kSwitch) >> before)) {
    GTEST_SKIP() << "needs root, the account nobody and " << kSwitch;
  }
  if (!write_sysctl(kSwitch, "1")) GTEST_SKIP() << kSwitch << " can't be set here";
  {
    UniqueFd made(shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT, 0666));
    ASSERT_TRUE(made);
    ASSERT_EQ(fchown(made.get(), other->pw_uid, other->pw_gid), 0);
  }
  const int result = sds_alloc_shm();
  const bool restored = write_sysctl(kSwitch, before);
  EXPECT_EQ(result, 1);
  EXPECT_TRUE(restored) << "could not restore " << kSwitch << " to " << before;
  struct stat st {};
  ASSERT_EQ(stat(SDS_SHM_FILE_PATH, &st), 0);
  EXPECT_EQ(static_cast<size_t>(st.st_size), SDS_SHM_SIZE);
}

TEST_F(ShmTest, MappingsShareTheContent) {
  ASSERT_EQ(sds_alloc_shm(), 1);
  auto* writer = static_cast<unsigned char*>(sds_attach_shm());
  auto* reader = static_cast<unsigned char*>(sds_attach_shm());
  ASSERT_NE(writer, nullptr);
  ASSERT_NE(reader, nullptr);
  const unsigned char pixels[] = {0x10, 0x20, 0x30, 0xff};
  std::memcpy(writer, pixels, sizeof pixels);
  writer[SDS_SHM_SIZE - 1] = 0x5a;  // the whole object is mapped
  EXPECT_EQ(std::memcmp(reader, pixels, sizeof pixels), 0);
  EXPECT_EQ(reader[SDS_SHM_SIZE - 1], 0x5a);
  EXPECT_EQ(sds_dettach_shm(writer), 1);
  EXPECT_EQ(sds_dettach_shm(reader), 1);
}

TEST_F(ShmTest, RemovingTwiceFailsTheSecondTimeAndAttachingThenFails) {
  ASSERT_EQ(sds_alloc_shm(), 1);
  EXPECT_EQ(sds_free_shm(), 1);
  EXPECT_EQ(sds_free_shm(), 0);
  // The message's own line feed ends the log line.
  EXPECT_EQ(log_.count("[CRITICAL] Error removing /browser_sds_shm_file"), 1);
  EXPECT_EQ(sds_attach_shm(), nullptr);
  EXPECT_TRUE(log_.contains("[CRITICAL] Unknown error"));
}

TEST_F(ShmTest, DetachRefusesNullAndMisalignedAddresses) {
  EXPECT_EQ(sds_dettach_shm(nullptr), 0);
  EXPECT_TRUE(log_.contains("[CRITICAL] Invalid memory Address"));
  ASSERT_EQ(sds_alloc_shm(), 1);
  auto* mapping = static_cast<char*>(sds_attach_shm());
  ASSERT_NE(mapping, nullptr);
  EXPECT_EQ(sds_dettach_shm(mapping + 1), 0);
  EXPECT_TRUE(log_.contains("[CRITICAL] The value specified for the argument is not correct."));
  EXPECT_EQ(sds_dettach_shm(mapping), 1);
}

TEST_F(ShmTest, RepeatedIconRequestsLeaveNoDescriptorsOpen) {
  int before = open_descriptor_count();
  ASSERT_EQ(sds_alloc_shm(), 1);
  for (int i = 0; i < 20; ++i) {
    void* mapping = sds_attach_shm();
    ASSERT_NE(mapping, nullptr);
    ASSERT_EQ(sds_dettach_shm(mapping), 1);
  }
  EXPECT_EQ(open_descriptor_count(), before);
}

}  // namespace
