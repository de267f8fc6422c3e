// The real service end to end, then its serving modules and the client library
// in this process on socket pairs, for what no real peer can provoke.
#include <fcntl.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <fstream>
#include <functional>
#include <set>
#include <string>
#include <vector>

#include "client/sitedeck-client-internal.h"
#include "kdb.h"
#include "serve/sitedeck-service-ipc.h"
#include "serve/sitedeck-service-main.h"
#include "serve/sitedeck-service-request-handler-internal.h"
#include "serve/sitedeck-service-request-handler.h"
#include "serve/sitedeck-service-shm.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/log_capture.h"
#include "support/seeded_deck.h"
#include "support/service_harness.h"
#include "support/socket_pair.h"
#include "support/temp_root.h"

namespace {

std::string read_bytes(int fd, size_t length) {
  std::string bytes(length, '\0');
  for (size_t done = 0; done < length;) {
    struct pollfd entry = {fd, POLLIN, 0};
    ssize_t n = poll(&entry, 1, 10000) == 1 ? read(fd, &bytes[done], length - done) : -1;
    if (n <= 0) return "<cut short>";
    done += static_cast<size_t>(n);
  }
  return bytes;
}

std::string words(std::initializer_list<int32_t> values) {
  return std::string(reinterpret_cast<const char*>(std::data(values)), values.size() * 4);
}

// The peer's side ends before any further byte (or resets, our bytes unread).
bool stream_ends(int fd) {
  char byte;
  struct pollfd entry = {fd, POLLIN, 0};
  ssize_t n = poll(&entry, 1, 10000) == 1 ? read(fd, &byte, 1) : 1;
  return n == 0 || (n < 0 && errno == ECONNRESET);
}

std::vector<uint8_t> shm_prefix(size_t length) {
  UniqueFd fd(shm_open(SDS_SHM_NAME, O_RDONLY, 0));
  struct stat st {};
  if (!fd || fstat(fd.get(), &st) != 0 || st.st_size < static_cast<off_t>(length)) return {};
  void* address = mmap(nullptr, length, PROT_READ, MAP_SHARED, fd.get(), 0);
  if (address == MAP_FAILED) return {};
  auto* start = static_cast<uint8_t*>(address);
  std::vector<uint8_t> bytes(start, start + length);
  (void)munmap(address, length);
  return bytes;
}

int exit_code(ServiceHarness& process) {
  int status = 0;
  return process.wait_exit(&status) ? exit_code_of(status) : -1;
}

// Live items 2, 1, 5 in order; 3 withdrawn; 4 with is_dirty 0 and texts the
// wire can't carry. 1's icon is not square; 5's is a row too tall for the object.
class DeckCommands : public ::testing::Test {
 protected:
  void SetUp() override {
    SeedItem one = seed_item(1, "https://one.example/", "One", 2);
    one.icon_size = "3x2";
    one.touch_icon_exists = 1;
    one.icon_data = pixels_;
    SeedItem two = seed_item(2, "https://two.example/news", "Two", 1);
    two.dominant_color = "#405060";
    SeedItem three = seed_item(3, "https://three.example/", "Three", 3);
    three.touch_icon_exists = 1;
    three.is_dirty = -1;
    SeedItem four = seed_item(4, "https://four.example/" + std::string(4979, 'u'),
                              std::string(5000, 't'), 4);
    four.is_dirty = 0;
    SeedItem big = seed_item(5, "https://big.example/", "Big", 5);
    big.icon_size = "1024x769";
    big.icon_data = seed_pixels(1024, 769, 5);
    ASSERT_TRUE(seed_deck({one, two, three, four, big}));
    ASSERT_TRUE(service_.start_activated());
    ASSERT_EQ(service_.connect(&connection_), SDS_ERROR_NONE) << service_.output();
    fd_ = connection_.fd();
  }
  void send(int32_t cmd, int32_t item_id, const std::string& after = "") {
    std::string request = words({cmd, connection_.cid(), item_id}) + after;
    ASSERT_TRUE(write_all(fd_, request.data(), request.size()));
  }
  // Command 10 answered as the next eight bytes: nothing was left pending.
  void expect_nothing_pending(int32_t seconds = SDS_DEFAULT_UPDATE_SECONDS) {
    send(SDS_CMD_GET_NEXT_UPDATE_DURATION, 0);
    EXPECT_EQ(read_bytes(fd_, 8), words({0, seconds}));
  }

