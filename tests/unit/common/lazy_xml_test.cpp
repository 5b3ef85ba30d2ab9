#include <gtest/gtest.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <string>

#include "test_files.h"

namespace {

bool library_is_loaded() {
  return read_text("/proc/self/maps").find("/libxml2.so") != std::string::npos;
}

std::string text(const xmlChar *value) {
  return value == nullptr ? "" : reinterpret_cast<const char *>(value);
}

TEST(LazyXml, IsLoadedWithTheFirstDocumentAndReadsIt) {
  ASSERT_FALSE(library_is_loaded());
  constexpr char kText[] = "<top>\n<part path=\"a/\">words</part></top>";
  xmlDoc *document = xmlReadMemory(kText, sizeof kText - 1, nullptr, nullptr, XML_PARSE_NONET);
  EXPECT_TRUE(library_is_loaded());
  ASSERT_NE(document, nullptr);
  const xmlNode *top = xmlDocGetRootElement(document);
  ASSERT_NE(top, nullptr);
  EXPECT_EQ(text(top->name), "top");
  const xmlNode *part = top->children->next;
  EXPECT_EQ(xmlGetLineNo(part), 2);
  xmlChar *path = xmlGetProp(part, reinterpret_cast<const xmlChar *>("path"));
  EXPECT_EQ(text(path), "a/");
  xmlFree(path);
  xmlChar *content = xmlNodeGetContent(part);
  EXPECT_EQ(text(content), "words");
  xmlFree(content);
  xmlFreeDoc(document);
}

}  // namespace
