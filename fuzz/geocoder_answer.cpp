// Fuzz target: the reverse geocoder's answer, as saved from the network,
// through the parser that takes city and province out of it.
#include <cstdint>
#include <cstdlib>

#include "fuzz_support.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-server-data.h"

namespace {

constexpr size_t kMaxInput = 64 * 1024;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  fuzz_write_file(fuzz_path(SDS_HERE_XML_PATH), data, size);
  sds_server_req_args args{};
  args.latitude = 37.5;
  args.longitude = 127.0;
  (void)sds_parse_city_and_province(&args);
  std::free(args.city);
  std::free(args.province);
  return 0;
}
