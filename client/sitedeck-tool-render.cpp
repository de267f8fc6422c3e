// `sitedeck render OUT_DIR`: the deck as the browser's start page would show
// it, written to OUT_DIR/index.html for a person to open. It reads the deck
// the way the browser does (the live ids in the server's order, then each
// item's fields and pixels) and leaves the page itself to
// sitedeck-tool-page.h.
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <vector>

#include <json-glib/json-glib.h>

#include "sitedeck-client-deck.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-tool-last-pull.h"
#include "sitedeck-tool-page.h"
#include "pull/sitedeck-service-utils.h"
#include "sitedeck-tool-output.h"
#include "sitedeck-tool.h"

namespace {

// A start page with more tiles than this is no longer a start page, and the
// cap keeps a deck that a broken service inflates from filling the memory.
constexpr size_t kMaxTiles = 1000;
// Icons embedded in one page, in PNG bytes; the icons after that get their
// letter, so that the page stays one a browser opens quickly.
constexpr size_t kMaxIconBytes = 64u << 20;

// What one tile needs beyond the item's texts: its icon as PNG.
struct sds_render_item {
  sds_client_item item;
  UniqueMalloc<unsigned char> png;
  int png_size = 0;
};

// Fetches the pixels of `entry` and re-encodes them as PNG. An icon that is
// not there, or that the service or the encoder can't hand over while the
// connection stays usable, leaves the tile with its letter instead; only a
// lost connection fails the page.
int __sds_render_icon(SdsConnection& connection, sds_render_item* entry, size_t* icon_bytes) {
  int32_t id = entry->item.id;
  sds_client_icon icon;
  int status = sds_client_get_icon(connection, id, &icon);
  if (status == SDS_ERROR_NO_DATA) return SDS_ERROR_NONE;
  if (status != SDS_ERROR_NONE) {
    if (!connection.is_open()) return status;
    std::fprintf(stderr, "sitedeck: render: item %d: icon unavailable: ", id);
    sds_tool_print_status(stderr, status);
    std::fprintf(stderr, "; showing a letter instead\n");
    return SDS_ERROR_NONE;
  }
  unsigned char* png = nullptr;
  int png_size = 0;
  if (convert_raw_data_to_png(icon.pixels.get(), icon.width, icon.height, &png, &png_size) != 0) {
    std::fprintf(stderr,
                 "sitedeck: render: item %d: the %dx%d icon could not be encoded as PNG; "
                 "showing a letter instead\n",
                 id, icon.width, icon.height);
    return SDS_ERROR_NONE;
  }
  if (*icon_bytes + static_cast<size_t>(png_size) > kMaxIconBytes) {
    std::free(png);
    std::fprintf(stderr,
                 "sitedeck: render: item %d: the page holds %zu bytes of icons already; "
                 "showing a letter instead\n",
                 id, *icon_bytes);
    return SDS_ERROR_NONE;
  }
  *icon_bytes += static_cast<size_t>(png_size);
  entry->png.reset(png);
  entry->png_size = png_size;
  return SDS_ERROR_NONE;
}

// Where the deck came from, from the pull's record beside the database.
std::string __sds_render_origin() {
  sds_last_pull pull = sds_tool_read_last_pull(sds_path(SDS_LAST_PULL_PATH));
  if (pull.state == sds_last_pull_state::denied || pull.state == sds_last_pull_state::unreadable) {
    return "where the deck came from is not known (the pull's record cannot be read)";
  }
  if (pull.state == sds_last_pull_state::missing || pull.stored == 0) {
    return "from the installed default deck (no pull has stored a list yet)";
  }
  std::string region = pull.city;
  if (!pull.province.empty()) region += (region.empty() ? "" : ", ") + pull.province;
  struct tm when {};
  char stamp[32] = "";
  if (gmtime_r(&pull.stored, &when) != nullptr) {
    (void)std::strftime(stamp, sizeof stamp, "%Y-%m-%d %H:%M UTC", &when);
  }
  return std::string("from a pull") + (region.empty() ? "" : " for " + region) + ", stored " +
         stamp;
}

}  // namespace

