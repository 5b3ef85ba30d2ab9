/**
 * @file url.h
 * @brief Addresses of the stores behind HTTP.
 */
#ifndef BACKUP_TRANSPORT_URL_H
#define BACKUP_TRANSPORT_URL_H

#include <string>

namespace transport {

/** A path of the store, percent-encoded, slashes kept. */
std::string encode_path(const std::string &path);

/** Is @p host this machine itself? Only there may a store be reached without TLS. */
[[nodiscard]] bool is_loopback(const std::string &host);

/** The parts of a network store's URL. */
struct StoreUrl {
  std::string base;   /**< "https://host:port/path", without a trailing slash */
  std::string origin; /**< "https://host:port" */
  std::string host;
  std::string path; /**< decoded, without a trailing slash; "" at the top */
};

/** What a kind of store takes two slashes in a row for. */
enum class Slashes {
  kOne, /**< they mean one */
  kKept /**< "a//b" is another name than "a/b" */
};

/** What the addresses of a kind of store begin with, and what is meant by their paths. */
struct StoreScheme {
  const char *name;
  Slashes slashes;
};

/**
 * The parts of @p url, where it is one of @p scheme: its name, "+", and an address.
 * @return false with @p problem; the problem is empty when the URL has another scheme
 */
[[nodiscard]] bool parse_store_url(const std::string &url, const StoreScheme &scheme,
                                   StoreUrl *parsed, std::string *problem);

}  // namespace transport

#endif
