// Icons in the item table: reading an item's pixel rows with the width and
// height its icon_size text gives, and storing a downloaded PNG file as pixel
// rows. The stored icon_size always describes the stored pixels, so a reader
// can rely on byte count = width * height * 4 (docs/storage.md). The PNG file
// is removed once it has been looked at, whether or not it could be stored.
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "pull/sitedeck-service-db-merge.h"
#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-error.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-utils.h"

namespace {

constexpr const char* kSiteDeck = "site_deck";
// Largest icon file read into memory; real touch icons are a few KiB.
constexpr long kMaxIconFileBytes = 16L << 20;

// Reads and decodes the icon file at `path` into `out`; returns the code.
// A refused icon is logged with its site and URL.
int load_icon_file(const char* site_url, const sds_icon* icon, const char* path,
                   sds_icon_columns* out) {
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
    SDS_LOGE("icon %s of %s not stored: larger than %ld bytes", icon->icon_path, site_url,
             kMaxIconFileBytes);
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
    SDS_LOGE("icon %s of %s not stored: %s", icon->icon_path, site_url, sds_png_failure());
    return SDS_ERROR_IO_ERROR;
  }
  out->pixels.reset(raw_pixels);
  out->pixel_bytes = size;
  out->icon_path = icon->icon_path;

  // The server's size text is kept when it describes the decoded pixels;
  // otherwise (empty, or a different size) the decoded size replaces it.
  std::memset(out->icon_size, 0, sizeof out->icon_size);
  std::memcpy(out->icon_size, icon->icon_size, sizeof icon->icon_size);
  int text_width = 0;
  int text_height = 0;
  if (!sds_db_parse_icon_size(out->icon_size, &text_width, &text_height) || text_width != width ||
      text_height != height) {
    char decoded[32];
    (void)std::snprintf(decoded, sizeof decoded, "%dx%d", width, height);
    std::memcpy(out->icon_size, decoded, sizeof out->icon_size - 1);
    out->icon_size[sizeof out->icon_size - 1] = '\0';
  }
  std::memset(out->last_modified, 0, sizeof out->last_modified);
  std::memcpy(out->last_modified, icon->last_modified, sizeof icon->last_modified);
  return SDS_ERROR_NONE;
}


// Checks the item and loads its one icon from the icon file; the path of
// that file goes to `*path` (null when there is none) for the caller to remove.
int load_item_icon(const sds_item* item, sds_icon_columns* out, UniqueCStr* path) {
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
  return load_icon_file(item->site_url, icon, path->get(), out);
}

// Writes one icon column; the code replaces `code` and is logged if not 0.
void write_icon_column(int id, const sds_db_column_value& value, int* code) {
  (void)sds_db_column_replace(sds_db_handle, id, kSiteDeck, value.column, value.value, value.length,
                              value.value_type, code);
  if (*code != SDS_ERROR_NONE) SDS_LOGE("Error : %s", sds_error_string(*code));
}

}  // namespace

int sds_icon_columns_values(const sds_icon_columns& icon, sds_db_column_value* values) {
  int count = 0;
  values[count++] = {"icon_data", icon.pixels.get(), icon.pixel_bytes, SDS_DB_COLUMN_TYPE_BLOB};
  if (icon.icon_path != nullptr) {
    values[count++] = {"icon_path", icon.icon_path, 0, SDS_DB_COLUMN_TYPE_TEXT};
  }
  values[count++] = {"icon_size", icon.icon_size, 0, SDS_DB_COLUMN_TYPE_TEXT};
  if (icon.last_modified[0] != '\0') {
    values[count++] = {"image_last_updated", icon.last_modified, 0, SDS_DB_COLUMN_TYPE_TEXT};
  }
  return count;
}

int update_sitedeck_icon_to_db(int id, sds_item* item) {
  UniqueCStr path;
  sds_icon_columns icon;
  int code = load_item_icon(item, &icon, &path);
  if (code == SDS_ERROR_NONE) {
    sds_db_column_value values[SDS_ICON_COLUMNS_MAX];
    int count = sds_icon_columns_values(icon, values);
    for (int i = 0; i < count; ++i) write_icon_column(id, values[i], &code);
  }
  if (path) (void)remove_file(path.get());
  return code;
}

int sds_load_sitedeck_icon_columns(const sds_item* item, sds_icon_columns* out) {
  UniqueCStr path;
  return load_item_icon(item, out, &path);
}
