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

/**
 * @param scheme "webdav" or "s3"
 * @return false with @p problem; the problem is empty when the URL has another scheme
 */
[[nodiscard]] bool parse_store_url(const std::string &url, const std::string &scheme,
                                   StoreUrl *parsed, std::string *problem);

}  // namespace transport

#endif
