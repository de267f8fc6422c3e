// Writing a pulled item list into the item store: the merge of a whole list
// and the store of an item's downloaded icon. They belong to the pull module;
// the connection and the row operations they use are the serving binary's
// (database/).
#pragma once

#include "database/sitedeck-service-db-interface.h"

// Decodes the item's downloaded icon file and writes its columns (pixels,
// path, size text, time stamp) to row `id`; the file is removed. Returns the code.
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
