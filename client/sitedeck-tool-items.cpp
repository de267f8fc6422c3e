// The `sitedeck` subcommands that show the stored deck: `list` (a table of the
// live items), `show ID` (every field of one item) and `icon ID -o FILE`
// (the item's pixels written back out as a PNG file).
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "sitedeck-client-deck.h"
#include "sitedeck-service-ipc.h"
#include "sitedeck-service-utils.h"
#include "sitedeck-tool.h"

namespace {

// Longest title and URL the table shows, in characters; longer ones are cut.
constexpr size_t kTitleColumnMax = 32;
constexpr size_t kUrlColumnMax = 48;
constexpr char kMissing[] = "-";

// Characters of a UTF-8 text: bytes that do not continue a sequence.
size_t __utf8_length(const std::string& text) {
  size_t count = 0;
  for (unsigned char c : text) count += (c & 0xC0) != 0x80;
  return count;
}

// `text` cut to at most `max` characters, "..." marking a cut.
std::string __fit(const std::string& text, size_t max) {
  if (__utf8_length(text) <= max) return text;
  size_t keep = max - 3, seen = 0, end = 0;
  for (; end < text.size(); ++end) {
    if ((static_cast<unsigned char>(text[end]) & 0xC0) != 0x80 && seen++ == keep) break;
  }
  return text.substr(0, end) + "...";
}

std::string __text_or_missing(const UniqueCStr& value) { return value ? value.get() : kMissing; }

std::string __flags(const sds_client_item& item) {
  std::string flags;
  if (item.touch_icon_exists != 0) flags = "touch";
  if (item.favicon_exists != 0) flags += flags.empty() ? "favicon" : ",favicon";
  return flags.empty() ? kMissing : flags;
}

// Left-aligned cells padded to `widths`, the last one unpadded.
void __print_row(const std::vector<std::string>& cells, const std::vector<size_t>& widths) {
  std::string line;
  for (size_t i = 0; i < cells.size(); ++i) {
    line += cells[i];
    if (i + 1 < cells.size()) line.append(widths[i] - __utf8_length(cells[i]) + 2, ' ');
  }
  std::printf("%s\n", line.c_str());
}

}  // namespace

int sds_tool_list(SdsConnection& connection, int argc, char** /*argv*/) {
  if (argc != 0) return kSdsToolUsage;
  sds_client_ids ids;
  int status = sds_client_get_full_ids(connection, &ids);
  if (status != SDS_ERROR_NONE && status != SDS_ERROR_NO_DATA) return status;

  std::vector<std::vector<std::string>> rows = {{"ID", "TITLE", "URL", "COLOUR", "ICON", "FLAGS"}};
  for (int32_t i = 0; i < ids.count; ++i) {
    sds_client_item item;
    status = sds_client_read_item(connection, ids.ids.get()[i], false, &item);
    if (status != SDS_ERROR_NONE) return status;
    rows.push_back({std::to_string(item.id), __fit(__text_or_missing(item.title), kTitleColumnMax),
                    __fit(__text_or_missing(item.url), kUrlColumnMax),
                    __text_or_missing(item.dominant_color), __text_or_missing(item.icon_size),
                    __flags(item)});
  }
  std::vector<size_t> widths(rows[0].size(), 0);
  for (const auto& row : rows) {
    for (size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], __utf8_length(row[i]));
  }
  for (const auto& row : rows) __print_row(row, widths);
  return SDS_ERROR_NONE;
}

int sds_tool_show(SdsConnection& connection, int argc, char** argv) {
  int32_t id = 0;
  if (argc != 1 || !sds_tool_parse_id(argv[0], &id)) return kSdsToolUsage;
  sds_client_item item;
  int status = sds_client_read_item(connection, id, false, &item);
  if (status != SDS_ERROR_NONE) return status;
  auto flag = [](int field_status, int32_t value) {
    return field_status == SDS_ERROR_NONE ? std::to_string(value) : std::string("(none)");
  };
  auto text = [](const UniqueCStr& value) { return value ? value.get() : "(none)"; };
  std::printf("id:                %d\n", item.id);
  std::printf("url:               %s\n", text(item.url));
  std::printf("title:             %s\n", text(item.title));
  std::printf("dominant colour:   %s\n", text(item.dominant_color));
  std::printf("icon size:         %s\n", text(item.icon_size));
  std::printf("touch icon exists: %s\n",
              flag(item.touch_icon_status, item.touch_icon_exists).c_str());
  std::printf("favicon exists:    %s\n", flag(item.favicon_status, item.favicon_exists).c_str());
  // The pixels are asked for on their own: an icon the service can't hand
  // over is a fact about the item, not a failure of `show`.
  sds_client_icon icon;
  status = sds_client_get_icon(connection, id, &icon);
  if (status == SDS_ERROR_NONE) {
    std::printf("icon pixels:       %dx%d, %d bytes\n", icon.width, icon.height, icon.byte_count);
  } else if (status == SDS_ERROR_NO_DATA) {
    std::printf("icon pixels:       (none)\n");
  } else if (connection.is_open()) {
    std::printf("icon pixels:       unavailable: ");
    sds_tool_print_status(stdout, status);
    std::printf("\n");
  } else {
    return status;
  }
  return SDS_ERROR_NONE;
}

int sds_tool_icon(SdsConnection& connection, int argc, char** argv) {
  const char* id_text = nullptr;
  const char* output = nullptr;
  for (int i = 0; i < argc; ++i) {
    if (std::strcmp(argv[i], "-o") == 0 && i + 1 < argc && output == nullptr) {
      output = argv[++i];
    } else if (id_text == nullptr) {
      id_text = argv[i];
    } else {
      return kSdsToolUsage;
    }
  }
  int32_t id = 0;
  if (id_text == nullptr || output == nullptr || !sds_tool_parse_id(id_text, &id)) {
    return kSdsToolUsage;
  }
  sds_client_icon icon;
  int status = sds_client_get_icon(connection, id, &icon);
  if (status != SDS_ERROR_NONE) return status;

  unsigned char* png_bytes = nullptr;
  int png_size = 0;
  if (convert_raw_data_to_png(icon.pixels.get(), icon.width, icon.height, &png_bytes, &png_size) !=
      0) {
    std::fprintf(stderr, "sitedeck: icon: the pixels could not be encoded as PNG\n");
    return kSdsToolReported;
  }
  UniqueMalloc<unsigned char> png(png_bytes);
  UniqueFile file(std::fopen(output, "wb"));
  bool written = file && std::fwrite(png.get(), 1, static_cast<size_t>(png_size), file.get()) ==
                             static_cast<size_t>(png_size);
  if (!written || std::fclose(file.release()) != 0) {
    std::fprintf(stderr, "sitedeck: icon: cannot write %s: %s\n", output, std::strerror(errno));
    return kSdsToolReported;
  }
  std::printf("%s: %dx%d, %d bytes of PNG\n", output, icon.width, icon.height, png_size);
  return SDS_ERROR_NONE;
}
