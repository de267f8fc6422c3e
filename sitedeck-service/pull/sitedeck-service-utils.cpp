// Icon files and pixel conversion. A downloaded touch icon lives in the images
// directory under a name derived from its URL; the storage step decodes it
// from memory into rows of B,G,R,A bytes (docs/storage.md) and then removes
// it. libpng reports errors by longjmp, so every libpng call sits in a small
// function that holds only plain pointers; the callers own and free everything
// and never keep an object with a destructor across the jump.
#include "pull/sitedeck-service-utils.h"

#include <dirent.h>
#include <glib.h>
#include <limits.h>
#include <png.h>
#include <unistd.h>

#include <csetjmp>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-types.h"

namespace {

// Hex digits of the URL hash in an icon file name.
constexpr size_t kIconHashDigits = 16;
// Longest part of the URL's last segment kept in a file name, so that
// hash, dash and segment stay below NAME_MAX.
constexpr size_t kIconSegmentMax = NAME_MAX - kIconHashDigits - 1 - 8;
// Largest image the decoder accepts: an icon is far smaller, and a PNG header
// claiming more must not make us allocate for it. Pixels that would not fit
// the shared-memory object could never be handed to the browser either.
constexpr png_uint_32 kMaxIconSide = 4096;
constexpr size_t kMaxRawBytes = SDS_SHM_SIZE;

// Why the last decode on this thread failed, for the caller's log line.
thread_local char t_png_failure[160];
// Largest PNG the encoder may produce.
constexpr size_t kMaxPngBytes = size_t{256} << 20;

// Read position over a PNG held in memory.
struct png_memory_source {
  const unsigned char* data;
  size_t length;
  size_t consumed;
};

// Write position over the encoder's output buffer, which grows on demand.
struct png_memory_sink {
  unsigned char* data;
  size_t capacity;
  size_t written;
};

// Everything a decode touches, kept in the caller's frame so that it survives
// a longjmp out of libpng.
struct png_decode_state {
  png_structp png;
  png_infop info;
  png_memory_source source;
  unsigned char* pixels;
  png_bytep* rows;
  png_uint_32 width;
  png_uint_32 height;
  size_t size;
};

struct png_encode_state {
  png_structp png;
  png_infop info;
  png_memory_sink sink;
  const unsigned char* raw;
  png_uint_32 width;
  png_uint_32 height;
  png_bytep* rows;
};

[[noreturn]] void png_error_jump(png_structp png, png_const_charp message) {
  (void)std::snprintf(t_png_failure, sizeof t_png_failure, "%s", message != nullptr ? message : "");
  png_longjmp(png, 1);
}

void png_warning_ignore(png_structp /*png*/, png_const_charp /*message*/) {}

void png_read_from_memory(png_structp png, png_bytep out, png_size_t count) {
  auto* source = static_cast<png_memory_source*>(png_get_io_ptr(png));
  if (source == nullptr || count > source->length - source->consumed) {
    png_error(png, "read past the end of the PNG data");
  }
  std::memcpy(out, source->data + source->consumed, count);
  source->consumed += count;
}

void png_write_to_memory(png_structp png, png_bytep in, png_size_t count) {
  auto* sink = static_cast<png_memory_sink*>(png_get_io_ptr(png));
  if (count > sink->capacity - sink->written) {
    size_t needed = sink->written + count;
    if (count > kMaxPngBytes || needed > kMaxPngBytes) png_error(png, "PNG output too large");
    size_t capacity = sink->capacity;
    while (capacity < needed) capacity = capacity * 2 < kMaxPngBytes ? capacity * 2 : kMaxPngBytes;
    auto* grown = static_cast<unsigned char*>(std::realloc(sink->data, capacity));
    if (grown == nullptr) png_error(png, "out of memory for PNG output");
    sink->data = grown;
    sink->capacity = capacity;
  }
  std::memcpy(sink->data + sink->written, in, count);
  sink->written += count;
}

void png_flush_nothing(png_structp /*png*/) {}

// All libpng reading happens here. Returns 0, or -1 after a libpng error;
// whatever was allocated is left in `state` for the caller to free.
int png_decode(png_decode_state* state) {
  png_structp png = state->png;
  png_infop info = state->info;
  png_set_read_fn(png, &state->source, png_read_from_memory);
  if (setjmp(png_jmpbuf(png))) {
    SDS_LOGE("Error during init_io");
    return -1;
  }
  png_set_user_limits(png, kMaxIconSide, kMaxIconSide);
  png_read_info(png, info);
  state->width = png_get_image_width(png, info);
  state->height = png_get_image_height(png, info);
  // Checked before anything is allocated for the pixels: a small file can
  // claim a very large image.
  if (size_t{state->width} * state->height * 4 > kMaxRawBytes) {
    png_error(png, "its pixels would exceed the 3145728 bytes of the shared memory");
  }
  int bit_depth = png_get_bit_depth(png, info);
  int color_type = png_get_color_type(png, info);

  if (png_get_valid(png, info, PNG_INFO_tRNS) != 0) png_set_tRNS_to_alpha(png);
  if (color_type == PNG_COLOR_TYPE_GRAY || color_type == PNG_COLOR_TYPE_GRAY_ALPHA) {
    png_set_gray_to_rgb(png);
    if (bit_depth < 8) png_set_expand_gray_1_2_4_to_8(png);
  }
  if (color_type == PNG_COLOR_TYPE_PALETTE) png_set_palette_to_rgb(png);
  // Grey gets the filler too, so that every stored pixel has four bytes; an
  // image that already carries alpha (or got it from tRNS) is left alone.
  if (color_type == PNG_COLOR_TYPE_PALETTE || color_type == PNG_COLOR_TYPE_RGB ||
      color_type == PNG_COLOR_TYPE_GRAY) {
    png_set_add_alpha(png, 0xFF, PNG_FILLER_AFTER);
    png_set_filler(png, 0xFF, PNG_FILLER_AFTER);
  }
  if (bit_depth < 8) {
    png_set_packing(png);
  } else if (bit_depth > 8) {
    png_set_strip_16(png);
  }
  png_set_bgr(png);
  (void)png_set_interlace_handling(png);
  png_read_update_info(png, info);

  size_t row_bytes = png_get_rowbytes(png, info);
  if (row_bytes != size_t{state->width} * 4) png_error(png, "unexpected pixel layout");
  state->size = row_bytes * state->height;
  if (state->size == 0 || state->size > kMaxRawBytes) png_error(png, "image too large");
  state->pixels = static_cast<unsigned char*>(std::malloc(state->size));
  state->rows = static_cast<png_bytep*>(std::calloc(state->height, sizeof(png_bytep)));
  if (state->pixels == nullptr || state->rows == nullptr) png_error(png, "out of memory");
  for (png_uint_32 i = 0; i < state->height; ++i) state->rows[i] = state->pixels + i * row_bytes;
  png_read_image(png, state->rows);
  return 0;
}

// All libpng writing happens here; see png_decode.
int png_encode(png_encode_state* state) {
  png_structp png = state->png;
  png_infop info = state->info;
  if (setjmp(png_jmpbuf(png))) {
    SDS_LOGE("Error during init_io");
    return -1;
  }
  png_set_write_fn(png, &state->sink, png_write_to_memory, png_flush_nothing);
  png_set_IHDR(png, info, state->width, state->height, 8, PNG_COLOR_TYPE_RGB_ALPHA,
               PNG_INTERLACE_NONE, PNG_COMPRESSION_TYPE_DEFAULT, PNG_FILTER_TYPE_DEFAULT);
  png_set_bgr(png);
  size_t row_bytes = size_t{state->width} * 4;
  for (png_uint_32 i = 0; i < state->height; ++i) {
    // libpng copies each row before transforming it; the input stays untouched.
    state->rows[i] = const_cast<png_bytep>(state->raw + i * row_bytes);
  }
  png_set_rows(png, info, state->rows);
  png_write_png(png, info, PNG_TRANSFORM_IDENTITY, nullptr);
  return 0;
}

}  // namespace

