// One call per command of the service (docs/protocol.md), each doing that
// command's whole wire exchange on an open connection and returning a
// status: SDS_ERROR_NONE with the outputs filled, or the status the service
// sent (outputs untouched), or a code of the library's own for a request it
// refuses before sending (SDS_ERROR_INVALID_PARAMETER) and for a reply that
// broke off, timed out or made no sense (SDS_ERROR_IO_ERROR,
// SDS_ERROR_INVALID_PARAMETER). A reply that broke off leaves the byte stream
// out of step with the requests, so those calls close the connection; later
// calls on it give SDS_ERROR_IO_ERROR. Every call blocks until its reply is
// read, bounded by timeouts().reply_ms (initialize: pull_ms for the result).
#pragma once

#include <cstdint>

#include "sitedeck-client.h"

// Most ids a client accepts from command 11 before refusing the reply: a
// count beyond any real deck is a broken or hostile peer, not a deck.
constexpr int32_t SDS_CLIENT_MAX_IDS = 1000000;

// Pixels of one icon as command 7 hands them over: rows top to bottom, four
// bytes per pixel (B, G, R, A, straight alpha), byte_count == width * height * 4.
struct sds_client_icon {
  SdsClientBuffer<unsigned char> pixels;
  int32_t byte_count = 0;
  int32_t width = 0;
  int32_t height = 0;
};

// Item ids in the order the service lists them (the server's order).
struct sds_client_ids {
  SdsClientBuffer<int32_t> ids;
  int32_t count = 0;
};

// Command 1: hands over the position and the browser version (null or empty:
// none) and waits for the data pull's result, which is returned (0: a new
// list was stored; 17: the stored list is current). The pull can take
// minutes: `waiting`, when given, is called about every `tick_ms`
// milliseconds while it lasts (to animate a spinner, say) and can give up by
// returning false, which closes the connection and returns
// SDS_ERROR_IO_EINTR; so does the end of timeouts().pull_ms. A version longer
// than 4096 bytes is refused before anything is sent.
using sds_client_wait_fn = bool (*)(void* user);
SDS_CLIENT_API int sds_client_initialize(SdsConnection& connection, double latitude,
                                         double longitude, const char* browser_version,
                                         sds_client_wait_fn waiting = nullptr,
                                         void* user = nullptr, int tick_ms = 100);

// Command 2: removes the shared-memory object. On SDS_ERROR_NONE the service
// ends the connection, and so does this call; SDS_ERROR_SHM_FAILED (the
// object was already gone) leaves the connection usable.
SDS_CLIENT_API int sds_client_release_shm(SdsConnection& connection);

// Commands 3, 4, 6 and 9: one text of item `item_id`, NUL terminated.
// SDS_ERROR_ID_NOT_FOUND for an unknown id, SDS_ERROR_NO_DATA when nothing is
// stored. A negative id is refused unsent: the service would not answer.
SDS_CLIENT_API int sds_client_get_url(SdsConnection& connection, int32_t item_id,
                                      SdsClientText* url);
SDS_CLIENT_API int sds_client_get_title(SdsConnection& connection, int32_t item_id,
                                        SdsClientText* title);
// "WIDTHxHEIGHT" of the stored icon.
SDS_CLIENT_API int sds_client_get_icon_size(SdsConnection& connection, int32_t item_id,
                                            SdsClientText* size);
// "#RRGGBB", as the content server gave it.
SDS_CLIENT_API int sds_client_get_dominant_color(SdsConnection& connection, int32_t item_id,
                                                 SdsClientText* color);

// Commands 5 and 8: the item's flags as the server gave them (0 or 1).
SDS_CLIENT_API int sds_client_get_touch_icon_exists(SdsConnection& connection, int32_t item_id,
                                                    int32_t* value);
SDS_CLIENT_API int sds_client_get_favicon_exists(SdsConnection& connection, int32_t item_id,
                                                 int32_t* value);

// Command 7: copies the icon's pixels out of the shared-memory object after
// the reply. SDS_ERROR_NO_DATA for an item without pixels; a reply whose byte
// count exceeds the object or is not width * height * 4 is refused with
// SDS_ERROR_INVALID_PARAMETER; SDS_ERROR_SHM_FAILED when the object can't be
// mapped. The mapping stays with the connection for the next icon.
SDS_CLIENT_API int sds_client_get_icon(SdsConnection& connection, int32_t item_id,
                                       sds_client_icon* icon);

// Command 10: seconds until the browser should ask for a pull again.
SDS_CLIENT_API int sds_client_get_next_update_duration(SdsConnection& connection,
                                                       int32_t* seconds);

// Command 11 without a condition: the ids of the live items, the ones a start
// page shows. SDS_ERROR_NO_DATA when there are none.
SDS_CLIENT_API int sds_client_get_full_ids(SdsConnection& connection, sds_client_ids* ids);
// Command 11 with the one condition there is: the ids whose state equals
// `is_dirty`: 1 live, -1 withdrawn (the server still lists the site but asks
// that it not be shown). SDS_ERROR_NO_DATA when there are none.
SDS_CLIENT_API int sds_client_get_ids_by_dirty(SdsConnection& connection, int32_t is_dirty,
                                               sds_client_ids* ids);
