// Catalogue loading, synthesis, run-time changes and the item-list document.
#include "catalogue.h"

#include <json-glib/json-glib.h>

#include <cstdio>
#include <fstream>
#include <memory>

namespace {

constexpr std::streamsize kMaxCatalogueBytes = 16 * 1024 * 1024;
constexpr int kMaxIconPixels = 1024;

struct GObjectUnref {
  void operator()(gpointer p) const noexcept { g_object_unref(p); }
};
template <typename T>
using GObjectPtr = std::unique_ptr<T, GObjectUnref>;
struct GFree {
  void operator()(gpointer p) const noexcept { g_free(p); }
};

bool parse_color_type(const std::string& text, cs_color_type* out) {
  static const struct {
    const char* name;
    cs_color_type type;
  } kTypes[] = {{"rgb", cs_color_type::rgb},
                {"rgba", cs_color_type::rgba},
                {"palette", cs_color_type::palette},
                {"grey", cs_color_type::grey},
                {"grey_alpha", cs_color_type::grey_alpha},
                {"palette_trns", cs_color_type::palette_trns}};
  for (const auto& t : kTypes) {
    if (text == t.name) {
      *out = t.type;
      return true;
    }
  }
  return false;
}

bool depth_allowed(cs_color_type type, int depth) {
  switch (type) {
    case cs_color_type::rgb:
    case cs_color_type::rgba:
    case cs_color_type::grey_alpha:
      return depth == 8 || depth == 16;
    case cs_color_type::grey:
      return depth == 1 || depth == 2 || depth == 4 || depth == 8 || depth == 16;
    case cs_color_type::palette:
    case cs_color_type::palette_trns:
      return depth == 1 || depth == 2 || depth == 4 || depth == 8;
  }
  return false;
}

bool file_name_allowed(const std::string& file) {
  if (file.empty() || file.front() == '/' || file.find("..") != std::string::npos) return false;
  for (char c : file) {
    const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                    c == '.' || c == '_' || c == '-' || c == '/';
    if (!ok) return false;
  }
  return true;
}

std::string string_member(JsonObject* object, const char* name, const char* fallback) {
  const char* value = json_object_get_string_member_with_default(object, name, fallback);
  return value != nullptr ? value : "";
}

bool load_icon(JsonObject* object, const cs_site& site, cs_icon* icon, std::string* error) {
  icon->id = static_cast<int>(json_object_get_int_member_with_default(object, "id", 0));
  icon->file = string_member(object, "file", "");
  if (!file_name_allowed(icon->file)) {
    *error = "icon of " + site.url + ": bad \"file\" \"" + icon->file + "\"";
    return false;
  }
  const gint64 pixels = json_object_get_int_member_with_default(object, "size", 0);
  if (pixels < 1 || pixels > kMaxIconPixels) {
    *error = icon->file + ": \"size\" must be 1 to 1024";
    return false;
  }
  icon->pixels = static_cast<int>(pixels);
  icon->size_text = string_member(object, "iconSize", "");
  if (icon->size_text.empty()) {
    icon->size_text = std::to_string(pixels) + "x" + std::to_string(pixels);
  }
  if (!parse_color_type(string_member(object, "colorType", "rgba"), &icon->color_type)) {
    *error = icon->file + ": unknown \"colorType\"";
    return false;
  }
  icon->bit_depth =
      static_cast<int>(json_object_get_int_member_with_default(object, "bitDepth", 8));
  if (!depth_allowed(icon->color_type, icon->bit_depth)) {
    *error = icon->file + ": \"bitDepth\" not allowed for its colour type";
    return false;
  }
  icon->interlaced = json_object_get_boolean_member_with_default(object, "interlaced", FALSE);
  icon->administered = json_object_get_boolean_member_with_default(object, "administered", FALSE);
  icon->last_modified = string_member(object, "lastModified", "2024-01-01 00:00:00.000");
  const std::string color = string_member(object, "color", site.color_text.c_str());
  if (!cs_parse_color(color, &icon->color)) {
    *error = icon->file + ": bad \"color\"";
    return false;
  }
  return true;
}

bool load_site(JsonObject* object, cs_site* site, std::string* error) {
  site->url = string_member(object, "url", "");
  site->name = string_member(object, "name", "");
  site->color_text = string_member(object, "color", "");
  cs_rgb unused;
  if (site->url.empty() || !cs_parse_color(site->color_text, &unused)) {
    *error = "site \"" + site->url + "\": needs \"url\" and a \"color\" #RRGGBB";
    return false;
  }
  const std::string section = string_member(object, "section", "global");
  if (section != "global" && section != "regional") {
    *error = site->url + ": \"section\" is global or regional";
    return false;
  }
  site->global = section == "global";
  site->specially_removed =
      json_object_get_boolean_member_with_default(object, "speciallyRemoved", FALSE);
  site->fav_icon = json_object_get_boolean_member_with_default(object, "favIcon", TRUE);
  JsonArray* regions = json_object_has_member(object, "regions")
                           ? json_object_get_array_member(object, "regions")
                           : nullptr;
  if (regions != nullptr) {
    for (guint i = 0; i < json_array_get_length(regions); ++i) {
      const char* region = json_array_get_string_element(regions, i);
      if (region != nullptr) site->regions.emplace_back(region);
    }
  }
  JsonArray* icons = json_object_has_member(object, "icons")
                         ? json_object_get_array_member(object, "icons")
                         : nullptr;
  for (guint i = 0; icons != nullptr && i < json_array_get_length(icons); ++i) {
    JsonObject* icon_object = json_array_get_object_element(icons, i);
    if (icon_object == nullptr) {
      *error = site->url + ": an icon is not an object";
      return false;
    }
    cs_icon icon;
    if (!load_icon(icon_object, *site, &icon, error)) return false;
    site->icons.push_back(std::move(icon));
  }
  return true;
}

cs_rgb color_from_number(unsigned n) {
  // Spreads neighbouring numbers over the colour cube so their icons differ.
  cs_rgb c;
  c.r = static_cast<uint8_t>((n * 67u + 13u) & 0xFF);
  c.g = static_cast<uint8_t>((n * 131u + 71u) & 0xFF);
  c.b = static_cast<uint8_t>((n * 29u + 151u) & 0xFF);
  return c;
}

std::string color_text(cs_rgb c) {
  char text[8];
  std::snprintf(text, sizeof text, "#%02X%02X%02X", c.r, c.g, c.b);
  return text;
}

cs_site* find_site(cs_catalogue* catalogue, const std::string& url) {
  for (cs_site& site : catalogue->sites) {
    if (site.url == url) return &site;
  }
  return nullptr;
}

bool served_for(const cs_site& site, const std::string& city, const std::string& province) {
  if (site.regions.empty()) return true;
  for (const std::string& region : site.regions) {
    if ((!city.empty() && region == city) || (!province.empty() && region == province)) return true;
  }
  return false;
}

void add_site_json(JsonBuilder* b, const cs_site& site, const std::string& icon_base) {
  json_builder_begin_object(b);
  json_builder_set_member_name(b, "item");
  json_builder_begin_object(b);
  json_builder_set_member_name(b, "siteUrl");
  json_builder_add_string_value(b, site.url.c_str());
  json_builder_set_member_name(b, "siteName");
  json_builder_add_string_value(b, site.name.c_str());
  json_builder_set_member_name(b, "predominantColor");
  json_builder_add_string_value(b, site.color_text.c_str());
  json_builder_set_member_name(b, "numberOfTouchIcons");
  json_builder_add_int_value(b, static_cast<gint64>(site.icons.size()));
  json_builder_set_member_name(b, "isSpeciallyRemoved");
  json_builder_add_boolean_value(b, site.specially_removed);
  json_builder_set_member_name(b, "touchIconsExists");
  json_builder_add_boolean_value(b, !site.icons.empty());
  json_builder_set_member_name(b, "favIconExists");
  json_builder_add_boolean_value(b, site.fav_icon);
  json_builder_set_member_name(b, "touchIcons");
  json_builder_begin_array(b);
  for (const cs_icon& icon : site.icons) {
    json_builder_begin_object(b);
    json_builder_set_member_name(b, "id");
    json_builder_add_int_value(b, icon.id);
    json_builder_set_member_name(b, "iconPath");
    json_builder_add_string_value(b, (icon_base + "/" + icon.file).c_str());
    json_builder_set_member_name(b, "iconSize");
    json_builder_add_string_value(b, icon.size_text.c_str());
    json_builder_set_member_name(b, "lastModified");
    json_builder_add_string_value(b, icon.last_modified.c_str());
    json_builder_set_member_name(b, "isAdministered");
    json_builder_add_boolean_value(b, icon.administered);
    json_builder_end_object(b);
  }
  json_builder_end_array(b);
  json_builder_end_object(b);
  json_builder_end_object(b);
}

}  // namespace

