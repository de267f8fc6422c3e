// Fuzz target: the stored location file, read back for an unchanged position.
// Whatever city and province it yields must survive being stored again and
// read back.
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "fuzz_support.h"
#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-server-data.h"

namespace {

constexpr size_t kMaxInput = 64 * 1024;

struct Args {
  sds_server_req_args value{};
  Args() {
    // The position whose text the seed files carry: "37.500000,127.000000".
    value.latitude = 37.5;
    value.longitude = 127.0;
  }
  ~Args() {
    std::free(value.city);
    std::free(value.province);
  }
};

bool present(const char* text) { return text != nullptr && text[0] != '\0'; }

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  const std::string path = fuzz_path(SDS_LOCATION_INFO_PATH);
  fuzz_write_file(path, data, size);
  Args first;
  if (get_city_and_province_from_stored(&first.value) != 0) return 0;
  if (!present(first.value.city) || !present(first.value.province)) return 0;

  save_city_and_province(&first.value);
  Args second;
  if (get_city_and_province_from_stored(&second.value) != 0) std::abort();
  if (!present(second.value.city) || !present(second.value.province)) std::abort();
  if (std::strcmp(first.value.city, second.value.city) != 0) std::abort();
  if (std::strcmp(first.value.province, second.value.province) != 0) std::abort();
  return 0;
}
