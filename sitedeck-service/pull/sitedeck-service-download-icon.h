// Icon download: for each parsed item choose one touch icon, and fetch it into
// the images directory when it differs from the stored one. Each item ends up
// holding just the downloaded icon or no icon at all.
#pragma once

#include "sitedeck-service-types.h"

// Returns 0 when no download failed, -1 otherwise; prunes icon lists in place.
int sds_get_sitedeck_icons(sds_item** head);
// Returns 0 when the transfer completed into the icon's file, -1 otherwise.
int sds_download_icon(sds_icon* icon);
sds_icon* sds_choose_icon(sds_icon* head);
// Releases every icon of the list but `chosen`, which becomes the only one.
void sds_keep_only_icon(sds_icon** head, sds_icon* chosen);