bool sds_tool_render_arguments(int argc, char** argv, std::string* problem) {
  if (argc == 0) {
    *problem = "OUT_DIR is missing";
  } else if (argc > 1) {
    *problem = std::string("unexpected argument ") + argv[1];
  } else if (argv[0][0] == '\0' || argv[0][0] == '-') {
    *problem = std::string("\"") + argv[0] + "\" is not a directory name";
  } else {
    return true;
  }
  return false;
}

int sds_tool_render(SdsConnection& connection, int argc, char** argv) {
  std::string problem;
  if (!sds_tool_render_arguments(argc, argv, &problem)) return kSdsToolUsage;
  const char* out_dir = argv[0];

  // Withdrawn sites are not live, so the browser's list, and this page,
  // leave them out.
  sds_client_ids ids;
  int status = sds_client_get_ids_by_dirty(connection, 1, &ids);
  if (status != SDS_ERROR_NONE && status != SDS_ERROR_NO_DATA) return status;
  size_t count = status == SDS_ERROR_NONE ? static_cast<size_t>(ids.count) : 0;
  if (count > kMaxTiles) {
    std::fprintf(stderr,
                 "sitedeck: render: the deck has %zu live sites; the page shows the first %zu\n",
                 count, kMaxTiles);
    count = kMaxTiles;
  }
  size_t icon_bytes = 0;
  // Withdrawn sites stay in the store but not on the page: say how many.
  sds_client_ids withdrawn;
  int withdrawn_status = sds_client_get_ids_by_dirty(connection, -1, &withdrawn);
  if (withdrawn_status != SDS_ERROR_NONE && withdrawn_status != SDS_ERROR_NO_DATA) {
    return withdrawn_status;
  }
  const std::string origin = __sds_render_origin();
  sds_page_source source;
  source.origin = origin.c_str();
  source.withdrawn = withdrawn_status == SDS_ERROR_NONE ? static_cast<size_t>(withdrawn.count) : 0;

  std::vector<sds_render_item> entries(count);
  std::vector<sds_page_tile> tiles(count);
  for (size_t i = 0; i < count; ++i) {
    sds_render_item& entry = entries[i];
    status = sds_client_read_item(connection, ids.ids.get()[i], false, &entry.item);
    if (status != SDS_ERROR_NONE) return status;
    status = __sds_render_icon(connection, &entry, &icon_bytes);
    if (status != SDS_ERROR_NONE) return status;
    tiles[i].id = entry.item.id;
    tiles[i].url = entry.item.url.get();
    tiles[i].title = entry.item.title.get();
    tiles[i].dominant_color = entry.item.dominant_color.get();
    tiles[i].png = entry.png.get();
    tiles[i].png_size = static_cast<size_t>(entry.png_size);
  }

  char* html_text = nullptr;
  status = sds_page_render(tiles.data(), count, source, std::time(nullptr), &html_text);
  if (status != SDS_ERROR_NONE) return status;
  UniqueCStr html(html_text);
  char* path_text = nullptr;
  char* reason_text = nullptr;
  status = sds_page_write(out_dir, html.get(), &path_text, &reason_text);
  UniqueCStr path(path_text), reason(reason_text);
  if (status == SDS_ERROR_IO_ERROR && reason) {
    std::fprintf(stderr, "sitedeck: render: %s\n", reason.get());
    return kSdsToolReported;
  }
  if (status != SDS_ERROR_NONE) return status;
  if (sds_tool_output().json) {
    UniqueJsonBuilder json = sds_tool_json_builder();
    json_builder_begin_object(json.get());
    sds_tool_json_text(json.get(), "path", path.get());
    sds_tool_json_int(json.get(), "tiles", static_cast<long long>(count));
    json_builder_end_object(json.get());
    return sds_tool_json_print(json.get()) ? SDS_ERROR_NONE : kSdsToolReported;
  }
  std::printf("%s\n", path.get());
  return SDS_ERROR_NONE;
}
