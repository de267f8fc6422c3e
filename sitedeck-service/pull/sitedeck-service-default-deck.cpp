// Loading the default deck: the list file goes through the item-list parser
// with its size and nesting bounds, each item's icon is chosen as for a
// download, and the chosen icon's file is copied from the deck's directory to
// where a downloaded icon would lie; then the list is merged like any other.
// The icon URLs are only names here: nothing is fetched. A deck that is
// damaged in any way leaves a log line and, at worst, an empty table; the
// service serves on. Part of the pull (the parser and the merge live there).
#include "pull/sitedeck-service-default-deck.h"

#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "pull/sitedeck-service-db-merge.h"
#include "pull/sitedeck-service-download-icon.h"
#include "pull/sitedeck-service-file-read.h"
#include "pull/sitedeck-service-file-write.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-transfer-limits.h"
#include "pull/sitedeck-service-utils.h"

namespace {

// The icon's file name in the deck: the URL's last path segment, as the
// downloaded icon's file is named. Null when the URL has no usable segment
// (none, empty, or one that would name a directory).
const char* __deck_icon_name(const char* url) {
  const char* slash = url != nullptr ? std::strrchr(url, '/') : nullptr;
  if (slash == nullptr) return nullptr;
  const char* name = slash + 1;
  if (name[0] == '\0' || std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) {
    return nullptr;
  }
  return name;
}

// Copies the deck's file for `icon` to the path the merge reads it from. The
// file is bounded as a download is; a copy that fails half-way is removed.
bool __copy_deck_icon(const sds_icon* icon) {
  const char* name = __deck_icon_name(icon->icon_path);
  if (name == nullptr) return false;
  const std::string source = sds_path(SDS_DEFAULT_DECK_DIR) + "/" + name;
  size_t length = 0;
  UniqueCStr bytes(
      sds_read_file_bounded(source.c_str(), static_cast<long>(SDS_MAX_ICON_BYTES), &length));
  if (!bytes) return false;
  UniqueCStr target(get_icon_path(icon->icon_path));
  if (!target) return false;
  if (!sds_write_file_whole(target.get(), bytes.get(), length)) {
    SDS_LOGE("[CRITICAL]  Unable to open Image File");
    return false;
  }
  return true;
}

void __drop_icons(sds_item* item) {
  sds_free_icon_list(&item->ps_sds_icon_list);
  item->ps_sds_icon_list = nullptr;
}

// The icon step of a pull with the deck's files in place of downloads: an
// item keeps its chosen icon when the file was copied, and none otherwise
// (its row then has no icon, as after a failed download). There is nothing
// stored to compare with, so every chosen icon is copied. Returns the number
// of items left without their icon.
int __copy_deck_icons(sds_item* head) {
  int missing = 0;
  for (sds_item* item = head; item != nullptr; item = item->next) {
    if (item->ps_sds_icon_list == nullptr) continue;
    if (item->is_specially_removed) {
      __drop_icons(item);
      continue;
    }
    sds_icon* chosen = sds_choose_icon(item->ps_sds_icon_list);
    sds_keep_only_icon(&item->ps_sds_icon_list, chosen);
    if (!__copy_deck_icon(chosen)) {
      const char* name = __deck_icon_name(chosen->icon_path);
      SDS_LOGE("default deck: no icon file %s for %s", name != nullptr ? name : "(none)",
               item->site_url != nullptr ? item->site_url : "(no URL)");
      __drop_icons(item);
      ++missing;
    }
  }
  return missing;
}

// Items the merge stores: those with a URL.
int __count_sites(const sds_item* head) {
  int count = 0;
  for (const sds_item* item = head; item != nullptr; item = item->next) {
    if (item->site_url != nullptr && item->site_url[0] != '\0') ++count;
  }
  return count;
}

}  // namespace

int sds_default_deck_load(void) {
  const std::string list_path = sds_path(SDS_DEFAULT_DECK_JSON_PATH);
  if (access(list_path.c_str(), F_OK) != 0) return SDS_ERROR_NO_DATA;
  if (sds_item_list_head != nullptr) {
    SDS_LOGE("default deck not loaded: an item list is in use");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  // The parser reports running out of memory through the pull's result code;
  // no pull is running, and the code it will set is its own business.
  const int pull_error = sds_last_error;
  sds_last_error = SDS_ERROR_NONE;
  sds_parse_json_data(list_path.c_str());
  const bool cut_short = sds_last_error == SDS_ERROR_OUT_OF_MEMORY;
  sds_last_error = pull_error;
  if (sds_item_list_head != nullptr) (void)sds_drop_unusable_items();
  if (sds_item_list_head == nullptr) {
    SDS_LOGE("default deck not loaded: no item list in %s", list_path.c_str());
    return SDS_ERROR_NO_DATA;
  }
  const int missing = __copy_deck_icons(sds_item_list_head);
  const int sites = __count_sites(sds_item_list_head);
  const int merged = insert_sitedeck_items_in_db(sds_item_list_head);
  sds_free_item_list();
  if (merged == SDS_MERGE_NOT_COMMITTED) {
    SDS_LOGE("default deck not loaded: its items could not be stored");
    return SDS_ERROR_DISK_BUSY;
  }
  if (cut_short) SDS_LOGE("default deck cut short: out of memory");
  SDS_LOGI("default deck loaded: %d items (%d icon files missing)", sites, missing);
  return SDS_ERROR_NONE;
}
