// Limits and helpers shared by the HTTP transfers of a pull (item list, icons,
// geocoder). Everything a server sends is bounded before it reaches the disk,
// and every transfer, like the pull as a whole, has a deadline: a server that
// drips bytes just fast enough to pass the stall guard cannot hold the one
// connection of the service for longer.
#pragma once

#include <cstddef>

#include "pull/sitedeck-service-json-parser.h"

// Largest item-list answer accepted, in bytes: the download stops there and
// the reader refuses a larger file, so one bound holds for both.
constexpr size_t SDS_MAX_ITEM_LIST_BYTES = static_cast<size_t>(SDS_JSON_MAX_FILE_BYTES);
// Largest icon file accepted, in bytes.
constexpr size_t SDS_MAX_ICON_BYTES = 4u * 1024 * 1024;
// Largest geocoder answer accepted, in bytes.
constexpr size_t SDS_MAX_GEOCODER_BYTES = 1024 * 1024;
// Largest response header block accepted, in bytes.
constexpr size_t SDS_MAX_HEADER_BYTES = 256 * 1024;

// Default deadlines, in seconds, of one transfer of each kind and of a whole
// pull (the wait between attempts included). The platform keys
// "db/browser/sitedeck/transfer_deadline_seconds" (1..3600, all three kinds)
// and "db/browser/sitedeck/pull_deadline_seconds" (1..86400) override them.
constexpr long SDS_ITEM_LIST_DEADLINE_SECONDS = 300;
constexpr long SDS_ICON_DEADLINE_SECONDS = 60;
constexpr long SDS_GEOCODER_DEADLINE_SECONDS = 30;
constexpr long SDS_PULL_DEADLINE_SECONDS = 600;

enum sds_transfer_kind { SDS_TRANSFER_ITEM_LIST, SDS_TRANSFER_ICON, SDS_TRANSFER_GEOCODER };

// Sets up libcurl's global state once per process.
void sds_transfer_global_init(void);
// Applies the device proxy to `curl`; `*proxy` receives the text to free after
// the transfer. SDS_ERROR_OUT_OF_MEMORY (after "FAIL_TO_MEMALLOC") or NONE.
int sds_transfer_apply_proxy(void* curl, char** proxy);
// Gives `curl` the time limit of a transfer of `kind`, shortened to what is
// left of the running pull. False (the transfer must not start) when the
// pull's deadline has passed.
bool sds_transfer_apply_deadline(void* curl, sds_transfer_kind kind);

// The running pull's deadline: started by the pull job, ended when it returns.
// Outside a pull nothing is left over from an earlier one.
void sds_pull_deadline_start(void);
void sds_pull_deadline_end(void);
// Milliseconds left until the deadline (0 once it passed); a large number
// when no pull runs.
long long sds_pull_ms_left(void);
