// Fuzz target: bytes a client sends after the handshake, through the real
// request loop and dispatcher against a scratch database of three items. The
// client end shuts down for writing, so every read ends at the end of the
// stream; the service end does not block on writes and replies are drained
// after every request. Two things are redirected: the shared-memory name
// becomes this process's own (never a running service's object), and the
// geocoder and content server get a scheme the transfer library refuses at
// once, so an initialize runs its whole pull offline (ending with 18).
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "database/sitedeck-service-db-interface.h"
#include "fuzz_support.h"
#include "kdb.h"
#include "pull/sitedeck-service-utils.h"
#include "serve/sitedeck-service-main.h"
#include "serve/sitedeck-service-shm.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"

namespace {

// Far more than any request sequence needs to reach every handler; small
// enough that the whole input fits the socket buffer at once.
constexpr size_t kMaxInput = 16 * 1024;
constexpr int kSocketBuffer = 256 * 1024;

std::string g_shm_name;

const char* redirected_shm_name(const char* name) {
  if (name != nullptr && std::strcmp(name, SDS_SHM_NAME) == 0 && !g_shm_name.empty()) {
    return g_shm_name.c_str();
  }
  return name;
}

void remove_own_shm(void) {
  if (!g_shm_name.empty()) (void)shm_unlink(g_shm_name.c_str());
}

void set_up(void) {
  fuzz_open_database();
  g_shm_name = "/sitedeck-fuzz-" + std::to_string(getpid());
  std::atexit(remove_own_shm);
  if (!kdb_write("db/browser/sitedeck/geocoder_url", "nonet://geocoder")) std::abort();
  // Item 1 is whole, with a 2x2 icon; item 2 has no icon; item 3 is
  // specially removed and its icon size text does not match its pixels.
  fuzz_exec(
      "INSERT INTO site_deck(id,url,title,favicon_exists,dominant_color,touch_icon_exists,"
      "is_dirty,icon_size,icon_data,order_index) VALUES"
      " (1,'http://one.example/','One',1,'#102030',1,1,'2x2',"
      "  x'0102030405060708090a0b0c0d0e0f10',1),"
      " (2,'http://two.example/','Two',0,NULL,0,1,NULL,NULL,2),"
      " (3,'http://three.example/','',0,'',1,-1,'4096x4096',x'00',3)");
  // A content server the transfer library refuses at once, so that an
  // initialize builds its signed request from the fuzzed version and
  // position; and a stored place for the seeds' position, with characters
  // the request must escape.
  const char list[] =
      "<values><Server><Id>1</Id><Base-url>nonet://content/SiteDeck/getSubRegionalItems"
      "</Base-url><WaitTime>0</WaitTime><RetryCount>1</RetryCount><FallBack>true</FallBack>"
      "</Server></values>";
  fuzz_write_file(fuzz_path(SDS_SERVER_DATA_XML), reinterpret_cast<const uint8_t*>(list),
                  sizeof list - 1);
  const char place[] =
      "<Location><LatitudeLongitude>37.500000,127.000000</LatitudeLongitude>"
      "<City>Gangnam-gu &amp; &lt;Seoul&gt; ?=#</City><Province>Seoul %2F \xed\x8a\xb9</Province>"
      "</Location>";
  fuzz_write_file(fuzz_path(SDS_LOCATION_INFO_PATH), reinterpret_cast<const uint8_t*>(place),
                  sizeof place - 1);
  const char duration[] = "3600";
  fuzz_write_file(fuzz_path(SDS_NEXT_UPDATE_DURATION_PATH),
                  reinterpret_cast<const uint8_t*>(duration), sizeof duration - 1);
}

void drain(int fd) {
  char buffer[4096];
  while (recv(fd, buffer, sizeof buffer, MSG_DONTWAIT) > 0) {
  }
}

}  // namespace

// Every shm_open and shm_unlink of this program goes through these, the
// service's included; the real calls are the C library's.
extern "C" int shm_open(const char* name, int oflag, mode_t mode) {
  using shm_open_fn = int (*)(const char*, int, mode_t);
  static auto real = reinterpret_cast<shm_open_fn>(dlsym(RTLD_NEXT, "shm_open"));
  if (real == nullptr) std::abort();
  return real(redirected_shm_name(name), oflag, mode);
}

extern "C" int shm_unlink(const char* name) {
  using shm_unlink_fn = int (*)(const char*);
  static auto real = reinterpret_cast<shm_unlink_fn>(dlsym(RTLD_NEXT, "shm_unlink"));
  if (real == nullptr) std::abort();
  return real(redirected_shm_name(name));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  if (g_shm_name.empty()) set_up();
  if (sds_alloc_shm() != 1) std::abort();

  int fds[2] = {-1, -1};
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) std::abort();
  UniqueFd service(fds[0]);
  UniqueFd peer(fds[1]);
  (void)setsockopt(peer.get(), SOL_SOCKET, SO_SNDBUF, &kSocketBuffer, sizeof kSocketBuffer);
  (void)setsockopt(service.get(), SOL_SOCKET, SO_RCVBUF, &kSocketBuffer, sizeof kSocketBuffer);
  if (size > 0 && write(peer.get(), data, size) != static_cast<ssize_t>(size)) std::abort();
  if (shutdown(peer.get(), SHUT_WR) != 0) std::abort();
  // A reply the drain has not caught up with fails its write instead of
  // blocking the fuzzer.
  (void)fcntl(service.get(), F_SETFL, O_NONBLOCK);

  sds_client slot;
  slot.client_id = 1;
  slot.sock = service.get();
  // Every request consumes at least one byte or ends the loop, so the
  // number of rounds is bounded by the input; the bound here is a backstop.
  for (size_t round = 0; round <= size + 1; ++round) {
    int result = __sds_handle_client_request(&slot);
    drain(peer.get());
    if (result == SDS_ERROR_IO_ERROR || result == SDS_ERROR_OUT_OF_MEMORY) break;
    if (slot.client_id < 0) break;
  }
  remove_own_shm();
  return 0;
}
