// PNG rendering for the content server's icons; see the header.
#include "icons.h"

#include <png.h>
#include <zlib.h>

#include <csetjmp>
#include <cstring>
#include <vector>

namespace {

struct PngWriter {
  png_structp png = nullptr;
  png_infop info = nullptr;
  PngWriter() {
    png = png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, nullptr, nullptr);
    if (png != nullptr) info = png_create_info_struct(png);
  }
  ~PngWriter() {
    if (png != nullptr) png_destroy_write_struct(&png, info != nullptr ? &info : nullptr);
  }
  PngWriter(const PngWriter&) = delete;
  PngWriter& operator=(const PngWriter&) = delete;
};

void append_to_string(png_structp png, png_bytep data, png_size_t length) {
  auto* out = static_cast<std::string*>(png_get_io_ptr(png));
  out->append(reinterpret_cast<const char*>(data), length);
}

void flush_nothing(png_structp) {}

cs_rgb inverse(cs_rgb c) {
  return cs_rgb{static_cast<uint8_t>(255 - c.r), static_cast<uint8_t>(255 - c.g),
                static_cast<uint8_t>(255 - c.b)};
}

int png_color_type(cs_color_type type) {
  switch (type) {
    case cs_color_type::rgb:
      return PNG_COLOR_TYPE_RGB;
    case cs_color_type::rgba:
      return PNG_COLOR_TYPE_RGB_ALPHA;
    case cs_color_type::grey:
      return PNG_COLOR_TYPE_GRAY;
    case cs_color_type::grey_alpha:
      return PNG_COLOR_TYPE_GRAY_ALPHA;
    case cs_color_type::palette:
    case cs_color_type::palette_trns:
      return PNG_COLOR_TYPE_PALETTE;
  }
  return PNG_COLOR_TYPE_RGB;
}

class RowWriter {
 public:
  RowWriter(std::vector<png_byte>* row, int depth) : row_(row), depth_(depth) {}
  // Appends one sample of `depth_` bits; 8-bit values are scaled up or down.
  void sample(int value8) {
    if (depth_ == 16) {
      const int v = value8 * 257;
      row_->push_back(static_cast<png_byte>(v >> 8));
      row_->push_back(static_cast<png_byte>(v & 0xFF));
    } else if (depth_ == 8) {
      row_->push_back(static_cast<png_byte>(value8));
    } else {
      packed(value8 >> (8 - depth_));
    }
  }
  // Appends a sample that is already in `depth_` bits (palette index).
  void packed(int value) {
    if (bits_used_ == 0) row_->push_back(0);
    bits_used_ += depth_;
    row_->back() = static_cast<png_byte>(row_->back() | (value << (8 - bits_used_)));
    if (bits_used_ == 8) bits_used_ = 0;
  }

 private:
  std::vector<png_byte>* row_;
  int depth_;
  int bits_used_ = 0;
};

std::vector<png_byte> render_row(const cs_icon& icon, int y) {
  const int n = icon.pixels;
  const cs_rgb background = cs_icon_background(icon);
  const cs_rgb square = inverse(background);
  std::vector<png_byte> row;
  RowWriter out(&row, icon.bit_depth);
  const bool row_in = y >= n / 4 && y < n - n / 4;
  for (int x = 0; x < n; ++x) {
    const bool in = row_in && x >= n / 4 && x < n - n / 4;
    const cs_rgb c = in ? square : background;
    const int alpha = in ? 128 : 255;
    switch (icon.color_type) {
      case cs_color_type::rgb:
      case cs_color_type::rgba:
        out.sample(c.r);
        out.sample(c.g);
        out.sample(c.b);
        if (icon.color_type == cs_color_type::rgba) out.sample(alpha);
        break;
      case cs_color_type::grey:
      case cs_color_type::grey_alpha:
        out.sample(cs_luminance(c));
        if (icon.color_type == cs_color_type::grey_alpha) out.sample(alpha);
        break;
      case cs_color_type::palette:
      case cs_color_type::palette_trns:
        out.packed(in ? 1 : 0);
        break;
    }
  }
  return row;
}

