// The network half of the location step: reuse the stored answer for an
// unchanged position, else ask the reverse geocoder and store its answer. A
// new place also drops the stored ETag, so the next item-list request is a
// full one for the new region.
#include <curl/curl.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "kdb.h"
#include "pull/sitedeck-service-file-write.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"

#ifndef SITEDECK_HERE_APP_ID
#define SITEDECK_HERE_APP_ID "Vb7Qm2Lx9Tr4Kp6Ws1Nd"
#endif
#ifndef SITEDECK_HERE_APP_CODE
#define SITEDECK_HERE_APP_CODE "Hk3Pz8Rt_Wm5Yc2Nq7Lv4J"
#endif

namespace {

constexpr const char* kGeocoderUrlKey = "db/browser/sitedeck/geocoder_url";
constexpr const char* kDefaultGeocoder = "https://reverse.geocoder.api.here.com";
constexpr const char* kGeocoderPath = "/6.2/reversegeocode.xml?prox=";
constexpr const char* kGeocoderQueryTail =
    "&mode=retrieveAddresses&app_id=" SITEDECK_HERE_APP_ID "&app_code=" SITEDECK_HERE_APP_CODE
    "&gen=1";

struct CurlEasyDeleter {
  void operator()(CURL* c) const noexcept { curl_easy_cleanup(c); }
};

// The answer file of the transfer in progress, written beside its name and
// put in place once the transfer completed.
SdsFileBeside* g_answer = nullptr;
size_t g_answer_bytes = 0;

bool present(const char* text) { return text != nullptr && text[0] != '\0'; }

std::string geocoder_origin() {
  std::string origin;
  if (kdb_read(kGeocoderUrlKey, &origin) && !origin.empty()) {
    while (!origin.empty() && origin.back() == '/') origin.pop_back();
    return origin;
  }
  return kDefaultGeocoder;
}

}  // namespace

char* __get_here_reverse_geocoder_url(double latitude, double longitude) {
  UniqueCStr position(get_string_from_location(latitude, longitude));
  if (!position) {
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    return nullptr;
  }
  std::string head = geocoder_origin() + kGeocoderPath;
  size_t length = head.size() + std::strlen(position.get()) + std::strlen(kGeocoderQueryTail) + 1;
  auto* url = static_cast<char*>(std::malloc(length));
  if (url == nullptr) {
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    SDS_LOGE("[CRITICAL] Unable to malloc");
    return nullptr;
  }
  std::snprintf(url, length, "%s%s%s", head.c_str(), position.get(), kGeocoderQueryTail);
  return url;
}

size_t sds_parse_here_xml_header(char* line, size_t size, size_t count, void* /*user*/) {
  if (line == nullptr || (size == 0 && count == 0)) return size * count;
  std::string text(line, size * count);
  if (text.find("200 OK") != std::string::npos) {
    sds_last_error = SDS_ERROR_NONE;
  } else if (text.find("503 Service Unavailable") != std::string::npos) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
  } else if (text.find("400 Bad Request") != std::string::npos) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    SDS_LOGE("Here Service : 400 Bad Request");
  } else if (text.find("404 Not Found") != std::string::npos) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    SDS_LOGE("Here Service : 404 Not Found");
  } else if (text.find("401 Unauthorized") != std::string::npos) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    SDS_LOGE("Here Service : 401 Unauthorized");
    SDS_LOGE("Check app_Code or app_id for here service");
  }
  return size * count;
}

size_t sds_download_xml_data(char* chunk, size_t size, size_t count, void* /*user*/) {
  size_t bytes = size * count;
  if (chunk == nullptr || size == 0 || count == 0) {
    SDS_LOGE("[CRITICAL] invalid data NULL\n");
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return bytes;
  }
  // An answer bigger than any real address document is not stored at all.
  if (g_answer_bytes + bytes > SDS_MAX_GEOCODER_BYTES) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return 0;
  }
  if (g_answer == nullptr || g_answer->get() == nullptr) {
    SDS_LOGE("Unable to open file = %s", sds_path(SDS_HERE_XML_PATH).c_str());
    sds_last_error = SDS_ERROR_IO_ERROR;
    return bytes;
  }
  size_t written = std::fwrite(chunk, 1, bytes, g_answer->get());
  g_answer_bytes += written;
  if (written != bytes) sds_last_error = SDS_ERROR_IO_ERROR;
  return bytes;
}

