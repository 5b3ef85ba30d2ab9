/**
 * @file xml_answer.h
 * @brief XML that a server sent.
 */
#ifndef BACKUP_TRANSPORT_XML_ANSWER_H
#define BACKUP_TRANSPORT_XML_ANSWER_H

#include <libxml/tree.h>

#include <functional>
#include <memory>
#include <string>

namespace transport {

struct XmlFree {
  void operator()(xmlDoc *document) const { xmlFreeDoc(document); }
};
using XmlAnswer = std::unique_ptr<xmlDoc, XmlFree>;

/**
 * Null when it is no well-formed document, has a document type, or more elements and attributes
 * than an answer that is read as a whole can have.
 */
[[nodiscard]] XmlAnswer parse_xml(const std::string &text);

/**
 * Read a document element by element, so that a long one takes no more memory than its text.
 * @param root called with the outermost element, without what is in it
 * @param child called with each element right below it, with all that is in that one
 * @return false when it is no well-formed document, has a document type, @p root is false, or a
 *   single child has more elements and attributes than an answer can have
 */
[[nodiscard]] bool read_xml(const std::string &text,
                            const std::function<bool(const xmlNode *)> &root,
                            const std::function<void(const xmlNode *)> &child);

/**
 * The library's name once an answer had to be read and it could not be loaded; null before. Then
 * nothing that an answer says is known, and no request that follows from it may be made.
 */
const char *xml_missing_for_answers();

/** Everything that @p node says, as it stands. */
std::string xml_text(const xmlNode *node);

}  // namespace transport

#endif
