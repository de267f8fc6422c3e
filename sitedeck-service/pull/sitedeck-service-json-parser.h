// A thin reader over json-glib: loads a JSON file and lets the item-list
// parser walk it one level at a time through a small flat record. No state of
// its own beyond a per-thread cache of member names that keeps the walk by
// index over an object linear; every call works on records the caller provides.
#pragma once

#include <cstdint>

typedef struct _JsonNode JsonNode;

enum sds_json_type_e : int {
  SDS_JSON_NONE = 0,
  SDS_JSON_INT = 1,
  SDS_JSON_UINT = 2,
  SDS_JSON_DOUBLE = 3,
  SDS_JSON_STRING = 4,
  SDS_JSON_BOOLEAN = 5,
  SDS_JSON_ARRAY = 6,
  SDS_JSON_OBJECT = 7,
};

// Largest JSON file the reader loads; a larger one fails like an unreadable one.
constexpr long SDS_JSON_MAX_FILE_BYTES = 4L * 1024 * 1024;

// One node as the walker sees it. `key` is the member name the node was found
// under: an owned copy after a load ("root") or a member lookup, a pointer into
// the document after a walk by index, null for array elements. The record frees
// an owned copy itself when it is filled again or destroyed, and the root
// record's document and a leftover string copy when destroyed, so a record can
// be dropped at any point without leaking. Not copyable: it may own memory.
struct sds_json_node {
  int type = SDS_JSON_NONE;
  char* key = nullptr;
  union {
    JsonNode* node;
    char* str;  // for SDS_JSON_STRING: an owned copy of the value
  };
  uint32_t value = 0;

  // Bookkeeping of the reader; callers leave these alone.
  bool owns_key_ = false;   // `key` was allocated by the reader
  bool owns_str_ = false;   // the slot holds an owned string copy
  bool owns_node_ = false;  // the slot holds the loaded document (root record)

  sds_json_node() : node(nullptr) {}
  ~sds_json_node();
  sds_json_node(const sds_json_node&) = delete;
  sds_json_node& operator=(const sds_json_node&) = delete;
};

// Loads the JSON file at `path` into `root`. On any failure (missing, too
// large, too deeply nested or unparsable file) `root->key` stays null.
void sds_json_parser_parse_buffer(const char* path, sds_json_node* root);
// Reads the scalar held by `record->node` into type, slot and value. 1, or -1
// when no record is given.
int sds_json_parser_read_value(sds_json_node* record);
// Fills `child` with the index-th member of an object or element of an array
// held by `parent`. 1 when filled, 0 otherwise. Linear over a whole walk.
int sds_json_parser_get_nth(sds_json_node* parent, sds_json_node* child, int index);
// Fills `child` with the member `name` of the object held by `parent`; `child`
// gets an owned copy of `name` as key. 1 when filled, -1 otherwise.
int sds_json_parser_get_member(sds_json_node* parent, sds_json_node* child, const char* name);
// Releases the string copy of a type-4 record; harmless when repeated.
void sds_json_parser_parse_buffer_free_value(sds_json_node* record);
// Releases what a root record owns (key copy and document); for the root only.
void sds_json_parser_parse_buffer_free(sds_json_node* root);