  const std::vector<uint8_t> pixels_ = seed_pixels(3, 2, 1);
  TempRoot root_;
  ServiceHarness service_;
  SdsConnection connection_;
  int fd_ = -1;
};

// Queries as raw bytes, then nothing pending. A text longer than a string item
// carries was answered 0 with no string: every later reply was out of step.
TEST_F(DeckCommands, RepliesOnTheWireAreExactlyTheirWords) {
  const auto dirty = [](int32_t is_dirty) {
    return words({0, SITE_DECK_ADAPTOR_O_DIRTY}).substr(0, 6) + words({is_dirty});
  };
  const std::string path = root_.path(SDS_NEXT_UPDATE_DURATION_PATH);
  struct Case {
    const char* name;
    int32_t cmd, id;
    std::string sent_after, reply;
    const char* next_update_file = nullptr;  // written first; "-": removed
    bool warned = false;
  } cases[] = {
      {"url", SDS_CMD_GET_URL, 1, "", words({0, 20}) + "https://one.example/"},
      {"colour", SDS_CMD_GET_DOMINANT_COLOR, 2, "", words({0, 7}) + "#405060"},
      {"NULL colour: status six alone", SDS_CMD_GET_DOMINANT_COLOR, 3, "", words({6})},
      {"text of an unknown id", SDS_CMD_GET_URL, 99, "", words({SDS_ERROR_ID_NOT_FOUND})},
      {"flag of withdrawn 3", SDS_CMD_GET_TOUCH_ICON_EXISTS, 3, "", words({0, 1})},
      {"flag of an unknown id", SDS_CMD_GET_FAVICON_EXISTS, 99, "", words({SDS_ERROR_NO_DATA})},
      {"icon without pixels", SDS_CMD_GET_ICON, 2, "", words({SDS_ERROR_NO_DATA})},
      {"url over the wire limit", SDS_CMD_GET_URL, 4, "", words({6})},
      {"title over the wire limit", SDS_CMD_GET_TITLE, 4, "", words({6})},
      {"no condition: live ids in order", SDS_CMD_GET_FULL_IDS, 0, words({6}),
       words({0, 3, 2, 1, 5})},
      {"is_dirty 0", SDS_CMD_GET_FULL_IDS, 0, dirty(0), words({0, 1, 4})},
      {"withdrawn", SDS_CMD_GET_FULL_IDS, 0, dirty(-1), words({0, 1, 3})},
      {"live", SDS_CMD_GET_FULL_IDS, 0, dirty(1), words({0, 3, 2, 1, 5})},
      {"no id matches", SDS_CMD_GET_FULL_IDS, 0, dirty(7), words({SDS_ERROR_NO_DATA})},
      {"unknown selector: status five alone", SDS_CMD_GET_FULL_IDS, 0, words({0, 2}).substr(0, 6),
       words({SDS_ERROR_INVALID_PARAMETER})},
      {"next update, no file", 10, 0, "", words({0, 86400}), "-"},
      {"next update, empty file", 10, 0, "", words({0, 86400}), ""},
      {"next update zero", 10, 0, "", words({0, 86400}), "0", true},
      {"next update negative", 10, 0, "", words({0, 86400}), "-5", true},
      {"next update, an hour", 10, 0, "", words({0, 3600}), "3600"},
  };
  const auto warnings = [this] {
    const auto m = service_.messages();
    return std::count(m.begin(), m.end(), "Next update duration is <= zero ?");
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.next_update_file != nullptr) {
      (void)unlink(path.c_str());
      ASSERT_TRUE(std::string(c.next_update_file) == "-" || write_file(path, c.next_update_file));
    }
    const auto before = warnings();
    send(c.cmd, c.id, c.sent_after);
    EXPECT_EQ(read_bytes(fd_, c.reply.size()), c.reply);
    EXPECT_EQ(warnings() - before, c.warned ? 1 : 0);
    if (c.next_update_file == nullptr) expect_nothing_pending();
  }
  for (int32_t cmd = SDS_CMD_GET_URL; cmd <= SDS_CMD_GET_DOMINANT_COLOR; ++cmd) {
    send(cmd, -1);  // a negative item id gets no reply at all
    expect_nothing_pending(3600);
  }
  EXPECT_TRUE(
      service_.has_message("[ERROR] title of id:4 is 5000 bytes, not sendable as a string"));
}

