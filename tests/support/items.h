// Builds item lists for tests with the service's own list operations
// (sds_allocate_item_memory and friends), so sds_free_item_list releases them.
#pragma once

#include "sitedeck-service-types.h"

// Appends an item to the global list; null texts stay null.
sds_item* add_item(const char* url, const char* name = nullptr, const char* color = nullptr,
                   int specially_removed = 0);
// Appends a touch icon to `item`; texts longer than their fields are cut.
sds_icon* add_icon(sds_item* item, const char* path, const char* size = "",
                   const char* last_modified = "");

// Frees the global list when the test ends, however it ends.
class ItemListGuard {
 public:
  ItemListGuard();
  ~ItemListGuard();
  ItemListGuard(const ItemListGuard&) = delete;
  ItemListGuard& operator=(const ItemListGuard&) = delete;
};
