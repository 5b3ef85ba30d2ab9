/**
 * @file backend_webdav.h
 * @brief A store that is a collection of a WebDAV server.
 */
#ifndef BACKUP_TRANSPORT_BACKEND_WEBDAV_H
#define BACKUP_TRANSPORT_BACKEND_WEBDAV_H

#include <memory>
#include <string>

#include "backend.h"
#include "config.h"
#include "http.h"

namespace transport {

std::shared_ptr<Backend> make_webdav_backend(const StoreUrl &url, const Config &config);

/** One resource of a multi-status answer. */
struct DavEntry {
  std::string path; /**< decoded, without a trailing slash */
  bool is_collection = false;
  uint64_t size = 0;
};

/**
 * The resources of a multi-status document, in its order.
 * @param origin what an absolute reference must begin with to be ours
 * @return false when it is none, or holds a document type
 */
bool parse_multistatus(const std::string &xml, const std::string &origin,
                       std::vector<DavEntry> *entries);

}  // namespace transport

#endif
