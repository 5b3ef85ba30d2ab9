#include "s3/s3_xml.h"

#include <glib.h>

#include <cstring>

#include "http/xml_answer.h"

namespace transport {
namespace {

constexpr std::size_t kMaxNameBytes = 64;
constexpr char kNoSuchKey[] = "NoSuchKey";

// Some services leave the namespace out, some send another version's.
bool is_element(const xmlNode *node, const char *name) {
  return node->type == XML_ELEMENT_NODE &&
         std::strcmp(reinterpret_cast<const char *>(node->name), name) == 0;
}

const xmlNode *root_named(const XmlAnswer &document, const char *name) {
  const xmlNode *root = document ? xmlDocGetRootElement(document.get()) : nullptr;
  return root != nullptr && is_element(root, name) ? root : nullptr;
}

// "" when there is none.
std::string text_in(const xmlNode *parent, const char *name) {
  for (const xmlNode *node = parent->children; node != nullptr; node = node->next) {
    if (is_element(node, name)) return xml_text(node);
  }
  return "";
}

std::string name_in(const xmlNode *parent, const char *name) {
  std::string text = text_in(parent, name);
  return is_s3_name(text) ? text : "";
}

// Blanks come as a plus from some services, as an escape from the others.
bool decode(std::string *text) {
  for (char &c : *text) {
    if (c == '+') c = ' ';
  }
  char *decoded = g_uri_unescape_string(text->c_str(), nullptr);
  if (decoded == nullptr) return false;
  *text = decoded;
  g_free(decoded);
  return true;
}

S3Error error_in(const xmlNode *node) { return {name_in(node, "Code"), name_in(node, "Region")}; }

bool is_xml_character(gunichar c) {
  constexpr gunichar kFirstPlain = 0x20;
  constexpr gunichar kLastOfFirstPlane = 0xFFFD;
  constexpr gunichar kFirstOfOtherPlanes = 0x10000;
  return c == '\t' || c == '\n' || c == '\r' || (c >= kFirstPlain && c <= kLastOfFirstPlane) ||
         c >= kFirstOfOtherPlanes;
}

void append_text(const std::string &text, std::string *xml) {
  constexpr unsigned char kFirstPlain = 0x20;
  for (const char c : text) {
    if (static_cast<unsigned char>(c) < kFirstPlain || c == '&' || c == '<' || c == '>') {
      *xml += "&#" + std::to_string(static_cast<int>(c)) + ";";
    } else {
      *xml += c;
    }
  }
}

}  // namespace

bool is_s3_name(const std::string &text) {
  return !text.empty() && text.size() <= kMaxNameBytes &&
         text.find_first_not_of(
             "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-._") ==
             std::string::npos;
}

bool parse_s3_listing(const std::string &xml, S3Listing *listing) {
  const XmlAnswer document = parse_xml(xml);
  const xmlNode *root = root_named(document, "ListBucketResult");
  if (root == nullptr) return false;
  const bool encoded = text_in(root, "EncodingType") == "url";
  for (const xmlNode *node = root->children; node != nullptr; node = node->next) {
    if (is_element(node, "Contents")) {
      S3Object object;
      object.key = text_in(node, "Key");
      object.size = g_ascii_strtoull(text_in(node, "Size").c_str(), nullptr, 10);
      if (!encoded || decode(&object.key)) listing->objects.push_back(std::move(object));
    } else if (is_element(node, "CommonPrefixes")) {
      std::string prefix = text_in(node, "Prefix");
      if (!encoded || decode(&prefix)) listing->prefixes.push_back(std::move(prefix));
    }
  }
  listing->truncated = text_in(root, "IsTruncated") == "true";
  listing->next = text_in(root, "NextContinuationToken");
  return true;
}

S3Error parse_s3_error(const std::string &xml) {
  const XmlAnswer document = parse_xml(xml);
  const xmlNode *root = root_named(document, "Error");
  return root == nullptr ? S3Error() : error_in(root);
}

bool parse_s3_deletion(const std::string &xml, std::vector<S3Error> *errors) {
  const XmlAnswer document = parse_xml(xml);
  const xmlNode *root = root_named(document, "DeleteResult");
  if (root == nullptr) return false;
  for (const xmlNode *node = root->children; node != nullptr; node = node->next) {
    if (!is_element(node, "Error")) continue;
    S3Error error = error_in(node);
    if (error.code != kNoSuchKey) errors->push_back(std::move(error));
  }
  return true;
}

bool fits_xml(const std::string &key) {
  for (const char *c = key.c_str(); *c != '\0'; c = g_utf8_next_char(c)) {
    if (!is_xml_character(g_utf8_get_char(c))) return false;
  }
  return true;
}

std::string make_s3_deletion(const std::vector<std::string> &keys) {
  std::string xml = "<?xml version=\"1.0\" encoding=\"UTF-8\"?><Delete><Quiet>true</Quiet>";
  for (const std::string &key : keys) {
    xml += "<Object><Key>";
    append_text(key, &xml);
    xml += "</Key></Object>";
  }
  return xml + "</Delete>";
}

std::string make_s3_query(const std::map<std::string, std::string> &parameters) {
  std::string query;
  for (const auto &[name, value] : parameters) {
    char *text = g_uri_escape_string(value.c_str(), nullptr, FALSE);
    query += (query.empty() ? "?" : "&") + name + "=" + text;
    g_free(text);
  }
  return query;
}

}  // namespace transport
