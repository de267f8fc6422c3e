// The data-pull job: resolve city and province, then try the configured
// content servers in order, each as often as its entry allows, until one
// answer ends the pull. Follows redirects (a bounded number per pull), waits
// between failures, and keeps to the pull's deadline. A server's permanent
// move (301) is followed at once but written to the server list only once the
// new address has answered (200 or 304): a move to a host that never answers
// must not cut the device off for good. Every failed attempt is logged with
// what a person needs to act on it, and the pull's end is recorded in the
// last-pull file.
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>
#include <thread>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt-cache.h"
#include "pull/sitedeck-service-file-read.h"
#include "pull/sitedeck-service-file-write.h"
#include "database/sitedeck-service-error.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"

namespace {

// A server that redirects more often than this within one pull is not
// going anywhere; its further redirects count as failed attempts.
constexpr int kMaxRedirectsPerPull = 5;
// The last-pull file is a few short lines.
constexpr long kMaxLastPullBytes = 4096;

bool valid_position(const sds_server_req_args* args) {
  // Comparisons with NaN are false, so a value that is not a number fails.
  return args->latitude >= -90.0 && args->latitude <= 90.0 && args->longitude >= -180.0 &&
         args->longitude <= 180.0;
}

void wait_before_retry(int wait_time_ms, int attempts_left) {
  SDS_LOGE("Server Request Failed so waiting (%d) milliseconds before next reqest", wait_time_ms);
  SDS_LOGE("Remaining retries = %d", attempts_left);
  if (wait_time_ms < 1000) return;
  // Whole seconds, as ever, but never past the pull's deadline.
  const long long wait_ms = static_cast<long long>(wait_time_ms / 1000) * 1000;
  std::this_thread::sleep_for(std::chrono::milliseconds(std::min(wait_ms, sds_pull_ms_left())));
}

// `url` as a log line may show it: without its query (the signature) and
// fragment, and without credentials in its authority.
std::string url_for_log(const char* url) {
  std::string text = url != nullptr ? url : "";
  const size_t cut = text.find_first_of("?#");
  if (cut != std::string::npos) text.resize(cut);
  const size_t scheme = text.find("://");
  if (scheme == std::string::npos) return text;
  const size_t host = scheme + 3;
  const size_t path = std::min(text.find('/', host), text.size());
  const size_t at = text.rfind('@', path);
  if (at != std::string::npos && at >= host) text.erase(host, at + 1 - host);
  return text;
}

// One line on a failed attempt: the server, where it was asked, which
// attempt, what went wrong and how long it took.
void log_failed_attempt(const sds_server_data* server, const char* url, int attempt, int attempts,
                        int result) {
  const sds_transfer_outcome& t = sds_last_transfer;
  std::string cause;
  if (t.http_status != 0) cause = "HTTP " + std::to_string(t.http_status);
  if (t.reason[0] != '\0') cause += (cause.empty() ? "" : ", ") + std::string(t.reason);
  if (cause.empty()) cause = sds_error_string(result);
  SDS_LOGE("pull: server %d, %s, attempt %d of %d failed (%d): %s after %.2f s", server->id,
           url_for_log(url).c_str(), attempt, attempts, result, cause.c_str(), t.seconds);
}

// The value of `key` in the last-pull file's text, or "".
std::string last_pull_value(const std::string& text, const char* key) {
  const std::string prefix = std::string(key) + " ";
  size_t at = 0;
  while (at < text.size()) {
    size_t end = text.find('\n', at);
    if (end == std::string::npos) end = text.size();
    if (text.compare(at, prefix.size(), prefix) == 0) {
      return text.substr(at + prefix.size(), end - at - prefix.size());
    }
    at = end + 1;
  }
  return {};
}

// A value that is one line of the file.
std::string one_line(const char* text) {
  std::string value = text != nullptr ? text : "";
  std::replace_if(value.begin(), value.end(), [](char c) { return c == '\n' || c == '\r'; }, ' ');
  return value;
}

// Records when this pull ended and with what status; when it stored a list,
// also when and for which region, else what the previous record said of the
// list in the deck.
void record_last_pull(int status, const sds_server_req_args* args) {
  const std::string path = sds_path(SDS_LAST_PULL_PATH);
  std::string stored, city, province;
  if (sds_pull_stored_list) {
    stored = std::to_string(static_cast<long long>(std::time(nullptr)));
    if (args != nullptr) {
      city = one_line(args->city);
      province = one_line(args->province);
    }
  } else {
    size_t length = 0;
    UniqueCStr previous(sds_read_file_bounded(path.c_str(), kMaxLastPullBytes, &length));
    if (previous) {
      const std::string text(previous.get(), length);
      stored = last_pull_value(text, "stored");
      city = last_pull_value(text, "city");
      province = last_pull_value(text, "province");
    }
  }
  std::string text = "time " + std::to_string(static_cast<long long>(std::time(nullptr))) +
                     "\nstatus " + std::to_string(status) + "\n";
  if (!stored.empty()) text += "stored " + stored + "\n";
  if (!city.empty()) text += "city " + city + "\n";
  if (!province.empty()) text += "province " + province + "\n";
  if (!sds_write_file_whole(path, text.data(), text.size())) {
    SDS_LOGE("Unable to open file = %s", path.c_str());
  }
}

// The server's permanent move, followed in this pull and written to the
// server list once the new address has answered.
struct PendingMove {
  int id = 0;
  UniqueCStr base_url;
};

int run_pull(sds_server_req_args* args) {
  int result = SDS_ERROR_DATA_PULL_FAILED;
  sds_transfer_global_init();
  // A damaged database would keep its damage for good: a 304 answer leaves
  // it as it is and a merge into it fails. Made afresh, this pull refills it.
  (void)sds_ensure_db_sound();
  // The pull writes most of the file; read it without the memory mapping.
  SdsDbFileMappingPause unmapped(sds_db_handle);
  // Icon files are there only while a pull stores them.
  (void)sds_images_sweep();

  if (args != nullptr && valid_position(args) && sds_get_city_and_province(args) != 0) {
    std::free(args->province);
    args->province = nullptr;
    std::free(args->city);
    args->city = nullptr;
  }

  const std::string list_path = sds_path(SDS_SERVER_DATA_XML);
  sds_server_list* list = sds_get_server_data(list_path.c_str());
  if (list == nullptr) {
    SDS_LOGE("[CRITICAL]  Failed to get the server list");
    return SDS_ERROR_DATA_PULL_FAILED;
  }
  print_server_data(list);

  int redirects = 0;
  PendingMove moved;
  sds_server_list* current = list;
  while (current != nullptr) {
    sds_server_data* server = current->server;
    char* url = sds_get_request_url(server, args);
    if (url == nullptr) {
      SDS_LOGE("[CRITICAL]  http request url is null");
      result = SDS_ERROR_DATA_PULL_FAILED;
      break;
    }
    const int wait_time = server->wait_time;
    int attempts = server->retry_count;
    const int attempts_given = attempts;
    bool finished = false;
    while (attempts > 0) {
      if (sds_pull_ms_left() == 0) {
        SDS_LOGE("pull: deadline passed, no further attempt");
        result = SDS_ERROR_SERVER_REQUEST_FAILED;
        finished = true;
        break;
      }
      --attempts;
      result = sds_download_and_parse_json_data(url);
      if ((result == SDS_ERROR_HTTP_MOVED_PERMANENTLY || result == SDS_ERROR_HTTP_FOUND) &&
          ++redirects > kMaxRedirectsPerPull) {
        SDS_LOGE("Too many redirects (%d) in one pull", redirects);
        std::free(sds_redirect_base_url);
        sds_redirect_base_url = nullptr;
        result = SDS_ERROR_SERVER_REQUEST_FAILED;
        std::snprintf(sds_last_transfer.reason, sizeof sds_last_transfer.reason,
                      "more than %d redirects in one pull", kMaxRedirectsPerPull);
      }
      if (result == SDS_ERROR_SERVER_REQUEST_FAILED) {
        log_failed_attempt(server, url, attempts_given - attempts, attempts_given, result);
        wait_before_retry(wait_time, attempts);
      } else if (result == SDS_ERROR_HTTP_MOVED_PERMANENTLY || result == SDS_ERROR_HTTP_FOUND) {
        if (result == SDS_ERROR_HTTP_MOVED_PERMANENTLY) {
          moved.id = server->id;
          moved.base_url.reset(strdup(sds_redirect_base_url));
        }
        std::free(server->base_url);
        server->base_url = sds_redirect_base_url;  // the entry takes ownership
        sds_redirect_base_url = nullptr;
        attempts = 0;
      } else {
        if (result != SDS_ERROR_NONE && result != SDS_ERROR_HTTP_NOT_MODIFIED) {
          log_failed_attempt(server, url, attempts_given - attempts, attempts_given, result);
        }
        finished = true;
        break;
      }
    }
    std::free(url);
    if (finished) {
      const bool answered = result == SDS_ERROR_NONE || result == SDS_ERROR_HTTP_NOT_MODIFIED;
      if (answered && moved.base_url && moved.id == server->id) {
        (void)sds_update_base_url(list_path.c_str(), moved.id, moved.base_url.get());
      }
      break;
    }
    if (result != SDS_ERROR_HTTP_MOVED_PERMANENTLY && result != SDS_ERROR_HTTP_FOUND) {
      current = current->next;
    }
    if (current == nullptr) break;
    if (result != SDS_ERROR_SERVER_REQUEST_FAILED && result != SDS_ERROR_HTTP_MOVED_PERMANENTLY &&
        result != SDS_ERROR_HTTP_FOUND) {
      break;
    }
  }
  sds_free_server_list(&list);
  return result;
}

}  // namespace

void sds_free_server_list(sds_server_list** head) {
  if (head == nullptr) return;
  sds_server_list* node = *head;
  while (node != nullptr) {
    sds_server_list* next = node->next;
    if (node->server != nullptr) std::free(node->server->base_url);
    std::free(node->server);
    std::free(node);
    node = next;
  }
  *head = nullptr;
  // A redirect base URL still wanted has become an entry's base_url by now.
  sds_redirect_base_url = nullptr;
}

int sds_check_data_pull_required(sds_server_req_args* args) {
  sds_pull_deadline_start();
  sds_pull_stored_list = false;
  const int result = run_pull(args);
  sds_pull_deadline_end();
  record_last_pull(result, args);
  return result;
}
