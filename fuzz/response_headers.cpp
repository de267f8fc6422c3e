// Fuzz target: the saved header lines of an item-list answer through the
// header parser, as the answer to each status it reads headers for. A
// redirect may only ever yield an absolute web URL as the new base URL.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "fuzz_support.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-request-server.h"

namespace {

// The download keeps at most 256 KiB of headers; the parser's paths are
// all reached with far less.
constexpr size_t kMaxInput = 64 * 1024;
constexpr long kStatuses[] = {200, 301, 302, 304};

bool starts_with(const char* text, const char* prefix) {
  return std::strncmp(text, prefix, std::strlen(prefix)) == 0;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  const std::string path = fuzz_path(SDS_HEADER_RESPONSE_PATH);
  fuzz_write_file(path, data, size);
  for (long status : kStatuses) {
    sds_last_error = SDS_ERROR_NONE;
    sds_parse_header(path.c_str(), status);
    if (sds_redirect_base_url != nullptr) {
      if (status != 301 && status != 302) std::abort();
      if (!starts_with(sds_redirect_base_url, "http://") &&
          !starts_with(sds_redirect_base_url, "https://")) {
        std::abort();
      }
    }
    std::free(sds_redirect_base_url);
    sds_redirect_base_url = nullptr;
  }
  (void)std::remove(fuzz_path(SDS_ETAG_TO_UPDATE_PATH).c_str());
  (void)std::remove(fuzz_path(SDS_NEXT_UPDATE_DURATION_PATH).c_str());
  return 0;
}
