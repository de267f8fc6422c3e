// The `sitedeck` subcommands that show the stored deck: `list` (a table of the
// live items), `show ID` (every field of one item) and `icon ID -o FILE`
// (the item's pixels written back out as a PNG file).
#include <json-glib/json-glib.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "sitedeck-client-deck.h"
#include "sitedeck-client-status.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-utils.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool.h"

namespace {

constexpr char kMissing[] = "-";

std::string __text_or_missing(const SdsClientText& value) { return value ? value.get() : kMissing; }

std::string __flags(const sds_client_item& item) {
  std::string flags;
  if (item.touch_icon_exists != 0) flags = "touch";
  if (item.favicon_exists != 0) flags += flags.empty() ? "favicon" : ",favicon";
  return flags.empty() ? kMissing : flags;
}

// A flag member: true or false when the service had one, else null.
void __json_flag(JsonBuilder* builder, const char* name, int status, int32_t value) {
  if (status == SDS_ERROR_NONE) {
    sds_tool_json_bool(builder, name, value != 0);
  } else {
    sds_tool_json_null(builder, name);
  }
}

// The icon size as the service stores it ("WIDTHxHEIGHT") and, when it is
// one, its two numbers beside it; null members otherwise.
void __json_icon_size(JsonBuilder* builder, const SdsClientText& size) {
  sds_tool_json_text(builder, "icon_size", size.get());
  int width = 0, height = 0;
  char tail = '\0';
  if (size && std::sscanf(size.get(), "%dx%d%c", &width, &height, &tail) == 2 && width > 0 &&
      height > 0) {
    sds_tool_json_int(builder, "icon_width", width);
    sds_tool_json_int(builder, "icon_height", height);
  } else {
    sds_tool_json_null(builder, "icon_width");
    sds_tool_json_null(builder, "icon_height");
  }
}

// The item's stored fields as members of the open object.
void __json_item_fields(JsonBuilder* builder, const sds_client_item& item) {
  sds_tool_json_int(builder, "id", item.id);
  sds_tool_json_text(builder, "url", item.url.get());
  sds_tool_json_text(builder, "title", item.title.get());
  sds_tool_json_text(builder, "dominant_color", item.dominant_color.get());
  __json_icon_size(builder, item.icon_size);
  __json_flag(builder, "touch_icon_exists", item.touch_icon_status, item.touch_icon_exists);
  __json_flag(builder, "favicon_exists", item.favicon_status, item.favicon_exists);
}

}  // namespace

int sds_tool_list(SdsConnection& connection, int argc, char** /*argv*/) {
  if (argc != 0) return kSdsToolUsage;
  sds_client_ids ids;
  int status = sds_client_get_full_ids(connection, &ids);
  if (status != SDS_ERROR_NONE && status != SDS_ERROR_NO_DATA) return status;

  const sds_tool_settings& output = sds_tool_output();
  UniqueJsonBuilder json = sds_tool_json_builder();
  json_builder_begin_object(json.get());
  json_builder_set_member_name(json.get(), "items");
  json_builder_begin_array(json.get());
  sds_tool_table table;
  table.header = {"ID", "TITLE", "URL", "COLOUR", "ICON", "FLAGS"};
  table.shrinkable = {false, true, true, false, false, false};
  for (int32_t i = 0; i < ids.count; ++i) {
    sds_client_item item;
    status = sds_client_read_item(connection, ids.ids.get()[i], false, &item);
    if (status != SDS_ERROR_NONE) return status;
    json_builder_begin_object(json.get());
    __json_item_fields(json.get(), item);
    json_builder_end_object(json.get());
    table.rows.push_back({{std::to_string(item.id)},
                          {__text_or_missing(item.title)},
                          {__text_or_missing(item.url)},
                          {__text_or_missing(item.dominant_color), true},
                          {__text_or_missing(item.icon_size)},
                          {__flags(item)}});
  }
  json_builder_end_array(json.get());
  json_builder_end_object(json.get());
  if (output.json) return sds_tool_json_print(json.get()) ? SDS_ERROR_NONE : kSdsToolReported;
  std::string text = sds_tool_format_table(table, output);
  std::fwrite(text.data(), 1, text.size(), stdout);
  return SDS_ERROR_NONE;
}

bool sds_tool_show_arguments(int argc, char** argv, std::string* problem) {
  int32_t id = 0;
  if (argc == 0) {
    *problem = "ID is missing";
  } else if (argc > 1) {
    *problem = std::string("unexpected argument ") + argv[1];
  } else if (!sds_tool_parse_id(argv[0], &id)) {
    *problem = std::string(argv[0]) + " is not an item id (a whole number from 0)";
  } else {
    return true;
  }
  return false;
}

