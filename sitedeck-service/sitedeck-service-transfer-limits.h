// Limits and helpers shared by the HTTP transfers of a pull (item list, icons,
// geocoder). Everything a server sends is bounded before it reaches the disk.
#pragma once

#include <cstddef>

// Largest item-list answer accepted, in bytes.
constexpr size_t SDS_MAX_ITEM_LIST_BYTES = 16u * 1024 * 1024;
// Largest icon file accepted, in bytes.
constexpr size_t SDS_MAX_ICON_BYTES = 4u * 1024 * 1024;
// Largest geocoder answer accepted, in bytes.
constexpr size_t SDS_MAX_GEOCODER_BYTES = 1024 * 1024;
// Largest response header block accepted, in bytes.
constexpr size_t SDS_MAX_HEADER_BYTES = 256 * 1024;

// Sets up libcurl's global state once per process.
void sds_transfer_global_init(void);
// Applies the device proxy to `curl`; `*proxy` receives the text to free after
// the transfer. SDS_ERROR_OUT_OF_MEMORY (after "FAIL_TO_MEMALLOC") or NONE.
int sds_transfer_apply_proxy(void* curl, char** proxy);
