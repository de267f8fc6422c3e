// The JSON document reader: loads a saved server answer with json-glib and
// hands it out one level at a time through sds_json_node records. The file is
// read whole under a size cap and pre-checked for nesting and repeated names
// before json-glib sees it. A small per-thread cache of member-name lists keeps
// the walk by index over an object linear instead of quadratic.
#include "pull/sitedeck-service-json-parser.h"

#include <json-glib/json-glib.h>

#include <cmath>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "pull/sitedeck-service-file-read.h"
#include "pull/sitedeck-service-json-guard.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"

namespace {

struct GObjectUnref {
  void operator()(gpointer p) const noexcept { g_object_unref(p); }
};
using JsonParserPtr = std::unique_ptr<JsonParser, GObjectUnref>;

struct GErrorFree {
  void operator()(GError* e) const noexcept { g_error_free(e); }
};
using GErrorPtr = std::unique_ptr<GError, GErrorFree>;

struct JsonNodeUnref {
  void operator()(JsonNode* n) const noexcept { json_node_unref(n); }
};
using JsonNodePtr = std::unique_ptr<JsonNode, JsonNodeUnref>;

// Member names of one object in document order. The entry holds a reference
// on the object, so the names stay valid and the address cannot be reused by
// another object while it is cached. A few entries, because a walk nests: an
// item element, its body and the body's icon entries are walked in turn.
struct MemberNames {
  JsonObject* object = nullptr;
  const char** names = nullptr;
  guint count = 0;
  unsigned long last_use = 0;
};

constexpr int kNameCacheEntries = 4;

struct NameCache {
  MemberNames entries[kNameCacheEntries];
  unsigned long clock = 0;

  void drop(MemberNames* e) {
    if (e->object != nullptr) json_object_unref(e->object);
    std::free(e->names);
    *e = MemberNames{};
  }
  void clear() {
    for (auto& e : entries) drop(&e);
  }
  ~NameCache() { clear(); }

  // The names of `object`, or null when they cannot be listed.
  MemberNames* lookup(JsonObject* object) {
    MemberNames* victim = &entries[0];
    for (auto& e : entries) {
      if (e.object == object) {
        e.last_use = ++clock;
        return &e;
      }
      if (e.last_use < victim->last_use) victim = &e;
    }
    drop(victim);
    guint count = json_object_get_size(object);
    auto* names = static_cast<const char**>(std::calloc(count > 0 ? count : 1, sizeof(char*)));
    if (names == nullptr) return nullptr;
    GList* list = json_object_get_members(object);
    guint i = 0;
    for (GList* l = list; l != nullptr && i < count; l = l->next) {
      names[i++] = static_cast<const char*>(l->data);
    }
    g_list_free(list);
    victim->object = json_object_ref(object);
    victim->names = names;
    victim->count = i;
    victim->last_use = ++clock;
    return victim;
  }
};

thread_local NameCache t_name_cache;

void __set_key(sds_json_node* record, char* key, bool owned) {
  if (record->owns_key_) std::free(record->key);
  record->key = key;
  record->owns_key_ = owned;
}

// Frees whatever the slot owns before it is given another node.
void __release_slot(sds_json_node* record) {
  if (record->owns_str_) {
    std::free(record->str);
  } else if (record->owns_node_) {
    json_node_unref(record->node);
  }
  record->node = nullptr;
  record->owns_str_ = false;
  record->owns_node_ = false;
}

// Doubles outside the 32-bit range wrap modulo 2^32 after truncation toward
// zero; NaN, infinities and values beyond 64 bits give 0. A plain conversion
// would be undefined for them.
uint32_t __double_to_u32(double d) {
  if (!std::isfinite(d)) return 0;
  double t = std::trunc(d);
  if (t >= 0 && t < 4294967296.0) return static_cast<uint32_t>(t);
  if (t < -9.2e18 || t > 9.2e18) return 0;
  return static_cast<uint32_t>(static_cast<int64_t>(t));
}

// Classifies the node now in the slot. A JSON null is where the two walk
// steps differ: the walk by index reports it as type 0 (`null_result` 1), the
// member lookup as not found (`null_result` -1, type unchanged).
int __classify_child(sds_json_node* child, int null_result) {
  switch (json_node_get_node_type(child->node)) {
    case JSON_NODE_OBJECT:
      child->type = SDS_JSON_OBJECT;
      return 1;
    case JSON_NODE_ARRAY:
      child->type = SDS_JSON_ARRAY;
      return 1;
    case JSON_NODE_VALUE:
      return sds_json_parser_read_value(child);
    case JSON_NODE_NULL:
    default:
      if (null_result == 1) child->type = SDS_JSON_NONE;
      return null_result;
  }
}

// The slot of a record holding a string copy is no node to walk.
bool __holds_node(const sds_json_node* record) {
  return record->node != nullptr && !record->owns_str_;
}

}  // namespace