int sds_get_city_and_province(sds_server_req_args* args) {
  sds_last_error = SDS_ERROR_NONE;
  if (args == nullptr) return SDS_ERROR_INVALID_PARAMETER;
  if (get_city_and_province_from_stored(args) == 0 && present(args->city) &&
      present(args->province)) {
    return SDS_ERROR_NONE;
  }
  UniqueCStr url(__get_here_reverse_geocoder_url(args->latitude, args->longitude));
  if (!url) return sds_last_error;
  sds_transfer_global_init();
  std::unique_ptr<CURL, CurlEasyDeleter> curl(curl_easy_init());
  if (!curl) return sds_last_error;
  char* user_agent_text = nullptr;
  char* proxy_text = nullptr;
  int settings = sds_transfer_apply_settings(curl.get(), &user_agent_text, &proxy_text);
  UniqueCStr user_agent(user_agent_text);
  UniqueCStr proxy(proxy_text);
  if (settings != SDS_ERROR_NONE) {
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    return sds_last_error;
  }
  CURL* c = curl.get();
  char error_text[CURL_ERROR_SIZE] = {};
  (void)curl_easy_setopt(c, CURLOPT_URL, url.get());
  (void)curl_easy_setopt(c, CURLOPT_ERRORBUFFER, error_text);
  (void)curl_easy_setopt(c, CURLOPT_HEADERFUNCTION, sds_parse_here_xml_header);
  (void)curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, sds_download_xml_data);
  (void)curl_easy_setopt(c, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_1_1));
  const std::string answer_path = sds_path(SDS_HERE_XML_PATH);
  if (!sds_transfer_apply_deadline(c, SDS_TRANSFER_GEOCODER)) {
    SDS_LOGE("geocoder not asked: the pull's deadline passed");
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return sds_last_error;
  }

  SdsFileBeside answer(answer_path);
  g_answer = &answer;
  g_answer_bytes = 0;
  // An answer without a body must not be read as the previous answer's file.
  (void)std::remove(answer_path.c_str());
  CURLcode performed = curl_easy_perform(c);
  g_answer = nullptr;
  long status = 0;
  (void)curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &status);
  double seconds = 0;
  (void)curl_easy_getinfo(c, CURLINFO_TOTAL_TIME, &seconds);
  if (performed != CURLE_OK) {
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    SDS_LOGE("[CRITICAL] Failed to perform easy perfomr[%d] \n", static_cast<int>(performed));
    SDS_LOGE("geocoder %s failed after %.2f s: %s", geocoder_origin().c_str(), seconds,
             error_text[0] != '\0' ? error_text : curl_easy_strerror(performed));
    return sds_last_error;
  }
  if (sds_last_error != SDS_ERROR_NONE) {
    SDS_LOGE("\nNot Parsing XML\n");
    SDS_LOGE("geocoder %s failed after %.2f s: HTTP %ld", geocoder_origin().c_str(), seconds,
             status);
    return sds_last_error;
  }
  if (g_answer_bytes > 0 && !answer.commit()) {
    SDS_LOGE("Unable to open file = %s", answer_path.c_str());
    sds_last_error = SDS_ERROR_IO_ERROR;
    return sds_last_error;
  }
  sds_last_error = sds_parse_city_and_province(args);
  if (present(args->city) && present(args->province)) {
    save_city_and_province(args);
    (void)remove_file(sds_path(SDS_ETAG_PATH).c_str());
  }
  return sds_last_error;
}
