#include "http/url.h"

#include <glib.h>

#include <algorithm>
#include <memory>

namespace transport {

namespace {

struct UriFree {
  void operator()(GUri *uri) const { g_uri_unref(uri); }
};
using Uri = std::unique_ptr<GUri, UriFree>;

// An escape can stand for anything, also for what would end the name.
bool is_host(const std::string &host) {
  // Behind a percent sign is the interface that an address is reached through.
  if (host.find(':') != std::string::npos)
    return g_hostname_is_ip_address(host.substr(0, host.find('%')).c_str()) != FALSE;
  return std::all_of(host.begin(), host.end(),
                     [](char c) { return g_ascii_isalnum(c) || c == '-' || c == '.' || c == '_'; });
}

std::string with_single_slashes(const std::string &path) {
  std::string single;
  for (const char c : path) {
    if (c != '/' || single.empty() || single.back() != '/') single += c;
  }
  return single;
}

// Null when there is none.
const char *problem_of(GUri *uri) {
  if (uri == nullptr || g_uri_get_host(uri) == nullptr || *g_uri_get_host(uri) == '\0')
    return "the url is not complete";
  if (g_uri_get_userinfo(uri) != nullptr)
    return "the url holds a user or password, which belong into keys of their own";
  if (!is_host(g_uri_get_host(uri))) return "the url's host is no name or address";
  if (g_uri_get_port(uri) == 0) return "the url's port cannot be 0";
  if (g_uri_get_query(uri) != nullptr || g_uri_get_fragment(uri) != nullptr)
    return "the url has a query or fragment";
  const std::string transport = g_uri_get_scheme(uri);
  if (transport == "https" || (transport == "http" && is_loopback(g_uri_get_host(uri))))
    return nullptr;
  return transport == "http" ? "plain http is for this machine itself only"
                             : "the url names no store that is known";
}

}  // namespace

std::string encode_path(const std::string &path) {
  char *text = g_uri_escape_string(path.c_str(), "/", FALSE);
  std::string encoded = text;
  g_free(text);
  return encoded;
}

bool is_loopback(const std::string &host) {
  return host == "localhost" || host == "::1" ||
         (host.compare(0, 4, "127.") == 0 &&
          host.find_first_not_of("0123456789.") == std::string::npos);
}

bool parse_store_url(const std::string &url, const StoreScheme &scheme, StoreUrl *parsed,
                     std::string *problem) {
  const std::string prefix = std::string(scheme.name) + "+";
  if (url.compare(0, prefix.size(), prefix) != 0) return false;
  const Uri parts(g_uri_parse(url.c_str() + prefix.size(), G_URI_FLAGS_NONE, nullptr));
  GUri *const uri = parts.get();
  if (const char *found = problem_of(uri)) {
    *problem = found;
    return false;
  }
  const std::string host = g_uri_get_host(uri);
  parsed->host = host;
  parsed->origin = std::string(g_uri_get_scheme(uri)) + "://" +
                   (host.find(':') == std::string::npos ? host : "[" + host + "]");
  if (g_uri_get_port(uri) > 0) parsed->origin += ":" + std::to_string(g_uri_get_port(uri));
  parsed->path = g_uri_get_path(uri);
  if (scheme.slashes == Slashes::kOne) parsed->path = with_single_slashes(parsed->path);
  while (!parsed->path.empty() && parsed->path.back() == '/') parsed->path.pop_back();
  parsed->base = parsed->origin + encode_path(parsed->path);
  return true;
}

}  // namespace transport
