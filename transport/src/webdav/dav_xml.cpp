#include "webdav/dav_xml.h"

#include <glib.h>

#include <algorithm>
#include <cstring>

#include "http/http_date.h"
#include "http/xml_answer.h"

namespace transport {
namespace {

constexpr char kDav[] = "DAV:";
constexpr guint kDecimal = 10;
// No folder of a device holds as many; what a server says beyond it is no listing.
constexpr std::size_t kMaxEntries = 50000;

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

// "host", "host:port" and "[address]:port" without what comes behind the host.
std::string host_of(const std::string &authority) {
  if (authority.empty() || authority[0] != '[') return authority.substr(0, authority.find(':'));
  return authority.substr(1, authority.find(']') - 1);
}

// "" for what is no path of this server. Behind a proxy that ends the encryption a server may
// name itself with the scheme and the port that it sees.
std::string path_of_href(std::string href, const std::string &host) {
  static constexpr char kBeforeAuthority[] = "://";
  if (href.empty() || href[0] != '/') {
    const std::size_t scheme_end = href.find(kBeforeAuthority);
    if (scheme_end == std::string::npos) return "";
    const std::size_t authority = scheme_end + sizeof kBeforeAuthority - 1;
    const std::size_t slash = std::min(href.find('/', authority), href.size());
    if (g_ascii_strcasecmp(host_of(href.substr(authority, slash - authority)).c_str(),
                           host.c_str()) != 0)
      return "";
    href.erase(0, slash);
  }
  char *decoded = g_uri_unescape_string(href.c_str(), nullptr);
  std::string path = decoded == nullptr ? "" : decoded;
  g_free(decoded);
  if (path.empty() || path[0] != '/') return "";
  while (!path.empty() && path.back() == '/') path.pop_back();
  return path.empty() ? "/" : path;
}

// "HTTP/1.1 200 OK"
bool is_good(const xmlNode *status) {
  const std::string line = text_of(status);
  return line.compare(std::min(line.find(' '), line.size()), 2, " 2") == 0;
}

void read_properties(const xmlNode *response, bool slash, DavEntry *entry) {
  // Whoever does not tell the type still ends a collection's name with a slash.
  std::optional<bool> is_collection;
  guint64 size = 0;
  for (const xmlNode *node = response->children; node != nullptr; node = node->next) {
    if (!is_element(node, "propstat")) continue;
    const xmlNode *status = child_named(node, "status");
    const xmlNode *properties = child_named(node, "prop");
    // Properties that it does not have come in a group with a status of their own.
    if (properties == nullptr || (status != nullptr && !is_good(status))) continue;
    if (const xmlNode *type = child_named(properties, "resourcetype"))
      is_collection = is_collection.value_or(false) || child_named(type, "collection") != nullptr;
    if (const xmlNode *length = child_named(properties, "getcontentlength"))
      g_ascii_string_to_unsigned(text_of(length).c_str(), kDecimal, 0, G_MAXUINT64, &size, nullptr);
    if (const xmlNode *time = child_named(properties, "getlastmodified"))
      entry->modified = parse_http_date(text_of(time));
  }
  entry->is_collection = is_collection.value_or(slash);
  entry->size = entry->is_collection ? 0 : size;
}

// False for one that cannot be told of.
bool read_response(const xmlNode *node, const std::string &host, std::vector<DavEntry> *entries) {
  const xmlNode *status = child_named(node, "status");
  const xmlNode *href = child_named(node, "href");
  if (href == nullptr || (status != nullptr && !is_good(status))) return false;
  const std::string reference = text_of(href);
  DavEntry entry;
  entry.path = path_of_href(reference, host);
  if (entry.path.empty()) return false;
  read_properties(node, reference.back() == '/', &entry);
  entries->push_back(std::move(entry));
  return true;
}

// A lock's token goes into headers as it is: what could end one is no part of an address.
std::string as_token(const std::string &text) {
  const bool plain = std::all_of(
      text.begin(), text.end(), [](char c) { return c > ' ' && c <= '~' && c != '<' && c != '>'; });
  return text.empty() || !plain ? "" : "<" + text + ">";
}

std::string find_token(const xmlNode *node, const std::string &owner) {
  const xmlNode *named = child_named(node, "owner");
  const xmlNode *token = child_named(node, "locktoken");
  const xmlNode *href = token == nullptr ? nullptr : child_named(token, "href");
  if (named != nullptr && href != nullptr && text_of(named) == owner)
    return as_token(text_of(href));
  for (const xmlNode *child = node->children; child != nullptr; child = child->next) {
    const std::string found = find_token(child, owner);
    if (!found.empty()) return found;
  }
  return "";
}

// The first one in the document's order, wherever it is.
const xmlNode *find_below(const xmlNode *parent, const char *name) {
  for (const xmlNode *node = parent->children; node != nullptr; node = node->next) {
    if (is_element(node, name)) return node;
    const xmlNode *found = find_below(node, name);
    if (found != nullptr) return found;
  }
  return nullptr;
}

// "Second-30"
uint64_t seconds_in(const xmlNode *parent) {
  static constexpr char kUnit[] = "Second-";
  const xmlNode *node = child_named(parent, "timeout");
  const std::string text = node == nullptr ? "" : text_of(node);
  guint64 seconds = 0;
  if (text.compare(0, sizeof kUnit - 1, kUnit) == 0)
    g_ascii_string_to_unsigned(text.c_str() + sizeof kUnit - 1, kDecimal, 0, G_MAXUINT64, &seconds,
                               nullptr);
  return seconds;
}

std::string href_in(const xmlNode *parent, const char *name) {
  const xmlNode *node = child_named(parent, name);
  const xmlNode *href = node == nullptr ? nullptr : child_named(node, "href");
  return href == nullptr ? "" : text_of(href);
}

}  // namespace

bool parse_multistatus(const std::string &xml, const std::string &host,
                       std::vector<DavEntry> *entries, bool *left_out) {
  const std::size_t before = entries->size();
  bool is_too_long = false;
  *left_out = false;
  const bool whole = read_xml(
      xml, [](const xmlNode *root) { return is_element(root, "multistatus"); },
      [&](const xmlNode *node) {
        is_too_long = entries->size() - before >= kMaxEntries;
        if (is_too_long || !is_element(node, "response")) return;
        if (!read_response(node, host, entries)) *left_out = true;
      });
  if (!whole || is_too_long) entries->resize(before);
  return whole && !is_too_long;
}

std::string parse_lock_token(const std::string &xml, const std::string &owner) {
  const XmlAnswer document = parse_xml(xml);
  return document ? find_token(xmlDocGetRootElement(document.get()), owner) : "";
}

bool parse_lock(const std::string &xml, const std::string &host, DavLock *lock) {
  const XmlAnswer document = parse_xml(xml);
  const xmlNode *root = document ? xmlDocGetRootElement(document.get()) : nullptr;
  const xmlNode *active = root == nullptr ? nullptr : find_below(root, "activelock");
  if (active == nullptr) return false;
  const xmlNode *owner = child_named(active, "owner");
  lock->owner = owner == nullptr ? "" : text_of(owner);
  lock->token = as_token(href_in(active, "locktoken"));
  lock->seconds = seconds_in(active);
  lock->root = path_of_href(href_in(active, "lockroot"), host);
  return !lock->token.empty();
}

}  // namespace transport
