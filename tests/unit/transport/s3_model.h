/**
 * @file s3_model.h
 * @brief An S3 service with one bucket, in memory.
 */
#ifndef TRANSPORT_S3_MODEL_H
#define TRANSPORT_S3_MODEL_H

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "http_front.h"

/** Any thread. What a service may have or lack is a setting, to be made before it is used. */
class S3Model : public front::Service {
 public:
  static constexpr char kBucket[] = "devices";
  static constexpr char kUser[] = "key";

  enum class Conditions { honoured, bare_tags_only, refused, ignored };

  struct Settings {
    Conditions conditions = Conditions::honoured;
    bool deletes_many = true;
    bool encodes_keys = true; /**< in listings, when it is asked to */
    bool tags_are_md5 = true;
    bool checks_bodies = true;
    std::size_t page = 1000; /**< keys in one answer, at the most */
    std::string region = "us-east-1";
    std::string host;               /**< "": path-style, else what follows the bucket's name */
    std::set<std::string> sticking; /**< keys that a deletion of many does not delete */
    std::string sticking_code = "AccessDenied";
  };

  S3Model() = default;
  explicit S3Model(const Settings &given) : settings(given) {}

  front::Response serve(const front::Request &request) override;

  Settings settings;

  /** "secret" at first; the signatures are checked. */
  void set_secret(const std::string &secret);
  /** No object larger than this is taken. */
  void set_room(std::size_t bytes);
  /** Objects by what follows @p prefix in their keys. */
  std::map<std::string, std::string> content(const std::string &prefix = "") const;
  void put(const std::string &key, const std::string &content);
  void erase(const std::string &key);
  /** A header of the stored object, "" when there is none. */
  std::string header(const std::string &key, const std::string &name) const;
  /** Headers that the object's answers get besides. */
  void set_header(const std::string &key, const std::string &name, const std::string &value);

 private:
  struct Object {
    std::string content;
    std::string tag;
    std::map<std::string, std::string> headers;
  };

  front::Response refusal(const front::Request &request) const;
  front::Response list(const front::Request &request) const;
  front::Response remove_many(const front::Request &request);
  front::Response get(const front::Request &request, const std::string &key) const;
  front::Response put_object(const front::Request &request, const std::string &key);
  Object object_of(const std::string &content) const;

  mutable std::mutex mutex_;
  std::string secret_ = "secret";
  std::size_t room_ = static_cast<std::size_t>(-1);
  int writes_ = 0;
  std::map<std::string, Object> objects_;
};

#endif
