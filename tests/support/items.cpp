#include "support/items.h"

#include <cstdio>
#include <cstring>

#include "pull/sitedeck-service-request-server.h"

sds_item* add_item(const char* url, const char* name, const char* color, int specially_removed) {
  sds_item* item = sds_allocate_item_memory();
  if (item == nullptr) return nullptr;
  item->site_url = url != nullptr ? strdup(url) : nullptr;
  item->site_name = name != nullptr ? strdup(name) : nullptr;
  item->predominant_color = color != nullptr ? strdup(color) : nullptr;
  item->is_specially_removed = specially_removed;
  return item;
}

sds_icon* add_icon(sds_item* item, const char* path, const char* size, const char* last_modified) {
  sds_icon* icon = sds_allocate_icon_memory(&item->ps_sds_icon_list);
  if (icon == nullptr) return nullptr;
  icon->icon_path = path != nullptr ? strdup(path) : nullptr;
  std::snprintf(icon->icon_size, sizeof icon->icon_size, "%s", size);
  std::snprintf(icon->last_modified, sizeof icon->last_modified, "%s", last_modified);
  item->number_of_touch_icons++;
  item->touch_icons_exists = 1;
  return icon;
}

ItemListGuard::ItemListGuard() { sds_free_item_list(); }
ItemListGuard::~ItemListGuard() { sds_free_item_list(); }
