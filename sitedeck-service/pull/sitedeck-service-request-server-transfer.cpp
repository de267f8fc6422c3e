// Settings every HTTP transfer of the service shares: the device's proxy, the
// user agent, the fixed libcurl options and the limits that keep a hostile or
// stalled server from holding a pull forever; and the next-update-duration
// file through which the browser learns when to pull again.
#include <curl/curl.h>

#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>

#include "kdb.h"
#include "net_connection.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-file-write.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "vconf.h"

namespace {

constexpr const char* kDefaultUserAgent =
    "Mozilla/5.0 (Linux; U; Valto 1.0; en-us) AppleWebKit/534.46 (KHTML, like Gecko) Mobile "
    "Valto Browser/1.0";
constexpr long kConnectTimeoutSeconds = 65;
// A transfer that moves less than one byte a second for this long is dead.
constexpr long kDefaultStallSeconds = 30;
constexpr const char* kStallSecondsKey = "db/browser/sitedeck/transfer_stall_seconds";
constexpr const char* kTransferDeadlineKey = "db/browser/sitedeck/transfer_deadline_seconds";
constexpr const char* kPullDeadlineKey = "db/browser/sitedeck/pull_deadline_seconds";

using Clock = std::chrono::steady_clock;
// When the running pull must end; unset outside a pull.
Clock::time_point g_pull_deadline;
bool g_pull_running = false;

// A whole number of seconds from the key, within 1..`most`; `fallback` otherwise.
long seconds_from_key(const char* key, long most, long fallback) {
  std::string value;
  if (kdb_read(key, &value)) {
    char* end = nullptr;
    long seconds = std::strtol(value.c_str(), &end, 10);
    if (end != value.c_str() && *end == '\0' && seconds > 0 && seconds <= most) return seconds;
  }
  return fallback;
}

long stall_seconds() { return seconds_from_key(kStallSecondsKey, 3600, kDefaultStallSeconds); }

long default_deadline_seconds(sds_transfer_kind kind) {
  switch (kind) {
    case SDS_TRANSFER_ICON:
      return SDS_ICON_DEADLINE_SECONDS;
    case SDS_TRANSFER_GEOCODER:
      return SDS_GEOCODER_DEADLINE_SECONDS;
    case SDS_TRANSFER_ITEM_LIST:
      break;
  }
  return SDS_ITEM_LIST_DEADLINE_SECONDS;
}

}  // namespace

void sds_pull_deadline_start(void) {
  const long seconds = seconds_from_key(kPullDeadlineKey, 86400, SDS_PULL_DEADLINE_SECONDS);
  g_pull_deadline = Clock::now() + std::chrono::seconds(seconds);
  g_pull_running = true;
}

void sds_pull_deadline_end(void) { g_pull_running = false; }

long long sds_pull_ms_left(void) {
  if (!g_pull_running) return LLONG_MAX;
  auto left = std::chrono::duration_cast<std::chrono::milliseconds>(g_pull_deadline - Clock::now());
  return left.count() > 0 ? left.count() : 0;
}

bool sds_transfer_apply_deadline(void* curl, sds_transfer_kind kind) {
  long long ms = seconds_from_key(kTransferDeadlineKey, 3600, default_deadline_seconds(kind)) * 1000LL;
  const long long pull_left = sds_pull_ms_left();
  if (pull_left <= 0) return false;
  if (pull_left < ms) ms = pull_left;
  (void)curl_easy_setopt(static_cast<CURL*>(curl), CURLOPT_TIMEOUT_MS, static_cast<long>(ms));
  return true;
}

void sds_transfer_global_init(void) {
  // libcurl's global state is process-wide and not cheap to set up; once is enough.
  static std::once_flag once;
  std::call_once(once, [] { (void)curl_global_init(CURL_GLOBAL_ALL); });
}

