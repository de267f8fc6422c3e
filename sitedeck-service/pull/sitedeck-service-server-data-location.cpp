// The XML half of the location step: reading city and province out of the
// reverse geocoder's saved answer, and keeping the last resolved position with
// its city and province on disk so an unchanged position needs no request.
// The geocoder's answer comes from the network: it is parsed offline under a
// size cap (sds_xml_read_file) and walked without recursion, so neither its
// entities nor its depth can hurt the service.
#include <libxml/xmlwriter.h>

#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "pull/sitedeck-service-file-write.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-request-server.h"
#include "pull/sitedeck-service-server-data.h"
#include "pull/sitedeck-service-utils.h"
#include "pull/sitedeck-service-xml-read.h"

namespace {

struct XmlTextWriterFree {
  void operator()(xmlTextWriter* writer) const noexcept { xmlFreeTextWriter(writer); }
};
using UniqueXmlTextWriter = std::unique_ptr<xmlTextWriter, XmlTextWriterFree>;
struct XmlBufferFree {
  void operator()(xmlBuffer* buffer) const noexcept { xmlBufferFree(buffer); }
};
using UniqueXmlBuffer = std::unique_ptr<xmlBuffer, XmlBufferFree>;

const xmlChar* __x(const char* text) { return reinterpret_cast<const xmlChar*>(text); }

// Replaces `*field` with a copy of the element's text ("" when it has none).
// False when the copy cannot be made; the field then stays as it was.
bool __copy_text(xmlNode* element, char** field) {
  UniqueXmlChar text(xmlNodeGetContent(element));
  char* copy = strdup(text ? reinterpret_cast<const char*>(text.get()) : "");
  if (copy == nullptr) return false;
  std::free(*field);
  *field = copy;
  return true;
}

// Handles one node of the answer; false when a copy failed.
bool __visit(xmlNode* node, sds_server_req_args* args) {
  if (!sds_xml_is_element(node, "AdditionalData")) return true;
  UniqueXmlChar key(xmlGetProp(node, __x("key")));
  if (!key) return true;
  if (xmlStrcmp(key.get(), __x("StateName")) == 0 && !__copy_text(node, &args->province)) {
    SDS_LOGE("[CRITICAL] Failed to malloc for province");
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    return false;
  }
  if (xmlStrcmp(key.get(), __x("CountyName")) == 0 && !__copy_text(node, &args->city)) {
    SDS_LOGE("[CRITICAL] Failed to malloc for city");
    sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
    return false;
  }
  return true;
}

bool __present(const char* text) { return text != nullptr && text[0] != '\0'; }

// The position text of `args`, logged when it cannot be had.
UniqueCStr __position_text(const sds_server_req_args* args) {
  UniqueCStr position(get_string_from_location(args->latitude, args->longitude));
  if (!position) {
    SDS_LOGE("lat_lan null\n");
  } else if (position.get()[0] == '\0') {
    SDS_LOGE("strlen(lat_lan) == 0\n");
    position.reset();
  }
  return position;
}

}  // namespace

// Depth first, parent before children, then siblings; the last element of a
// key wins. Iterative, following the tree's own links, so the depth of a
// hostile answer cannot exhaust the stack. A failed copy ends the walk of the
// sibling list it happened in, as a recursive walk returning would.
void __get_city_and_province_from_xml(xmlNode* node, xmlDoc* doc, sds_server_req_args* args) {
  (void)doc;
  if (node == nullptr || args == nullptr) return;
  xmlNode* const stop = node->parent;
  xmlNode* current = node;
  while (current != nullptr) {
    bool handled = __visit(current, args);
    // Only children the node owns: an entity reference's children link is
    // the entity's declaration in the DTD, and following it would climb out
    // of the tree into the DTD's siblings.
    if (handled && current->children != nullptr && current->children->parent == current) {
      current = current->children;
      continue;
    }
    if (!handled) {
      current = current->parent;
      if (current == stop || current == nullptr) return;
    }
    while (current->next == nullptr) {
      current = current->parent;
      if (current == stop || current == nullptr) return;
    }
    current = current->next;
  }
}

