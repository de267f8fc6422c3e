// Commands 2 to 11 end to end: the real service under the activator, in a
// scratch root whose database was seeded beforehand, spoken to through the
// client library and, where the exact bytes matter, through the raw socket.
// That nothing more follows a reply is shown by the next reply: a command 10
// sent after it must come back as the very next eight bytes. Last, clients
// and local processes that misbehave: the service must neither hang on them
// nor die of them.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "database/sitedeck-service-db-interface.h"
#include "kdb.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "serve/sitedeck-service-request-handler.h"
#include "support/db_session.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/socket_pair.h"
#include "support/temp_root.h"

namespace {

constexpr int kReadBoundMs = 10000;

// Icon of item 1: not square, so that width and height can't be mixed up.
constexpr int kIconWidth = 3;
constexpr int kIconHeight = 2;
// Item 5's icon is one row taller than the shared-memory object can hold.
constexpr int kBigWidth = 1024;
constexpr int kBigHeight = 769;

const std::string kLongUrl = "https://four.example/" + std::string(5000 - 21, 'u');
const std::string kLongTitle(5000, 't');

// Live items 2, 1, 5 in deck order; 3 withdrawn by the server; 4 with
// is_dirty 0 and a URL and title the wire can't carry.
std::vector<SeedItem> base_deck() {
  SeedItem one = seed_item(1, "https://one.example/", "One", 2);
  one.dominant_color = "#102030";
  one.icon_size = "3x2";
  one.touch_icon_exists = 1;
  one.icon_data = seed_pixels(kIconWidth, kIconHeight, 1);
  SeedItem two = seed_item(2, "https://two.example/news", "Two", 1);
  two.dominant_color = "#405060";
  two.favicon_exists = 1;
  SeedItem three = seed_item(3, "https://three.example/", "Three", 3);
  three.touch_icon_exists = 1;
  three.favicon_exists = 1;
  three.is_dirty = -1;
  SeedItem four = seed_item(4, kLongUrl, kLongTitle, 4);
  four.is_dirty = 0;
  SeedItem big = seed_item(5, "https://big.example/", "Big", 5);
  big.icon_size = "1024x769";
  big.icon_data = seed_pixels(kBigWidth, kBigHeight, 5);
  return {one, two, three, four, big};
}

// Reads exactly `length` bytes within the bound; false when the stream ended
// or nothing came.
bool read_bytes(int fd, void* buffer, size_t length) {
  auto* out = static_cast<char*>(buffer);
  size_t done = 0;
  while (done < length) {
    struct pollfd entry = {fd, POLLIN, 0};
    if (poll(&entry, 1, kReadBoundMs) != 1) return false;
    ssize_t n = read(fd, out + done, length - done);
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

std::vector<int32_t> read_words(int fd, size_t count) {
  std::vector<int32_t> words(count, -1);
  if (!read_bytes(fd, words.data(), count * sizeof(int32_t))) return {};
  return words;
}

// True when the peer's side of the stream ends before any further byte (a
// peer that closed with our bytes unread resets the connection instead).
bool stream_ends(int fd) {
  char byte;
  struct pollfd entry = {fd, POLLIN, 0};
  if (poll(&entry, 1, kReadBoundMs) != 1) return false;
  ssize_t n = read(fd, &byte, 1);
  return n == 0 || (n < 0 && errno == ECONNRESET);
}

// The icon bytes now at the start of the shared-memory object; none when it
// is shorter than that.
std::vector<uint8_t> shm_prefix(size_t length) {
  std::vector<uint8_t> bytes;
  int fd = shm_open(SDS_SHM_NAME, O_RDONLY, 0);
  if (fd < 0) return bytes;
  struct stat st {};
  if (fstat(fd, &st) != 0 || st.st_size < static_cast<off_t>(length)) {
    (void)close(fd);
    return bytes;
  }
  void* address = mmap(nullptr, SDS_SHM_SIZE, PROT_READ, MAP_SHARED, fd, 0);
  (void)close(fd);
  if (address == MAP_FAILED) return bytes;
  auto* start = static_cast<const uint8_t*>(address);
  bytes.assign(start, start + length);
  (void)munmap(address, SDS_SHM_SIZE);
  return bytes;
}

class DeckCommands : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(seed_deck(base_deck()));
    ASSERT_TRUE(service_.start_activated());
    ASSERT_EQ(service_.connect(&connection_), SDS_ERROR_NONE) << service_.output();
    fd_ = connection_.fd();
  }

  void send_header(int32_t cmd, int32_t item_id) {
    sds_command header{cmd, connection_.cid(), item_id};
    ASSERT_TRUE(write_all(fd_, &header, sizeof header));
  }

  // Command 10 answered as the next eight bytes: nothing was left pending.
  void expect_nothing_pending() {
    send_header(SDS_CMD_GET_NEXT_UPDATE_DURATION, 0);
    EXPECT_EQ(read_words(fd_, 2), (std::vector<int32_t>{0, SDS_DEFAULT_UPDATE_SECONDS}));
  }

  TempRoot root_;
  ServiceHarness service_;
  SdsConnection connection_;
  int fd_ = -1;
};

TEST_F(DeckCommands, TextAndFlagQueriesAnswerTheStoredValues) {
  struct TextCase {
    const char* name;
    int (*call)(SdsConnection&, int32_t, SdsClientText*);
    int32_t id;
    int status;
    const char* value;
  } texts[] = {
      {"url", sds_client_get_url, 2, SDS_ERROR_NONE, "https://two.example/news"},
      {"title", sds_client_get_title, 1, SDS_ERROR_NONE, "One"},
      {"icon size", sds_client_get_icon_size, 1, SDS_ERROR_NONE, "3x2"},
      {"colour", sds_client_get_dominant_color, 2, SDS_ERROR_NONE, "#405060"},
      {"NULL colour", sds_client_get_dominant_color, 3, SDS_ERROR_NO_DATA, nullptr},
      {"NULL icon size", sds_client_get_icon_size, 2, SDS_ERROR_NO_DATA, nullptr},
      {"unknown id", sds_client_get_url, 99, SDS_ERROR_ID_NOT_FOUND, nullptr},
  };
  for (const auto& c : texts) {
    SdsClientText value;
    EXPECT_EQ(c.call(connection_, c.id, &value), c.status) << c.name;
    if (c.value != nullptr) {
      ASSERT_TRUE(value) << c.name;
      EXPECT_STREQ(value.get(), c.value) << c.name;
    } else {
      EXPECT_FALSE(value) << c.name;
    }
  }
  struct FlagCase {
    const char* name;
    int (*call)(SdsConnection&, int32_t, int32_t*);
    int32_t id;
    int status;
    int32_t value;
  } flags[] = {
      {"touch icon of 1", sds_client_get_touch_icon_exists, 1, SDS_ERROR_NONE, 1},
      {"favicon of 1", sds_client_get_favicon_exists, 1, SDS_ERROR_NONE, 0},
      {"touch icon of 2", sds_client_get_touch_icon_exists, 2, SDS_ERROR_NONE, 0},
      {"favicon of 2", sds_client_get_favicon_exists, 2, SDS_ERROR_NONE, 1},
      {"unknown id", sds_client_get_favicon_exists, 99, SDS_ERROR_NO_DATA, -7},
  };
  for (const auto& c : flags) {
    int32_t value = -7;
    EXPECT_EQ(c.call(connection_, c.id, &value), c.status) << c.name;
    EXPECT_EQ(value, c.value) << c.name;
  }
  EXPECT_TRUE(connection_.is_open());
}

// Raw replies: exactly these words (and string bytes), then nothing pending.
TEST_F(DeckCommands, RepliesOnTheWireAreExactlyTheirWords) {
  const std::string flag6 = std::string("\x06\0\0\0", 4);
  struct Case {
    const char* name;
    int32_t cmd, id;
    std::string sent_after;  // bytes following the header
    std::vector<int32_t> words;
    std::string text;
  } cases[] = {
      {"url: status, length, bytes", SDS_CMD_GET_URL, 1, "", {0, 20}, "https://one.example/"},
      {"flag: status and one word", SDS_CMD_GET_TOUCH_ICON_EXISTS, 3, "", {0, 1}, ""},
      {"NULL text: status alone", SDS_CMD_GET_DOMINANT_COLOR, 3, "", {SDS_ERROR_NO_DATA}, ""},
      {"icon without pixels: status six alone", SDS_CMD_GET_ICON, 2, "", {SDS_ERROR_NO_DATA}, ""},
      {"url over the wire limit: status six alone", SDS_CMD_GET_URL, 4, "", {6}, ""},
      {"title over the wire limit: status six alone", SDS_CMD_GET_TITLE, 4, "", {6}, ""},
      {"no condition: live ids in order", SDS_CMD_GET_FULL_IDS, 0, flag6, {0, 3, 2, 1, 5}, ""},
      {"unknown selector: status five alone", SDS_CMD_GET_FULL_IDS, 0,
       std::string("\0\0\0\0\x02\0", 6), {SDS_ERROR_INVALID_PARAMETER}, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    send_header(c.cmd, c.id);
    ASSERT_TRUE(write_all(fd_, c.sent_after.data(), c.sent_after.size()));
    EXPECT_EQ(read_words(fd_, c.words.size()), c.words);
    std::string text(c.text.size(), '\0');
    ASSERT_TRUE(read_bytes(fd_, text.data(), text.size()));
    EXPECT_EQ(text, c.text);
    expect_nothing_pending();
  }
  EXPECT_TRUE(service_.has_message("[ERROR] title of id:4 is 5000 bytes, not sendable as a string"))
      << service_.output();
}

TEST_F(DeckCommands, IconPixelsArriveThroughSharedMemoryWithWidthBeforeHeight) {
  const auto pixels = seed_pixels(kIconWidth, kIconHeight, 1);
  send_header(SDS_CMD_GET_ICON, 1);
  EXPECT_EQ(read_words(fd_, 4), (std::vector<int32_t>{0, static_cast<int32_t>(pixels.size()),
                                                      kIconWidth, kIconHeight}));
  EXPECT_EQ(shm_prefix(pixels.size()), pixels);

  sds_client_icon icon;
  ASSERT_EQ(sds_client_get_icon(connection_, 1, &icon), SDS_ERROR_NONE);
  EXPECT_EQ(icon.width, kIconWidth);
  EXPECT_EQ(icon.height, kIconHeight);
  ASSERT_TRUE(icon.pixels);
  EXPECT_EQ(std::vector<uint8_t>(icon.pixels.get(), icon.pixels.get() + icon.byte_count), pixels);
  sds_client_icon none;
  EXPECT_EQ(sds_client_get_icon(connection_, 99, &none), SDS_ERROR_NO_DATA);
  EXPECT_FALSE(none.pixels);
}

// The client keeps its mapping between icons. When another party removes the
// object and a new one takes its name, the service writes into the new one:
// reading the kept mapping would hand out whatever the old object held.
TEST_F(DeckCommands, IconIsReadFromTheObjectNowBehindTheName) {
  const auto pixels = seed_pixels(kIconWidth, kIconHeight, 1);
  sds_client_icon first;
  ASSERT_EQ(sds_client_get_icon(connection_, 1, &first), SDS_ERROR_NONE);

  int old_fd = shm_open(SDS_SHM_NAME, O_RDWR, 0);
  ASSERT_GE(old_fd, 0);
  void* old_mapping = mmap(nullptr, SDS_SHM_SIZE, PROT_WRITE, MAP_SHARED, old_fd, 0);
  (void)close(old_fd);
  ASSERT_NE(old_mapping, MAP_FAILED);
  std::memset(old_mapping, 0xEE, pixels.size());
  (void)munmap(old_mapping, SDS_SHM_SIZE);
  ASSERT_EQ(shm_unlink(SDS_SHM_NAME), 0);
  int new_fd = shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT | O_EXCL, 0666);
  ASSERT_GE(new_fd, 0);
  EXPECT_EQ(ftruncate(new_fd, static_cast<off_t>(SDS_SHM_SIZE)), 0);
  (void)close(new_fd);

  sds_client_icon second;
  ASSERT_EQ(sds_client_get_icon(connection_, 1, &second), SDS_ERROR_NONE);
  EXPECT_EQ(std::vector<uint8_t>(second.pixels.get(), second.pixels.get() + second.byte_count),
            pixels);
}

TEST_F(DeckCommands, IconLargerThanTheSharedMemoryIsStatusTwoAndNothingIsCopied) {
  const auto small = seed_pixels(kIconWidth, kIconHeight, 1);
  sds_client_icon icon;
  ASSERT_EQ(sds_client_get_icon(connection_, 1, &icon), SDS_ERROR_NONE);

  send_header(SDS_CMD_GET_ICON, 5);
  EXPECT_EQ(read_words(fd_, 1), std::vector<int32_t>{SDS_ERROR_SHM_FAILED});
  expect_nothing_pending();
  EXPECT_EQ(shm_prefix(small.size()), small);  // still the previous icon
  sds_client_icon big;
  EXPECT_EQ(sds_client_get_icon(connection_, 5, &big), SDS_ERROR_SHM_FAILED);
  EXPECT_FALSE(big.pixels);
  EXPECT_TRUE(connection_.is_open());
}

// Any local process may cut the object short (mode 0666): the next icon
// was copied beyond its end, and the service died of SIGBUS.
TEST_F(DeckCommands, IconAfterTheObjectWasCutShortKilledTheService) {
  const auto pixels = seed_pixels(kIconWidth, kIconHeight, 1);
  const std::vector<int32_t> served = {0, static_cast<int32_t>(pixels.size()), kIconWidth,
                                       kIconHeight};
  send_header(SDS_CMD_GET_ICON, 1);
  ASSERT_EQ(read_words(fd_, 4), served);
  UniqueFd object(shm_open(SDS_SHM_NAME, O_RDWR, 0));
  ASSERT_TRUE(object);
  ASSERT_EQ(ftruncate(object.get(), 0), 0);

  send_header(SDS_CMD_GET_ICON, 1);
  EXPECT_EQ(read_words(fd_, 4), served);
  EXPECT_EQ(shm_prefix(pixels.size()), pixels);
  struct stat st {};
  ASSERT_EQ(fstat(object.get(), &st), 0);
  EXPECT_EQ(st.st_size, static_cast<off_t>(SDS_SHM_SIZE));
  expect_nothing_pending();
}

// A client that left with requests unanswered had every item of every reply
// written into the void, each failure logged (33,000 lines from one client).
TEST_F(DeckCommands, RepliesToAClientThatLeftWereWrittenAndLoggedItemByItem) {
  const sds_command title{SDS_CMD_GET_TITLE, connection_.cid(), 1};
  const std::vector<sds_command> requests(2000, title);
  ASSERT_TRUE(write_all(fd_, requests.data(), requests.size() * sizeof title));
  connection_.close();
  int status = 0;
  ASSERT_TRUE(service_.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service_.output();
  const auto messages = service_.messages();
  EXPECT_EQ(std::count_if(messages.begin(), messages.end(),
                          [](const std::string& m) { return m.rfind("[IPC.Write]", 0) == 0; }),
            1)
      << service_.output();
  EXPECT_TRUE(service_.has_message_matching("disconnect client:[0-9]+ sock:[0-9]+"));
}

TEST_F(DeckCommands, ReleaseAnswersZeroRemovesTheObjectAndEndsTheConnection) {
  struct stat st {};
  ASSERT_EQ(stat(SDS_SHM_FILE_PATH, &st), 0);
  send_header(SDS_CMD_FREE_SHM, 0);
  EXPECT_EQ(read_words(fd_, 1), std::vector<int32_t>{SDS_ERROR_NONE});
  EXPECT_TRUE(stream_ends(fd_));
  int status = 0;
  ASSERT_TRUE(service_.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service_.output();
  EXPECT_NE(stat(SDS_SHM_FILE_PATH, &st), 0);
}

TEST_F(DeckCommands, ReleaseWhenTheObjectIsAlreadyGoneIsStatusTwoAndTheConnectionGoesOn) {
  ASSERT_EQ(shm_unlink(SDS_SHM_NAME), 0);
  EXPECT_EQ(sds_client_release_shm(connection_), SDS_ERROR_SHM_FAILED);
  ASSERT_TRUE(connection_.is_open());
  expect_nothing_pending();
  EXPECT_TRUE(service_.has_message("[CRITICAL] Error removing /browser_sds_shm_file"))
      << service_.output();
}

TEST_F(DeckCommands, NextUpdateDurationFollowsTheFile) {
  const std::string path = root_.path(SDS_NEXT_UPDATE_DURATION_PATH);
  const auto warnings = [this] {
    const auto m = service_.messages();
    return std::count(m.begin(), m.end(), "Next update duration is <= zero ?");
  };
  struct Case {
    const char* name;
    const char* content;  // null: no file
    int32_t seconds;
    bool warned;
  } cases[] = {
      {"no file", nullptr, 86400, false}, {"empty file", "", 86400, false},
      {"zero", "0", 86400, true},         {"negative", "-5", 86400, true},
      {"an hour", "3600", 3600, false},
  };
  for (const auto& c : cases) {
    (void)unlink(path.c_str());
    if (c.content != nullptr) {
      ASSERT_TRUE(write_file(path, c.content)) << c.name;
    }
    const auto before = warnings();
    send_header(SDS_CMD_GET_NEXT_UPDATE_DURATION, 0);
    EXPECT_EQ(read_words(fd_, 2), (std::vector<int32_t>{0, c.seconds})) << c.name;
    EXPECT_EQ(warnings() - before, c.warned ? 1 : 0) << c.name;
  }
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &seconds), SDS_ERROR_NONE);
  EXPECT_EQ(seconds, 3600);
}

TEST_F(DeckCommands, FullIdsFollowTheCondition) {
  struct Case {
    const char* name;
    int32_t is_dirty;
    std::vector<int32_t> ids;
  } cases[] = {{"is_dirty 0", 0, {4}}, {"withdrawn", -1, {3}}, {"live", 1, {2, 1, 5}}};
  for (const auto& c : cases) {
    sds_client_ids ids;
    ASSERT_EQ(sds_client_get_ids_by_dirty(connection_, c.is_dirty, &ids), SDS_ERROR_NONE) << c.name;
    EXPECT_EQ(std::vector<int32_t>(ids.ids.get(), ids.ids.get() + ids.count), c.ids) << c.name;
  }
  sds_client_ids none;
  EXPECT_EQ(sds_client_get_ids_by_dirty(connection_, 7, &none), SDS_ERROR_NO_DATA);
  EXPECT_EQ(none.count, 0);
}

TEST_F(DeckCommands, NegativeItemIdGetsNoReplyAndTheConnectionGoesOn) {
  for (int32_t cmd = SDS_CMD_GET_URL; cmd <= SDS_CMD_GET_DOMINANT_COLOR; ++cmd) {
    send_header(cmd, -1);
    expect_nothing_pending();
  }
  // The library does not send what would get no answer.
  SdsClientText url;
  EXPECT_EQ(sds_client_get_url(connection_, -1, &url), SDS_ERROR_INVALID_PARAMETER);
  expect_nothing_pending();
}

// The worker opens the database before it reads the first header; when that
// fails the connection ends without a reply to anything.
TEST(UnopenableDatabase, ServiceAnswersTheHandshakeThenEndsWithoutReply) {
  TempRoot root;
  ASSERT_EQ(rmdir(root.path(SDS_DATABASE_DIR).c_str()), 0);
  ServiceHarness service;
  ASSERT_TRUE(service.start_activated());
  SdsConnection connection;
  ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
  sds_command header{SDS_CMD_GET_URL, connection.cid(), 1};
  (void)write_all(connection.fd(), &header, sizeof header);  // may meet a closed peer
  EXPECT_TRUE(stream_ends(connection.fd()));
  int status = 0;
  ASSERT_TRUE(service.wait_exit(&status));
  EXPECT_EQ(exit_code_of(status), 0) << service.output();
}

// A database that can't be opened by the time a request is dispatched is
// answered with status 15 alone, and what the request carried stays in the
// stream. Only the dispatcher can meet that state: the worker never starts
// serving without a database.
TEST(UnopenableDatabase, DispatcherAnswersFifteenAndLeavesTheRequestDataUnread) {
  TempRoot root;
  DbSession::close_handle();
  ASSERT_EQ(rmdir(root.path(SDS_DATABASE_DIR).c_str()), 0);
  SocketPair pair;
  sds_client slot;
  slot.client_id = 5;
  slot.sock = pair.service.get();
  const unsigned char condition[] = {0, 0, 0, 0, 1, 0, 0, 0, 0, 0};  // flag 0, selector 1, value 0
  ASSERT_TRUE(write_all(pair.peer.get(), condition, sizeof condition));
  sds_command header{SDS_CMD_GET_FULL_IDS, 5, 0};
  EXPECT_EQ(sds_handle_requests(&slot, &header), SDS_ERROR_DB_OPEN_FAILED);
  EXPECT_EQ(read_words(pair.peer.get(), 1), std::vector<int32_t>{SDS_ERROR_DB_OPEN_FAILED});
  EXPECT_FALSE(readable_now(pair.peer.get()));
  unsigned char unread[sizeof condition + 1] = {};
  EXPECT_EQ(read(pair.service.get(), unread, sizeof unread),
            static_cast<ssize_t>(sizeof condition));
  EXPECT_EQ(std::memcmp(unread, condition, sizeof condition), 0);
  EXPECT_EQ(sds_db_handle, nullptr);
}

// Any local process may put something else at the object's name: a
// directory, FIFO or symlink there made every handshake answer 2, for good.
// And one that cuts the object short while icons are copied must not kill
// the service either: a 3 MiB icon gives the cut time to come mid-copy.
TEST(SharedMemoryName, ForeignThingsAtTheNameFailedEveryHandshake) {
  TempRoot root;
  SeedItem big = seed_item(1, "https://big.example/", "Big", 1);
  big.icon_size = "1024x768";
  big.icon_data = seed_pixels(1024, 768, 7);
  ASSERT_TRUE(seed_deck({big}));
  const std::vector<int32_t> served = {0, static_cast<int32_t>(SDS_SHM_SIZE), 1024, 768};
  const std::string target = root.path("/target");
  ASSERT_TRUE(write_file(target, "kept"));
  struct Case {
    const char* name;
    std::function<int()> make;  // 0 when it stands at the name
    bool cut_during_copies;
  } cases[] = {
      {"directory", [] { return mkdir(SDS_SHM_FILE_PATH, 0777); }, false},
      {"FIFO", [] { return mkfifo(SDS_SHM_FILE_PATH, 0666); }, false},
      {"symlink", [&] { return symlink(target.c_str(), SDS_SHM_FILE_PATH); }, false},
      {"object cut short during copies", [] { return 0; }, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_EQ(c.make(), 0);
    ServiceHarness service;
    ASSERT_TRUE(service.start_activated());
    SdsConnection connection;
    ASSERT_EQ(service.connect(&connection), SDS_ERROR_NONE) << service.output();
    struct stat st {};
    ASSERT_EQ(lstat(SDS_SHM_FILE_PATH, &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode));
    const sds_command icon{SDS_CMD_GET_ICON, connection.cid(), 1};
    if (c.cut_during_copies) {
      UniqueFd object(shm_open(SDS_SHM_NAME, O_RDWR, 0));
      ASSERT_TRUE(object);
      // Cuts the object short over and over until the case ends, or this
      // process does.
      struct Cutter {
        pid_t pid = fork();
        ~Cutter() {
          if (pid > 0 && kill(pid, SIGKILL) == 0) (void)waitpid(pid, nullptr, 0);
        }
      } cutter;
      ASSERT_GE(cutter.pid, 0);
      if (cutter.pid == 0) {
        (void)prctl(PR_SET_PDEATHSIG, SIGKILL);
        for (;;) (void)ftruncate(object.get(), 0);
      }
      for (int i = 0; i < 50; ++i) {
        ASSERT_TRUE(write_all(connection.fd(), &icon, sizeof icon));
        std::vector<int32_t> status = read_words(connection.fd(), 1);
        ASSERT_EQ(status.size(), 1u);
        if (status[0] == SDS_ERROR_SHM_FAILED) continue;  // cut during the copy
        EXPECT_EQ(status[0], 0);
        EXPECT_EQ(read_words(connection.fd(), 3),
                  std::vector<int32_t>(served.begin() + 1, served.end()));
      }
    }
    ASSERT_TRUE(write_all(connection.fd(), &icon, sizeof icon));
    EXPECT_EQ(read_words(connection.fd(), 4), served);
    EXPECT_EQ(shm_prefix(SDS_SHM_SIZE), big.icon_data);
    connection.close();
    int status = 0;
    ASSERT_TRUE(service.wait_exit(&status));
    EXPECT_EQ(exit_code_of(status), 0) << service.output();
    (void)shm_unlink(SDS_SHM_NAME);
  }
  EXPECT_EQ(read_file(target), "kept");
}

// Time-outs set short through the platform keys, as an integrator may.
class ConnectionBounds : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/request_timeout_ms", "200"));
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/reply_timeout_ms", "200"));
    ASSERT_TRUE(service_.start_activated());
    ASSERT_EQ(service_.connect(&connection_), SDS_ERROR_NONE) << service_.output();
    fd_ = connection_.fd();
  }
  int exit_code() {
    int status = 0;
    return service_.wait_exit(&status) ? exit_code_of(status) : -1;
  }

