// Stands where libxml2 would be linked: its functions, under their own names, which load the
// library with the first document. Linking it brings four libraries and a quarter of the symbols
// that the daemon's start would have to look up; most runs read no XML at all. What is not here is
// missed by the linker.
#include "lazy_xml.h"

#include <dlfcn.h>

#include <algorithm>
#include <iterator>

#pragma GCC visibility push(hidden)
#include <libxml/parser.h>
#include <libxml/tree.h>
#include <libxml/xmlreader.h>
#include <libxml/xmlstring.h>

namespace {

constexpr char kLibrary[] = "libxml2.so.2";

template <typename Function>
Function find(const char *name) {
  // Never closed: the library keeps state of its own.
  static void *const library = dlopen(kLibrary, RTLD_NOW | RTLD_LOCAL);
  return library == nullptr ? nullptr : reinterpret_cast<Function>(dlsym(library, name));
}

constexpr const char *kFunctions[] = {"xmlFree",
                                      "xmlReadMemory",
                                      "xmlDocGetRootElement",
                                      "xmlGetProp",
                                      "xmlNodeGetContent",
                                      "xmlReaderForIO",
                                      "xmlTextReaderRead",
                                      "xmlTextReaderNext",
                                      "xmlTextReaderNodeType",
                                      "xmlFreeTextReader",
                                      "xmlTextReaderExpand",
                                      "xmlTextReaderDepth",
                                      "xmlFreeDoc",
                                      "xmlTextReaderCurrentNode",
                                      "xmlGetLineNo"};

bool all_functions_found() {
  return std::all_of(std::begin(kFunctions), std::end(kFunctions),
                     [](const char *name) { return find<void *>(name) != nullptr; });
}

void free_text(void *memory) {
  static auto *const real = find<xmlFreeFunc *>("xmlFree");
  if (real != nullptr) (*real)(memory);
}

}  // namespace

const char *missing_xml_library() {
  static const bool complete = all_functions_found();
  return complete ? nullptr : kLibrary;
}

// Looked up once each. Without the library there is no document, and nothing else is called.
#define FORWARD(name, ...)                                  \
  static auto *const real = find<decltype(&::name)>(#name); \
  return real == nullptr ? nullptr : real(__VA_ARGS__)
#define FORWARD_NUMBER(name, ...)                           \
  static auto *const real = find<decltype(&::name)>(#name); \
  return real == nullptr ? -1 : real(__VA_ARGS__)

extern "C" {

xmlFreeFunc xmlFree = free_text;

xmlDocPtr xmlReadMemory(const char *buffer, int size, const char *url, const char *encoding,
                        int options) {
  FORWARD(xmlReadMemory, buffer, size, url, encoding, options);
}

xmlNodePtr xmlDocGetRootElement(const xmlDoc *document) { FORWARD(xmlDocGetRootElement, document); }

xmlChar *xmlGetProp(const xmlNode *node, const xmlChar *name) { FORWARD(xmlGetProp, node, name); }

xmlChar *xmlNodeGetContent(const xmlNode *node) { FORWARD(xmlNodeGetContent, node); }

xmlTextReaderPtr xmlReaderForIO(xmlInputReadCallback take, xmlInputCloseCallback close,
                                void *source, const char *url, const char *encoding, int options) {
  FORWARD(xmlReaderForIO, take, close, source, url, encoding, options);
}

xmlNodePtr xmlTextReaderCurrentNode(xmlTextReaderPtr reader) {
  FORWARD(xmlTextReaderCurrentNode, reader);
}

xmlNodePtr xmlTextReaderExpand(xmlTextReaderPtr reader) { FORWARD(xmlTextReaderExpand, reader); }

int xmlTextReaderRead(xmlTextReaderPtr reader) { FORWARD_NUMBER(xmlTextReaderRead, reader); }

int xmlTextReaderNext(xmlTextReaderPtr reader) { FORWARD_NUMBER(xmlTextReaderNext, reader); }

int xmlTextReaderNodeType(xmlTextReaderPtr reader) {
  FORWARD_NUMBER(xmlTextReaderNodeType, reader);
}

int xmlTextReaderDepth(xmlTextReaderPtr reader) { FORWARD_NUMBER(xmlTextReaderDepth, reader); }

void xmlFreeTextReader(xmlTextReaderPtr reader) {
  static auto *const real = find<decltype(&::xmlFreeTextReader)>("xmlFreeTextReader");
  if (real != nullptr) real(reader);
}

long xmlGetLineNo(const xmlNode *node) { FORWARD_NUMBER(xmlGetLineNo, node); }

void xmlFreeDoc(xmlDocPtr document) {
  static auto *const real = find<decltype(&::xmlFreeDoc)>("xmlFreeDoc");
  if (real != nullptr) real(document);
}

}  // extern "C"
#pragma GCC visibility pop
