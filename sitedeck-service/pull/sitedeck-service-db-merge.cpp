// The merge of a downloaded item list into the table: new sites are inserted,
// stored ones refreshed, all numbered in list order with their specially
// removed state, new icons stored, and live sites the list no longer names
// deleted. The whole merge is one transaction, so neither a reader in another
// process nor a crash ever sees a half-merged table; within it, one item's
// failing step does not stop the others, but a row that could not be written
// makes the whole merge roll back. SQLite rolls the transaction back by
// itself after some failures (a full disk, an I/O error); the merge stops at
// the first statement that finds it gone, for every statement after it would
// commit on its own. An icon's path, time stamp and size are stored only
// together with its pixels, so that a broken icon is fetched again next time.
#include <sqlite3.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <new>
#include <string_view>
#include <unordered_set>

#include "pull/sitedeck-service-db-merge.h"
#include "database/sitedeck-service-db-stmt-cache.h"
#include "database/sitedeck-service-error.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-utils.h"

namespace {

using UrlSet = std::unordered_set<std::string_view>;

bool run(const char* sql) {
  if (sqlite3_exec(sds_db_handle, sql, nullptr, nullptr, nullptr) == SQLITE_OK) return true;
  SDS_LOGE("%s failed: %s", sql, sqlite3_errmsg(sds_db_handle));
  return false;
}

// False once SQLite has rolled the merge's transaction back by itself.
bool transaction_alive() { return sqlite3_get_autocommit(sds_db_handle) == 0; }

// Pass 1 for one item: insert or refresh its row. `order` is its number.
// The columns that the single-column accessors would write one after
// another (the icon's four, the order number, the title, the colour and the
// specially removed state) go into one UPDATE per item: inside the merge's
// transaction the row ends the same, with a third of the statements.
// False when a write of the row itself failed (a read-only or full disk, an
// I/O error): the table would then not hold the list. A failed icon store
// is not counted: a broken icon leaves its site without an icon.
bool merge_item(sds_item* item, int order) {
  if (item->site_name == nullptr || item->site_name[0] == '\0') {
    std::free(item->site_name);
    item->site_name = strdup(item->site_url);
  }
  int code = SDS_ERROR_NONE;
  bool written = true;
  int id = sds_db_check_duplicated_string(sds_db_handle, "site_deck", "url", item->site_url, &code);
  const bool stored = id >= 0;
  sds_icon_columns icon;
  const bool icon_loaded = sds_load_sitedeck_icon_columns(item, &icon) == SDS_ERROR_NONE;
  if (!icon_loaded && item->ps_sds_icon_list != nullptr) ++sds_merge_refused_icons;
  if (!stored) {
    // A new row takes the icon's texts only with the pixels, which the
    // update below writes: without them the next pull fetches the icon again.
    sds_icon* icons = item->ps_sds_icon_list;
    item->ps_sds_icon_list = nullptr;
    id = sds_db_create_site_deck_item(sds_db_handle, item, &code);
    item->ps_sds_icon_list = icons;
    written = id > 0;
  }
  if (!transaction_alive()) return false;

  sds_db_column_value values[SDS_ICON_COLUMNS_MAX + 4];
  int count = 0;
  if (icon_loaded) count = sds_icon_columns_values(icon, values);
  values[count++] = {"order_index", &order, 0, SDS_DB_COLUMN_TYPE_INT};
  if (stored) {
    if (item->site_name != nullptr) {
      values[count++] = {"title", item->site_name, 0, SDS_DB_COLUMN_TYPE_TEXT};
    }
    if (item->predominant_color != nullptr) {
      values[count++] = {"dominant_color", item->predominant_color, 0, SDS_DB_COLUMN_TYPE_TEXT};
    }
  }
  int is_dirty = item->is_specially_removed != 0 ? -1 : 1;
  values[count++] = {"is_dirty", &is_dirty, 0, SDS_DB_COLUMN_TYPE_INT};
  int write_code = SDS_ERROR_NONE;
  if (sds_db_columns_replace(sds_db_handle, id, "site_deck", values, count, &write_code) != 0) {
    SDS_LOGE("Error : %s", sds_error_string(write_code));
    written = false;
  }
  if (code != SDS_ERROR_NONE) SDS_LOGE("Error :: %s", sds_error_string(code));
  return written;
}

// Removes the downloaded icon files of the list once the merge is over,
// however it ends. Several items may name one icon URL and so one file: it
// must outlive every item's store, and is removed once.
struct IconFileSweep {
  const sds_item* head;
  ~IconFileSweep() {
    for (const sds_item* item = head; item != nullptr; item = item->next) {
      if (item->ps_sds_icon_list == nullptr) continue;
      const char* url = item->ps_sds_icon_list->icon_path;
      if (url == nullptr || std::strchr(url, '/') == nullptr) continue;  // never had a file
      UniqueCStr path(get_icon_path(url));
      if (path && access(path.get(), F_OK) == 0) (void)remove_file(path.get());
    }
  }
};

// Collects the listed URLs; false when memory ran out.
bool collect_urls(const sds_item* head, UrlSet* urls) {
  try {
    for (const sds_item* item = head; item != nullptr; item = item->next) {
      if (sds_item_is_usable(item)) urls->insert(item->site_url);
    }
    return true;
  } catch (const std::bad_alloc&) {
    return false;
  }
}

// Pass 2: deletes the live rows whose URL the list does not name. Returns
// SDS_ERROR_NONE, the code of the failed id list (SDS_ERROR_NO_DATA when no
// row is live), or SDS_ERROR_IO_ERROR when a delete failed.
int delete_vanished(const sds_item* head) {
  UrlSet listed;
  if (!collect_urls(head, &listed)) {
    SDS_LOGE("failed to malloc");
    return SDS_ERROR_OUT_OF_MEMORY;
  }
  int* raw_ids = nullptr;
  int count = 0;
  int live = 1;
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_all_dirty_ids(sds_db_handle, &raw_ids, &count, "is_dirty", &live,
                                 SDS_DB_COND_TYPE_INT, &code);
  UniqueMalloc<int> ids(raw_ids);
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("Error : %d", code);
    return code;
  }
  for (int i = 0; i < count; ++i) {
    char* raw_url = nullptr;
    if (get_sitedeck_url_from_db(ids.get()[i], &raw_url) != SDS_ERROR_NONE) {
      std::free(raw_url);
      continue;
    }
    UniqueCStr url(raw_url);
    if (!url || url.get()[0] == '\0' || listed.contains(url.get())) continue;
    if (delete_sitedeck_item_from_db(url.get()) != 0) {
      SDS_LOGE("Not able to delete one URL");
      code = SDS_ERROR_IO_ERROR;
    }
    if (!transaction_alive()) return SDS_ERROR_IO_ERROR;
  }
  return code;
}

}  // namespace

