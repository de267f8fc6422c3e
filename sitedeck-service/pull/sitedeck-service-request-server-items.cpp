// The in-memory item list of one pull: items in document order, each with its
// touch icons. Lists are released by loops, never recursively, so a hostile
// list of any length cannot exhaust the stack.
#include <strings.h>

#include <cstdlib>
#include <cstring>

#include "sitedeck-service-log.h"
#include "pull/sitedeck-service-request-server.h"

sds_item* sds_item_list_head = nullptr;
sds_item* sds_item_list_tail = nullptr;
int sds_last_error = SDS_ERROR_NONE;
char* sds_redirect_base_url = nullptr;

namespace {

// Why the deck must not hold `item`; null when it may.
const char* __unusable_because(const sds_item* item) {
  const char* url = item->site_url;
  if (url == nullptr || url[0] == '\0') return "it has no site URL";
  // Over plain HTTP anyone on the path could slip a javascript: or data:
  // address onto the start page; only web sites join the deck.
  size_t scheme = strncasecmp(url, "http://", 7) == 0    ? 7
                  : strncasecmp(url, "https://", 8) == 0 ? 8
                                                         : 0;
  if (scheme == 0 || url[scheme] == '\0') return "its site URL is no http or https address";
  if (strnlen(url, SDS_IPC_STRING_MAX + 1) > SDS_IPC_STRING_MAX) {
    return "its site URL is longer than 4096 bytes";
  }
  return nullptr;
}

// Drops a text the browser could never be sent (a string item carries 4096 bytes at most).
void __drop_long_text(char** text, const char* what, const char* url) {
  if (*text == nullptr || strnlen(*text, SDS_IPC_STRING_MAX + 1) <= SDS_IPC_STRING_MAX) return;
  SDS_LOGE("%s of %s is longer than 4096 bytes: not stored", what, url);
  std::free(*text);
  *text = nullptr;
}

void __free_item(sds_item* item) {
  sds_free_icon_list(&item->ps_sds_icon_list);
  std::free(item->site_url);
  std::free(item->site_name);
  std::free(item->predominant_color);
  std::free(item);
}

}  // namespace

bool sds_item_is_usable(const sds_item* item) {
  return item != nullptr && __unusable_because(item) == nullptr;
}

int sds_drop_unusable_items(void) {
  int kept = 0;
  sds_item** link = &sds_item_list_head;
  sds_item* last = nullptr;
  while (*link != nullptr) {
    sds_item* item = *link;
    if (const char* reason = __unusable_because(item)) {
      SDS_LOGE("item \"%.100s\" not stored: %s", item->site_url != nullptr ? item->site_url : "",
               reason);
      *link = item->next;
      __free_item(item);
      continue;
    }
    __drop_long_text(&item->site_name, "the title", item->site_url);
    __drop_long_text(&item->predominant_color, "the colour", item->site_url);
    ++kept;
    last = item;
    link = &item->next;
  }
  sds_item_list_tail = last;
  return kept;
}

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
    __free_item(item);
    item = next;
  }
  sds_item_list_head = nullptr;
  sds_item_list_tail = nullptr;
}
