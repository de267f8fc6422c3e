#include "support/stand_in_servers.h"

#include <curl/curl.h>
#include <fcntl.h>
#include <glib.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>

#include "support/run_process.h"

extern char** environ;

namespace {

constexpr int kStartTimeoutMs = 10000;
constexpr int kStopTimeoutMs = 10000;
constexpr size_t kMaxAnnouncement = 256;

struct CurlCleanup {
  void operator()(CURL* c) const noexcept { curl_easy_cleanup(c); }
};

// One GET of a control route; never follows redirects.
struct HttpAnswer {
  long status = 0;
  std::string body;
};

struct Collector {
  std::string* text;
  size_t limit;
};

size_t collect(char* data, size_t size, size_t count, void* user) {
  auto* c = static_cast<Collector*>(user);
  const size_t bytes = size * count;
  if (c->text->size() + bytes > c->limit) return 0;
  c->text->append(data, bytes);
  return bytes;
}

// Everything but the unreserved characters escaped, as a query value needs.
std::string percent_encode(const std::string& text) {
  gchar* escaped = g_uri_escape_string(text.c_str(), nullptr, FALSE);
  std::string out = escaped;
  g_free(escaped);
  return out;
}

// Reads the server's first stdout line within the start-up bound.
std::string read_announcement(int fd) {
  std::string line;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(kStartTimeoutMs);
  while (line.find('\n') == std::string::npos && line.size() < kMaxAnnouncement) {
    const int left = ms_left(deadline);
    if (left == 0) break;
    pollfd p{fd, POLLIN, 0};
    const int ready = poll(&p, 1, left);
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) break;
    char buffer[64];
    const ssize_t n = read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    line.append(buffer, static_cast<size_t>(n));
  }
  return line;
}

// Waits for `pid` to exit within `ms` through a pidfd; false on time-out.
bool wait_exit(pid_t pid, int ms) {
  const int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (pidfd < 0) return false;
  pollfd p{pidfd, POLLIN, 0};
  int ready = 0;
  do {
    ready = poll(&p, 1, ms);
  } while (ready < 0 && errno == EINTR);
  close(pidfd);
  return ready > 0;
}

HttpAnswer http_get(const std::string& url) {
  HttpAnswer answer;
  std::unique_ptr<CURL, CurlCleanup> curl(curl_easy_init());
  if (!curl) return answer;
  Collector body{&answer.body, 1024 * 1024};
  CURL* c = curl.get();
  curl_easy_setopt(c, CURLOPT_URL, url.c_str());
  curl_easy_setopt(c, CURLOPT_PROXY, "");
  curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(c, CURLOPT_TIMEOUT_MS, 10000L);
  curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, collect);
  curl_easy_setopt(c, CURLOPT_WRITEDATA, &body);
  if (curl_easy_perform(c) == CURLE_OK) curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &answer.status);
  return answer;
}

void stop_and_reap(pid_t pid) {
  if (pid <= 0) return;
  kill(pid, SIGTERM);
  if (!wait_exit(pid, kStopTimeoutMs)) kill(pid, SIGKILL);
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
}

}  // namespace


std::string stand_in_signature(const std::string& query, const std::string& key) {
  const std::string text = query + key;
  gchar* digest =
      g_compute_checksum_for_string(G_CHECKSUM_MD5, text.data(), static_cast<gssize>(text.size()));
  std::string hex = digest != nullptr ? digest : "";
  g_free(digest);
  return hex;
}

StandInProcess::StandInProcess(const char* binary, const std::vector<std::string>& args) {
  const std::string path = std::string(SITEDECK_BIN_DIR) + "/" + binary;
  std::vector<std::string> words = {path, "--port", "0"};
  const char* verbose = std::getenv("SITEDECK_STAND_IN_VERBOSE");
  if (verbose == nullptr || *verbose == '\0') words.emplace_back("--quiet");
  words.insert(words.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& w : words) argv.push_back(w.data());
  argv.push_back(nullptr);

  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
  pid_t pid = -1;
  const int spawned = posix_spawn(&pid, path.c_str(), &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  close(fds[1]);
  if (spawned != 0) {
    close(fds[0]);
    return;
  }
  pid_ = pid;
  const std::string line = read_announcement(fds[0]);
  close(fds[0]);
  int port = 0;
  if (std::sscanf(line.c_str(), "listening on 127.0.0.1:%d", &port) == 1 && port > 0) {
    port_ = port;
  } else {
    std::fprintf(stderr, "%s did not announce its port (got \"%s\")\n", binary, line.c_str());
  }
}

StandInProcess::~StandInProcess() { stop_and_reap(pid_); }

std::string StandInProcess::root_url() const { return "http://127.0.0.1:" + std::to_string(port_); }

bool StandInProcess::control(
    const std::vector<std::pair<std::string, std::string>>& settings) const {
  std::string query;
  for (const auto& [key, value] : settings) {
    // Appended piece by piece: g++ 12 at -O3 misreads the one-expression form
    // as an overlapping copy (-Wrestrict).
    if (!query.empty()) query += '&';
    query += percent_encode(key);
    query += '=';
    query += percent_encode(value);
  }
  const HttpAnswer answer = http_get(root_url() + "/_control/set?" + query);
  if (answer.status != 200) std::fprintf(stderr, "control refused: %s", answer.body.c_str());
  return answer.status == 200;
}

bool StandInProcess::reset() const {
  return http_get(root_url() + "/_control/reset").status == 200;
}

bool StandInProcess::release() const {
  return http_get(root_url() + "/_control/release").status == 200;
}

std::map<std::string, std::string> StandInProcess::stats() const {
  std::map<std::string, std::string> values;
  const HttpAnswer answer = http_get(root_url() + "/_control/stats");
  if (answer.status != 200) return values;
  size_t start = 0;
  while (start < answer.body.size()) {
    size_t end = answer.body.find('\n', start);
    if (end == std::string::npos) end = answer.body.size();
    const std::string line = answer.body.substr(start, end - start);
    const size_t colon = line.find(": ");
    if (colon != std::string::npos) values[line.substr(0, colon)] = line.substr(colon + 2);
    start = end + 1;
  }
  return values;
}

ContentServerProcess::ContentServerProcess(const std::vector<std::string>& args)
    : StandInProcess("sitedeck-content-server", args) {}

std::string ContentServerProcess::base_url() const {
  return root_url() + "/SiteDeck/getSubRegionalItems";
}

std::string ContentServerProcess::signed_url(const std::string& query) const {
  return base_url() + "?" + query + "&hash=" + stand_in_signature(query);
}

std::string ContentServerProcess::icon_url(const std::string& file) const {
  return root_url() + "/icons/" + file;
}

GeocoderProcess::GeocoderProcess(const std::vector<std::string>& args)
    : StandInProcess("sitedeck-geocoder", args) {}


