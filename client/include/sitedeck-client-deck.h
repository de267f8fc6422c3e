// Whole tiles of the deck for clients that show it: everything the service
// stores about one item, read with the per-command calls in one go.
#pragma once

#include <cstdint>

#include "sitedeck-client-commands.h"

// One item as the browser shows it. Each field has the status its command
// gave: SDS_ERROR_NONE with the value set, or SDS_ERROR_NO_DATA when the
// service stores nothing for it (the value then stays empty).
struct sds_client_item {
  int32_t id = 0;
  SdsClientText url, title, dominant_color, icon_size;
  int32_t touch_icon_exists = 0;
  int32_t favicon_exists = 0;
  sds_client_icon icon;
  int url_status = SDS_ERROR_NO_DATA;
  int title_status = SDS_ERROR_NO_DATA;
  int color_status = SDS_ERROR_NO_DATA;
  int icon_size_status = SDS_ERROR_NO_DATA;
  int touch_icon_status = SDS_ERROR_NO_DATA;
  int favicon_status = SDS_ERROR_NO_DATA;
  int icon_status = SDS_ERROR_NO_DATA;  // stays so when the pixels were not asked for
};

// Reads URL, title, colour, icon size, both flags and, with `with_icon`, the
// pixels of item `id` into `item`. Returns SDS_ERROR_NONE when every field
// was read or had nothing stored; otherwise the first other status (no item
// with that id gives SDS_ERROR_ID_NOT_FOUND), without reading further.
// Blocks for up to seven replies.
SDS_CLIENT_API int sds_client_read_item(SdsConnection& connection, int32_t id, bool with_icon,
                                        sds_client_item* item);
