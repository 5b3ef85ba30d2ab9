/**
 * @file lazy_xml.h
 * @brief Whether the XML library, which is loaded with the first document, serves.
 */
#ifndef QUARN_LAZY_XML_H
#define QUARN_LAZY_XML_H

/**
 * The name of the library when it, or one of its functions, cannot be loaded: then no text is known
 * to be a document or none, and whoever reads one has to fail. Null when it serves. Static. Loads
 * it. Any thread.
 */
[[nodiscard]] const char *missing_xml_library();

#endif