  TempRoot root_;
  ServiceHarness service_;
  SdsConnection connection_;
  int fd_ = -1;
};

// A request that stopped half-way held its connection, and its process, for
// ever. Between requests the wait stays unbounded: the browser's session.
TEST_F(ConnectionBounds, HalfSentRequestHeldTheConnectionForEver) {
  struct pollfd idle = {fd_, POLLIN, 0};
  EXPECT_EQ(poll(&idle, 1, 600), 0);  // three times the bound, and nothing
  sds_command next_update{SDS_CMD_GET_NEXT_UPDATE_DURATION, connection_.cid(), 0};
  ASSERT_TRUE(write_all(fd_, &next_update, sizeof next_update));
  EXPECT_EQ(read_words(fd_, 2), (std::vector<int32_t>{0, SDS_DEFAULT_UPDATE_SECONDS}));

  sds_command initialize{SDS_CMD_INITIALIZE, connection_.cid(), 0};
  ASSERT_TRUE(write_all(fd_, &initialize, sizeof initialize));
  EXPECT_EQ(read_words(fd_, 1), std::vector<int32_t>{0});  // and no position follows
  EXPECT_TRUE(stream_ends(fd_));
  EXPECT_EQ(exit_code(), 0) << service_.output();
  EXPECT_TRUE(
      service_.has_message_matching("\\[ERROR\\] cmd 1 not complete within 200 ms sock:[0-9]+"))
      << service_.output();
}

// A client that sent requests and never read the replies blocked the
// service's writes for ever.
TEST_F(ConnectionBounds, UnreadRepliesHeldTheConnectionForEver) {
  const sds_command next_update{SDS_CMD_GET_NEXT_UPDATE_DURATION, connection_.cid(), 0};
  bool ended = false;
  for (int sent = 0; sent < 100000 && !ended; ++sent) {
    struct pollfd entry = {fd_, POLLOUT, 0};
    ASSERT_EQ(poll(&entry, 1, kReadBoundMs), 1) << "neither room nor an end";
    ended = (entry.revents & (POLLHUP | POLLERR)) != 0 ||
            (send(fd_, &next_update, sizeof next_update, MSG_NOSIGNAL | MSG_DONTWAIT) < 0 &&
             errno != EAGAIN);
  }
  EXPECT_TRUE(ended);
  EXPECT_EQ(exit_code(), 0) << service_.output();
  EXPECT_TRUE(service_.has_message_matching(
      "\\[ERROR\\] reply to cmd 10 not read within 200 ms sock:[0-9]+"))
      << service_.output();
}

}  // namespace
