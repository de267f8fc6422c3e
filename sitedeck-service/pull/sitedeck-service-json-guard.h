// A pre-check of JSON text before json-glib sees it. json-glib parses with
// unbounded recursion and looks up repeated member names with a linear search,
// so a hostile answer could crash the service with deep nesting or stall it
// with many repeated names. This scan refuses such text in linear time; it
// does not validate JSON otherwise (json-glib does that).
#pragma once

#include <cstddef>

// Deepest nesting of arrays and objects that is accepted.
constexpr int SDS_JSON_MAX_DEPTH = 64;
// Budget for repeated member names: each repeat costs the number of distinct
// names its object holds so far (json-glib's search for the earlier one).
constexpr long SDS_JSON_MAX_REPEAT_COST = 1000000;

// 0 when `length` bytes at `data` may be handed to json-glib; -1 otherwise,
// with `*reason` (when given) set to a constant text naming the problem.
int sds_json_guard_check(const char* data, size_t length, const char** reason);
