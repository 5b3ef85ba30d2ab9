/**
 * @file s3_model.h
 * @brief An S3 service's bucket, in memory.
 */
#ifndef TRANSPORT_S3_MODEL_H
#define TRANSPORT_S3_MODEL_H

#include <map>
#include <mutex>
#include <string>

#include "http_front.h"

/**
 * Path-style, with conditional puts and checksums. Signatures must be there; whether they are
 * right is for real services to say. Any thread.
 */
class S3Model : public front::Service {
 public:
  static constexpr char kBucket[] = "/bucket";
  static constexpr char kUser[] = "device";

  front::Response serve(const front::Request &request) override;

  /** No more of anybody's requests are taken, or again all. */
  void set_accepting(bool accepting);
  /** No object larger than this is taken. */
  void set_room(std::size_t bytes);

  /** Objects by key, with a slash in front. */
  std::map<std::string, std::string> content() const;
  void put(const std::string &path, const std::string &content);

 private:
  struct Object {
    std::string content;
    std::map<std::string, std::string> metadata;  // headers
  };

  front::Response get(const std::string &key) const;
  front::Response put_object(const front::Request &request, const std::string &key);
  front::Response list(const front::Request &request) const;
  front::Response remove_many(const front::Request &request);
  bool conditions_hold(const front::Request &request, const std::string &key) const;

  mutable std::mutex mutex_;
  bool accepting_ = true;
  std::size_t room_ = static_cast<std::size_t>(-1);
  std::map<std::string, Object> objects_;
};

#endif
