// The signed item-list request URL: the server's base URL, a query describing
// the device (country, mobile operator, platform), its city and province and
// the browser's version, and the signature of that query. Values go in as they
// are: the content server expects them unescaped.
#include <strings.h>

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "sitedeck-service-raii.h"
#include "sitedeck-service-request-server.h"
#include "sitedeck-service-signature.h"
#include "tapi.h"
#include "vconf.h"

namespace {

struct sds_operator {
  const char* network_name;  // compared without regard to case
  const char* code;
};

// Networks with an operator code; consulted only in South Africa.
constexpr sds_operator sds_operator_table[] = {
    {"MTN", "MTN"},
    {"Vodacom", "VDC"},
};

constexpr const char* kPlatform = "Valto";

// A growing malloc'ed text; once an append fails the text is dropped.
struct QueryText {
  char* text = nullptr;
  size_t length = 0;
  bool failed = false;

  ~QueryText() { std::free(text); }

  __attribute__((format(printf, 2, 3))) void append(const char* format, ...) {
    if (failed) return;
    va_list args;
    va_start(args, format);
    va_list copy;
    va_copy(copy, args);
    int needed = std::vsnprintf(nullptr, 0, format, copy);
    va_end(copy);
    auto* grown =
        needed < 0 ? nullptr : static_cast<char*>(std::realloc(text, length + needed + 1));
    if (grown == nullptr) {
      failed = true;
    } else {
      text = grown;
      std::vsnprintf(text + length, static_cast<size_t>(needed) + 1, format, args);
      length += static_cast<size_t>(needed);
    }
    va_end(args);
  }
};

bool __present(const char* text) { return text != nullptr && text[0] != '\0'; }

}  // namespace

char* sds_get_country_iso(void) { return vconf_get_str(VCONFKEY_CSC_COUNTRY_ISO); }

const char* sds_get_operator_code(void) {
  UniqueCStr country(sds_get_country_iso());
  if (!country || std::strcmp(country.get(), "ZA") != 0) return nullptr;

  TapiHandle* handle = tel_init(nullptr);
  if (handle == nullptr) return nullptr;
  char* raw_name = nullptr;
  (void)tel_get_property_string(handle, TAPI_PROP_NETWORK_NETWORK_NAME, &raw_name);
  UniqueCStr name(raw_name);
  (void)tel_deinit(handle);
  if (!name) return nullptr;

  for (const auto& row : sds_operator_table) {
    if (strcasecmp(name.get(), row.network_name) == 0) return row.code;
  }
  return nullptr;
}

char* sds_get_request_url(const sds_server_data* server, const sds_server_req_args* args) {
  if (server == nullptr) return nullptr;
  QueryText query;
  {
    UniqueCStr country(sds_get_country_iso());
    if (__present(country.get())) query.append("country=%s&", country.get());
  }
  const char* operator_code = sds_get_operator_code();
  if (operator_code != nullptr) query.append("operator=%s&", operator_code);
  query.append("platform=%s&", kPlatform);
  if (args != nullptr) {
    if (__present(args->city)) query.append("city=%s&", args->city);
    if (__present(args->province)) query.append("province=%s&", args->province);
    if (__present(args->browser_version)) {
      query.append("browserversion=%s&", args->browser_version);
    }
  }
  if (server->fall_back != 0) query.append("&storage=s3");
  if (query.failed) return nullptr;

  UniqueCStr hash(sds_get_request_hash(query.text));
  if (!hash) return nullptr;
  const char* base_url = server->base_url != nullptr ? server->base_url : "";
  size_t size = std::strlen(base_url) + 1 + query.length + std::strlen("&hash=") +
                std::strlen(hash.get()) + 1;
  auto* url = static_cast<char*>(std::malloc(size));
  if (url == nullptr) return nullptr;
  std::snprintf(url, size, "%s?%s&hash=%s", base_url, query.text, hash.get());
  return url;
}
