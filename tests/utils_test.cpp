#include <gtest/gtest.h>
#include <limits.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "sitedeck-service-paths.h"
#include "pull/sitedeck-service-utils.h"
#include "support/log_capture.h"
#include "support/png_maker.h"
#include "support/temp_root.h"

namespace {

// Output of one decode; the sentinels show that a failure wrote nothing.
struct Decoded {
  int result = 0;
  unsigned char* raw = reinterpret_cast<unsigned char*>(0x1);
  int width = -7, height = -7, size = -7;
  std::vector<uint8_t> bytes;
};

// Decodes from an exactly sized heap copy, so that a read past the end of
// the input is caught by the address sanitizer.
Decoded decode(const std::string& png) {
  Decoded out;
  auto* copy = static_cast<unsigned char*>(std::malloc(png.empty() ? 1 : png.size()));
  std::memcpy(copy, png.data(), png.size());
  out.result =
      convert_png_to_raw_data(copy, png.size(), &out.raw, &out.width, &out.height, &out.size);
  std::free(copy);
  if (out.result == 0) {
    out.bytes.assign(out.raw, out.raw + out.size);
    std::free(out.raw);
  }
  return out;
}

void expect_untouched(const Decoded& d) {
  EXPECT_EQ(d.raw, reinterpret_cast<unsigned char*>(0x1));
  EXPECT_EQ(d.width, -7);
  EXPECT_EQ(d.height, -7);
  EXPECT_EQ(d.size, -7);
}

struct ColourCase {
  const char* name;
  int color_type;
  int bit_depth;
  bool trns;
  bool interlaced;
  int width;
  int height;
};

const ColourCase kColourCases[] = {
    {"grey1", 0, 1, false, false, 11, 3},
    {"grey8", 0, 8, false, false, 5, 3},
    {"grey16", 0, 16, false, false, 5, 3},
    {"grey2_trns", 0, 2, true, false, 7, 3},
    {"grey8_trns", 0, 8, true, false, 5, 3},
    {"grey16_trns", 0, 16, true, false, 5, 3},
    {"rgb8", 2, 8, false, false, 5, 3},
    {"rgb16", 2, 16, false, false, 5, 3},
    {"rgb8_trns", 2, 8, true, false, 5, 3},
    {"palette1", 3, 1, false, false, 9, 2},
    {"palette8", 3, 8, false, false, 9, 2},
    {"palette4_trns", 3, 4, true, false, 9, 2},
    {"palette8_trns", 3, 8, true, false, 9, 2},
    {"grey_alpha8", 4, 8, false, false, 5, 3},
    {"grey_alpha16", 4, 16, false, false, 5, 3},
    {"rgba8", 6, 8, false, false, 5, 3},
    {"rgba16", 6, 16, false, false, 5, 3},
    {"rgba8_interlaced", 6, 8, false, true, 9, 7},
    {"grey4_interlaced", 0, 4, false, true, 9, 7},
    {"palette2_trns_interlaced", 3, 2, true, true, 9, 7},
};

PngImage colour_case_image(const ColourCase& c) {
  PngImage image = png_pattern(c.width, c.height, c.color_type, c.bit_depth, c.interlaced);
  if (c.trns) {
    image.has_trns = true;
    // The first pixel's value is the transparent one, so some pixels get
    // alpha 0 and the others 255.
    image.trns_grey = image.samples[0];
    if (c.color_type == 2) {
      image.trns_red = image.samples[0];
      image.trns_green = image.samples[1];
      image.trns_blue = image.samples[2];
    }
    // Shorter than the palette: the remaining entries are opaque.
    image.trns_alpha = {0, 64, 128, 200, 7};
    size_t entries = image.palette.size() / 3;
    if (c.color_type == 3 && image.trns_alpha.size() >= entries)
      image.trns_alpha.resize(entries - 1);
  }
  return image;
}

TEST(ConvertPngToRawData, EveryColourTypeGivesFourBytesPerPixelBgra) {
  for (const ColourCase& c : kColourCases) {
    SCOPED_TRACE(c.name);
    PngImage image = colour_case_image(c);
    Decoded d = decode(png_encode_image(image));
    ASSERT_EQ(d.result, 0);
    EXPECT_EQ(d.width, c.width);
    EXPECT_EQ(d.height, c.height);
    EXPECT_EQ(d.size, c.width * c.height * 4);
    EXPECT_EQ(d.bytes, png_expected_bgra(image));
  }
}

TEST(ConvertPngToRawData, GreyWithoutTransparencyNoLongerGivesThreeBytesPerPixel) {
  PngImage image;
  image.width = 2;
  image.height = 2;
  image.color_type = 0;
  image.samples = {0, 85, 170, 255};
  Decoded d = decode(png_encode_image(image));
  ASSERT_EQ(d.result, 0);
  EXPECT_EQ(d.size, 16);
  EXPECT_EQ(d.bytes, (std::vector<uint8_t>{0, 0, 0, 255, 85, 85, 85, 255, 170, 170, 170, 255, 255,
                                           255, 255, 255}));
}

TEST(ConvertPngToRawData, OnePixelRgbIsBgrAndOpaque) {
  PngImage image;
  image.color_type = 2;
  image.samples = {10, 20, 30};
  EXPECT_EQ(decode(png_encode_image(image)).bytes, (std::vector<uint8_t>{30, 20, 10, 255}));
}

TEST(ConvertPngToRawData, TruncatedPngIsAnErrorNotAReadPastTheEnd) {
  std::string png = png_encode_image(png_pattern(40, 40, 6, 8));
  ASSERT_GT(png.size(), 100u);
  for (size_t keep : {png.size() - 20, png.size() / 2, size_t{40}, size_t{8}}) {
    SCOPED_TRACE(keep);
    LogCapture log;
    Decoded d = decode(png.substr(0, keep));
    EXPECT_EQ(d.result, -1);
    expect_untouched(d);
    EXPECT_TRUE(log.contains("Error during init_io"));
  }
}

TEST(ConvertPngToRawData, InputThatIsNoPngIsRefused) {
  const std::string inputs[] = {"", "\x89PNG\r\n", "GIF89a-not-a-png-at-all", "\x89PNG\r\n\x1b\n"};
  for (const std::string& input : inputs) {
    LogCapture log;
    Decoded d = decode(input);
    EXPECT_EQ(d.result, -1);
    expect_untouched(d);
    EXPECT_TRUE(log.contains("not recognized as a PNG"));
  }
  LogCapture log;
  unsigned char* raw = nullptr;
  int w = 0, h = 0, s = 0;
  EXPECT_EQ(convert_png_to_raw_data(nullptr, 100, &raw, &w, &h, &s), -1);
  EXPECT_TRUE(log.contains("not recognized as a PNG"));
}

uint32_t crc32_of(const std::string& bytes) {
  uint32_t crc = 0xFFFFFFFFu;
  for (unsigned char b : bytes) {
    crc ^= b;
    for (int k = 0; k < 8; ++k) crc = (crc >> 1) ^ (0xEDB88320u & (0u - (crc & 1u)));
  }
  return ~crc;
}

std::string be32(uint32_t v) { return {char(v >> 24), char(v >> 16), char(v >> 8), char(v)}; }

// A PNG whose header claims the given size; its image data is one tiny
// deflate stream that could never fill it.
std::string png_claiming(uint32_t width, uint32_t height) {
  std::string ihdr = "IHDR" + be32(width) + be32(height) + std::string("\x08\x06\x00\x00\x00", 5);
  std::string idat = "IDAT" + std::string("\x78\x9c\x03\x00\x00\x00\x00\x01", 8);
  std::string png = "\x89PNG\r\n\x1a\n";
  png += be32(13) + ihdr + be32(crc32_of(ihdr));
  png += be32(8) + idat + be32(crc32_of(idat));
  return png;
}

TEST(ConvertPngToRawData, HugeClaimedDimensionsAreRefusedBeforeAllocating) {
  for (auto [w, h] : {std::pair{100000u, 100000u}, std::pair{4097u, 1u}, std::pair{1u, 4097u},
                      std::pair{2000000000u, 2000000000u}}) {
    SCOPED_TRACE(std::to_string(w) + "x" + std::to_string(h));
    LogCapture log;
    Decoded d = decode(png_claiming(w, h));
    EXPECT_EQ(d.result, -1);
    expect_untouched(d);
    EXPECT_TRUE(log.contains("Error during init_io"));
  }
}

struct Encoded {
  int result = 0;
  std::string png;
};

Encoded encode(const std::vector<uint8_t>& raw, int width, int height) {
  Encoded out;
  unsigned char* png = nullptr;
  int size = 0;
  out.result = convert_raw_data_to_png(raw.data(), width, height, &png, &size);
  if (out.result == 0) {
    out.png.assign(reinterpret_cast<char*>(png), size_t(size));
    std::free(png);
  }
  return out;
}

// Encodes and decodes `raw`; the PNG's size, or 0 on failure.
size_t round_trip(const std::vector<uint8_t>& raw, int w, int h) {
  SCOPED_TRACE(std::to_string(w) + "x" + std::to_string(h));
  Encoded e = encode(raw, w, h);
  EXPECT_EQ(e.result, 0);
  Decoded d = decode(e.png);
  EXPECT_EQ(d.result, 0);
  EXPECT_EQ(d.width, w);
  EXPECT_EQ(d.height, h);
  EXPECT_EQ(d.bytes, raw);
  return e.result == 0 ? e.png.size() : 0;
}

TEST(ConvertRawDataToPng, RoundTripGivesBackTheSameBytes) {
  for (auto [w, h] : {std::pair{1, 1}, std::pair{3, 2}, std::pair{37, 23}}) {
    std::vector<uint8_t> raw(size_t(w) * h * 4);
    for (size_t i = 0; i < raw.size(); ++i) raw[i] = uint8_t(i * 29 + 3);
    round_trip(raw, w, h);
  }
}

TEST(ConvertRawDataToPng, IncompressiblePixelsNoLongerOverrunTheOutputBuffer) {
  for (auto [w, h] : {std::pair{1, 1}, std::pair{64, 64}, std::pair{300, 7}}) {
    std::vector<uint8_t> raw = noise_bytes(size_t(w) * h * 4, 42);
    // The PNG is longer than the first guess of w*h*4 bytes.
    EXPECT_GT(round_trip(raw, w, h), raw.size());
  }
}

TEST(ConvertRawDataToPng, RefusesEmptyImages) {
  std::vector<uint8_t> raw(16);
  unsigned char* png = reinterpret_cast<unsigned char*>(0x1);
  int size = -3;
  EXPECT_EQ(convert_raw_data_to_png(raw.data(), 0, 2, &png, &size), -1);
  EXPECT_EQ(convert_raw_data_to_png(raw.data(), 2, -1, &png, &size), -1);
  EXPECT_EQ(convert_raw_data_to_png(nullptr, 2, 2, &png, &size), -1);
  EXPECT_EQ(png, reinterpret_cast<unsigned char*>(0x1));
  EXPECT_EQ(size, -3);
}

std::string icon_path(const char* url) {
  char* path = get_icon_path(url);
  std::string out = path != nullptr ? path : "<null>";
  std::free(path);
  return out;
}

TEST(GetIconPath, NameIsUrlHashThenLastSegment) {
  TempRoot root;
  std::string images = root.path(SDS_IMAGES_DIR);
  EXPECT_EQ(icon_path("https://a.example/icons/i.png?x=1"), images + "/ea799797bb188d7c-i.png?x=1");
  EXPECT_EQ(icon_path("https://b.example/dir/"), images + "/47a709e7214c5367-");
}

TEST(GetIconPath, IconsSharingALastSegmentNoLongerShareAFile) {
  TempRoot root;
  std::string a = icon_path("https://a.example/apple-touch-icon.png");
  std::string b = icon_path("https://b.example/apple-touch-icon.png");
  EXPECT_NE(a, b);
  EXPECT_EQ(a.substr(a.size() - 21), "-apple-touch-icon.png");
  EXPECT_EQ(b.substr(b.size() - 21), "-apple-touch-icon.png");
}

TEST(GetIconPath, LongLastSegmentIsCutBelowNameMax) {
  TempRoot root;
  std::string segment(1000, 'n');
  std::string path = icon_path(("https://a.example/" + segment).c_str());
  std::string name = path.substr(path.rfind('/') + 1);
  EXPECT_LT(name.size(), size_t{NAME_MAX});
  EXPECT_EQ(name.substr(16, 1), "-");
  EXPECT_EQ(name.substr(17), segment.substr(0, name.size() - 17));
}

TEST(GetIconPath, UrlWithoutSlashOrNoUrlGivesNothing) {
  LogCapture log;
  EXPECT_EQ(get_icon_path("no-slash-here.png"), nullptr);
  EXPECT_TRUE(log.contains("icon name is NULL"));
  EXPECT_EQ(get_icon_path(nullptr), nullptr);
  EXPECT_TRUE(log.contains("icon_url is NULL"));
}

TEST(RemoveFile, RemovesOrSaysWhyNot) {
  TempRoot root;
  LogCapture log;
  std::string path = root.path(SDS_IMAGES_DIR "/x.png");
  ASSERT_TRUE(write_file(path, "x"));
  EXPECT_EQ(remove_file(path.c_str()), 0);
  EXPECT_FALSE(file_exists(path));
  EXPECT_TRUE(log.lines().empty());

  EXPECT_EQ(remove_file(path.c_str()), -1);
  EXPECT_TRUE(log.contains("Failed to remove file in the path"));
  EXPECT_EQ(remove_file(""), -1);
  EXPECT_EQ(remove_file(nullptr), -1);
  EXPECT_EQ(log.count("Failed to remove file Path is invalid"), 2);
}

}  // namespace