// Pixels go through the object (0666, full size), width before height; one too
// large is refused uncopied. The client keeps its mapping between icons: the
// service writes into whatever object now has the name, which it must read.
// Release answers 2 while no object has it, 0 once it is removed.
TEST_F(DeckCommands, IconPixelsArriveThroughSharedMemoryAndReleaseRemovesTheObject) {
  struct stat st {};
  ASSERT_EQ(stat(SDS_SHM_FILE_PATH, &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0666u);
  EXPECT_EQ(static_cast<size_t>(st.st_size), SDS_SHM_SIZE);
  send(SDS_CMD_GET_ICON, 1);
  EXPECT_EQ(read_bytes(fd_, 16), words({0, 24, 3, 2}));
  EXPECT_EQ(shm_prefix(24), pixels_);
  send(SDS_CMD_GET_ICON, 5);
  EXPECT_EQ(read_bytes(fd_, 4), words({SDS_ERROR_SHM_FAILED}));
  expect_nothing_pending();
  EXPECT_EQ(shm_prefix(24), pixels_);  // still the previous icon
  sds_client_icon icon, again, none;
  ASSERT_EQ(sds_client_get_icon(connection_, 1, &icon), SDS_ERROR_NONE);  // its mapping kept
  {  // the old object, scribbled over and removed
    UniqueFd old(shm_open(SDS_SHM_NAME, O_RDWR, 0));
    void* mapping = mmap(nullptr, SDS_SHM_SIZE, PROT_WRITE, MAP_SHARED, old.get(), 0);
    ASSERT_NE(mapping, MAP_FAILED);
    std::memset(mapping, 0xEE, 24);
    (void)munmap(mapping, SDS_SHM_SIZE);
    ASSERT_EQ(shm_unlink(SDS_SHM_NAME), 0);
  }
  send(SDS_CMD_GET_ICON, 1);
  EXPECT_EQ(read_bytes(fd_, 4), words({SDS_ERROR_SHM_FAILED}));
  EXPECT_EQ(sds_client_release_shm(connection_), SDS_ERROR_SHM_FAILED);  // and goes on
  EXPECT_TRUE(service_.has_message("[CRITICAL] Error removing /browser_sds_shm_file"));
  UniqueFd fresh(shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT | O_EXCL, 0666));
  ASSERT_EQ(ftruncate(fresh.get(), static_cast<off_t>(SDS_SHM_SIZE)), 0);
  ASSERT_EQ(sds_client_get_icon(connection_, 1, &again), SDS_ERROR_NONE);
  EXPECT_EQ(std::make_pair(again.width, again.height), std::make_pair(3, 2));
  EXPECT_EQ(std::vector<uint8_t>(again.pixels.get(), again.pixels.get() + 24), pixels_);
  EXPECT_EQ(sds_client_get_icon(connection_, 99, &none), SDS_ERROR_NO_DATA);
  EXPECT_FALSE(none.pixels);
  send(SDS_CMD_FREE_SHM, 0);  // release: 0, the object removed, the connection ended
  EXPECT_EQ(read_bytes(fd_, 4), words({SDS_ERROR_NONE}));
  EXPECT_TRUE(stream_ends(fd_));
  EXPECT_EQ(exit_code(service_), 0) << service_.output();
  EXPECT_FALSE(file_exists(SDS_SHM_FILE_PATH));
}

// A client that left with requests unanswered had every item of every reply
// written into the void, each failure logged (33,000 lines from one client).
TEST_F(DeckCommands, RepliesToAClientThatLeftWereWrittenAndLoggedItemByItem) {
  const std::vector<sds_command> requests(2000, {SDS_CMD_GET_TITLE, connection_.cid(), 1});
  ASSERT_TRUE(write_all(fd_, requests.data(), requests.size() * sizeof(sds_command)));
  connection_.close();
  EXPECT_EQ(exit_code(service_), 0) << service_.output();
  const auto messages = service_.messages();
  EXPECT_EQ(std::count_if(messages.begin(), messages.end(),
                          [](const std::string& m) { return m.rfind("[IPC.Write]", 0) == 0; }),
            1)
      << service_.output();
}

bool write_sysctl(const char* path, const std::string& value) {
  UniqueFd fd(open(path, O_WRONLY));
  return fd && write(fd.get(), value.data(), value.size()) == static_cast<ssize_t>(value.size());
}

