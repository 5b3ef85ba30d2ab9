/**
 * @file xml_answer.h
 * @brief XML that a server sent.
 */
#ifndef BACKUP_TRANSPORT_XML_ANSWER_H
#define BACKUP_TRANSPORT_XML_ANSWER_H

#include <libxml/tree.h>

#include <memory>
#include <string>

namespace transport {

struct XmlFree {
  void operator()(xmlDoc *document) const { xmlFreeDoc(document); }
};
using XmlAnswer = std::unique_ptr<xmlDoc, XmlFree>;

/** Null when it is no well-formed document, or has a document type. */
XmlAnswer parse_xml(const std::string &text);

/** Everything that @p node says, as it stands. */
std::string xml_text(const xmlNode *node);

}  // namespace transport

#endif
