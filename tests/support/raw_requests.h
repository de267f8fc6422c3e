// The item queries the end-to-end fault and resource tests send, spelled out
// on the wire with the service's own primitives (layouts: docs/protocol.md);
// initialize is in pull_env.h.
// Every call returns the reply's status (SDS_ERROR_IO_ERROR when the
// connection failed) and fills its outputs only when the status is 0.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "sitedeck-client.h"

// Command 11: the live ids (selector "is_dirty" = 1), or every id with the
// storage's default condition when `default_condition`.
int request_ids(const SdsConnection& connection, std::vector<int32_t>* ids,
                bool default_condition = false);
// Command 3 or 4 (or 6, 9): one text column of item `id`.
int request_text(const SdsConnection& connection, int32_t cmd, int32_t id, std::string* text);
// Commands 5 and 8: one integer column of item `id`.
int request_int(const SdsConnection& connection, int32_t cmd, int32_t id, int32_t* value);
// Command 7: byte count, width and height of item `id`'s icon.
int request_icon(const SdsConnection& connection, int32_t id, int32_t* bytes, int32_t* width,
                 int32_t* height);
// Command 10: seconds until the next pull is due.
int request_next_update(const SdsConnection& connection, int32_t* seconds);
// Command 2: removes the shared-memory object; the service then ends.
int request_free_shm(const SdsConnection& connection);

// The live items as "id|url" in the service's order (command 11, then
// command 3 for each); an empty list and `*status` set when a step failed.
std::vector<std::string> live_items(const SdsConnection& connection, int* status = nullptr);
