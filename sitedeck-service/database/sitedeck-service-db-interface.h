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

int delete_sitedeck_item_from_db(const char* url);
int get_sitedeck_url_from_db(int id, char** url);

int get_sitedeck_title_from_db(int id, char** title);
int get_sitedeck_icon_path_from_db(int id, char** path);
int get_sitedeck_icon_size_from_db(int id, char** size);
int get_sitedeck_icon_data_from_db(int id, unsigned char** data, int* data_size);
int get_sitedeck_icon_dominant_color(int id, char** color);
int get_sitedeck_icon_time_stamp(int id, char** time_stamp);
int get_sitedeck_item_from_db(int id, sds_item* item);