// A directory, FIFO or symlink that any local process put at the object's
// name made every handshake answer 2, for good; so did, under
// fs.protected_regular, an object of another account (the browser's after the
// first connection). Cutting the object short (0666) between icons or during
// a copy (of 3 MiB, to give it time) killed the service with SIGBUS.
TEST(SharedMemoryName, ForeignThingsAtTheNameFailedEveryHandshake) {
  TempRoot root;
  SeedItem big = seed_item(1, "https://big.example/", "Big", 1);
  big.icon_size = "1024x768";
  big.icon_data = seed_pixels(1024, 768, 7);
  ASSERT_TRUE(seed_deck({big}));
  const std::string served = words({0, static_cast<int32_t>(SDS_SHM_SIZE), 1024, 768});
  const std::string target = root.path("/target");
  ASSERT_TRUE(write_file(target, "kept"));
  constexpr const char* kSwitch = "/proc/sys/fs/protected_regular";
  const struct passwd* nobody = getpwnam("nobody");
  struct Restore {  // the switch's value before, when it is ours to set (as root)
    std::string before;
    ~Restore() { EXPECT_TRUE(before.empty() || write_sysctl(kSwitch, before)); }
  } restore;
  if (geteuid() != 0 || nobody == nullptr || !(std::ifstream(kSwitch) >> restore.before) ||
      !write_sysctl(kSwitch, restore.before)) {
    restore.before.clear();
  }
  struct Case {
    const char* name;
    std::function<int()> make;  // 0 when it stands at the name
    bool cut = false;
  } cases[] = {
      {"directory", [] { return mkdir(SDS_SHM_FILE_PATH, 0777); }},
      {"FIFO", [] { return mkfifo(SDS_SHM_FILE_PATH, 0666); }},
      {"symlink", [&] { return symlink(target.c_str(), SDS_SHM_FILE_PATH); }},
      {"object of another account", [&] {
         UniqueFd made(shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT, 0666));
         bool foreign = restore.before.empty() ||  // else a plain object
                        (fchown(made.get(), nobody->pw_uid, nobody->pw_gid) == 0 &&
                         write_sysctl(kSwitch, "1"));
         return made && foreign ? 0 : -1;
       }},
      {"IconAfterTheObjectWasCutShortKilledTheService", [] { return 0; }, true},
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
    const std::string icon = words({SDS_CMD_GET_ICON, connection.cid(), 1});
    UniqueFd object(shm_open(SDS_SHM_NAME, O_RDWR, 0));
    if (c.cut) {
      struct Cutter {  // cuts the object short over and over until the case ends
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
        ASSERT_TRUE(write_all(connection.fd(), icon.data(), icon.size()));
        const std::string status = read_bytes(connection.fd(), 4);
        if (status == words({SDS_ERROR_SHM_FAILED})) continue;  // cut during the copy
        ASSERT_EQ(status + read_bytes(connection.fd(), 12), served);
      }
    }
    ASSERT_TRUE(!c.cut || ftruncate(object.get(), 0) == 0);  // and now between two icons
    ASSERT_TRUE(write_all(connection.fd(), icon.data(), icon.size()));
    EXPECT_EQ(read_bytes(connection.fd(), 16), served);
    EXPECT_EQ(shm_prefix(SDS_SHM_SIZE), big.icon_data);
    ASSERT_EQ(fstat(object.get(), &st), 0);
    EXPECT_EQ(static_cast<size_t>(st.st_size), SDS_SHM_SIZE);
    connection.close();
    EXPECT_EQ(exit_code(service), 0) << service.output();
    (void)shm_unlink(SDS_SHM_NAME);
  }
  EXPECT_EQ(read_file(target), "kept");
}

class ConnectionBounds : public ::testing::Test {  // time-outs set short, as an integrator may
 protected:
  void SetUp() override {
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/request_timeout_ms", "200"));
    ASSERT_TRUE(kdb_write("db/browser/sitedeck/reply_timeout_ms", "200"));
    ASSERT_TRUE(service_.start_activated());
    ASSERT_EQ(service_.connect(&connection_), SDS_ERROR_NONE) << service_.output();
  }
  int fd() const { return connection_.fd(); }
  TempRoot root_;
  ServiceHarness service_;
  SdsConnection connection_;
};