bool cs_parse_color(const std::string& text, cs_rgb* out) {
  if (text.size() != 7 || text[0] != '#') return false;
  unsigned value = 0;
  for (size_t i = 1; i < 7; ++i) {
    const char c = text[i];
    unsigned digit = 0;
    if (c >= '0' && c <= '9') {
      digit = static_cast<unsigned>(c - '0');
    } else if (c >= 'a' && c <= 'f') {
      digit = static_cast<unsigned>(c - 'a' + 10);
    } else if (c >= 'A' && c <= 'F') {
      digit = static_cast<unsigned>(c - 'A' + 10);
    } else {
      return false;
    }
    value = value * 16 + digit;
  }
  out->r = static_cast<uint8_t>(value >> 16);
  out->g = static_cast<uint8_t>(value >> 8);
  out->b = static_cast<uint8_t>(value);
  return true;
}

bool cs_catalogue_load(const std::string& path, cs_catalogue* out, std::string* error) {
  std::ifstream in(path, std::ios::binary | std::ios::ate);
  if (!in) {
    *error = "cannot open " + path;
    return false;
  }
  const std::streamsize size = in.tellg();
  if (size < 0 || size > kMaxCatalogueBytes) {
    *error = path + " is larger than 16 MiB";
    return false;
  }
  std::string text(static_cast<size_t>(size), '\0');
  in.seekg(0);
  if (!in.read(text.data(), size)) {
    *error = "cannot read " + path;
    return false;
  }
  GObjectPtr<JsonParser> parser(json_parser_new());
  GError* parse_error = nullptr;
  if (!json_parser_load_from_data(parser.get(), text.data(), static_cast<gssize>(text.size()),
                                  &parse_error)) {
    *error = path + ": " + parse_error->message;
    g_error_free(parse_error);
    return false;
  }
  JsonNode* root = json_parser_get_root(parser.get());
  JsonObject* root_object = root != nullptr ? json_node_get_object(root) : nullptr;
  JsonArray* sites = root_object != nullptr && json_object_has_member(root_object, "sites")
                         ? json_object_get_array_member(root_object, "sites")
                         : nullptr;
  if (sites == nullptr) {
    *error = path + ": the root needs a \"sites\" array";
    return false;
  }
  cs_catalogue loaded;
  for (guint i = 0; i < json_array_get_length(sites); ++i) {
    JsonObject* site_object = json_array_get_object_element(sites, i);
    cs_site site;
    if (site_object == nullptr) {
      *error = path + ": a site is not an object";
      return false;
    }
    if (!load_site(site_object, &site, error)) return false;
    loaded.sites.push_back(std::move(site));
  }
  *out = std::move(loaded);
  return true;
}

