#include "support/seeded_deck.h"

#include <sqlite3.h>

#include "database/sitedeck-service-db.h"

namespace {

void bind_text(sqlite3_stmt* stmt, int index, const std::optional<std::string>& value) {
  if (value) {
    (void)sqlite3_bind_text(stmt, index, value->c_str(), static_cast<int>(value->size()),
                            SQLITE_TRANSIENT);
  } else {
    (void)sqlite3_bind_null(stmt, index);
  }
}

bool insert(sqlite3* db, const SeedItem& item) {
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(db,
                         "INSERT INTO site_deck(id, url, title, dominant_color, icon_size, "
                         "touch_icon_exists, favicon_exists, is_dirty, order_index, icon_data) "
                         "VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?)",
                         -1, &stmt, nullptr) != SQLITE_OK) {
    return false;
  }
  (void)sqlite3_bind_int(stmt, 1, item.id);
  bind_text(stmt, 2, item.url);
  bind_text(stmt, 3, item.title);
  bind_text(stmt, 4, item.dominant_color);
  bind_text(stmt, 5, item.icon_size);
  (void)sqlite3_bind_int(stmt, 6, item.touch_icon_exists);
  (void)sqlite3_bind_int(stmt, 7, item.favicon_exists);
  (void)sqlite3_bind_int(stmt, 8, item.is_dirty);
  (void)sqlite3_bind_int(stmt, 9, item.order_index);
  if (item.icon_data.empty()) {
    (void)sqlite3_bind_null(stmt, 10);
  } else {
    (void)sqlite3_bind_blob(stmt, 10, item.icon_data.data(),
                            static_cast<int>(item.icon_data.size()), SQLITE_TRANSIENT);
  }
  bool ok = sqlite3_step(stmt) == SQLITE_DONE;
  sqlite3_finalize(stmt);
  return ok;
}

}  // namespace

SeedItem seed_item(int id, const std::string& url, const std::string& title, int order_index) {
  SeedItem item;
  item.id = id;
  item.url = url;
  item.title = title;
  item.order_index = order_index;
  return item;
}

bool seed_deck(const std::vector<SeedItem>& items) {
  sqlite3* db = nullptr;
  if (sds_db_open(&db) != 0 || db == nullptr) return false;
  bool ok = sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr) == SQLITE_OK;
  for (const auto& item : items) ok = ok && insert(db, item);
  ok = ok && sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr) == SQLITE_OK;
  sqlite3_close(db);
  return ok;
}

std::vector<uint8_t> seed_pixels(int width, int height, uint32_t seed) {
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * static_cast<size_t>(height) * 4);
  uint32_t state = seed * 2654435761u + 1;
  for (auto& byte : pixels) {
    state = state * 1664525u + 1013904223u;
    byte = static_cast<uint8_t>(state >> 24);
  }
  return pixels;
}