char* get_icon_path(const char* icon_url) {
  if (icon_url == nullptr) {
    SDS_LOGE("icon_url is NULL");
    return nullptr;
  }
  const char* slash = std::strrchr(icon_url, '/');
  if (slash == nullptr) {
    SDS_LOGE("icon name is NULL");
    return nullptr;
  }
  // Icons of different sites often share a last segment ("apple-touch-icon.png"),
  // so the name starts with a hash of the whole URL and keeps the segment only
  // for people reading the directory.
  gchar* digest = g_compute_checksum_for_string(G_CHECKSUM_SHA256, icon_url, -1);
  if (digest == nullptr) {
    SDS_LOGE("failed to malloc");
    return nullptr;
  }
  const char* segment = slash + 1;
  int segment_length = static_cast<int>(strnlen(segment, kIconSegmentMax));
  std::string images = sds_path(SDS_IMAGES_DIR);
  int length = std::snprintf(nullptr, 0, "%s/%.*s-%.*s", images.c_str(),
                             static_cast<int>(kIconHashDigits), digest, segment_length, segment);
  auto* path = length < 0 ? nullptr : static_cast<char*>(std::malloc(size_t(length) + 1));
  if (path == nullptr) {
    g_free(digest);
    SDS_LOGE("failed to malloc");
    return nullptr;
  }
  (void)std::snprintf(path, size_t(length) + 1, "%s/%.*s-%.*s", images.c_str(),
                      static_cast<int>(kIconHashDigits), digest, segment_length, segment);
  g_free(digest);
  return path;
}

