// Bounded, offline parsing of the service's XML files; see the header.
#include "pull/sitedeck-service-xml-read.h"

#include "pull/sitedeck-service-file-read.h"
#include "sitedeck-service-raii.h"

namespace {

// No XML_PARSE_NOENT, XML_PARSE_DTDLOAD, XML_PARSE_DTDATTR or XML_PARSE_HUGE:
// entity references stay references, external ones are never fetched, and
// libxml2 keeps its default limits on depth and entity amplification.
constexpr int kParseOptions = XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING;

}  // namespace

UniqueXmlDoc sds_xml_read_file(const char* path) {
  size_t length = 0;
  UniqueCStr text(sds_read_file_bounded(path, SDS_XML_MAX_FILE_BYTES, &length));
  if (!text) return nullptr;
  return UniqueXmlDoc(
      xmlReadMemory(text.get(), static_cast<int>(length), path, nullptr, kParseOptions));
}

bool sds_xml_is_element(const xmlNode* node, const char* name) {
  return node != nullptr && node->type == XML_ELEMENT_NODE &&
         xmlStrcmp(node->name, reinterpret_cast<const xmlChar*>(name)) == 0;
}