sds_json_node::~sds_json_node() {
  if (owns_key_) std::free(key);
  __release_slot(this);
}

void sds_json_parser_parse_buffer(const char* path, sds_json_node* root) {
  if (path == nullptr || root == nullptr) {
    SDS_LOGE("[CRITICAL] Invalid data");
    return;
  }
  JsonParserPtr parser(json_parser_new());
  if (!parser) return;

  size_t length = 0;
  UniqueCStr text(sds_read_file_bounded(path, SDS_JSON_MAX_FILE_BYTES, &length));
  const char* refused = nullptr;
  if (text && sds_json_guard_check(text.get(), length, &refused) != 0) {
    SDS_LOGE("[CRITICAL] %s refused: %s", path, refused);
    text.reset();
  }
  GError* raw_error = nullptr;
  if (!text || !json_parser_load_from_data(parser.get(), text.get(), static_cast<gssize>(length),
                                           &raw_error)) {
    GErrorPtr error(raw_error);
    SDS_LOGE("[CRITICAL] json_parser_load_from_data failed");
    return;
  }
  text.reset();

  // Taken over from the parser instead of deep-copied: same lifetime, half
  // the memory of a large answer.
  JsonNodePtr document(json_parser_steal_root(parser.get()));
  if (!document) return;
  char* key = strdup("root");
  if (key == nullptr) return;

  __set_key(root, key, true);
  __release_slot(root);
  root->node = document.get();
  switch (json_node_get_node_type(document.get())) {
    case JSON_NODE_VALUE:
      (void)sds_json_parser_read_value(root);
      break;
    case JSON_NODE_OBJECT:
      root->type = SDS_JSON_OBJECT;
      break;
    case JSON_NODE_ARRAY:
      root->type = SDS_JSON_ARRAY;
      break;
    case JSON_NODE_NULL:
      root->type = SDS_JSON_NONE;
      break;
  }
  if (root->owns_str_) return;        // a string root keeps only its text copy
  if (root->node == nullptr) return;  // a number or boolean root keeps only its value
  root->owns_node_ = true;
  (void)document.release();
}

