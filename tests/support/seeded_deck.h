// Seeds the item database of the current scratch root (TempRoot) with rows a
// test or benchmark chooses, before the service is started: the file and its
// table are made by the service's own sds_db_open, the rows written with
// plain SQL on a connection of their own, which is closed again.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

// One row of site_deck; an empty optional or empty pixels store NULL.
struct SeedItem {
  int id = 0;
  std::optional<std::string> url, title, dominant_color, icon_size;
  int touch_icon_exists = 0;
  int favicon_exists = 0;
  int is_dirty = 1;
  int order_index = 0;
  std::vector<uint8_t> icon_data;
};

// A live item with the given texts and position, everything else default.
SeedItem seed_item(int id, const std::string& url, const std::string& title, int order_index);

// Creates the database if needed and inserts `items`; false with nothing
// committed when any step fails.
bool seed_deck(const std::vector<SeedItem>& items);

// Pixels of a width x height icon, four bytes (B, G, R, A) per pixel, each
// byte depending on position and `seed`, so that two icons never agree.
std::vector<uint8_t> seed_pixels(int width, int height, uint32_t seed);
