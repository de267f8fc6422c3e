// Fuzz target: an item-list answer from the content server through the JSON
// reader and the item-list parser, and the parsed list through the merge into
// a scratch database that starts every run with the same two rows, as the
// download hands it over (unusable sites dropped). After a
// committed merge the live rows must be exactly the listed sites whose last
// mention is not specially removed, and every listed site must have a row.
#include <sqlite3.h>

#include <cstdint>
#include <cstdlib>
#include <map>
#include <set>
#include <string>

#include "pull/sitedeck-service-db-merge.h"
#include "fuzz_support.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-utils.h"

namespace {

// Long enough for some hundred items; longer inputs only cost merge time.
constexpr size_t kMaxInput = 32 * 1024;
// The seed corpus names this icon; its PNG is put in place before each run,
// as the icon download would, so that the merge stores real pixels.
constexpr const char* kSeedIconUrl = "http://127.0.0.1/icons/seed.png";

constexpr const char* kResetTable =
    "DELETE FROM site_deck;"
    "INSERT INTO site_deck(id,url,title,is_dirty,order_index) VALUES"
    " (1,'http://stored.example/','Stored',1,1),"
    " (2,'http://removed.example/','Removed',-1,2);";

std::string g_icon_path;
std::string g_icon_png;

void set_up(void) {
  fuzz_open_database();
  UniqueCStr path(get_icon_path(kSeedIconUrl));
  if (!path) std::abort();
  g_icon_path = path.get();
  unsigned char pixels[2 * 2 * 4] = {1, 2, 3, 255, 4, 5, 6, 128, 7, 8, 9, 0, 10, 11, 12, 255};
  unsigned char* png = nullptr;
  int png_size = 0;
  if (convert_raw_data_to_png(pixels, 2, 2, &png, &png_size) != 0) std::abort();
  g_icon_png.assign(reinterpret_cast<char*>(png), static_cast<size_t>(png_size));
  std::free(png);
}

// The URLs of the rows `sql` selects.
std::set<std::string> urls(const char* sql) {
  std::set<std::string> found;
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(sds_db_handle, sql, -1, &stmt, nullptr) != SQLITE_OK) std::abort();
  while (sqlite3_step(stmt) == SQLITE_ROW) {
    const unsigned char* url = sqlite3_column_text(stmt, 0);
    found.insert(url != nullptr ? reinterpret_cast<const char*>(url) : "(null)");
  }
  sqlite3_finalize(stmt);
  return found;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return -1;
  if (g_icon_path.empty()) set_up();
  fuzz_exec(kResetTable);
  fuzz_write_file(g_icon_path, reinterpret_cast<const uint8_t*>(g_icon_png.data()),
                  g_icon_png.size());
  const std::string path = fuzz_path(SDS_JSON_RESPONSE_PATH);
  fuzz_write_file(path, data, size);

  sds_last_error = SDS_ERROR_NONE;
  sds_parse_json_data(path.c_str());
  // As the download does: only the sites the deck may hold go on.
  if (sds_item_list_head != nullptr) (void)sds_drop_unusable_items();
  if (sds_item_list_head == nullptr) return 0;

  // What the merge must leave live: each listed URL, by its last mention.
  std::map<std::string, bool> removed_by_url;
  for (const sds_item* item = sds_item_list_head; item != nullptr; item = item->next) {
    if (item->site_url == nullptr || item->site_url[0] == '\0') continue;
    removed_by_url[item->site_url] = item->is_specially_removed != 0;
  }
  int merged = insert_sitedeck_items_in_db(sds_item_list_head);
  sds_free_item_list();
  (void)std::remove(g_icon_path.c_str());
  if (merged == SDS_MERGE_NOT_COMMITTED) return 0;

  const std::set<std::string> stored = urls("SELECT url FROM site_deck");
  std::set<std::string> expected;
  for (const auto& [url, removed] : removed_by_url) {
    if (stored.count(url) == 0) std::abort();
    if (!removed) expected.insert(url);
  }
  if (urls("SELECT url FROM site_deck WHERE is_dirty=1") != expected) std::abort();
  return 0;
}