int sds_parse_city_and_province(sds_server_req_args* args) {
  sds_last_error = SDS_ERROR_NONE;
  if (args == nullptr) return SDS_ERROR_INVALID_PARAMETER;
  const std::string path = sds_path(SDS_HERE_XML_PATH);
  UniqueXmlDoc doc = sds_xml_read_file(path.c_str());
  if (!doc) {
    SDS_LOGE("[CRITICAL] %s file not found", path.c_str());
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return sds_last_error;
  }
  xmlNode* root = xmlDocGetRootElement(doc.get());
  if (root == nullptr) {
    SDS_LOGE("[CRITICAL] empty Root document");
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return sds_last_error;
  }
  if (xmlStrcmp(root->name, __x("Error")) == 0) {
    SDS_LOGE("[CRITICAL] Here service returned error");
    sds_last_error = SDS_ERROR_SERVER_REQUEST_FAILED;
    return sds_last_error;
  }
  if (xmlStrcmp(root->name, __x("Search")) == 0) {
    std::free(args->city);
    std::free(args->province);
    args->city = nullptr;
    args->province = nullptr;
    __get_city_and_province_from_xml(root, doc.get(), args);
    (void)remove_file(path.c_str());
  }
  return sds_last_error;
}

int get_city_and_province_from_stored(sds_server_req_args* args) {
  sds_last_error = SDS_ERROR_NONE;
  if (args == nullptr) return -1;
  const std::string path = sds_path(SDS_LOCATION_INFO_PATH);
  UniqueXmlDoc doc = sds_xml_read_file(path.c_str());
  if (!doc) return -1;
  xmlNode* root = xmlDocGetRootElement(doc.get());
  if (root == nullptr) {
    SDS_LOGE("[CRITICAL] empty Root document");
    return -1;
  }
  UniqueCStr position = __position_text(args);
  if (!position) return -1;
  if (xmlStrcmp(root->name, __x("Location")) != 0) {
    SDS_LOGE("Wrong XML data in  - %s", path.c_str());
    return 0;
  }
  for (xmlNode* child = root->children; child != nullptr; child = child->next) {
    if (sds_xml_is_element(child, "LatitudeLongitude")) {
      UniqueXmlChar stored(xmlNodeGetContent(child));
      if (stored && stored.get()[0] != '\0' &&
          std::strcmp(reinterpret_cast<const char*>(stored.get()), position.get()) != 0) {
        SDS_LOGE("Longitude and latitude didn't match with previous");
        return -1;
      }
    } else if (sds_xml_is_element(child, "City")) {
      if (!__copy_text(child, &args->city)) {
        SDS_LOGE("[CRITICAL] Failed to malloc for city");
        sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
        return -1;
      }
    } else if (sds_xml_is_element(child, "Province")) {
      if (!__copy_text(child, &args->province)) {
        SDS_LOGE("[CRITICAL] Failed to malloc for province");
        sds_last_error = SDS_ERROR_OUT_OF_MEMORY;
        return -1;
      }
    }
  }
  return 0;
}

void save_city_and_province(const sds_server_req_args* args) {
  if (args == nullptr) return;
  UniqueCStr position = __position_text(args);
  if (!position) return;
  if (!__present(args->city) || !__present(args->province)) return;

  // Made in memory and written beside the file, then renamed over it: a
  // reader never finds half a document, and no symlink at the name is followed.
  const std::string path = sds_path(SDS_LOCATION_INFO_PATH);
  UniqueXmlBuffer buffer(xmlBufferCreate());
  int rc = -1;
  if (buffer) {
    UniqueXmlTextWriter writer(xmlNewTextWriterMemory(buffer.get(), 0));
    if (writer) {
      (void)xmlTextWriterStartDocument(writer.get(), nullptr, "UTF-8", nullptr);
      (void)xmlTextWriterStartElement(writer.get(), __x("Location"));
      (void)xmlTextWriterWriteElement(writer.get(), __x("LatitudeLongitude"), __x(position.get()));
      (void)xmlTextWriterWriteElement(writer.get(), __x("City"), __x(args->city));
      (void)xmlTextWriterWriteElement(writer.get(), __x("Province"), __x(args->province));
      rc = xmlTextWriterEndDocument(writer.get());
    }
  }
  if (rc >= 0 && !sds_write_file_whole(path, xmlBufferContent(buffer.get()),
                                       static_cast<size_t>(xmlBufferLength(buffer.get())))) {
    rc = -1;
  }
  if (rc < 0) {
    SDS_LOGE("|xmlTextWriterEndDocument| failed. Couldn't save city and province information");
  }
}
