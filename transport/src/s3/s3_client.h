/**
 * @file s3_client.h
 * @brief Signed requests to the bucket, or the part of one, that a store is.
 */
#ifndef BACKUP_TRANSPORT_S3_CLIENT_H
#define BACKUP_TRANSPORT_S3_CLIENT_H

#include <string>

#include "core/config.h"
#include "http/http_store.h"
#include "http/url.h"
#include "thread_annotations.h"

namespace transport {

/** Where the store is. */
struct S3Place {
  std::string bucket_url; /**< what the query of a listing follows */
  std::string object_url; /**< what a key follows; ends in a slash */
  std::string prefix;     /**< of every key; "" or ends in a slash */
  bool is_tls = true;
};

/** @return what cannot be meant by the configuration; "" when @p place is the one that it names */
[[nodiscard]] std::string find_s3_place(const StoreUrl &url, const Config &config, S3Place *place);

/** The checksum of a text, in hexadecimal. */
std::string checksum_of(GChecksumType type, const std::string &text);

/** Paths are those of the store ("/a/b"). Any thread. */
class S3Client {
 public:
  S3Client(S3Place place, const Config &config);

  const S3Place &place() const { return place_; }
  std::string key_of(const std::string &path) const { return place_.prefix + path.substr(1); }

  /** Not signed yet: for perform(). */
  HttpRequest request_to(const char *method, std::string url) const;
  /** One without a body, to be performed by others. */
  HttpRequest signed_request(const char *method, const std::string &key) QUARN_EXCLUDES(mutex_);
  /**
   * Whether the answer named another region than the request, which is the one from now on.
   * The request is then to be signed anew.
   */
  [[nodiscard]] bool takes_region_from(const HttpAnswer &answer, const HttpRequest &request)
      QUARN_EXCLUDES(mutex_);

  /**
   * Sign and send it, and again where the service is of another region.
   * @param payload the hexadecimal SHA-256 of the body, or what stands for its having none
   */
  HttpAnswer perform(Ticket &ticket, HttpRequest request, const std::string &payload);
  /** The same for a request whose body, if any, is in memory. */
  HttpAnswer perform(Ticket &ticket, HttpRequest request);
  HttpAnswer head(Ticket &ticket, const std::string &path);

 private:
  void sign(const std::string &payload, HttpRequest *request) QUARN_EXCLUDES(mutex_);

  const S3Place place_;
  const std::string user_;
  const std::string password_;
  const std::string ca_file_;
  Mutex mutex_;
  std::string region_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace transport

#endif
