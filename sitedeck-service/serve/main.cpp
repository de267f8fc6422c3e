// The process entry of the service, the only part that knows it is a daemon.
// It takes over the listening socket that socket activation passes in (it
// never binds one of its own), installs the signal handling, lets the
// acceptor take exactly one connection and start its worker, and parks in an
// empty main loop until the worker ends it. One process serves one connection.
#include <glib.h>
#include <pthread.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

#include "serve/sitedeck-service-activation.h"
#include "sitedeck-service-log.h"
#include "serve/sitedeck-service-main.h"
#include "sitedeck-service-paths.h"

#if defined(__SANITIZE_ADDRESS__)
#define SDS_UNDER_LSAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define SDS_UNDER_LSAN 1
#endif
#endif

#ifdef SDS_UNDER_LSAN
// The TLS library keeps per-thread state for the worker, which runs the
// transfers of a pull; it is freed when the detached worker has finished,
// and the process may already be exiting by then. That is no leak.
extern "C" const char* __lsan_default_suppressions() { return "leak:CRYPTO_zalloc\n"; }
#endif

namespace {

// Read by the SIGTERM handler; null until the context exists and again once
// it is being released.
std::atomic<sds_server_context*> g_context{nullptr};

// Returns the first passed descriptor the activation check does not reject.
// A result of 0 (a socket, but not listening at our path) is accepted too:
// the activation unit decides what it hands over.
int __sds_accept_socket(void) {
  int count = sds_listen_fds(1);
  std::string path = sds_path(SDS_SOCKET_PATH);
  for (int fd = SDS_LISTEN_FDS_START; count > 0 && fd < SDS_LISTEN_FDS_START + count; ++fd) {
    if (sds_is_socket_unix(fd, SOCK_STREAM, 1, path.c_str()) >= 0) {
      SDS_LOGI("listen systemd socket:%d", fd);
      return fd;
    }
  }
  return -1;
}

// Closing the listening socket makes a pending accept fail; SIGUSR1 keeps its
// default action, so signalling the worker ends the whole process at once.
// Uses only async-signal-safe calls.
void __sds_stop(sds_server_context* context) {
  if (context->listen_sock >= 0) {
    (void)close(context->listen_sock);
    context->listen_sock = -1;
  }
  if (context->client.thread != 0) (void)pthread_kill(context->client.thread, SIGUSR1);
}

void sds_sigterm_handler(int /*signal_number*/) {
  sds_server_context* context = g_context.load();
  // Before the context exists there is no connection and nothing to stop.
  if (context == nullptr) _exit(255);
  __sds_stop(context);
}

}  // namespace

int main(int argc, char** argv) {
  // The only arguments: what a person trying the binary by hand asks.
  if (argc == 2 && std::strcmp(argv[1], "--version") == 0) {
    std::printf("browser-sitedeck-service %s\n", SITEDECK_VERSION);
    return 0;
  }
  if (argc == 2 && std::strcmp(argv[1], "--help") == 0) {
    std::printf(
        "usage: browser-sitedeck-service [--help | --version]\n"
        "The site deck service of the browser. Not for starting by hand: it is\n"
        "started by its socket unit (browser-sitedeck-service.socket) for each\n"
        "connection to %s,\n"
        "which hands it the listening socket; it serves that one connection and\n"
        "exits. Without systemd, sitedeck-activator does the same. Talk to it\n"
        "with the `sitedeck` tool.\n",
        SDS_SOCKET_PATH);
    return 0;
  }
  // The GLib type system initialises itself; nothing to call before the loop.
  sds_main_loop = g_main_loop_new(nullptr, FALSE);
  if (sds_main_loop == nullptr) {
    SDS_LOGE("Failed to create g main loop handle");
    return 0;
  }

  int listen_sock = __sds_accept_socket();
  if (listen_sock < 0) {
    SDS_LOGE("[CRITICAL]  Failed to get the socket");
    std::exit(1);
  }

  if (std::signal(SIGTERM, sds_sigterm_handler) == SIG_ERR ||
      std::signal(SIGPIPE, SIG_IGN) == SIG_ERR) {
    SDS_LOGE("failed to register signal callback");
  }
  // A file that reaches the size limit (a full quota) must fail its write
  // with EFBIG, which every writer handles, rather than end the process.
  (void)std::signal(SIGXFSZ, SIG_IGN);

  auto* context = new (std::nothrow) sds_server_context{};
  if (context == nullptr) {
    // Without a context no connection can be taken, and a loop without a
    // worker would never end.
    SDS_LOGE("[CRITICAL] Failed to allocate the service context");
    (void)close(listen_sock);
    g_main_loop_unref(sds_main_loop);
    return -1;
  }
  context->listen_sock = listen_sock;
  g_context.store(context);

  int result = 0;
  if (sds_main_thread(context) != 0) {
    g_context.store(nullptr);
    __sds_stop(context);
    // A worker that was started (the handshake write failed) may use its
    // slot in the context, the main loop and the process's other state until
    // SIGUSR1 ends the process: nothing is released or destroyed under it,
    // exit handlers included. Same status as the return below.
    if (context->client.thread != 0) _exit(255);
    result = -1;
  } else {
    g_main_loop_run(sds_main_loop);
    // From here on a SIGTERM simply ends the process: the context goes away.
    (void)std::signal(SIGTERM, SIG_DFL);
    g_context.store(nullptr);
  }
  delete context;
  g_main_loop_unref(sds_main_loop);
  return result;
}
