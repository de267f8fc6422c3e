#include "support/png_maker.h"

#include <png.h>

#include <csetjmp>
#include <cstring>
#include <fstream>

#include "pull/sitedeck-service-utils.h"

namespace {

struct ByteSink {
  unsigned char* data = nullptr;
  size_t size = 0;
  size_t capacity = 0;
};

struct EncodeState {
  png_structp png = nullptr;
  png_infop info = nullptr;
  ByteSink sink;
  png_bytep* rows = nullptr;
  const png_color* palette = nullptr;
  int palette_size = 0;
  const PngImage* image = nullptr;
};

void sink_write(png_structp png, png_bytep data, png_size_t length) {
  auto* sink = static_cast<ByteSink*>(png_get_io_ptr(png));
  if (sink->size + length > sink->capacity) {
    size_t capacity = (sink->size + length) * 2;
    auto* grown = static_cast<unsigned char*>(std::realloc(sink->data, capacity));
    if (grown == nullptr) png_error(png, "out of memory");
    sink->data = grown;
    sink->capacity = capacity;
  }
  std::memcpy(sink->data + sink->size, data, length);
  sink->size += length;
}

void sink_flush(png_structp) {}

[[noreturn]] void on_error(png_structp png, png_const_charp) { png_longjmp(png, 1); }
void on_warning(png_structp, png_const_charp) {}

// Packs one row of samples into PNG row bytes (big-endian 16-bit, MSB-first
// packing below 8 bits).
void pack_row(const PngImage& image, int y, unsigned char* out) {
  int channels = png_channels(image.color_type);
  int per_row = image.width * channels;
  const uint16_t* in = image.samples.data() + size_t(y) * per_row;
  if (image.bit_depth == 16) {
    for (int i = 0; i < per_row; ++i) {
      out[2 * i] = uint8_t(in[i] >> 8);
      out[2 * i + 1] = uint8_t(in[i] & 0xFF);
    }
  } else if (image.bit_depth == 8) {
    for (int i = 0; i < per_row; ++i) out[i] = uint8_t(in[i]);
  } else {
    int depth = image.bit_depth;
    int per_byte = 8 / depth;
    std::memset(out, 0, size_t((per_row + per_byte - 1) / per_byte));
    for (int i = 0; i < per_row; ++i) {
      int shift = 8 - depth * (i % per_byte + 1);
      out[i / per_byte] |= uint8_t((in[i] & ((1 << depth) - 1)) << shift);
    }
  }
}

// Holds no object with a destructor: libpng errors leave by longjmp.
int encode(EncodeState* state) {
  const PngImage& image = *state->image;
  if (setjmp(png_jmpbuf(state->png))) return -1;
  png_set_write_fn(state->png, &state->sink, sink_write, sink_flush);
  png_set_IHDR(state->png, state->info, png_uint_32(image.width), png_uint_32(image.height),
               image.bit_depth, image.color_type,
               image.interlaced ? PNG_INTERLACE_ADAM7 : PNG_INTERLACE_NONE,
               PNG_COMPRESSION_TYPE_DEFAULT, PNG_FILTER_TYPE_DEFAULT);
  if (image.color_type == PNG_COLOR_TYPE_PALETTE) {
    png_set_PLTE(state->png, state->info, state->palette, state->palette_size);
  }
  if (image.has_trns) {
    if (image.color_type == PNG_COLOR_TYPE_PALETTE) {
      png_set_tRNS(state->png, state->info, image.trns_alpha.data(), int(image.trns_alpha.size()),
                   nullptr);
    } else {
      png_color_16 color{};
      color.gray = image.trns_grey;
      color.red = image.trns_red;
      color.green = image.trns_green;
      color.blue = image.trns_blue;
      png_set_tRNS(state->png, state->info, nullptr, 0, &color);
    }
  }
  png_set_rows(state->png, state->info, state->rows);
  png_write_png(state->png, state->info, PNG_TRANSFORM_IDENTITY, nullptr);
  return 0;
}

// Scales a sample to 8 bits as libpng does: 16 bits lose their low byte,
// fewer bits are replicated (a 1-bit 1 becomes 255).
uint8_t expand_to_8(uint16_t value, int depth) {
  return depth == 16 ? uint8_t(value >> 8) : uint8_t(value * 255 / ((1 << depth) - 1));
}

}  // namespace

int png_channels(int color_type) {
  return color_type == 2 ? 3 : color_type == 4 ? 2 : color_type == 6 ? 4 : 1;
}

