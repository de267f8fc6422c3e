// The in-memory item list of one pull: items in document order, each with its
// touch icons. Lists are released by loops, never recursively, so a hostile
// list of any length cannot exhaust the stack.
#include <cstdlib>

#include "sitedeck-service-log.h"
#include "sitedeck-service-request-server.h"

sds_item* sds_item_list_head = nullptr;
sds_item* sds_item_list_tail = nullptr;
int sds_last_error = SDS_ERROR_NONE;
char* sds_redirect_base_url = nullptr;

sds_item* sds_allocate_item_memory(void) {
  auto* item = static_cast<sds_item*>(std::calloc(1, sizeof(sds_item)));
  if (item == nullptr) {
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    return nullptr;
  }
  if (sds_item_list_head == nullptr) {
    sds_item_list_head = item;
  } else {
    sds_item_list_tail->next = item;
  }
  sds_item_list_tail = item;
  return item;
}

sds_icon* sds_allocate_icon_memory(sds_icon** list) {
  if (list == nullptr) return nullptr;
  auto* icon = static_cast<sds_icon*>(std::calloc(1, sizeof(sds_icon)));
  if (icon == nullptr) {
    SDS_LOGE("Unable to allocate memory");
    return nullptr;
  }
  sds_icon** link = list;
  while (*link != nullptr) link = &(*link)->next;
  *link = icon;
  return icon;
}

void sds_free_icon_list(sds_icon** list) {
  if (list == nullptr) return;
  sds_icon* icon = *list;
  while (icon != nullptr) {
    sds_icon* next = icon->next;
    std::free(icon->icon_path);
    std::free(icon);
    icon = next;
  }
}

void sds_free_item_list(void) {
  sds_item* item = sds_item_list_head;
  while (item != nullptr) {
    sds_item* next = item->next;
    sds_free_icon_list(&item->ps_sds_icon_list);
    item->ps_sds_icon_list = nullptr;
    std::free(item->site_url);
    std::free(item->site_name);
    std::free(item->predominant_color);
    std::free(item);
    item = next;
  }
  sds_item_list_head = nullptr;
  sds_item_list_tail = nullptr;
}
