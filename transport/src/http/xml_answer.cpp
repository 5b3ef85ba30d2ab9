#include "http/xml_answer.h"

#include <glib.h>
#include <libxml/parser.h>
#include <libxml/xmlreader.h>

#include <algorithm>
#include <atomic>
#include <string_view>

#include "lazy_xml.h"

namespace transport {
namespace {

// Signs of tags and attributes in what is in memory at one time: a page of a listing has a third.
// Each can be a node, of a hundred times its bytes.
constexpr std::ptrdiff_t kMaxSigns = 65536;
constexpr int kOptions = XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING;

struct ReaderFree {
  void operator()(xmlTextReader *reader) const { xmlFreeTextReader(reader); }
};

std::atomic<bool> missed{false};

bool library_serves() {
  if (missing_xml_library() == nullptr) return true;
  if (!missed.exchange(true)) {
    g_warning("cloud transport: %s cannot be loaded", missing_xml_library());
  }
  return false;
}

// No server has a reason to send one, and entities are what bombs are made of.
bool has_document_type(const std::string &text) {
  return text.find("<!DOCTYPE") != std::string::npos;
}

std::ptrdiff_t signs_in(std::string_view text) {
  return std::count_if(text.begin(), text.end(), [](char c) { return c == '<' || c == '='; });
}

/** A document on its way to a reader, which is told of no more of it than it may keep. */
struct Source {
  std::string_view left;
  std::ptrdiff_t signs = 0;  // since the last element that was done with
  bool is_too_much = false;
};

int take_piece(void *data, char *buffer, int size) {
  auto *const source = static_cast<Source *>(data);
  const std::string_view piece = source->left.substr(0, static_cast<std::size_t>(size));
  source->signs += signs_in(piece);
  source->is_too_much = source->signs > kMaxSigns;
  if (source->is_too_much) return -1;
  piece.copy(buffer, piece.size());
  source->left.remove_prefix(piece.size());
  return static_cast<int>(piece.size());
}

}  // namespace

bool read_xml(const std::string &text, const std::function<bool(const xmlNode *)> &root,
              const std::function<void(const xmlNode *)> &child) {
  if (!library_serves() || has_document_type(text)) return false;
  Source source{text};
  const std::unique_ptr<xmlTextReader, ReaderFree> reader(
      xmlReaderForIO(&take_piece, nullptr, &source, nullptr, nullptr, kOptions));
  if (reader == nullptr) return false;
  int read = xmlTextReaderRead(reader.get());
  while (read == 1) {
    const int type = xmlTextReaderNodeType(reader.get());
    if (type == XML_READER_TYPE_DOCUMENT_TYPE) return false;
    const int depth = type == XML_READER_TYPE_ELEMENT ? xmlTextReaderDepth(reader.get()) : -1;
    if (depth == 0 && !root(xmlTextReaderCurrentNode(reader.get()))) return false;
    if (depth == 1) {
      const xmlNode *node = xmlTextReaderExpand(reader.get());
      if (node == nullptr) return false;
      child(node);
    }
    source.signs = 0;
    read = depth == 1 ? xmlTextReaderNext(reader.get()) : xmlTextReaderRead(reader.get());
  }
  return read == 0 && !source.is_too_much;
}

XmlAnswer parse_xml(const std::string &text) {
  if (text.empty() || !library_serves() || has_document_type(text)) return nullptr;
  if (signs_in(text) > kMaxSigns) return nullptr;
  XmlAnswer document(
      xmlReadMemory(text.data(), static_cast<int>(text.size()), nullptr, nullptr, kOptions));
  if (document && document->intSubset != nullptr) document.reset();
  return document;
}

const char *xml_missing_for_answers() { return missed ? missing_xml_library() : nullptr; }

std::string xml_text(const xmlNode *node) {
  xmlChar *content = xmlNodeGetContent(node);
  std::string text = content == nullptr ? "" : reinterpret_cast<const char *>(content);
  xmlFree(content);
  return text;
}

}  // namespace transport