// A request that stopped half-way held its connection, and its process, for
// ever. Between requests the wait stays unbounded: the browser's session.
TEST_F(ConnectionBounds, HalfSentRequestHeldTheConnectionForEver) {
  struct pollfd idle = {fd(), POLLIN, 0};
  EXPECT_EQ(poll(&idle, 1, 600), 0);  // three times the bound, and nothing
  ASSERT_TRUE(write_all(fd(), words({10, connection_.cid(), 0}).data(), 12));  // command 10
  EXPECT_EQ(read_bytes(fd(), 8), words({0, SDS_DEFAULT_UPDATE_SECONDS}));
  ASSERT_TRUE(write_all(fd(), words({SDS_CMD_INITIALIZE, connection_.cid(), 0}).data(), 12));
  EXPECT_EQ(read_bytes(fd(), 4), words({0}));  // and no position follows
  EXPECT_TRUE(stream_ends(fd()));
  EXPECT_EQ(exit_code(service_), 0) << service_.output();
  EXPECT_TRUE(service_.has_message_matching(
      "\\[ERROR\\] cmd 1 not complete within 200 ms sock:[0-9]+"));
}

// A client that sent requests and never read the replies blocked the
// service's writes for ever.
TEST_F(ConnectionBounds, UnreadRepliesHeldTheConnectionForEver) {
  const std::string request = words({SDS_CMD_GET_NEXT_UPDATE_DURATION, connection_.cid(), 0});
  bool ended = false;
  for (int sent = 0; sent < 100000 && !ended; ++sent) {
    struct pollfd entry = {fd(), POLLOUT, 0};
    ASSERT_EQ(poll(&entry, 1, 10000), 1) << "neither room nor an end";
    ended = (entry.revents & (POLLHUP | POLLERR)) != 0 ||
            (send(fd(), request.data(), 12, MSG_NOSIGNAL | MSG_DONTWAIT) < 0 && errno != EAGAIN);
  }
  EXPECT_TRUE(ended);
  EXPECT_EQ(exit_code(service_), 0) << service_.output();
  EXPECT_TRUE(service_.has_message_matching(
      "\\[ERROR\\] reply to cmd 10 not read within 200 ms sock:[0-9]+"));
}

// Without activation the service exits with 1 and makes no socket; SIGTERM
// before any client ends it through the failed accept, with 255.
TEST(Activation, WithoutActivationExitsWithOneAndSigtermBeforeAnyClientWith255) {
  TempRoot root;
  ServiceHarness unactivated, service;
  ASSERT_TRUE(unactivated.start_unactivated());
  EXPECT_EQ(exit_code(unactivated), 1);
  EXPECT_TRUE(unactivated.has_message("[CRITICAL]  Failed to get the socket"));
  EXPECT_FALSE(file_exists(root.path(SDS_SOCKET_PATH)));
  ASSERT_TRUE(service.start_direct());
  ASSERT_TRUE(service.wait_until_accepting() && service.signal(SIGTERM));
  EXPECT_EQ(exit_code(service), 255) << service.output();
  EXPECT_TRUE(service.has_message("[CRITICAL] accept Sitedeck service was crashed ?"));
}

// What the module uses of the service must come from the binary: a copy in
// the module keeps state of its own (a cache, a handle) that nothing shows.
TEST(PullModule, ModuleCarriesNoCopyOfWhatTheBinaryExports) {
  const auto defined = [](const char* file) {  // strong names for the dynamic linker
    std::set<std::string> names;
    FILE* nm = popen((std::string("nm -D --defined-only ") + file).c_str(), "r");
    char type = 0, name[4096];
    while (nm != nullptr && std::fscanf(nm, "%*s %c %4095s", &type, name) == 2) {
      if (std::strchr("WVwvu", type) == nullptr && std::strchr(name, '@') == nullptr) {
        names.insert(name);
      }
    }
    EXPECT_TRUE(nm != nullptr && pclose(nm) == 0) << file;
    return names;
  };
  const auto binary = defined(SITEDECK_BIN_DIR "/browser-sitedeck-service");
  std::string both;
  for (const auto& name : defined(SITEDECK_BIN_DIR "/libsitedeck-pull.so")) {
    if (binary.count(name) != 0) both += " " + name;
  }
  EXPECT_GT(binary.size(), 50u);
  EXPECT_EQ(both, "") << "defined in both: such a module file belongs to SERVE_SOURCES";
}