int convert_png_to_raw_data(const unsigned char* png, size_t png_length, unsigned char** raw_data,
                            int* width, int* height, int* size) {
  if (raw_data == nullptr || width == nullptr || height == nullptr || size == nullptr) return -1;
  t_png_failure[0] = '\0';
  if (png == nullptr || png_length < 8 || png_sig_cmp(png, 0, 8) != 0) {
    SDS_LOGE("not recognized as a PNG");
    (void)std::snprintf(t_png_failure, sizeof t_png_failure, "not a PNG");
    return -1;
  }
  png_decode_state state{};
  state.source = {png, png_length, 0};
  state.png =
      png_create_read_struct(PNG_LIBPNG_VER_STRING, nullptr, png_error_jump, png_warning_ignore);
  if (state.png == nullptr) {
    SDS_LOGE("png_create_read_struct failed");
    return -1;
  }
  state.info = png_create_info_struct(state.png);
  if (state.info == nullptr) {
    SDS_LOGE("png_create_info_struct failed");
    png_destroy_read_struct(&state.png, nullptr, nullptr);
    return -1;
  }
  int result = png_decode(&state);
  png_destroy_read_struct(&state.png, &state.info, nullptr);
  std::free(state.rows);
  if (result != 0) {
    std::free(state.pixels);
    return -1;
  }
  *raw_data = state.pixels;
  *width = static_cast<int>(state.width);
  *height = static_cast<int>(state.height);
  *size = static_cast<int>(state.size);
  return 0;
}

const char* sds_png_failure(void) { return t_png_failure; }

int sds_images_sweep(void) {
  const std::string dir = sds_path(SDS_IMAGES_DIR);
  DIR* raw = opendir(dir.c_str());
  if (raw == nullptr) return 0;
  int removed = 0;
  const int dir_fd = dirfd(raw);
  while (const struct dirent* entry = readdir(raw)) {
    if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
    // unlinkat removes a symlink itself, never what it points at.
    if (unlinkat(dir_fd, entry->d_name, 0) == 0) ++removed;
  }
  (void)closedir(raw);
  if (removed > 0) SDS_LOGE("%d icon files left by an earlier pull removed", removed);
  return removed;
}

int convert_raw_data_to_png(const unsigned char* raw_data, int width, int height,
                            unsigned char** png, int* png_size) {
  if (width <= 0 || height <= 0 || raw_data == nullptr || png == nullptr || png_size == nullptr) {
    return -1;
  }
  // The PNG size travels as an int; refuse inputs whose pixels alone exceed it.
  if (static_cast<long long>(width) * height * 4 > INT_MAX) return -1;
  png_encode_state state{};
  state.raw = raw_data;
  state.width = static_cast<png_uint_32>(width);
  state.height = static_cast<png_uint_32>(height);
  state.png =
      png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, png_error_jump, png_warning_ignore);
  if (state.png == nullptr) {
    SDS_LOGE("png_create_write_struct failed");
    return -1;
  }
  state.info = png_create_info_struct(state.png);
  if (state.info == nullptr) {
    SDS_LOGE("png_create_info_struct failed");
    png_destroy_write_struct(&state.png, nullptr);
    return -1;
  }
  // The first guess holds the pixels; incompressible data makes the PNG a
  // little longer, and the sink then grows the buffer.
  state.sink.capacity = size_t(width) * size_t(height) * 4;
  state.sink.data = static_cast<unsigned char*>(std::calloc(state.sink.capacity, 1));
  state.rows = static_cast<png_bytep*>(std::calloc(state.height, sizeof(png_bytep)));
  int result = -1;
  if (state.sink.data == nullptr || state.rows == nullptr) {
    SDS_LOGE("malloc failed");
  } else {
    result = png_encode(&state);
  }
  png_destroy_write_struct(&state.png, &state.info);
  std::free(state.rows);
  if (result != 0 || state.sink.written > INT_MAX) {
    std::free(state.sink.data);
    return -1;
  }
  *png = state.sink.data;
  *png_size = static_cast<int>(state.sink.written);
  return 0;
}

int remove_file(const char* path) {
  if (path == nullptr || path[0] == '\0') {
    SDS_LOGE("Failed to remove file Path is invalid");
    return -1;
  }
  if (unlink(path) != 0) {
    SDS_LOGE("Failed to remove file in the path");
    return -1;
  }
  return 0;
}
