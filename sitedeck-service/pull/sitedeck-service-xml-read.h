// Reading the service's XML files (server list, geocoder answer, stored
// location) safely: the file is read whole under a size cap and parsed
// without network access, without loading external entities or DTDs and
// without substituting entities, so a hostile document can neither read
// local files nor exhaust memory. Owners for libxml2 handles live here too.
#pragma once

#include <libxml/parser.h>
#include <libxml/tree.h>

#include <memory>

// Largest XML file the service parses.
constexpr long SDS_XML_MAX_FILE_BYTES = 1024L * 1024;

struct SdsXmlDocFree {
  void operator()(xmlDoc* doc) const noexcept { xmlFreeDoc(doc); }
};
using UniqueXmlDoc = std::unique_ptr<xmlDoc, SdsXmlDocFree>;

struct SdsXmlCharFree {
  void operator()(xmlChar* text) const noexcept { xmlFree(text); }
};
using UniqueXmlChar = std::unique_ptr<xmlChar, SdsXmlCharFree>;

// Parses the file at `path`; null when it is missing, unreadable, larger than
// the cap (logged) or not well-formed XML.
UniqueXmlDoc sds_xml_read_file(const char* path);

// True when `node` is an element named `name`.
bool sds_xml_is_element(const xmlNode* node, const char* name);