// Bad arguments are refused with their log line and send nothing.
TEST(IpcTest, BadArgumentsAreRefusedLoggedAndSendNothing) {
  SocketPair pair;
  LogCapture log;
  const int s = pair.service.get();
  sds_command header{1, 1, 0}, zero{0, 5, 1};
  char buffer[4];
  const std::string overlong(4097, 'y'), bad_sock = "[ERROR] check sock:-1";
  const auto at = [s](const char* check) { return format("[ERROR] check %s sock:%d", check, s); };
  struct Case {
    std::function<long()> call;
    long result;
    std::string message;
  } cases[] = {
      {[] { return sds_ipc_send_errorcode(-1, 0); }, -1, bad_sock},
      {[] { return sds_ipc_send_string(-1, "x"); }, -1, bad_sock},
      {[&] { return sds_ipc_simple_response(-1, &header); }, 5, bad_sock},
      {[] { return sds_ipc_read_int(-1, nullptr); }, -1, "[CHECK SOCKET]"},
      {[&] { return sds_ipc_recv(-1, buffer, 4, "probe"); }, -1, "[ERROR] probe check sock:-1"},
      {[&] { return sds_ipc_recv(s, nullptr, 4, "probe"); }, -1,
       format("[ERROR] probe check buffer sock:%d", s)},
      {[&] { return sds_ipc_send_custom_type(s, nullptr, 4); }, -1, at("buffer")},
      {[&] { return sds_ipc_send_string(s, nullptr); }, -1, at("buffer")},
      {[&] { return sds_ipc_read_blob(s, nullptr, 4); }, -1, at("buffer")},
      {[&] { return sds_ipc_read_blob(s, buffer, 0); }, -1, at("size:0")},
      {[&] { return sds_ipc_send_string(s, ""); }, -1, at("length:0")},
      {[&] { return sds_ipc_send_string(s, overlong.c_str()); }, -1, at("length:4097")},
      {[&] { return sds_ipc_simple_response(s, &zero); }, 5, at("command(0)")},
      {[] { return errno = EPIPE, sds_ipc_check_stderr(1); }, SDS_ERROR_IO_ERROR,
       format("[EPIPE:%d] Broken Pipe [%s]", EPIPE, strerror(EPIPE))},
      {[] { return errno = EINTR, sds_ipc_check_stderr(1); }, SDS_ERROR_IO_EINTR,
       format("[EINTR:%d] [%s]", EINTR, strerror(EINTR))},
      {[] { return errno = ENOENT, sds_ipc_check_stderr(9); }, 9,
       format("[errno:%d] [%s]", ENOENT, strerror(ENOENT))},
  };
  for (const auto& c : cases) {
    log.clear();
    EXPECT_EQ(c.call(), c.result) << c.message;
    EXPECT_TRUE(log.contains(c.message)) << c.message;
  }
  EXPECT_FALSE(readable_now(pair.peer.get()));
  ASSERT_EQ(fcntl(s, F_SETFL, O_NONBLOCK), 0);  // a read that would block is tried three times
  EXPECT_EQ(sds_ipc_recv(s, buffer, sizeof buffer, "probe"), -1);
  EXPECT_EQ(log.count(format("[IPC.Read] probe exception sock:%d", s)), 3);
  pair.peer.reset();  // a string read at the end of the stream
  EXPECT_EQ(sds_ipc_read_string(s), nullptr);
  EXPECT_TRUE(log.contains(format("[ERROR] read length:0 sock:%d", s)));
}

// Every item of a reply to a gone peer was tried and logged, and the handler
// answered success, so that the connection went on to fail again.
TEST(ServingReplies, ReplyToAGonePeerWasTriedAndLoggedItemByItem) {
  DbSession db;
  (void)shm_unlink(SDS_SHM_NAME);
  ASSERT_EQ(sds_alloc_shm(), 1);
  ASSERT_TRUE(db.exec("INSERT INTO site_deck(id, url, title, touch_icon_exists, icon_size, "
                      "icon_data) VALUES (1, 'https://a.example/', 'A', 1, '1x1', x'10203040')"));
  const std::function<int(int)> handlers[] = {
      [](int sock) { return _sds_get_string(sock, 1, "url"); },
      [](int sock) { return _sds_get_int(sock, 1, "touch_icon_exists"); },
      [](int sock) { return _sds_get_blob(sock, 1); },
      [](int sock) { return _sds_get_next_update_duration(sock); },
  };
  for (const auto& handle : handlers) {
    SocketPair pair;
    pair.peer.reset();
    LogCapture log;
    EXPECT_EQ(handle(pair.service.get()), SDS_ERROR_IO_ERROR);
    ASSERT_EQ(log.lines().size(), 1u);
    EXPECT_EQ(log.lines()[0].message,
              format("[IPC.Write] exception sock:%d [%s]", pair.service.get(), strerror(EPIPE)));
  }
  sds_shm_drop_kept_mapping();
  (void)shm_unlink(SDS_SHM_NAME);
}