cs_catalogue cs_catalogue_synthesise(int count) {
  cs_catalogue catalogue;
  catalogue.sites.reserve(static_cast<size_t>(count));
  for (int n = 1; n <= count; ++n) {
    char label[16];
    std::snprintf(label, sizeof label, "site-%04d", n);
    cs_site site;
    site.url = std::string("http://") + label + ".test/";
    site.name = std::string("Site ") + (label + 5);
    const cs_rgb color = color_from_number(static_cast<unsigned>(n));
    site.color_text = color_text(color);
    site.global = n % 4 != 0;
    cs_icon small;
    small.id = n * 10 + 1;
    small.file = std::string(label) + "/apple-touch-icon-57.png";
    small.pixels = 57;
    small.size_text = "57x57";
    small.color_type = cs_color_type::rgb;
    small.last_modified = "2024-01-01 00:00:00.000";
    small.color = color;
    cs_icon chosen = small;
    chosen.id = n * 10 + 2;
    chosen.file = std::string(label) + "/apple-touch-icon.png";
    chosen.pixels = 96;
    chosen.size_text = "96x96";
    chosen.color_type = cs_color_type::rgba;
    chosen.administered = true;
    site.icons = {small, chosen};
    catalogue.sites.push_back(std::move(site));
  }
  return catalogue;
}

