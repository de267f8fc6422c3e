// Item-list parsing: turns the content server's saved JSON answer into the
// global list of sds_item records with their touch icons, global items before
// regional ones, each section in document order. Member names are matched by
// prefix (the server has sent suffixed names such as "siteUrlX" that must still
// count), "touchIcons" alone by its whole name so that "touchIconsExists" is
// not taken for the icon list. The list is bounded: an answer past a bound
// (items, icons of one item) is refused whole, like one that is no JSON item
// list at all, so that a list cut short is never stored as if it were whole.
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <iterator>

#include "pull/sitedeck-service-json-parser.h"
#include "sitedeck-service-log.h"
#include "pull/sitedeck-service-request-server.h"

// Most items one answer may hold.
constexpr int SDS_MAX_ITEMS = 100000;
// Most touch icons one item may list; a site lists a handful.
constexpr int SDS_MAX_ICONS_PER_ITEM = 64;

const char* sds_item_list_refusal = nullptr;

namespace {

enum class Field { kText, kNumber, kFixedText };

struct MemberRule {
  const char* key;
  Field kind;
  size_t offset;  // of the field inside its record
  size_t size;    // of a fixed text field
};

constexpr MemberRule kItemRules[] = {
    {"siteUrl", Field::kText, offsetof(sds_item, site_url), 0},
    {"siteName", Field::kText, offsetof(sds_item, site_name), 0},
    {"isSpeciallyRemoved", Field::kNumber, offsetof(sds_item, is_specially_removed), 0},
    {"predominantColor", Field::kText, offsetof(sds_item, predominant_color), 0},
    {"numberOfTouchIcons", Field::kNumber, offsetof(sds_item, number_of_touch_icons), 0},
    {"touchIconsExists", Field::kNumber, offsetof(sds_item, touch_icons_exists), 0},
    {"favIconExists", Field::kNumber, offsetof(sds_item, fav_icon_exists), 0},
};

constexpr MemberRule kIconRules[] = {
    {"id", Field::kNumber, offsetof(sds_icon, id), 0},
    {"iconPath", Field::kText, offsetof(sds_icon, icon_path), 0},
    {"iconSize", Field::kFixedText, offsetof(sds_icon, icon_size), sizeof(sds_icon::icon_size)},
    {"isAdministered", Field::kNumber, offsetof(sds_icon, is_administered), 0},
    {"lastModified", Field::kFixedText, offsetof(sds_icon, last_modified),
     sizeof(sds_icon::last_modified)},
};

// kStop ends the walk keeping what was read (out of memory); kRefuse ends it
// refusing the whole answer (sds_item_list_refusal says why).
enum class Walk { kGoOn, kStop, kRefuse };

Walk __refuse(const char* reason) {
  sds_item_list_refusal = reason;
  return Walk::kRefuse;
}

bool __is_number(const sds_json_node& m) {
  return m.type >= SDS_JSON_INT && m.type <= SDS_JSON_BOOLEAN;
}

// Applies every rule whose key begins the member's name. A string that cannot
// be copied leaves its field as it was.
void __apply_rules(const MemberRule* rules, size_t count, void* record, const sds_json_node& m) {
  if (m.key == nullptr) return;
  auto* base = static_cast<char*>(record);
  for (size_t i = 0; i < count; ++i) {
    const MemberRule& rule = rules[i];
    if (std::strncmp(m.key, rule.key, std::strlen(rule.key)) != 0) continue;
    switch (rule.kind) {
      case Field::kNumber:
        if (__is_number(m)) {
          *reinterpret_cast<int*>(base + rule.offset) = static_cast<int>(m.value);
        }
        break;
      case Field::kText:
        if (m.type == SDS_JSON_STRING && m.str != nullptr) {
          char* copy = strdup(m.str);
          if (copy == nullptr) break;
          auto** field = reinterpret_cast<char**>(base + rule.offset);
          std::free(*field);
          *field = copy;
        }
        break;
      case Field::kFixedText:
        if (m.type == SDS_JSON_STRING && m.str != nullptr) {
          // A longer text than the field holds is cut at the field's size.
          char* field = base + rule.offset;
          size_t n = strnlen(m.str, rule.size - 1);
          std::memcpy(field, m.str, n);
          field[n] = '\0';
        }
        break;
    }
  }
}

// Walks the members of an object record by index, applying `rules`.
void __read_members(sds_json_node* object, const MemberRule* rules, size_t count, void* record) {
  if (object->type != SDS_JSON_OBJECT) return;
  sds_json_node member;
  for (int i = 0; sds_json_parser_get_nth(object, &member, i) != 0; ++i) {
    __apply_rules(rules, count, record, member);
    sds_json_parser_parse_buffer_free_value(&member);
  }
}

// A repeated "touchIcons" starts a new list in place of the earlier one.
Walk __read_icons(sds_json_node* icons, sds_item* item) {
  sds_free_icon_list(&item->ps_sds_icon_list);
  item->ps_sds_icon_list = nullptr;
  if (icons->type != SDS_JSON_ARRAY && icons->type != SDS_JSON_OBJECT) return Walk::kGoOn;
  sds_icon* tail = nullptr;
  sds_json_node child;
  for (int i = 0; sds_json_parser_get_nth(icons, &child, i) != 0; ++i) {
    if (i == SDS_MAX_ICONS_PER_ITEM) {
      sds_json_parser_parse_buffer_free_value(&child);
      return __refuse("an item lists more than 64 touch icons");
    }
    // Appending after the known tail keeps a long icon list linear.
    sds_icon* icon =
        sds_allocate_icon_memory(tail == nullptr ? &item->ps_sds_icon_list : &tail->next);
    if (icon == nullptr) {
      sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
      SDS_LOGE("[CRITICAL] Unable to allocate memory");
      sds_json_parser_parse_buffer_free_value(&child);
      return Walk::kStop;
    }
    tail = icon;
    __read_members(&child, kIconRules, std::size(kIconRules), icon);
    sds_json_parser_parse_buffer_free_value(&child);
  }
  return Walk::kGoOn;
}

Walk __read_body(sds_json_node* body, sds_item* item) {
  if (body->type != SDS_JSON_OBJECT) return Walk::kGoOn;
  sds_json_node member;
  for (int i = 0; sds_json_parser_get_nth(body, &member, i) != 0; ++i) {
    __apply_rules(kItemRules, std::size(kItemRules), item, member);
    Walk walk = Walk::kGoOn;
    if (member.key != nullptr && std::strcmp(member.key, "touchIcons") == 0) {
      walk = __read_icons(&member, item);
    }
    sds_json_parser_parse_buffer_free_value(&member);
    if (walk != Walk::kGoOn) return walk;
  }
  return Walk::kGoOn;
}

Walk __read_items(sds_json_node* items, int* item_count) {
  if (items->type != SDS_JSON_ARRAY) return Walk::kGoOn;
  sds_json_node element;
  for (int i = 0; sds_json_parser_get_nth(items, &element, i) != 0; ++i) {
    if (element.type != SDS_JSON_OBJECT) {
      sds_json_parser_parse_buffer_free_value(&element);
      continue;
    }
    if (*item_count >= SDS_MAX_ITEMS) {
      sds_json_parser_parse_buffer_free_value(&element);
      return __refuse("the list holds more than 100000 items");
    }
    sds_item* item = sds_allocate_item_memory();
    if (item == nullptr) {
      SDS_LOGE("[CRITICAL] Unable to allocate memory");
      return Walk::kStop;
    }
    ++*item_count;
    sds_json_node body;
    // The rest of the list could not be read: refused rather than cut short.
    if (sds_json_parser_get_nth(&element, &body, 0) == 0) {
      sds_json_parser_parse_buffer_free_value(&element);
      return __refuse("an item element without a body");
    }
    item->is_specially_removed = 0;
    Walk walk = __read_body(&body, item);
    sds_json_parser_parse_buffer_free_value(&body);
    if (walk != Walk::kGoOn) return walk;
  }
  return Walk::kGoOn;
}

// Reads the "items" array of `parent`.
Walk __read_items_of(sds_json_node* parent, int* item_count) {
  sds_json_node items;
  if (sds_json_parser_get_member(parent, &items, "items") != 1) return Walk::kGoOn;
  Walk walk = __read_items(&items, item_count);
  sds_json_parser_parse_buffer_free_value(&items);
  return walk;
}

// Reads the document into the global list; kRefuse when the answer must be
// refused whole.
Walk __read_document(sds_json_node* root) {
  {
    sds_json_node count;
    if (sds_json_parser_get_member(root, &count, "itemCount") == 1) {
      sds_json_parser_parse_buffer_free_value(&count);
    }
  }
  if (sds_item_list_head != nullptr) return Walk::kGoOn;
  if (root->type != SDS_JSON_OBJECT) return __refuse("the answer is no JSON object");

  int item_count = 0;
  sds_json_node sections[2];
  const char* names[2] = {"global", "regional"};
  bool found[2];
  for (int s = 0; s < 2; ++s) {
    found[s] = sds_json_parser_get_member(root, &sections[s], names[s]) == 1;
  }
  if (!found[0] && !found[1]) return __read_items_of(root, &item_count);
  Walk walk = Walk::kGoOn;
  for (int s = 0; s < 2 && walk == Walk::kGoOn; ++s) {
    if (!found[s] || sections[s].type != SDS_JSON_OBJECT) continue;
    walk = __read_items_of(&sections[s], &item_count);
  }
  for (auto& section : sections) sds_json_parser_parse_buffer_free_value(&section);
  return walk;
}

// Refuses the answer: the list read so far goes, and the attempt fails.
void __refuse_answer(void) {
  SDS_LOGE("[CRITICAL] item list refused: %s", sds_item_list_refusal);
  sds_free_item_list();
  sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
}

}  // namespace

void sds_parse_json_data(const char* path) {
  sds_item_list_refusal = nullptr;
  if (path == nullptr) {
    SDS_LOGE("[CRITICAL] File path is null");
    return;
  }
  const bool list_given = sds_item_list_head != nullptr;
  sds_json_node root;
  sds_json_parser_parse_buffer(path, &root);
  if (root.key == nullptr) {
    SDS_LOGE("[CRITICAL] parent.key is null");
    if (!list_given) {
      sds_item_list_refusal =
          "the answer is no JSON document the reader accepts (malformed, larger than 4194304 "
          "bytes, nested deeper than 64 or with too many repeated names)";
      __refuse_answer();
    }
    return;
  }
  if (std::strcmp(root.key, "root") != 0) {
    SDS_LOGE("[CRITICAL] Unable to find root");
  } else if (__read_document(&root) == Walk::kRefuse) {
    __refuse_answer();
  }
  sds_json_parser_parse_buffer_free(&root);
}
