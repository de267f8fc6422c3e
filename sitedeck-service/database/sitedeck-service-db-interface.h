// Item accessors over the `site_deck` table: one property of one item by id or
// URL, id lists, icons with their dimensions, the single-column writes and the
// merge of a downloaded item list. All work goes through sds_db_handle.
#pragma once

#include "database/sitedeck-service-db.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"

// The process's one connection; opened by sds_ensure_db_open.
extern sqlite3* sds_db_handle;

// Opens sds_db_handle when it is not open yet: SDS_ERROR_NONE or
// SDS_ERROR_DB_OPEN_FAILED.
int sds_ensure_db_open(void);
// As sds_ensure_db_open, but a database found damaged is first deleted and
// made afresh (empty, so the stored ETag goes too and the next download is
// a full one). Meant for the start of a data pull, which is about to refill it.
int sds_ensure_db_sound(void);

int sds_get_string_from_db(int id, char** value, const char* column);
int sds_get_int_from_db(int id, sds_db_value* value, const char* column);
int sds_get_all_ids_from_db(int** ids, int* count, const char* cond_column, const void* cond_value,
                            int cond_type);
int sds_get_blob_from_db(int id, int* length, int* height, int* width, unsigned char** bytes);
// As sds_get_blob_from_db, with the same checks, codes and log lines, but
// the pixels are copied once, straight to where `place` says: it is called
// with their byte count once they are known to be there, and returns the
// destination (null: not copied). An I/O failure while copying gives the
// connection's code for it, or SDS_ERROR_NO_DATA.
int sds_copy_blob_from_db(int id, int* length, int* height, int* width,
                          unsigned char* (*place)(int length, void* user), void* user);
int sds_get_string_for_url_from_db(const char* url, char** value, const char* column);

int update_sitedeck_order_index_to_db(int id, const int* order_index);
int update_sitedeck_is_specially_removed(int id, int flag);
int update_sitedeck_title_to_db(int id, const char* title);
int update_sitedeck_predominant_color_to_db(int id, const char* color);
int update_sitedeck_icon_to_db(int id, sds_item* item);

// The icon columns of an item's downloaded icon, as update_sitedeck_icon_to_db
// writes them: decoded pixel rows, the icon's path, its size text (the
// decoded size when the server's text does not describe the pixels) and its
// time stamp (not written when empty).
struct sds_icon_columns {
  UniqueMalloc<unsigned char> pixels;
  int pixel_bytes = 0;
  const char* icon_path = nullptr;  // the item's icon's text, or null
  char icon_size[sizeof(sds_icon::icon_size) + 1] = {};
  char last_modified[sizeof(sds_icon::last_modified) + 1] = {};
};
constexpr int SDS_ICON_COLUMNS_MAX = 4;
// Reads and decodes the item's one icon file, with the checks and messages of
// update_sitedeck_icon_to_db, and leaves the file where it is: items naming
// the same icon URL share one downloaded file, so the merge stores every item
// first and removes the files afterwards. Returns the code; `out` is filled
// only on SDS_ERROR_NONE.
int sds_load_sitedeck_icon_columns(const sds_item* item, sds_icon_columns* out);
// Fills `values` (room for SDS_ICON_COLUMNS_MAX) with the columns to write, in
// update_sitedeck_icon_to_db's order; returns their count. They point into `icon`.
int sds_icon_columns_values(const sds_icon_columns& icon, sds_db_column_value* values);
int delete_sitedeck_item_from_db(const char* url);
int get_sitedeck_url_from_db(int id, char** url);

int get_sitedeck_title_from_db(int id, char** title);
int get_sitedeck_icon_path_from_db(int id, char** path);
int get_sitedeck_icon_size_from_db(int id, char** size);
int get_sitedeck_icon_data_from_db(int id, unsigned char** data, int* data_size);
int get_sitedeck_icon_dominant_color(int id, char** color);
int get_sitedeck_icon_time_stamp(int id, char** time_stamp);
int get_sitedeck_item_from_db(int id, sds_item* item);

// Merges a parsed item list into the table, in one transaction. Returns 0; -1
// when the merge committed but found no live row to clean up;
// SDS_MERGE_NOT_COMMITTED when it was rolled back and the table is unchanged.
int insert_sitedeck_items_in_db(sds_item* head);

// Icons the last insert_sitedeck_items_in_db could not store (not a PNG, too
// large, unreadable): their sites have no new pixels.
extern int sds_merge_refused_icons;

// Result of insert_sitedeck_items_in_db when its transaction was rolled back
// and the table still holds the previous list.
constexpr int SDS_MERGE_NOT_COMMITTED = -2;