// Everything libpng may longjmp out of stays in this function, which holds
// no object with a destructor of its own.
bool write_png(PngWriter* w, const cs_icon& icon, std::vector<png_bytep>* rows, std::string* png) {
  if (setjmp(png_jmpbuf(w->png))) return false;
  png_set_write_fn(w->png, png, append_to_string, flush_nothing);
  const png_uint_32 n = static_cast<png_uint_32>(icon.pixels);
  png_set_IHDR(w->png, w->info, n, n, icon.bit_depth, png_color_type(icon.color_type),
               icon.interlaced ? PNG_INTERLACE_ADAM7 : PNG_INTERLACE_NONE,
               PNG_COMPRESSION_TYPE_DEFAULT, PNG_FILTER_TYPE_DEFAULT);
  if (icon.color_type == cs_color_type::palette || icon.color_type == cs_color_type::palette_trns) {
    const cs_rgb background = cs_icon_background(icon);
    const cs_rgb square = inverse(background);
    png_color palette[2] = {{background.r, background.g, background.b},
                            {square.r, square.g, square.b}};
    png_set_PLTE(w->png, w->info, palette, 2);
    if (icon.color_type == cs_color_type::palette_trns) {
      png_byte alpha[2] = {255, 128};
      png_set_tRNS(w->png, w->info, alpha, 2, nullptr);
    }
  }
  png_write_info(w->png, w->info);
  png_write_image(w->png, rows->data());
  png_write_end(w->png, nullptr);
  return true;
}

void put_chunk(std::string* out, const char* type, const std::string& data) {
  const uint32_t length = static_cast<uint32_t>(data.size());
  const unsigned char be[4] = {
      static_cast<unsigned char>(length >> 24), static_cast<unsigned char>(length >> 16),
      static_cast<unsigned char>(length >> 8), static_cast<unsigned char>(length)};
  out->append(reinterpret_cast<const char*>(be), 4);
  const std::string typed = std::string(type, 4) + data;
  out->append(typed);
  uLong crc = crc32(0L, Z_NULL, 0);
  crc = crc32(crc, reinterpret_cast<const Bytef*>(typed.data()), static_cast<uInt>(typed.size()));
  const unsigned char crc_be[4] = {
      static_cast<unsigned char>(crc >> 24), static_cast<unsigned char>(crc >> 16),
      static_cast<unsigned char>(crc >> 8), static_cast<unsigned char>(crc)};
  out->append(reinterpret_cast<const char*>(crc_be), 4);
}

}  // namespace

int cs_luminance(cs_rgb c) { return (299 * c.r + 587 * c.g + 114 * c.b) / 1000; }

cs_rgb cs_icon_background(const cs_icon& icon) {
  return icon.generation % 2 == 0 ? icon.color : inverse(icon.color);
}

bool cs_render_icon_png(const cs_icon& icon, std::string* png) {
  if (icon.pixels < 1) return false;
  std::vector<std::vector<png_byte>> rows;
  rows.reserve(static_cast<size_t>(icon.pixels));
  for (int y = 0; y < icon.pixels; ++y) rows.push_back(render_row(icon, y));
  std::vector<png_bytep> pointers;
  for (auto& row : rows) pointers.push_back(row.data());
  PngWriter writer;
  if (writer.png == nullptr || writer.info == nullptr) return false;
  std::string out;
  if (!write_png(&writer, icon, &pointers, &out)) return false;
  *png = std::move(out);
  return true;
}

std::string cs_huge_dimension_png() {
  constexpr uint32_t kSide = 100000;
  std::string png("\x89PNG\r\n\x1a\n", 8);
  std::string header;
  for (int i = 0; i < 2; ++i) {
    header.push_back(static_cast<char>(kSide >> 24));
    header.push_back(static_cast<char>((kSide >> 16) & 0xFF));
    header.push_back(static_cast<char>((kSide >> 8) & 0xFF));
    header.push_back(static_cast<char>(kSide & 0xFF));
  }
  header.append("\x08\x06\x00\x00\x00", 5);  // 8 bits, RGBA, deflate, filter 0, no interlace
  put_chunk(&png, "IHDR", header);
  // A few rows' worth of compressed zeros: far short of what the header claims.
  std::vector<Bytef> raw(4 * 1024, 0);
  uLongf packed_size = compressBound(static_cast<uLong>(raw.size()));
  std::vector<Bytef> packed(packed_size);
  if (compress2(packed.data(), &packed_size, raw.data(), static_cast<uLong>(raw.size()), 9) ==
      Z_OK) {
    put_chunk(&png, "IDAT", std::string(reinterpret_cast<const char*>(packed.data()), packed_size));
  }
  put_chunk(&png, "IEND", std::string());
  return png;
}

std::string cs_truncate_png(const std::string& png) {
  size_t offset = 8;
  while (offset + 8 <= png.size()) {
    const auto byte = [&png](size_t i) {
      return static_cast<uint32_t>(static_cast<uint8_t>(png[i]));
    };
    const uint32_t length =
        byte(offset) << 24 | byte(offset + 1) << 16 | byte(offset + 2) << 8 | byte(offset + 3);
    if (png.compare(offset + 4, 4, "IDAT") == 0) {
      return png.substr(0, offset + 8 + length / 2);
    }
    offset += 12 + static_cast<size_t>(length);
  }
  return png.substr(0, png.size() / 2);
}