int sds_merge_refused_icons = 0;

int insert_sitedeck_items_in_db(sds_item* head) {
  sds_merge_refused_icons = 0;
  // An empty list, or one without a site the deck may hold, would make pass 2
  // delete every live site.
  const sds_item* usable = head;
  while (usable != nullptr && !sds_item_is_usable(usable)) usable = usable->next;
  if (usable == nullptr) {
    SDS_LOGE("NULL check::item");
    return SDS_MERGE_NOT_COMMITTED;
  }
  IconFileSweep sweep{head};
  if (!run("BEGIN IMMEDIATE")) return SDS_MERGE_NOT_COMMITTED;
  bool rows_written = true;
  int code = SDS_ERROR_IO_ERROR;
  {
    // Every item runs the same few statements: prepare each once.
    SdsDbStatementScope statements(sds_db_handle);
    int order = 1;
    for (sds_item* item = head; item != nullptr && transaction_alive(); item = item->next) {
      if (!sds_item_is_usable(item)) continue;
      rows_written = merge_item(item, order) && rows_written;
      ++order;
    }
    if (transaction_alive()) code = delete_vanished(head);
  }

  // SQLite rolls a transaction back by itself after some errors (a full disk,
  // an I/O error); then there is nothing left to commit, and the table is as
  // it was before the merge.
  if (!transaction_alive()) {
    SDS_LOGE("merge transaction was rolled back");
    // With every statement of the merge finalized, the next read lets SQLite
    // finish the rollback and remove its journal, instead of leaving a hot
    // journal on the full disk for whoever opens the file next.
    (void)sqlite3_exec(sds_db_handle, "SELECT count(*) FROM site_deck", nullptr, nullptr, nullptr);
    return SDS_MERGE_NOT_COMMITTED;
  }
  // With no live row there is nothing to clean up and the merge is whole,
  // though it answers -1. Any other failed clean-up would leave vanished
  // sites live beside the new numbering, and a row that could not be written
  // would leave the list incomplete: keep the previous table instead, so
  // that its ETag stays and the next pull asks for the whole list again.
  if (!rows_written) SDS_LOGE("a row of the list could not be written");
  bool keep = rows_written && (code == SDS_ERROR_NONE || code == SDS_ERROR_NO_DATA);
  if (keep && run("COMMIT")) return code == SDS_ERROR_NONE ? 0 : -1;
  (void)run("ROLLBACK");
  return SDS_MERGE_NOT_COMMITTED;
}