void cs_catalogue_reverse(cs_catalogue* catalogue) {
  std::vector<cs_site> reversed(catalogue->sites.rbegin(), catalogue->sites.rend());
  catalogue->sites = std::move(reversed);
  ++catalogue->version;
}

bool cs_catalogue_remove(cs_catalogue* catalogue, const std::string& url) {
  for (auto it = catalogue->sites.begin(); it != catalogue->sites.end(); ++it) {
    if (it->url == url) {
      catalogue->sites.erase(it);
      ++catalogue->version;
      return true;
    }
  }
  return false;
}

bool cs_catalogue_add(cs_catalogue* catalogue, const std::string& url) {
  if (url.empty() || find_site(catalogue, url) != nullptr) return false;
  ++catalogue->version;
  const unsigned number = 7000u + static_cast<unsigned>(catalogue->version);
  cs_site site;
  site.url = url;
  site.name = "Added " + std::to_string(number);
  const cs_rgb color = color_from_number(number);
  site.color_text = color_text(color);
  cs_icon icon;
  icon.id = static_cast<int>(number);
  icon.file = "added-" + std::to_string(number) + "/apple-touch-icon.png";
  icon.pixels = 144;
  icon.size_text = "144x144";
  icon.color_type = cs_color_type::rgba;
  icon.administered = true;
  icon.last_modified = "2030-01-01 00:00:00.000";
  icon.color = color;
  site.icons.push_back(icon);
  catalogue->sites.push_back(std::move(site));
  return true;
}

bool cs_catalogue_mark_removed(cs_catalogue* catalogue, const std::string& url) {
  cs_site* site = find_site(catalogue, url);
  if (site == nullptr) return false;
  site->specially_removed = true;
  ++catalogue->version;
  return true;
}

bool cs_catalogue_touch(cs_catalogue* catalogue, const std::string& url) {
  cs_site* site = find_site(catalogue, url);
  if (site == nullptr) return false;
  ++catalogue->version;
  for (cs_icon& icon : site->icons) {
    ++icon.generation;
    char stamp[32];
    std::snprintf(stamp, sizeof stamp, "2030-01-01 00:%02d:%02d.000",
                  (catalogue->version / 60) % 60, catalogue->version % 60);
    icon.last_modified = stamp;
  }
  return true;
}

const cs_icon* cs_catalogue_find_icon(const cs_catalogue& catalogue, const std::string& file) {
  for (const cs_site& site : catalogue.sites) {
    for (const cs_icon& icon : site.icons) {
      if (icon.file == file) return &icon;
    }
  }
  return nullptr;
}

std::string cs_item_list_json(const cs_catalogue& catalogue, const std::string& icon_base,
                              const std::string& city, const std::string& province) {
  std::vector<const cs_site*> sections[2];
  for (const cs_site& site : catalogue.sites) {
    if (served_for(site, city, province)) sections[site.global ? 0 : 1].push_back(&site);
  }
  GObjectPtr<JsonBuilder> builder(json_builder_new());
  JsonBuilder* b = builder.get();
  json_builder_begin_object(b);
  json_builder_set_member_name(b, "itemCount");
  json_builder_add_int_value(b, static_cast<gint64>(sections[0].size() + sections[1].size()));
  json_builder_set_member_name(b, "listVersion");
  json_builder_add_int_value(b, catalogue.version);
  const char* names[2] = {"global", "regional"};
  for (int s = 0; s < 2; ++s) {
    json_builder_set_member_name(b, names[s]);
    json_builder_begin_object(b);
    json_builder_set_member_name(b, "items");
    json_builder_begin_array(b);
    for (const cs_site* site : sections[s]) add_site_json(b, *site, icon_base);
    json_builder_end_array(b);
    json_builder_end_object(b);
  }
  json_builder_end_object(b);

  JsonNode* root = json_builder_get_root(b);
  GObjectPtr<JsonGenerator> generator(json_generator_new());
  json_generator_set_root(generator.get(), root);
  std::unique_ptr<gchar, GFree> text(json_generator_to_data(generator.get(), nullptr));
  json_node_unref(root);
  return text ? std::string(text.get()) : std::string();
}
