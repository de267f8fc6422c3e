// The acceptor and the worker of the process's one connection. The acceptor
// runs on the main thread: it takes the connection, issues the client id,
// creates the shared-memory object, starts the worker and sends the handshake.
// The worker serves one request at a time until the connection ends and then
// ends the main loop, which ends the process. Neither closes the connection
// nor frees anything on the way out: the process exit does that. Between
// requests the worker waits for the client as long as it takes (that is how
// the browser holds its session); within one, the rest of a request and the
// reading of a reply are bounded (docs/hardening.md).
#include "serve/sitedeck-service-main.h"

#include <glib.h>
#include <poll.h>
#include <pthread.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "database/sitedeck-service-db-interface.h"
#include "kdb.h"
#include "serve/sitedeck-service-default-deck-start.h"
#include "serve/sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"
#include "serve/sitedeck-service-request-handler.h"
#include "serve/sitedeck-service-shm.h"

GMainLoop* sds_main_loop = nullptr;

namespace {

// The last id handed out; only the acceptor writes it.
int32_t g_last_client_id = 0;

// Once a request's header has arrived, the rest of it must follow within this
// time; a reply must find the client reading within this time. Long enough
// for a slow device under load, short enough that a stuck client does not
// keep a process (and the database) for long. Read per connection.
constexpr int kDefaultRequestTimeoutMs = 10000;
constexpr int kDefaultReplyTimeoutMs = 30000;
constexpr int kMaxTimeoutMs = 600000;
constexpr const char* kRequestTimeoutKey = "db/browser/sitedeck/request_timeout_ms";
constexpr const char* kReplyTimeoutKey = "db/browser/sitedeck/reply_timeout_ms";

// Written by the acceptor before the worker starts, read by the worker.
int g_request_timeout_ms = kDefaultRequestTimeoutMs;
int g_reply_timeout_ms = kDefaultReplyTimeoutMs;

// A time-out key's value in milliseconds: a whole decimal number from 1 to
// kMaxTimeoutMs, else `fallback` (logged when the key is there but unusable).
int __sds_timeout_setting(const char* key, int fallback) {
  std::string value;
  if (!kdb_read(key, &value)) return fallback;
  char* end = nullptr;
  errno = 0;
  long ms = std::strtol(value.c_str(), &end, 10);
  if (errno != 0 || end == value.c_str() || *end != '\0' || ms < 1 || ms > kMaxTimeoutMs) {
    SDS_LOGE("[ERROR] %s: not a time-out of 1 to %d ms, %d ms used", key, kMaxTimeoutMs, fallback);
    return fallback;
  }
  return static_cast<int>(ms);
}

gboolean __sds_quit_loop(gpointer loop) {
  g_main_loop_quit(static_cast<GMainLoop*>(loop));
  return G_SOURCE_REMOVE;
}

// Running a loop resets its quit state, so a plain quit issued before the
// main thread has entered the loop would be lost and nothing would end the
// process. A source on the loop's context waits until the loop runs.
void __sds_end_main_loop(void) {
  GMainLoop* loop = sds_main_loop;
  if (loop == nullptr) return;
  GSource* source = g_idle_source_new();
  g_source_set_callback(source, __sds_quit_loop, g_main_loop_ref(loop),
                        reinterpret_cast<GDestroyNotify>(g_main_loop_unref));
  (void)g_source_attach(source, g_main_loop_get_context(loop));
  g_source_unref(source);
}

// select() without its FD_SETSIZE limit: readable covers data, end of stream
// and errors, as select reports them; exceptional is out-of-band data.
int __sds_wait_for_socket(int sock, bool* readable, bool* exceptional) {
  struct pollfd entry = {sock, POLLIN | POLLPRI, 0};
  int result = poll(&entry, 1, -1);
  if (result < 0) return -1;
  *readable = (entry.revents & (POLLIN | POLLHUP | POLLERR | POLLNVAL)) != 0;
  *exceptional = (entry.revents & POLLPRI) != 0;
  return 0;
}

}  // namespace

int32_t sds_client_id_from_time(int32_t seconds, int32_t microseconds) {
  int32_t u = microseconds;
  int32_t digits = 1;
  for (int32_t rest = u / 10; rest > 0; rest /= 10) ++digits;
  if (u == 0) u = seconds & 0xFFF;
  int32_t factor = 10;
  for (int32_t i = 3; i < digits; ++i) factor *= 10;
  // Unsigned arithmetic gives the wrap-around the ids are defined with.
  uint32_t id = static_cast<uint32_t>(seconds) + static_cast<uint32_t>(u) * 400u +
                static_cast<uint32_t>(u >> (digits - 1)) * static_cast<uint32_t>(factor) +
                ((static_cast<uint32_t>(u % 10) + static_cast<uint32_t>(u)) & 0xFFFu);
  auto result = static_cast<int32_t>(id);
  // The header check refuses a cid of 0 or below, so such an id would lock
  // its client out; large microsecond values make the sum wrap negative.
  if (result <= 0) {
    result &= 0x7fffffff;
    if (result == 0) result = 1;
  }
  return result;
}

int sds_generate_client_id(void) {
  int32_t id = 0;
  do {
    struct timeval now {};
    (void)gettimeofday(&now, nullptr);
    id = sds_client_id_from_time(static_cast<int32_t>(now.tv_sec),
                                 static_cast<int32_t>(now.tv_usec));
  } while (id == g_last_client_id);
  g_last_client_id = id;
  return id;
}

