// The position text of the location step: latitude and longitude with six
// decimals, "%f,%f". Stored answers are reused by comparing this text, so two
// positions that agree to six decimals count as the same place.
#include <cstdio>
#include <cstdlib>

#include "sitedeck-service-log.h"
#include "pull/sitedeck-service-request-server.h"

namespace {

// Room for two doubles printed with "%f", even the largest ones.
constexpr size_t kPositionTextSize = 1000;

}  // namespace

char* get_string_from_location(double latitude, double longitude) {
  auto* text = static_cast<char*>(std::malloc(kPositionTextSize));
  if (text == nullptr) {
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    SDS_LOGE(" [CRITICAL]Unable to malloc");
    return nullptr;
  }
  std::snprintf(text, kPositionTextSize, "%f,%f", latitude, longitude);
  return text;
}
