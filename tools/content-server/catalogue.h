// The content server's catalogue: the sites it lists with their touch icons,
// loaded from a JSON data file or synthesised in bulk, the changes a test can
// make to it at run time, and the item-list JSON document built from it.
// Icon pixels are not held here; icons.cpp renders them from each icon's
// description.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct cs_rgb {
  uint8_t r = 0;
  uint8_t g = 0;
  uint8_t b = 0;
};

enum class cs_color_type { rgb, rgba, palette, grey, grey_alpha, palette_trns };

struct cs_icon {
  int id = 0;
  std::string file;       // below /icons/, e.g. "news-a/apple-touch-icon.png"
  int pixels = 0;         // width and height
  std::string size_text;  // the "iconSize" text listed, e.g. "144x144"
  cs_color_type color_type = cs_color_type::rgba;
  int bit_depth = 8;
  bool interlaced = false;
  bool administered = false;
  std::string last_modified;
  cs_rgb color;        // background; the centre square is its inverse
  int generation = 0;  // odd generations invert the colours
};

struct cs_site {
  std::string url;
  std::string name;
  std::string color_text;  // "predominantColor" as listed, "#RRGGBB"
  bool global = true;      // section "global", else "regional"
  bool specially_removed = false;
  bool fav_icon = true;
  std::vector<std::string> regions;  // regional sites: cities or provinces; empty = everywhere
  std::vector<cs_icon> icons;
};

struct cs_catalogue {
  std::vector<cs_site> sites;
  int version = 0;  // bumped by every change, listed as "listVersion"
};

// Loads a catalogue file (at most 16 MiB). On failure returns false and says why.
bool cs_catalogue_load(const std::string& path, cs_catalogue* out, std::string* error);

// `count` sites site-0001... with two icons each (57 px RGB, 96 px RGBA administered).
cs_catalogue cs_catalogue_synthesise(int count);

// Run-time changes; each bumps the version. False when `url` names no site
// (or, for add, when it already does).
void cs_catalogue_reverse(cs_catalogue* catalogue);
bool cs_catalogue_remove(cs_catalogue* catalogue, const std::string& url);
bool cs_catalogue_add(cs_catalogue* catalogue, const std::string& url);
bool cs_catalogue_mark_removed(cs_catalogue* catalogue, const std::string& url);
bool cs_catalogue_touch(cs_catalogue* catalogue, const std::string& url);

// The icon whose file is `file`, or nullptr.
const cs_icon* cs_catalogue_find_icon(const cs_catalogue& catalogue, const std::string& file);

// The item-list document for a request from `city` / `province` (empty when
// not sent). Icon URLs are `icon_base` + "/" + file.
std::string cs_item_list_json(const cs_catalogue& catalogue, const std::string& icon_base,
                              const std::string& city, const std::string& province);

// "#RRGGBB" to a colour; false when malformed.
bool cs_parse_color(const std::string& text, cs_rgb* out);
