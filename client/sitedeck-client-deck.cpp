// Reading one whole tile: the item calls one after the other, a field with
// nothing stored being a normal part of a tile rather than a failure.
#include "sitedeck-client-deck.h"

namespace {

// True when reading may go on after a field's status.
bool __sds_client_field_ok(int status) {
  return status == SDS_ERROR_NONE || status == SDS_ERROR_NO_DATA;
}

}  // namespace

int sds_client_read_item(SdsConnection& connection, int32_t id, bool with_icon,
                         sds_client_item* item) {
  if (item == nullptr || id < 0) return SDS_ERROR_INVALID_PARAMETER;
  item->id = id;
  struct text_field {
    int (*read)(SdsConnection&, int32_t, SdsClientText*);
    SdsClientText* value;
    int* status;
  } texts[] = {
      {sds_client_get_url, &item->url, &item->url_status},
      {sds_client_get_title, &item->title, &item->title_status},
      {sds_client_get_dominant_color, &item->dominant_color, &item->color_status},
      {sds_client_get_icon_size, &item->icon_size, &item->icon_size_status},
  };
  for (const auto& field : texts) {
    *field.status = field.read(connection, id, field.value);
    if (!__sds_client_field_ok(*field.status)) return *field.status;
  }
  item->touch_icon_status =
      sds_client_get_touch_icon_exists(connection, id, &item->touch_icon_exists);
  if (!__sds_client_field_ok(item->touch_icon_status)) return item->touch_icon_status;
  item->favicon_status = sds_client_get_favicon_exists(connection, id, &item->favicon_exists);
  if (!__sds_client_field_ok(item->favicon_status)) return item->favicon_status;
  if (with_icon) {
    item->icon_status = sds_client_get_icon(connection, id, &item->icon);
    if (!__sds_client_field_ok(item->icon_status)) return item->icon_status;
  }
  return SDS_ERROR_NONE;
}
