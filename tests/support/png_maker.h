// Makes real PNG files for tests with libpng: any colour type and bit depth,
// with or without a tRNS chunk, interlaced or not, from samples the test
// chooses. Also computes what the service's decoder should give for such an
// image (4 bytes per pixel, B,G,R,A, 8 bits, straight alpha).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct PngImage {
  int width = 1;
  int height = 1;
  int color_type = 6;  // 0 grey, 2 RGB, 3 palette, 4 grey+alpha, 6 RGBA
  int bit_depth = 8;   // as allowed for the colour type: 1, 2, 4, 8 or 16
  bool interlaced = false;
  // Row-major samples, png_channels(color_type) per pixel, each in
  // [0, 2^bit_depth). For a palette image: one index per pixel.
  std::vector<uint16_t> samples;
  // Palette entries (R, G, B), for colour type 3.
  std::vector<uint8_t> palette;
  // tRNS chunk: for a palette, one alpha per entry (may be shorter than the
  // palette); for grey and RGB, the one transparent sample value(s).
  bool has_trns = false;
  std::vector<uint8_t> trns_alpha;
  uint16_t trns_grey = 0;
  uint16_t trns_red = 0, trns_green = 0, trns_blue = 0;
};

// Samples per pixel of a PNG colour type (a palette index counts as one).
int png_channels(int color_type);

// A pattern image: every sample differs with x, y and channel. A palette
// image gets a 2^depth entry palette (at most 256) with distinct colours.
PngImage png_pattern(int width, int height, int color_type, int bit_depth, bool interlaced = false);

// Encodes `image`; an empty string when libpng refuses it.
std::string png_encode_image(const PngImage& image);
bool png_write_file(const std::string& path, const PngImage& image);

// The B,G,R,A bytes the service's decoder gives for `image`, row by row.
std::vector<uint8_t> png_expected_bgra(const PngImage& image);

// What the service's own decoder makes of `png`: B,G,R,A rows, empty when it
// refuses it. It reads an exactly sized heap copy, so that the address
// sanitizer catches a read past the end.
std::vector<uint8_t> service_decode_png(const std::string& png, int* width = nullptr,
                                        int* height = nullptr);

// Deterministic pseudo-random bytes (for images that do not compress).
std::vector<uint8_t> noise_bytes(size_t count, uint32_t seed);
