// The server list: the content servers a data pull may ask, read from the
// installed XML file in file order, logged, and one server's base URL
// rewritten when that server has moved permanently. The file is left
// byte-for-byte alone unless a server's URL actually changes, and is only
// ever replaced whole.
#include "pull/sitedeck-service-server-data.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <string>

#include "pull/sitedeck-service-file-write.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-xml-read.h"

namespace {

// atoi without its undefined behaviour on overflow: leading blanks, a sign
// and decimal digits; 0 without digits; clamped to the range of int.
int __leading_int(const char* text) {
  if (text == nullptr) return 0;
  long value = std::strtol(text, nullptr, 10);
  if (value > INT_MAX) return INT_MAX;
  if (value < INT_MIN) return INT_MIN;
  return static_cast<int>(value);
}

UniqueXmlChar __text_of(xmlNode* element) { return UniqueXmlChar(xmlNodeGetContent(element)); }

const char* __chars(const UniqueXmlChar& text) { return reinterpret_cast<const char*>(text.get()); }

// Parses the file and checks its root; logs and returns null on failure.
UniqueXmlDoc __open_server_list(const char* path, xmlNode** root) {
  UniqueXmlDoc doc = sds_xml_read_file(path);
  if (!doc) {
    SDS_LOGE("[CRITICAL] %s server file not found", path);
    return nullptr;
  }
  *root = xmlDocGetRootElement(doc.get());
  if (*root == nullptr) {
    SDS_LOGE("[CRITICAL] %s empty document", path);
    return nullptr;
  }
  if (xmlStrcmp((*root)->name, reinterpret_cast<const xmlChar*>("values")) != 0) {
    SDS_LOGE("[CRITICAL] document of the wrong type, root node != values");
    return nullptr;
  }
  return doc;
}

void __read_server_field(sds_server_data* server, xmlNode* element) {
  UniqueXmlChar text = __text_of(element);
  const char* value = __chars(text);
  if (sds_xml_is_element(element, "Id")) {
    server->id = __leading_int(value);
  } else if (sds_xml_is_element(element, "Base-url")) {
    std::free(server->base_url);
    server->base_url = value != nullptr && value[0] != '\0' ? strdup(value) : nullptr;
  } else if (sds_xml_is_element(element, "WaitTime")) {
    server->wait_time = __leading_int(value);
  } else if (sds_xml_is_element(element, "RetryCount")) {
    server->retry_count = __leading_int(value);
  } else if (sds_xml_is_element(element, "FallBack")) {
    server->fall_back = value != nullptr && std::strcmp(value, "true") == 0 ? 1 : 0;
  }
}

void __free_list(sds_server_list* head) {
  while (head != nullptr) {
    sds_server_list* next = head->next;
    if (head->server != nullptr) std::free(head->server->base_url);
    std::free(head->server);
    std::free(head);
    head = next;
  }
}

// The first "Id" element of a server decides whether it is server `id`.
bool __server_has_id(xmlNode* server, int id) {
  for (xmlNode* child = server->children; child != nullptr; child = child->next) {
    if (!sds_xml_is_element(child, "Id")) continue;
    UniqueXmlChar text = __text_of(child);
    return __leading_int(__chars(text)) == id;
  }
  return false;
}

// Replaces the file at `path` with `doc` as a whole: the document is written
// beside it, synced and renamed over it once it is complete on disk, so a
// full disk or a crash in the middle leaves the old list, never a cut one
// (without a server list no pull can run again). 0, or -1 with the old file
// in place.
int __save_whole(const char* path, xmlDoc* doc) {
  xmlChar* raw = nullptr;
  int length = 0;
  xmlDocDumpMemoryEnc(doc, &raw, &length, "UTF-8");
  UniqueXmlChar text(raw);
  if (!text || length < 0 ||
      !sds_write_file_whole(path, text.get(), static_cast<size_t>(length), true)) {
    SDS_LOGE("[CRITICAL] %s could not be rewritten [%s]", path, strerror(errno));
    return -1;
  }
  return 0;
}

}  // namespace

sds_server_list* sds_get_server_data(const char* path) {
  xmlNode* root = nullptr;
  UniqueXmlDoc doc = __open_server_list(path, &root);
  if (!doc) return nullptr;

  sds_server_list* head = nullptr;
  sds_server_list* tail = nullptr;
  for (xmlNode* node = root->children; node != nullptr; node = node->next) {
    if (!sds_xml_is_element(node, "Server")) continue;
    auto* entry = static_cast<sds_server_list*>(std::calloc(1, sizeof(sds_server_list)));
    auto* server = static_cast<sds_server_data*>(std::calloc(1, sizeof(sds_server_data)));
    if (entry == nullptr || server == nullptr) {
      std::free(entry);
      std::free(server);
      __free_list(head);
      return nullptr;
    }
    entry->server = server;
    if (head == nullptr) {
      head = entry;
    } else {
      tail->next = entry;
    }
    tail = entry;
    for (xmlNode* field = node->children; field != nullptr; field = field->next) {
      if (field->type == XML_ELEMENT_NODE) __read_server_field(server, field);
    }
  }
  return head;
}

void print_server_data(const sds_server_list* head) {
  static constexpr const char* kRule = "+++++++++++++++++++++++++++++++++++++++++++++++++";
  for (const sds_server_list* node = head; node != nullptr; node = node->next) {
    const sds_server_data* server = node->server;
    if (server == nullptr) continue;
    SDS_LOGI("%s", kRule);
    SDS_LOGI("[INFO] Server base_url    %s",
             server->base_url != nullptr ? server->base_url : "(null)");
    SDS_LOGI("[INFO] Server Id          %d", server->id);
    SDS_LOGI("[INFO] Server wait_time   %d", server->wait_time);
    SDS_LOGI("[INFO] Server retry_count %d", server->retry_count);
    SDS_LOGI("[INFO] Server fall_back   %d", server->fall_back);
    SDS_LOGI("%s", kRule);
  }
}

int sds_update_base_url(const char* path, int id, const char* new_base_url) {
  xmlNode* root = nullptr;
  UniqueXmlDoc doc = __open_server_list(path, &root);
  if (!doc) return -1;
  if (new_base_url == nullptr) return -1;

  xmlNode* match = nullptr;
  for (xmlNode* node = root->children; node != nullptr && match == nullptr; node = node->next) {
    if (sds_xml_is_element(node, "Server") && __server_has_id(node, id)) match = node;
  }
  if (match == nullptr) return 0;

  // xmlNodeSetContent reads entity references in its argument, so the URL is
  // escaped first; the element's text then equals the URL exactly.
  UniqueXmlChar escaped(
      xmlEncodeSpecialChars(doc.get(), reinterpret_cast<const xmlChar*>(new_base_url)));
  if (!escaped) return 0;
  for (xmlNode* child = match->children; child != nullptr; child = child->next) {
    if (sds_xml_is_element(child, "Base-url")) xmlNodeSetContent(child, escaped.get());
  }
  (void)__save_whole(path, doc.get());  // a failed save leaves the old list
  return 0;
}