int sds_main_thread(sds_server_context* context) {
  if (context == nullptr) {
    SDS_LOGE("[CRITICAL] Invalid Address");
    return -1;
  }
  if (context->listen_sock < 0) {
    SDS_LOGE("[CRITICAL] Invalid File Discriptor");
    return -1;
  }
  struct sockaddr_un peer {};
  socklen_t peer_length = sizeof peer;
  int sock = accept(context->listen_sock, reinterpret_cast<struct sockaddr*>(&peer), &peer_length);
  if (sock < 0) {
    SDS_LOGE("[CRITICAL] accept Sitedeck service was crashed ?");
    return -1;
  }
  g_request_timeout_ms = __sds_timeout_setting(kRequestTimeoutKey, kDefaultRequestTimeoutMs);
  g_reply_timeout_ms = __sds_timeout_setting(kReplyTimeoutKey, kDefaultReplyTimeoutMs);
  // No receive time-out: the worker waits for the client as long as it takes
  // (a request's own bound is kept by the reads). A write that finds no room
  // for the reply time-out fails with EAGAIN, which ends the connection.
  struct timeval no_timeout {};
  struct timeval reply_timeout {};
  reply_timeout.tv_sec = g_reply_timeout_ms / 1000;
  reply_timeout.tv_usec = (g_reply_timeout_ms % 1000) * 1000;
  if (setsockopt(sock, SOL_SOCKET, SO_RCVTIMEO, &no_timeout, sizeof no_timeout) != 0 ||
      setsockopt(sock, SOL_SOCKET, SO_SNDTIMEO, &reply_timeout, sizeof reply_timeout) != 0) {
    SDS_LOGE("[CRITICAL] setsockopt SO_SNDTIMEO [%s]", strerror(errno));
    (void)close(sock);
    return -1;
  }
  sds_client* client = &context->client;
  int32_t id = sds_generate_client_id();
  client->client_id = id;
  client->sock = sock;

  if (sds_alloc_shm() == 0) {
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_SHM_FAILED);
    SDS_LOGE("[CRITICAL] Failed to alloc shared memory");
    return -1;
  }
  if (pthread_create(&client->thread, nullptr, sds_client_thread_idle, client) != 0) {
    client->thread = 0;
    SDS_LOGE("[ERROR][main_thread] create\n");
    (void)sds_ipc_send_errorcode(sock, SDS_ERROR_OUT_OF_MEMORY);
    return -1;
  }
  (void)pthread_detach(client->thread);

  // The worker only reads from here on, so writing the handshake is safe.
  // Status and id go out in one write, which wakes the client once.
  const int32_t status = SDS_ERROR_NONE;
  const struct iovec handshake[] = {{const_cast<int32_t*>(&status), sizeof status},
                                    {&id, sizeof id}};
  if (sds_ipc_send_reply(sock, handshake, 2) != 0) return -1;
  SDS_LOGW("sds_main_thread end");
  return 0;
}

void* sds_client_thread_idle(void* arg) {
  auto* slot = static_cast<sds_client*>(arg);
  if (slot == nullptr) {
    SDS_LOGE("slot null, can not launch the thread for client");
    __sds_end_main_loop();
    return nullptr;
  }
  (void)pthread_setcanceltype(PTHREAD_CANCEL_DEFERRED, nullptr);
  if (sds_ensure_db_open() == SDS_ERROR_NONE) {
    // Before the first request is read, so that it already sees the deck.
    sds_default_deck_load_if_created();
    while (slot->sock >= 0 && slot->client_id >= 0) {
      bool readable = false;
      bool exceptional = false;
      if (__sds_wait_for_socket(slot->sock, &readable, &exceptional) != 0) {
        SDS_LOGE("select");
        break;
      }
      if (readable) {
        (void)pthread_mutex_lock(&slot->lock);
        int previous_state = 0;
        (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &previous_state);
        int result = __sds_handle_client_request(slot);
        (void)pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, &previous_state);
        (void)pthread_mutex_unlock(&slot->lock);
        if (result == SDS_ERROR_IO_ERROR || result == SDS_ERROR_OUT_OF_MEMORY) {
          SDS_LOGE("disconnect client:%d sock:%d", slot->client_id, slot->sock);
          break;
        }
      }
      if (exceptional) {
        SDS_LOGE("[EXCEPTION]");
        break;
      }
    }
  }
  __sds_end_main_loop();
  return nullptr;
}

int __sds_handle_client_request(sds_client* slot) {
  if (slot == nullptr) return SDS_ERROR_IO_ERROR;
  sds_command command{};
  // One read: a header that arrives in pieces is not completed, its missing
  // fields stay 0 and fail the check below.
  if (sds_ipc_recv(slot->sock, &command, sizeof command, "__sds_handle_client_request") <= 0) {
    slot->client_id = -1;
    return SDS_ERROR_IO_ERROR;
  }
  if (command.cmd == 0 || command.cid <= 0) {
    SDS_LOGE("[Closed Peer] sock:%d cmd %d cid %d ", slot->sock, command.cmd, command.cid);
    slot->client_id = -1;
    return SDS_ERROR_IO_ERROR;
  }
  sds_ipc_request_begin(slot->sock, g_request_timeout_ms);
  int result = sds_handle_requests(slot, &command);
  int failure = sds_ipc_request_end(slot->sock);
  if (failure == 0) return result;
  // The request stopped half-way, or its reply could not be written: what
  // follows on the connection would be out of step.
  if (failure == ETIMEDOUT) {
    SDS_LOGE("[ERROR] cmd %d not complete within %d ms sock:%d", command.cmd, g_request_timeout_ms,
             slot->sock);
  } else if (failure == EAGAIN) {
    SDS_LOGE("[ERROR] reply to cmd %d not read within %d ms sock:%d", command.cmd,
             g_reply_timeout_ms, slot->sock);
  }
  return SDS_ERROR_IO_ERROR;
}
