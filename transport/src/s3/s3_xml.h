/**
 * @file s3_xml.h
 * @brief The documents that an S3 service sends and takes.
 *
 * Names of elements, headers and error codes are those of the Amazon S3 API
 * reference, version 2006-03-01. Any thread.
 */
#ifndef BACKUP_TRANSPORT_S3_XML_H
#define BACKUP_TRANSPORT_S3_XML_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace transport {

struct S3Object {
  std::string key;
  uint64_t size = 0;
};

/** One answer to a listing. */
struct S3Listing {
  std::vector<S3Object> objects;
  std::vector<std::string> prefixes; /**< with their trailing delimiter */
  bool truncated = false;
  std::string next; /**< where to go on when it is truncated */
};

/** @return false when @p xml is no listing */
[[nodiscard]] bool parse_s3_listing(const std::string &xml, S3Listing *listing);

/** What an answer that is none says; texts that are no plain names are left out. */
struct S3Error {
  std::string code;
  std::string region; /**< the one that the service expected */
};

/** Nothing in it when @p xml tells of no error. */
S3Error parse_s3_error(const std::string &xml);

/**
 * The errors that an answer to a deletion of many objects tells of; of an
 * object that was not there it is none.
 * @return false when @p xml is no such answer
 */
[[nodiscard]] bool parse_s3_deletion(const std::string &xml, std::vector<S3Error> *errors);

/** Can XML 1.0 carry this key? */
[[nodiscard]] bool fits_xml(const std::string &key);

/** The request to delete these objects; each key must fit. */
std::string make_s3_deletion(const std::vector<std::string> &keys);

/** "?a=1&b=": sorted and encoded as the signature demands it. */
std::string make_s3_query(const std::map<std::string, std::string> &parameters);

/** A plain name of letters, digits, "-", "." and "_", of at most 64 bytes? */
[[nodiscard]] bool is_s3_name(const std::string &text);

}  // namespace transport

#endif
