#include "xml_answer.h"

#include <libxml/parser.h>

namespace transport {

XmlAnswer parse_xml(const std::string &text) {
  // No server has a reason to send one, and entities are what bombs are made of.
  if (text.find("<!DOCTYPE") != std::string::npos) return nullptr;
  XmlAnswer document(xmlReadMemory(text.data(), static_cast<int>(text.size()), nullptr, nullptr,
                                   XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING));
  if (document && document->intSubset != nullptr) document.reset();
  return document;
}

std::string xml_text(const xmlNode *node) {
  xmlChar *content = xmlNodeGetContent(node);
  std::string text = content == nullptr ? "" : reinterpret_cast<const char *>(content);
  xmlFree(content);
  return text;
}

}  // namespace transport