char* sds_get_proxy_address(void) {
  connection_h connection = nullptr;
  if (connection_create(&connection) < 0) {
    SDS_LOGE("Fail to create connection handle");
    return nullptr;
  }
  char* address = nullptr;
  if (connection_get_proxy(connection, CONNECTION_ADDRESS_FAMILY_IPV4, &address) < 0) {
    SDS_LOGE("Fail to get proxy address");
    (void)connection_destroy(connection);
    return nullptr;
  }
  if (address != nullptr) {
    char* copy = strdup(address);
    std::free(address);
    (void)connection_destroy(connection);
    return copy;
  }
  if (connection_destroy(connection) < 0) SDS_LOGE("Fail to desctory connection handle");
  return nullptr;
}

char* sds_get_user_agent_string(void) {
  char* user_agent = vconf_get_str(VCONFKEY_BROWSER_USER_AGENT);
  if (user_agent != nullptr) return user_agent;
  SDS_LOGI("No UA information from vconf !!");
  return strdup(kDefaultUserAgent);
}

void sds_set_next_update_duration(int seconds) {
  std::string path = sds_path(SDS_NEXT_UPDATE_DURATION_PATH);
  const std::string text = std::to_string(seconds);
  // A duration that did not reach the disk must not read as written.
  if (!sds_write_file_whole(path, text.data(), text.size())) {
    SDS_LOGE("Unable to open file = %s", path.c_str());
    sds_last_error = SDS_ERROR_IO_ERROR;
  }
}

int sds_transfer_apply_proxy(void* curl, char** proxy) {
  *proxy = sds_get_proxy_address();
  const char* address = *proxy;
  if (address == nullptr || address[0] == '\0' || std::strstr(address, "0.0.0.0") != nullptr) {
    return SDS_ERROR_NONE;
  }
  if (std::strstr(address, "http") != nullptr) {
    (void)curl_easy_setopt(static_cast<CURL*>(curl), CURLOPT_PROXY, address);
    return SDS_ERROR_NONE;
  }
  size_t length = std::strlen(address) + 8;
  auto* with_scheme = static_cast<char*>(std::calloc(length, 1));
  if (with_scheme == nullptr) {
    SDS_LOGE("FAIL_TO_MEMALLOC");
    return SDS_ERROR_OUT_OF_MEMORY;
  }
  std::snprintf(with_scheme, length, "%s%s", "http://", address);
  std::free(*proxy);
  *proxy = with_scheme;
  (void)curl_easy_setopt(static_cast<CURL*>(curl), CURLOPT_PROXY, with_scheme);
  return SDS_ERROR_NONE;
}

int sds_transfer_apply_settings(void* handle, char** user_agent, char** proxy) {
  auto* curl = static_cast<CURL*>(handle);
  *user_agent = nullptr;
  *proxy = nullptr;
  if (sds_transfer_apply_proxy(curl, proxy) != SDS_ERROR_NONE) return SDS_ERROR_OUT_OF_MEMORY;
  *user_agent = sds_get_user_agent_string();
  (void)curl_easy_setopt(curl, CURLOPT_USERAGENT, *user_agent);
  // libcurl's own trace would bypass the platform log and print request lines
  // that carry the geocoder credentials, so it stays off.
  (void)curl_easy_setopt(curl, CURLOPT_VERBOSE, 0L);
  (void)curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, kConnectTimeoutSeconds);
#if SITEDECK_INSECURE_TLS
  (void)curl_easy_setopt(curl, CURLOPT_SSL_VERIFYPEER, 0L);
  (void)curl_easy_setopt(curl, CURLOPT_SSL_VERIFYHOST, 0L);
#else
  // Anyone on the path could otherwise put sites on the start page.
  (void)curl_easy_setopt(curl, CURLOPT_SSL_VERIFYPEER, 1L);
  (void)curl_easy_setopt(curl, CURLOPT_SSL_VERIFYHOST, 2L);
#endif
  // URLs come from the network (icon paths, Location headers): never let one
  // name a local file or another protocol.
  (void)curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
  (void)curl_easy_setopt(curl, CURLOPT_LOW_SPEED_LIMIT, 1L);
  (void)curl_easy_setopt(curl, CURLOPT_LOW_SPEED_TIME, stall_seconds());
  (void)curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
  return SDS_ERROR_NONE;
}