PngImage png_pattern(int width, int height, int color_type, int bit_depth, bool interlaced) {
  PngImage image;
  image.width = width;
  image.height = height;
  image.color_type = color_type;
  image.bit_depth = bit_depth;
  image.interlaced = interlaced;
  if (color_type == PNG_COLOR_TYPE_PALETTE) {
    int entries = bit_depth >= 8 ? 256 : 1 << bit_depth;
    for (int i = 0; i < entries; ++i) {
      image.palette.push_back(uint8_t(i * 7 + 3));
      image.palette.push_back(uint8_t(255 - i * 3));
      image.palette.push_back(uint8_t(i * 11 + 40));
    }
  }
  // Every sample differs with x, y and channel; 16-bit samples spread over
  // both bytes, so that stripping is visible.
  const int channels = png_channels(color_type);
  const uint32_t mask = (1u << bit_depth) - 1;
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x) {
      for (int c = 0; c < channels; ++c) {
        const uint32_t v = uint32_t(x * 37 + y * 101 + c * 59 + 11);
        image.samples.push_back(uint16_t((bit_depth == 16 ? v * 263 : v) & mask));
      }
    }
  }
  return image;
}

std::string png_encode_image(const PngImage& image) {
  EncodeState state;
  state.image = &image;
  int channels = png_channels(image.color_type);
  size_t row_bytes = (size_t(image.width) * channels * image.bit_depth + 7) / 8;
  std::vector<unsigned char> pixels(row_bytes * image.height);
  std::vector<png_bytep> rows(image.height);
  for (int y = 0; y < image.height; ++y) {
    rows[y] = pixels.data() + y * row_bytes;
    pack_row(image, y, rows[y]);
  }
  state.rows = rows.data();
  std::vector<png_color> entries(image.palette.size() / 3);
  for (size_t i = 0; i < entries.size(); ++i) {
    entries[i] = {image.palette[3 * i], image.palette[3 * i + 1], image.palette[3 * i + 2]};
  }
  state.palette = entries.data();
  state.palette_size = int(entries.size());
  state.png = png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, on_error, on_warning);
  state.info = state.png != nullptr ? png_create_info_struct(state.png) : nullptr;
  int result = state.info != nullptr ? encode(&state) : -1;
  png_destroy_write_struct(&state.png, &state.info);
  std::string out;
  if (result == 0) out.assign(reinterpret_cast<char*>(state.sink.data), state.sink.size);
  std::free(state.sink.data);
  return out;
}

bool png_write_file(const std::string& path, const PngImage& image) {
  std::string bytes = png_encode_image(image);
  if (bytes.empty()) return false;
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
  return static_cast<bool>(out);
}

std::vector<uint8_t> png_expected_bgra(const PngImage& image) {
  int channels = png_channels(image.color_type);
  int depth = image.bit_depth;
  std::vector<uint8_t> out;
  out.reserve(size_t(image.width) * image.height * 4);
  for (size_t p = 0; p < size_t(image.width) * image.height; ++p) {
    const uint16_t* s = image.samples.data() + p * channels;
    uint8_t r, g, b, a = 255;
    if (image.color_type == 3) {
      r = image.palette[3 * s[0]];
      g = image.palette[3 * s[0] + 1];
      b = image.palette[3 * s[0] + 2];
      if (image.has_trns && s[0] < image.trns_alpha.size()) a = image.trns_alpha[s[0]];
    } else {
      const bool colour = (image.color_type & 2) != 0, alpha = (image.color_type & 4) != 0;
      r = expand_to_8(s[0], depth);
      g = colour ? expand_to_8(s[1], depth) : r;
      b = colour ? expand_to_8(s[2], depth) : r;
      if (alpha) a = expand_to_8(s[channels - 1], depth);
      const bool keyed =
          colour ? s[0] == image.trns_red && s[1] == image.trns_green && s[2] == image.trns_blue
                 : s[0] == image.trns_grey;
      if (image.has_trns && !alpha && keyed) a = 0;
    }
    out.insert(out.end(), {b, g, r, a});
  }
  return out;
}

std::vector<uint8_t> service_decode_png(const std::string& png, int* width, int* height) {
  std::vector<unsigned char> copy(png.begin(), png.end());
  unsigned char* raw = nullptr;
  int w = 0, h = 0, size = 0;
  if (convert_png_to_raw_data(copy.data(), copy.size(), &raw, &w, &h, &size) != 0) return {};
  std::vector<uint8_t> bytes(raw, raw + size);
  std::free(raw);
  if (width != nullptr) *width = w;
  if (height != nullptr) *height = h;
  return bytes;
}

std::vector<uint8_t> noise_bytes(size_t count, uint32_t seed) {
  std::vector<uint8_t> out(count);
  uint64_t state = seed * 0x9E3779B97F4A7C15ull + 1;
  for (auto& byte : out) {
    state ^= state << 13;
    state ^= state >> 7;
    state ^= state << 17;
    byte = uint8_t(state >> 24);
  }
  return out;
}
