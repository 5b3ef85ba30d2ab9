#include <glib.h>

#include <cstring>

#include "backend_webdav.h"
#include "xml_answer.h"

namespace transport {
namespace {

constexpr char kDav[] = "DAV:";

bool is_element(const xmlNode *node, const char *name) {
  return node->type == XML_ELEMENT_NODE && node->ns != nullptr &&
         std::strcmp(reinterpret_cast<const char *>(node->ns->href), kDav) == 0 &&
         std::strcmp(reinterpret_cast<const char *>(node->name), name) == 0;
}

const xmlNode *child_named(const xmlNode *parent, const char *name) {
  for (const xmlNode *node = parent->children; node != nullptr; node = node->next) {
    if (is_element(node, name)) return node;
  }
  return nullptr;
}

std::string text_of(const xmlNode *node) {
  const std::string text = xml_text(node);
  const std::size_t first = text.find_first_not_of(" \t\r\n");
  if (first == std::string::npos) return "";
  return text.substr(first, text.find_last_not_of(" \t\r\n") - first + 1);
}

// "" for what is no path of this server.
std::string path_of_href(std::string href, const std::string &origin) {
  if (href.empty() || href[0] != '/') {
    if (href.size() < origin.size() ||
        g_ascii_strncasecmp(href.c_str(), origin.c_str(), origin.size()) != 0)
      return "";
    href.erase(0, origin.size());
  }
  char *decoded = g_uri_unescape_string(href.c_str(), nullptr);
  std::string path = decoded == nullptr ? "" : decoded;
  g_free(decoded);
  if (path.empty() || path[0] != '/') return "";
  while (!path.empty() && path.back() == '/') path.pop_back();
  return path.empty() ? "/" : path;
}

void read_properties(const xmlNode *response, DavEntry *entry) {
  for (const xmlNode *node = response->children; node != nullptr; node = node->next) {
    if (!is_element(node, "propstat")) continue;
    const xmlNode *status = child_named(node, "status");
    const xmlNode *properties = child_named(node, "prop");
    // Properties that it does not have come in a group with a status of their own.
    if (properties == nullptr ||
        (status != nullptr && text_of(status).find(" 200") == std::string::npos))
      continue;
    if (const xmlNode *type = child_named(properties, "resourcetype"))
      entry->is_collection = entry->is_collection || child_named(type, "collection") != nullptr;
    if (const xmlNode *length = child_named(properties, "getcontentlength"))
      entry->size = g_ascii_strtoull(text_of(length).c_str(), nullptr, 10);
  }
  if (entry->is_collection) entry->size = 0;
}

}  // namespace

bool parse_multistatus(const std::string &xml, const std::string &origin,
                       std::vector<DavEntry> *entries) {
  const XmlAnswer document = parse_xml(xml);
  if (!document) return false;
  const xmlNode *root = xmlDocGetRootElement(document.get());
  if (root == nullptr || !is_element(root, "multistatus")) return false;
  for (const xmlNode *node = root->children; node != nullptr; node = node->next) {
    if (!is_element(node, "response")) continue;
    const xmlNode *href = child_named(node, "href");
    if (href == nullptr) continue;
    DavEntry entry;
    entry.path = path_of_href(text_of(href), origin);
    if (entry.path.empty()) continue;
    read_properties(node, &entry);
    entries->push_back(std::move(entry));
  }
  return true;
}

}  // namespace transport
