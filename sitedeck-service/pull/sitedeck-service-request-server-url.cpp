// The signed item-list request URL: the server's base URL, a query describing
// the device (country, mobile operator, platform), its city and province and
// the browser's version, and the signature of that query. In each value the
// bytes that cannot stand in a URL query as they are (RFC 3986: space,
// controls, '#', '%', '&', '+', '=', non-ASCII and the like) are
// percent-encoded; every other byte goes in as it is, so a value of plain
// letters and digits is sent exactly as before. The signature covers the
// query as it is sent.
#include <strings.h>

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-signature.h"
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

// True for a byte that may stand in a query value as it is: RFC 3986's
// unreserved characters and the sub-delimiters, ':', '@', '/' and '?', less
// the '&', '=' and '+' that give a query its structure.
bool __query_safe(unsigned char c) {
  if ((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9')) return true;
  return std::strchr("-._~!$'()*,;:@/?", c) != nullptr && c != '\0';
}

// `value` with every byte that may not stand in a query as "%XX". Owned, or
// null when it cannot be allocated.
char* __query_value(const char* value) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  size_t length = std::strlen(value);
  auto* out = static_cast<char*>(std::malloc(length * 3 + 1));
  if (out == nullptr) return nullptr;
  char* at = out;
  for (const auto* p = reinterpret_cast<const unsigned char*>(value); *p != '\0'; ++p) {
    if (__query_safe(*p)) {
      *at++ = static_cast<char>(*p);
    } else {
      *at++ = '%';
      *at++ = kHex[*p >> 4];
      *at++ = kHex[*p & 0x0F];
    }
  }
  *at = '\0';
  return out;
}

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
  // Appends "name=value&" with the value encoded; a value that cannot be
  // encoded fails the whole query.
  auto add = [&query](const char* name, const char* value) {
    UniqueCStr encoded(__query_value(value));
    if (!encoded) {
      query.failed = true;
      return;
    }
    query.append("%s=%s&", name, encoded.get());
  };
  {
    UniqueCStr country(sds_get_country_iso());
    if (__present(country.get())) add("country", country.get());
  }
  const char* operator_code = sds_get_operator_code();
  if (operator_code != nullptr) add("operator", operator_code);
  add("platform", kPlatform);
  if (args != nullptr) {
    if (__present(args->city)) add("city", args->city);
    if (__present(args->province)) add("province", args->province);
    if (__present(args->browser_version)) add("browserversion", args->browser_version);
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