int sds_json_parser_read_value(sds_json_node* record) {
  if (record == nullptr) {
    g_print("Invalid Input Parameters\n");
    return -1;
  }
  if (!__holds_node(record) || json_node_get_node_type(record->node) != JSON_NODE_VALUE) {
    return 1;  // nothing scalar to read; the record stays as it is
  }
  GValue value = G_VALUE_INIT;
  json_node_get_value(record->node, &value);
  GType type = G_VALUE_TYPE(&value);
  if (type == G_TYPE_INT) {
    record->type = SDS_JSON_INT;
    record->value = static_cast<uint32_t>(g_value_get_int(&value));
    record->node = nullptr;
  } else if (type == G_TYPE_INT64) {
    record->type = SDS_JSON_INT;
    record->value = static_cast<uint32_t>(g_value_get_int64(&value));
    record->node = nullptr;
  } else if (type == G_TYPE_UINT) {
    record->type = SDS_JSON_UINT;
    record->value = g_value_get_uint(&value);
    record->node = nullptr;
  } else if (type == G_TYPE_UINT64) {
    record->type = SDS_JSON_UINT;
    record->value = static_cast<uint32_t>(g_value_get_uint64(&value));
    record->node = nullptr;
  } else if (type == G_TYPE_DOUBLE) {
    record->type = SDS_JSON_DOUBLE;
    record->value = __double_to_u32(g_value_get_double(&value));
    record->node = nullptr;
  } else if (type == G_TYPE_STRING) {
    const char* text = g_value_get_string(&value);
    record->type = SDS_JSON_STRING;
    record->value = 0;
    record->str = strdup(text != nullptr ? text : "");
    record->owns_str_ = record->str != nullptr;
  } else if (type == G_TYPE_BOOLEAN) {
    record->type = SDS_JSON_BOOLEAN;
    record->value = g_value_get_boolean(&value) ? 1 : 0;
    record->node = nullptr;
  } else {
    g_print("\n Entering node default case\n");
  }
  g_value_unset(&value);
  return 1;
}

int sds_json_parser_get_nth(sds_json_node* parent, sds_json_node* child, int index) {
  if (parent == nullptr || !__holds_node(parent) || child == nullptr || index < 0) {
    g_print("Invalid Input Parameters\n");
    return 0;
  }
  JsonNode* found = nullptr;
  switch (json_node_get_node_type(parent->node)) {
    case JSON_NODE_OBJECT: {
      JsonObject* object = json_node_get_object(parent->node);
      MemberNames* names = t_name_cache.lookup(object);
      if (names == nullptr) return 0;
      if (static_cast<guint>(index) >= names->count) {
        __set_key(child, nullptr, false);
        return 0;
      }
      const char* name = names->names[index];
      __set_key(child, const_cast<char*>(name), false);
      found = json_object_get_member(object, name);
      break;
    }
    case JSON_NODE_ARRAY: {
      JsonArray* array = json_node_get_array(parent->node);
      __set_key(child, nullptr, false);
      if (static_cast<guint>(index) >= json_array_get_length(array)) return 0;
      found = json_array_get_element(array, static_cast<guint>(index));
      if (found == nullptr) return 0;
      break;
    }
    default:
      __set_key(child, nullptr, false);
      __release_slot(child);
      return 0;
  }
  __release_slot(child);
  child->node = found;
  if (found == nullptr) return 0;
  return __classify_child(child, 1);
}

int sds_json_parser_get_member(sds_json_node* parent, sds_json_node* child, const char* name) {
  if (parent == nullptr || !__holds_node(parent) || child == nullptr || name == nullptr) {
    g_print("Invalid Input Parameters\n");
    return -1;
  }
  if (json_node_get_node_type(parent->node) != JSON_NODE_OBJECT) {
    __set_key(child, nullptr, false);
    __release_slot(child);
    return -1;
  }
  char* copy = strdup(name);
  if (copy == nullptr) return -1;
  __set_key(child, copy, true);
  __release_slot(child);
  JsonObject* object = json_node_get_object(parent->node);
  child->node = json_object_get_member(object, name);
  if (child->node == nullptr) return -1;
  return __classify_child(child, -1);
}

void sds_json_parser_parse_buffer_free_value(sds_json_node* record) {
  if (record == nullptr) {
    SDS_LOGE("Invalid Input Parameters\n");
    return;
  }
  if (record->type != SDS_JSON_STRING) return;
  if (record->owns_str_) std::free(record->str);
  record->str = nullptr;
  record->owns_str_ = false;
}

void sds_json_parser_parse_buffer_free(sds_json_node* root) {
  if (root == nullptr) {
    SDS_LOGE("Invalid Input Parameters\n");
    return;
  }
  __set_key(root, nullptr, false);
  __release_slot(root);
  // The walk of this document is over: let go of its cached objects.
  t_name_cache.clear();
}
