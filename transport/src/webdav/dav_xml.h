/**
 * @file dav_xml.h
 * @brief The documents that a WebDAV server sends.
 *
 * Any thread.
 */
#ifndef BACKUP_TRANSPORT_DAV_XML_H
#define BACKUP_TRANSPORT_DAV_XML_H

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace transport {

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
[[nodiscard]] bool parse_multistatus(const std::string &xml, const std::string &host,
                                     std::vector<DavEntry> *entries, bool *left_out);

/** The token of the lock that has that owner, in angle brackets; "" when there is none. */
[[nodiscard]] std::string parse_lock_token(const std::string &xml, const std::string &owner);

/** A lock that somebody holds. */
struct DavLock {
  std::string owner;    /**< what its holder said of himself; may be empty */
  std::string token;    /**< in angle brackets */
  uint64_t seconds = 0; /**< how long it lasts; 0: not told, or for ever */
  std::string root;     /**< path of the collection that is locked, as of DavEntry; may be empty */
};

/** The first lock that a multi-status document tells of; false when there is none. */
[[nodiscard]] bool parse_lock(const std::string &xml, const std::string &host, DavLock *lock);

}  // namespace transport

#endif
