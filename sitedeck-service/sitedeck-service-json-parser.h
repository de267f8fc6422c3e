// A thin reader over json-glib: loads a JSON file and lets the item-list
// parser walk it one level at a time through a small flat record. No state of
// its own; every call works on records the caller provides.
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

struct sds_json_node {
  int type = SDS_JSON_NONE;
  char* key = nullptr;
  union {
    JsonNode* node;
    char* str;  // for SDS_JSON_STRING: an owned copy of the value
  };
  uint32_t value = 0;
  sds_json_node() : node(nullptr) {}
};

void sds_json_parser_parse_buffer(const char* path, sds_json_node* root);
int sds_json_parser_read_value(sds_json_node* record);
int sds_json_parser_get_nth(sds_json_node* parent, sds_json_node* child, int index);
int sds_json_parser_get_member(sds_json_node* parent, sds_json_node* child, const char* name);
void sds_json_parser_parse_buffer_free_value(sds_json_node* record);
void sds_json_parser_parse_buffer_free(sds_json_node* root);