// Unknown commands: no reply, the connection goes on; no header: answered 5,
// or ended when even that fails.
TEST(DispatcherTest, IgnoresUnknownCommandsAndAnswersAMissingHeaderWithFive) {
  TempRoot root;  // the dispatcher opens the item database first
  LogCapture log;
  SocketPair pair;
  sds_client slot;
  slot.client_id = 5;
  slot.sock = pair.service.get();
  for (int32_t cmd : {12, 1000, -1, INT_MIN}) {
    sds_command unknown{cmd, 5, 0};
    EXPECT_EQ(sds_handle_requests(&slot, &unknown), SDS_ERROR_NONE) << cmd;
  }
  EXPECT_FALSE(readable_now(pair.peer.get()));
  EXPECT_EQ(sds_handle_requests(&slot, nullptr), SDS_ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(log.contains("[ERROR] NULL Command"));
  EXPECT_EQ(read_bytes(pair.peer.get(), 4), words({SDS_ERROR_INVALID_PARAMETER}));
  EXPECT_FALSE(readable_now(pair.peer.get()));
  pair.peer.reset();
  EXPECT_EQ(sds_handle_requests(&slot, nullptr), SDS_ERROR_IO_ERROR);
}

// A quit issued before the main thread enters the loop used to be lost, which
// left the process running with nothing to end it.
TEST(WorkerTest, WorkerEndingBeforeTheLoopRunsStillEndsTheLoop) {
  TempRoot root;  // the worker opens the item database first
  LogCapture log;
  sds_main_loop = g_main_loop_new(nullptr, FALSE);
  SocketPair pair;
  sds_client slot;
  slot.sock = pair.service.get();
  pair.peer.reset();
  pthread_t worker{};
  ASSERT_EQ(pthread_create(&worker, nullptr, sds_client_thread_idle, &slot), 0);
  ASSERT_EQ(pthread_join(worker, nullptr), 0);
  EXPECT_TRUE(log.contains(format("disconnect client:-1 sock:%d", slot.sock)));
  bool fired = false;  // the loop runs until the worker's quit ends it, or this guard
  const auto fire = [](gpointer f) -> gboolean {
    *static_cast<bool*>(f) = true;
    g_main_loop_quit(sds_main_loop);
    return G_SOURCE_REMOVE;
  };
  guint guard = g_timeout_add_seconds(10, fire, &fired);
  g_main_loop_run(sds_main_loop);
  EXPECT_FALSE(fired);
  if (!fired) g_source_remove(guard);
  g_main_loop_unref(sds_main_loop);
  sds_main_loop = nullptr;
}

// The client library against a scripted peer, its replies queued before the call.
class ClientTest : public ::testing::Test {
 protected:
  void SetUp() override { open(); }
  void open() {
    connection_.close();
    pair_ = SocketPair();
    SdsConnectionAccess::adopt(connection_, pair_.service.release(), 77);
  }
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

// Counts initialize's waits and, at tick `release`, queues `result`.
struct Ticks {
  int count = 0, release = 0, peer = -1;
  int32_t result = 0;
  bool keep_waiting = true;
};

bool tick(void* user) {
  auto* t = static_cast<Ticks*>(user);
  if (++t->count == t->release) (void)write_int(t->peer, t->result);
  return t->keep_waiting;
}

// Position, then flag 0 and the version or flag 6 alone; an overlong version
// is refused unsent; a first status not 0 ends the call; giving up closes.
TEST_F(ClientTest, InitializeSendsPositionThenVersionAndWaitsOutTheResult) {
  const double position[2] = {-90, 180};
  const std::string header = words({SDS_CMD_INITIALIZE, 77, 0}) +
                             std::string(reinterpret_cast<const char*>(position), sizeof position);
  const std::string overlong(4097, 'v');
  struct Case {
    const char* name;
    std::string replies;
    const char* version;
    Ticks ticks;
    int status;
    std::string sent;
    bool open_after;
  } cases[] = {
      {"version, result after two ticks", words({0, 0}), "1.2.3", {0, 2, -1, 17}, 17,
       header + words({0, 5}) + "1.2.3", true},
      {"no version", words({0, 0, 0}), nullptr, {}, 0, header + words({6}), true},
      {"empty version", words({0, 0, 0}), "", {}, 0, header + words({6}), true},
      {"status 15 first", words({15}), "9", {}, 15, header.substr(0, 12), true},
      {"gave up waiting", words({0, 0}), nullptr, {0, 0, -1, 0, false}, SDS_ERROR_IO_EINTR,
       header + words({6}), false},
      {"overlong version", "", overlong.c_str(), {}, SDS_ERROR_INVALID_PARAMETER, "", true},
  };
  for (auto c : cases) {
    SCOPED_TRACE(c.name);
    open();
    ASSERT_TRUE(write_all(pair_.peer.get(), c.replies.data(), c.replies.size()));
    c.ticks.peer = pair_.peer.get();
    EXPECT_EQ(sds_client_initialize(connection_, -90, 180, c.version, tick, &c.ticks, 1), c.status);
    EXPECT_EQ(c.ticks.count, c.ticks.release + (c.ticks.keep_waiting ? 0 : 1));
    EXPECT_EQ(connection_.is_open(), c.open_after);
    EXPECT_EQ(sent(), c.sent);
  }
}

// An icon reply that describes no fitting image is read whole and refused; an
// id count out of bounds, status 15 (the flag left unread) or a reply cut
// short leave a stream that can't be trusted: the connection is closed.
TEST_F(ClientTest, RepliesThatDoNotFitAreRefusedBeforeAnyAllocation) {
  struct Case {
    const char* name;
    std::string reply;
    int32_t cmd;
    int status;
  } cases[] = {
      {"icon larger than the object", words({0, 1024 * 769 * 4, 1024, 769}), SDS_CMD_GET_ICON, 5},
      {"not four bytes per pixel", words({0, 27, 3, 3}), SDS_CMD_GET_ICON, 5},
      {"negative byte count", words({0, -16, -2, 2}), SDS_CMD_GET_ICON, 5},
      {"id count over the maximum", words({0, SDS_CLIENT_MAX_IDS + 1}), SDS_CMD_GET_FULL_IDS, 5},
      {"negative id count", words({0, -1}), SDS_CMD_GET_FULL_IDS, 5},
      {"status 15", words({SDS_ERROR_DB_OPEN_FAILED}), SDS_CMD_GET_FULL_IDS, 15},
      {"a ten-byte string, three sent", words({0, 10}) + "abc", SDS_CMD_GET_TITLE, 1},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    open();
    ASSERT_TRUE(write_all(pair_.peer.get(), c.reply.data(), c.reply.size()));
    ASSERT_EQ(shutdown(pair_.peer.get(), SHUT_WR), 0);  // nothing more comes
    sds_client_icon icon;
    sds_client_ids ids;
    SdsClientText title;
    EXPECT_EQ(c.cmd == SDS_CMD_GET_ICON       ? sds_client_get_icon(connection_, 3, &icon)
              : c.cmd == SDS_CMD_GET_FULL_IDS ? sds_client_get_full_ids(connection_, &ids)
                                              : sds_client_get_title(connection_, 3, &title),
              c.status);
    EXPECT_TRUE(!icon.pixels && icon.byte_count == 0 && !ids.ids && !title);
    EXPECT_EQ(connection_.is_open(), c.cmd == SDS_CMD_GET_ICON);  // an icon reply was read whole
    EXPECT_EQ(sent(),
              c.cmd == SDS_CMD_GET_FULL_IDS ? words({c.cmd, 77, 0, 6}) : words({c.cmd, 77, 3}));
  }
  int32_t seconds = 0;
  EXPECT_EQ(sds_client_get_next_update_duration(connection_, &seconds), SDS_ERROR_IO_ERROR);
}

// The path follows the root rule; why a call failed goes only to the log callback.
TEST_F(ClientTest, SocketPathFollowsTheRootAndFailuresGoOnlyToTheLogCallback) {
  EXPECT_EQ(sds_client_socket_path(), root_.dir() + SDS_CLIENT_SOCKET_PATH);
  std::vector<std::string> lines;
  sds_client_set_log(
      [](void* user, const char* line) { static_cast<decltype(lines)*>(user)->push_back(line); },
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