int sds_tool_show(SdsConnection& connection, int argc, char** argv) {
  int32_t id = 0;
  if (argc != 1 || !sds_tool_parse_id(argv[0], &id)) return kSdsToolUsage;
  sds_client_item item;
  int status = sds_client_read_item(connection, id, false, &item);
  if (status != SDS_ERROR_NONE) return status;
  // The pixels are asked for on their own: an icon the service can't hand
  // over is a fact about the item, not a failure of `show`.
  sds_client_icon icon;
  int icon_status = sds_client_get_icon(connection, id, &icon);
  if (icon_status != SDS_ERROR_NONE && icon_status != SDS_ERROR_NO_DATA && !connection.is_open()) {
    return icon_status;
  }

  const sds_tool_settings& output = sds_tool_output();
  if (output.json) {
    UniqueJsonBuilder json = sds_tool_json_builder();
    json_builder_begin_object(json.get());
    __json_item_fields(json.get(), item);
    json_builder_set_member_name(json.get(), "icon");
    if (icon_status == SDS_ERROR_NONE) {
      json_builder_begin_object(json.get());
      sds_tool_json_int(json.get(), "width", icon.width);
      sds_tool_json_int(json.get(), "height", icon.height);
      sds_tool_json_int(json.get(), "bytes", icon.byte_count);
      json_builder_end_object(json.get());
    } else {
      json_builder_add_null_value(json.get());
    }
    if (icon_status != SDS_ERROR_NONE && icon_status != SDS_ERROR_NO_DATA) {
      sds_tool_json_int(json.get(), "icon_status", icon_status);
    }
    json_builder_end_object(json.get());
    return sds_tool_json_print(json.get()) ? SDS_ERROR_NONE : kSdsToolReported;
  }

  auto flag = [](int field_status, int32_t value) {
    return field_status == SDS_ERROR_NONE ? std::to_string(value) : std::string("(none)");
  };
  auto text = [](const SdsClientText& value) { return value ? value.get() : "(none)"; };
  std::string pixels = "(none)";
  if (icon_status == SDS_ERROR_NONE) {
    pixels = std::to_string(icon.width) + "x" + std::to_string(icon.height) + ", " +
             std::to_string(icon.byte_count) + " bytes";
  } else if (icon_status != SDS_ERROR_NO_DATA) {
    pixels = std::string("unavailable: ") + std::to_string(icon_status) + " " +
             sds_client_status_name(icon_status) + ": " + sds_client_status_meaning(icon_status);
  }
  std::string lines = sds_tool_format_fields(
      {
          {"id", {std::to_string(item.id)}},
          {"url", {text(item.url)}},
          {"title", {text(item.title)}},
          {"dominant colour", {text(item.dominant_color), true}},
          {"icon size", {text(item.icon_size)}},
          {"touch icon exists", {flag(item.touch_icon_status, item.touch_icon_exists)}},
          {"favicon exists", {flag(item.favicon_status, item.favicon_exists)}},
          {"icon pixels", {pixels}},
      },
      output);
  std::fwrite(lines.data(), 1, lines.size(), stdout);
  return SDS_ERROR_NONE;
}

// `icon ID -o FILE`, the two in either order.
static bool __icon_arguments(int argc, char** argv, int32_t* id, const char** output,
                             std::string* problem) {
  const char* id_text = nullptr;
  *output = nullptr;
  for (int i = 0; i < argc; ++i) {
    if (std::strcmp(argv[i], "-o") == 0 && *output == nullptr) {
      if (i + 1 >= argc || argv[i + 1][0] == '\0') {
        *problem = "-o needs a FILE";
        return false;
      }
      *output = argv[++i];
    } else if (id_text == nullptr) {
      id_text = argv[i];
    } else {
      *problem = std::string("unexpected argument ") + argv[i];
      return false;
    }
  }
  if (id_text == nullptr) {
    *problem = "ID is missing";
  } else if (!sds_tool_parse_id(id_text, id)) {
    *problem = std::string(id_text) + " is not an item id (a whole number from 0)";
  } else if (*output == nullptr) {
    *problem = "-o FILE is missing";
  } else {
    return true;
  }
  return false;
}

bool sds_tool_icon_arguments(int argc, char** argv, std::string* problem) {
  int32_t id = 0;
  const char* output = nullptr;
  return __icon_arguments(argc, argv, &id, &output, problem);
}

int sds_tool_icon(SdsConnection& connection, int argc, char** argv) {
  int32_t id = 0;
  const char* output = nullptr;
  std::string problem;
  if (!__icon_arguments(argc, argv, &id, &output, &problem)) return kSdsToolUsage;
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
  if (sds_tool_output().json) {
    UniqueJsonBuilder json = sds_tool_json_builder();
    json_builder_begin_object(json.get());
    sds_tool_json_text(json.get(), "file", output);
    sds_tool_json_int(json.get(), "width", icon.width);
    sds_tool_json_int(json.get(), "height", icon.height);
    sds_tool_json_int(json.get(), "png_bytes", png_size);
    json_builder_end_object(json.get());
    return sds_tool_json_print(json.get()) ? SDS_ERROR_NONE : kSdsToolReported;
  }
  std::printf("%s: %dx%d, %d bytes of PNG\n", output, icon.width, icon.height, png_size);
  return SDS_ERROR_NONE;
}
