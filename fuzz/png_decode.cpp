// Fuzz target: icon bytes from a content server through the PNG decoder.
// Whatever decodes must have the promised layout (four bytes per pixel, rows
// of the reported width), and small images must survive a trip through the
// encoder and back unchanged.
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "fuzz_support.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-utils.h"

namespace {

// Icons are a few KiB; a longer input only slows the search down.
constexpr size_t kMaxInput = 64 * 1024;
// Images re-encoded for the round trip; bigger ones only cost time.
constexpr int kMaxRoundTripBytes = 64 * 1024;

void check(bool condition) {
  if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  (void)fuzz_root();  // quiet logs
  unsigned char* raw = nullptr;
  int width = -1, height = -1, length = -1;
  if (convert_png_to_raw_data(data, size, &raw, &width, &height, &length) != 0) {
    check(raw == nullptr && width == -1 && height == -1 && length == -1);
    return 0;
  }
  UniqueMalloc<unsigned char> pixels(raw);
  check(pixels != nullptr && width > 0 && height > 0);
  check(static_cast<long long>(width) * height * 4 == length);
  if (length > kMaxRoundTripBytes) return 0;

  unsigned char* png = nullptr;
  int png_size = 0;
  check(convert_raw_data_to_png(pixels.get(), width, height, &png, &png_size) == 0);
  UniqueMalloc<unsigned char> encoded(png);
  unsigned char* again = nullptr;
  int width2 = 0, height2 = 0, length2 = 0;
  check(convert_png_to_raw_data(encoded.get(), static_cast<size_t>(png_size), &again, &width2,
                                &height2, &length2) == 0);
  UniqueMalloc<unsigned char> decoded(again);
  check(width2 == width && height2 == height && length2 == length);
  check(std::memcmp(decoded.get(), pixels.get(), static_cast<size_t>(length)) == 0);
  return 0;
}
