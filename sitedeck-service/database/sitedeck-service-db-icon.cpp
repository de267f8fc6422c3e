// Icons in the item table, the data pull's half: storing a downloaded PNG
// file as pixel rows (the reading half, for command 7, is in
// sitedeck-service-db-icon-read.cpp). The stored icon_size always describes
// the stored pixels, so a reader can rely on byte count = width * height * 4
// (docs/storage.md). The PNG file is removed once it has been looked at,
// whether or not it could be stored.
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-utils.h"

namespace {

constexpr const char* kSiteDeck = "site_deck";
// Largest icon file read into memory; real touch icons are a few KiB.
constexpr long kMaxIconFileBytes = 16L << 20;

// Writes one icon column; the code replaces `code` and is logged if not 0.
void write_icon_column(int id, const char* column, const void* value, int length, int type,
                       int* code) {
  (void)sds_db_column_replace(sds_db_handle, id, kSiteDeck, column, value, length, type, code);
  if (*code != SDS_ERROR_NONE) SDS_LOGE("Error : %s", sds_error_string(*code));
}

// Reads, decodes and stores the icon file at `path`; returns the code.
int store_icon_file(int id, const sds_icon* icon, const char* path) {
  UniqueFile file(std::fopen(path, "rb"));
  if (!file) {
    SDS_LOGE("Failed to open file");
    return SDS_ERROR_IO_ERROR;
  }
  long length = -1;
  if (std::fseek(file.get(), 0, SEEK_END) == 0) length = std::ftell(file.get());
  if (length <= 0 || std::fseek(file.get(), 0, SEEK_SET) != 0) {
    SDS_LOGE("ftell failed");
    return SDS_ERROR_IO_ERROR;
  }
  if (length > kMaxIconFileBytes) {
    SDS_LOGE("icon file too large: %ld bytes", length);
    return SDS_ERROR_IO_ERROR;
  }
  UniqueMalloc<unsigned char> png(static_cast<unsigned char*>(std::malloc(size_t(length))));
  if (!png) {
    SDS_LOGE("failed to malloc");
    return SDS_ERROR_OUT_OF_MEMORY;
  }
  if (std::fread(png.get(), 1, size_t(length), file.get()) != size_t(length)) {
    SDS_LOGE("Some error ocured while reading file [%s]", std::strerror(errno));
    return SDS_ERROR_IO_ERROR;
  }
  file.reset();

  unsigned char* raw_pixels = nullptr;
  int width = 0;
  int height = 0;
  int size = 0;
  if (convert_png_to_raw_data(png.get(), size_t(length), &raw_pixels, &width, &height, &size) !=
      0) {
    SDS_LOGE("some error occured while converting data");
    return SDS_ERROR_IO_ERROR;
  }
  UniqueMalloc<unsigned char> pixels(raw_pixels);

  // The server's size text is kept when it describes the decoded pixels;
  // otherwise (empty, or a different size) the decoded size replaces it.
  char size_text[sizeof icon->icon_size + 1] = {};
  std::memcpy(size_text, icon->icon_size, sizeof icon->icon_size);
  int text_width = 0;
  int text_height = 0;
  if (!sds_db_parse_icon_size(size_text, &text_width, &text_height) || text_width != width ||
      text_height != height) {
    char decoded[32];
    (void)std::snprintf(decoded, sizeof decoded, "%dx%d", width, height);
    std::memcpy(size_text, decoded, sizeof size_text - 1);
    size_text[sizeof size_text - 1] = '\0';
  }
  char last_modified[sizeof icon->last_modified + 1] = {};
  std::memcpy(last_modified, icon->last_modified, sizeof icon->last_modified);

  int code = SDS_ERROR_NONE;
  write_icon_column(id, "icon_data", pixels.get(), size, SDS_DB_COLUMN_TYPE_BLOB, &code);
  if (icon->icon_path != nullptr) {
    write_icon_column(id, "icon_path", icon->icon_path, 0, SDS_DB_COLUMN_TYPE_TEXT, &code);
  }
  write_icon_column(id, "icon_size", size_text, 0, SDS_DB_COLUMN_TYPE_TEXT, &code);
  if (last_modified[0] != '\0') {
    write_icon_column(id, "image_last_updated", last_modified, 0, SDS_DB_COLUMN_TYPE_TEXT, &code);
  }
  return code;
}

// Checks the item and stores its one icon from the icon file; the path of
// that file goes to `*path` (null when there is none) for the caller to remove.
int store_item_icon(int id, const sds_item* item, UniqueCStr* path) {
  if (item == nullptr) {
    SDS_LOGE("NULL check::item");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (item->site_url == nullptr) {
    SDS_LOGE("NULL check::item->site_url");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (item->ps_sds_icon_list == nullptr) {
    SDS_LOGE("NULL check::item->ps_sds_icon_list");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  const sds_icon* icon = item->ps_sds_icon_list;
  path->reset(get_icon_path(icon->icon_path));
  if (!*path) {
    SDS_LOGE("NULL check::icon_path");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return store_icon_file(id, icon, path->get());
}

}  // namespace

int update_sitedeck_icon_to_db(int id, sds_item* item) {
  UniqueCStr path;
  int code = store_item_icon(id, item, &path);
  if (path) (void)remove_file(path.get());
  return code;
}

int sds_store_sitedeck_icon_keep_file(int id, const sds_item* item) {
  UniqueCStr path;
  return store_item_icon(id, item, &path);
}
