#include "support/default_deck.h"

#include <sys/stat.h>

#include "sitedeck-service-paths.h"
#include "support/temp_root.h"

namespace {

std::string deck_icon_url(const std::string& file) {
  return "https://static.example.org/deck/" + file;
}

std::string deck_json(const std::vector<DeckSite>& sites) {
  std::string items;
  for (const DeckSite& s : sites) {
    if (!items.empty()) items += ",\n";
    std::string icons;
    if (!s.icon.empty()) {
      const std::string size = std::to_string(s.image.width) + "x" + std::to_string(s.image.height);
      icons = R"({"id": 1, "iconPath": ")" + deck_icon_url("big-" + s.icon) +
              R"(", "iconSize": "512x512", "lastModified": "2026-01-01 00:00:00.000", )"
              R"("isAdministered": false}, {"id": 2, "iconPath": ")" +
              deck_icon_url(s.icon) + R"(", "iconSize": ")" + size +
              R"(", "lastModified": "2026-01-01 00:00:00.000", "isAdministered": true})";
    }
    items += R"({"item": {"siteUrl": ")" + s.url + R"(", "siteName": ")" + s.name +
             R"(", "predominantColor": ")" + s.color + R"(", "isSpeciallyRemoved": )" +
             (s.specially_removed ? "true" : "false") +
             R"(, "touchIconsExists": true, "favIconExists": true, "touchIcons": [)" + icons +
             "]}}";
  }
  return "{\"itemCount\": " + std::to_string(sites.size()) + ", \"global\": {\"items\": [\n" +
         items + "\n]}}\n";
}

}  // namespace

bool write_deck_list(const std::string& json) {
  const std::string dir = sds_path(SDS_DEFAULT_DECK_DIR);
  if (mkdir(dir.c_str(), 0755) != 0 && !file_exists(dir)) return false;
  return write_file(sds_path(SDS_DEFAULT_DECK_JSON_PATH), json);
}

bool write_deck(const std::vector<DeckSite>& sites) {
  if (!write_deck_list(deck_json(sites))) return false;
  for (const DeckSite& s : sites) {
    if (s.icon.empty() || !s.write_icon) continue;
    if (!png_write_file(sds_path(SDS_DEFAULT_DECK_DIR) + "/" + s.icon, s.image)) return false;
  }
  return true;
}

std::vector<DeckSite> small_deck() {
  return {
      {"https://news.example.org/", "News", "#C62828", "news.png", png_pattern(16, 16, 6, 8)},
      {"https://mail.example.net/", "Mail", "#1565C0", "mail.png", png_pattern(12, 10, 2, 8)},
      {"https://maps.example.com/", "Maps", "#2E7D32", "maps.png", png_pattern(9, 9, 3, 8)},
  };
}
