/**
 * @file backend_webdav.h
 * @brief A store that is a collection of a WebDAV server.
 */
#ifndef BACKUP_TRANSPORT_BACKEND_WEBDAV_H
#define BACKUP_TRANSPORT_BACKEND_WEBDAV_H

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/backend.h"
#include "core/config.h"
#include "http/url.h"

namespace transport {

/** Null with @p problem when nothing can be meant by the configuration. */
std::shared_ptr<Backend> make_webdav_backend(const StoreUrl &url, const Config &config,
                                             std::string *problem);

/** One resource of a multi-status answer. */
struct DavEntry {
  std::string path; /**< decoded, without a trailing slash */
  bool is_collection = false;
  uint64_t size = 0;               /**< bytes; 0 for a collection, and when it is not told */
  std::optional<int64_t> modified; /**< seconds since the Unix epoch by the server's clock */
};

/**
 * The resources of a multi-status document, in its order.
 * @param host the server's name; absolute references to others are left out
 * @param left_out receives whether the document tells of more than @p entries
 * @return false when it is none, or holds a document type
 */
bool parse_multistatus(const std::string &xml, const std::string &host,
                       std::vector<DavEntry> *entries, bool *left_out);

/** The token of the lock that has that owner, in angle brackets; "" when there is none. */
std::string parse_lock_token(const std::string &xml, const std::string &owner);

/** A lock that somebody holds. */
struct DavLock {
  std::string owner;    /**< what its holder said of himself; may be empty */
  std::string token;    /**< in angle brackets */
  uint64_t seconds = 0; /**< how long it lasts; 0: not told, or for ever */
  std::string root;     /**< path of the collection that is locked, as of DavEntry; may be empty */
};

/** The first lock that a multi-status document tells of; false when there is none. */
bool parse_lock(const std::string &xml, const std::string &host, DavLock *lock);

}  // namespace transport

#endif
