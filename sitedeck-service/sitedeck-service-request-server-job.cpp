// The data-pull job: resolve city and province, then try the configured
// content servers in order, each as often as its entry allows, until one
// answer ends the pull. Follows redirects (a bounded number per pull),
// persisting permanent ones in the server list, and waits between failures.
#include <unistd.h>

#include <cmath>
#include <cstdlib>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt-cache.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-request-server.h"
#include "sitedeck-service-server-data.h"
#include "sitedeck-service-transfer-limits.h"

namespace {

// A server that redirects more often than this within one pull is not
// going anywhere; its further redirects count as failed attempts.
constexpr int kMaxRedirectsPerPull = 5;

bool valid_position(const sds_server_req_args* args) {
  // Comparisons with NaN are false, so a value that is not a number fails.
  return args->latitude >= -90.0 && args->latitude <= 90.0 && args->longitude >= -180.0 &&
         args->longitude <= 180.0;
}

void wait_before_retry(int wait_time_ms, int attempts_left) {
  SDS_LOGE("Server Request Failed so waiting (%d) milliseconds before next reqest", wait_time_ms);
  SDS_LOGE("Remaining retries = %d", attempts_left);
  if (wait_time_ms >= 1000) (void)sleep(static_cast<unsigned>(wait_time_ms / 1000));
}

sds_server_list* find_server(sds_server_list* head, int id) {
  for (sds_server_list* node = head; node != nullptr; node = node->next) {
    if (node->server != nullptr && node->server->id == id) return node;
  }
  return nullptr;
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
  int result = SDS_ERROR_DATA_PULL_FAILED;
  sds_transfer_global_init();
  // A damaged database would keep its damage for good: a 304 answer leaves
  // it as it is and a merge into it fails. Made afresh, this pull refills it.
  (void)sds_ensure_db_sound();
  // The pull writes most of the file; read it without the memory mapping.
  SdsDbFileMappingPause unmapped(sds_db_handle);

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
    bool finished = false;
    bool list_lost = false;
    while (attempts > 0) {
      --attempts;
      result = sds_download_and_parse_json_data(url);
      if ((result == SDS_ERROR_HTTP_MOVED_PERMANENTLY || result == SDS_ERROR_HTTP_FOUND) &&
          ++redirects > kMaxRedirectsPerPull) {
        SDS_LOGE("Too many redirects (%d) in one pull", redirects);
        std::free(sds_redirect_base_url);
        sds_redirect_base_url = nullptr;
        result = SDS_ERROR_SERVER_REQUEST_FAILED;
      }
      if (result == SDS_ERROR_SERVER_REQUEST_FAILED) {
        wait_before_retry(wait_time, attempts);
      } else if (result == SDS_ERROR_HTTP_MOVED_PERMANENTLY) {
        const int id = server->id;
        (void)sds_update_base_url(list_path.c_str(), id, sds_redirect_base_url);
        std::free(sds_redirect_base_url);
        sds_redirect_base_url = nullptr;
        sds_free_server_list(&list);
        list = sds_get_server_data(list_path.c_str());
        if (list == nullptr) {
          SDS_LOGE("[CRITICAL]  Failed to get the server list");
          result = SDS_ERROR_DATA_PULL_FAILED;
          list_lost = true;
        } else {
          print_server_data(list);
          current = find_server(list, id);
        }
        attempts = 0;
      } else if (result == SDS_ERROR_HTTP_FOUND) {
        std::free(server->base_url);
        server->base_url = sds_redirect_base_url;  // the entry takes ownership
        sds_redirect_base_url = nullptr;
        attempts = 0;
      } else {
        finished = true;
        break;
      }
    }
    std::free(url);
    if (finished || list_lost) break;
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
