// Binding, announcing, controlling and stopping a stand-in server; see the header.
#include "stand-in-server.h"

#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <thread>

namespace {

std::mutex g_wait_mutex;
std::condition_variable g_wait_cv;
bool g_shutting_down = false;
unsigned long g_release_epoch = 0;
bool g_listen_done = false;

void begin_shutdown() {
  std::lock_guard<std::mutex> lock(g_wait_mutex);
  g_shutting_down = true;
  g_wait_cv.notify_all();
}

void termination_signals(sigset_t* set) {
  sigemptyset(set);
  sigaddset(set, SIGTERM);
  sigaddset(set, SIGINT);
  sigaddset(set, SIGHUP);
}

bool write_port_file(const std::string& path, int port) {
  // Written under a temporary name and renamed, so a reader never sees half a number.
  const std::string temp = path + ".tmp";
  FILE* f = std::fopen(temp.c_str(), "w");
  if (f == nullptr) return false;
  const bool written = std::fprintf(f, "%d\n", port) > 0;
  const bool closed = std::fclose(f) == 0;
  if (!written || !closed) return false;
  return std::rename(temp.c_str(), path.c_str()) == 0;
}

void answer_text(httplib::Response& res, int status, const std::string& text) {
  res.status = status;
  res.set_content(text, "text/plain");
}

}  // namespace

bool standin_parse_long(const std::string& text, long lo, long hi, long* out) {
  if (text.empty() || text.size() > 20) return false;
  char* end = nullptr;
  errno = 0;
  const long value = std::strtol(text.c_str(), &end, 10);
  if (errno != 0 || end == nullptr || *end != '\0' || value < lo || value > hi) return false;
  *out = value;
  return true;
}

bool standin_parse_args(int argc, char** argv, standin_listen_options* listen,
                        const standin_setter& set) {
  for (int i = 1; i < argc; ++i) {
    std::string name = argv[i];
    if (name.rfind("--", 0) != 0 || name.size() < 3) {
      std::fprintf(stderr, "unexpected argument: %s\n", argv[i]);
      return false;
    }
    name.erase(0, 2);
    for (char& c : name) {
      if (c == '-') c = '_';
    }
    if (name == "quiet") {
      listen->quiet = true;
      continue;
    }
    if (i + 1 >= argc) {
      std::fprintf(stderr, "--%s needs a value\n", name.c_str());
      return false;
    }
    const std::string value = argv[++i];
    if (name == "port") {
      long port = 0;
      if (!standin_parse_long(value, 0, 65535, &port)) {
        std::fprintf(stderr, "bad --port: %s\n", value.c_str());
        return false;
      }
      listen->port = static_cast<int>(port);
    } else if (name == "port_file") {
      listen->port_file = value;
    } else {
      const std::string why = set(name, value);
      if (!why.empty()) {
        std::fprintf(stderr, "--%s: %s\n", name.c_str(), why.c_str());
        return false;
      }
    }
  }
  return true;
}

void standin_add_control_routes(httplib::Server& svr, standin_control control) {
  auto shared = std::make_shared<standin_control>(std::move(control));
  auto set = [shared](const httplib::Request& req, httplib::Response& res) {
    if (req.params.empty()) return answer_text(res, 400, "no setting given\n");
    for (const auto& [key, value] : req.params) {
      const std::string why = shared->set(key, value);
      if (!why.empty()) return answer_text(res, 400, key + ": " + why + "\n");
    }
    answer_text(res, 200, "ok\n");
  };
  auto reset = [shared](const httplib::Request&, httplib::Response& res) {
    shared->reset();
    standin_release_waiters();
    answer_text(res, 200, "ok\n");
  };
  auto release = [](const httplib::Request&, httplib::Response& res) {
    standin_release_waiters();
    answer_text(res, 200, "ok\n");
  };
  auto stats = [shared](const httplib::Request&, httplib::Response& res) {
    answer_text(res, 200, shared->stats());
  };
  svr.Get("/_control/set", set).Post("/_control/set", set);
  svr.Get("/_control/reset", reset).Post("/_control/reset", reset);
  svr.Get("/_control/release", release).Post("/_control/release", release);
  svr.Get("/_control/stats", stats);
}

int standin_bind(httplib::Server& svr, const standin_listen_options& options, const char* tool) {
  // Blocked before any thread exists, so every thread inherits the mask and
  // only the waiter in standin_serve receives them.
  sigset_t set;
  termination_signals(&set);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  signal(SIGPIPE, SIG_IGN);
  // An answer goes out as a header write and a body write; with Nagle's
  // algorithm the body waits for the client's delayed ACK of the header
  // (tens of ms) on every request after the first of a kept-alive connection.
  svr.set_tcp_nodelay(true);
  // A kept-alive connection carries up to this many requests (as a web
  // server's default would), not the library's default of five.
  svr.set_keep_alive_max_count(1000);

  if (options.port == 0) {
    const int port = svr.bind_to_any_port("127.0.0.1");
    if (port > 0) return port;
  } else if (svr.bind_to_port("127.0.0.1", options.port)) {
    return options.port;
  }
  std::fprintf(stderr, "%s: cannot bind 127.0.0.1:%d\n", tool, options.port);
  return -1;
}

int standin_serve(httplib::Server& svr, int port, const standin_listen_options& options,
                  const char* tool) {
  if (!options.quiet) {
    svr.set_logger([tool](const httplib::Request& req, const httplib::Response& res) {
      std::fprintf(stderr, "%s: %s %s -> %d\n", tool, req.method.c_str(), req.target.c_str(),
                   res.status);
    });
  }
  if (!options.port_file.empty() && !write_port_file(options.port_file, port)) {
    std::fprintf(stderr, "%s: cannot write port file %s\n", tool, options.port_file.c_str());
    return 1;
  }
  std::printf("listening on 127.0.0.1:%d\n", port);
  std::fflush(stdout);

  std::thread([&svr] {
    sigset_t set;
    termination_signals(&set);
    int received = 0;
    while (sigwait(&set, &received) != 0) {
    }
    begin_shutdown();
    // stop() does nothing until listening has begun, so it is repeated until
    // the listener is done (a signal may arrive right after the announcement).
    std::unique_lock<std::mutex> lock(g_wait_mutex);
    for (int i = 0; i < 500 && !g_listen_done; ++i) {
      lock.unlock();
      svr.stop();
      lock.lock();
      g_wait_cv.wait_for(lock, std::chrono::milliseconds(20), [] { return g_listen_done; });
    }
  }).detach();

  const bool ok = svr.listen_after_bind();
  {
    std::lock_guard<std::mutex> lock(g_wait_mutex);
    g_listen_done = true;
    g_shutting_down = true;
    g_wait_cv.notify_all();
  }
  return ok ? 0 : 1;
}

bool standin_wait_ms(long ms) {
  std::unique_lock<std::mutex> lock(g_wait_mutex);
  const unsigned long epoch = g_release_epoch;
  const bool woken = g_wait_cv.wait_for(lock, std::chrono::milliseconds(ms), [epoch] {
    return g_shutting_down || g_release_epoch != epoch;
  });
  return !woken;
}

void standin_release_waiters() {
  std::lock_guard<std::mutex> lock(g_wait_mutex);
  ++g_release_epoch;
  g_wait_cv.notify_all();
}

std::string standin_raw_query(const httplib::Request& req) {
  const size_t mark = req.target.find('?');
  return mark == std::string::npos ? std::string() : req.target.substr(mark + 1);
}
