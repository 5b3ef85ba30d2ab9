/**
 * @file dav_model.h
 * @brief A WebDAV server's collection, in memory.
 */
#ifndef TRANSPORT_DAV_MODEL_H
#define TRANSPORT_DAV_MODEL_H

#include <map>
#include <mutex>
#include <string>

#include "http_front.h"

/** Class 2: exclusive locks of infinite depth, strong entity tags. Any thread. */
class DavModel : public front::Service {
 public:
  static constexpr char kRoot[] = "/dav";
  static constexpr char kUser[] = "device";

  front::Response serve(const front::Request &request) override;

  /** "right" at first. */
  void set_password(const std::string &password);
  /** From now on the method's requests get that answer; 0: no more. */
  void refuse(const std::string &method, int status);
  /** No object larger than this is taken. */
  void set_room(std::size_t bytes);

  /** Objects in @p folder by path from it; an empty collection with a trailing slash. */
  std::map<std::string, std::string> content(const std::string &folder = "") const;
  /** With the collections that it lies in. */
  void put(const std::string &path, const std::string &content);
  /** An object or a collection, with everything in it. */
  void drop(const std::string &path);
  std::size_t locks() const;

 private:
  struct Lock {
    std::string token;
    std::string owner;
  };
  struct Node {
    bool is_collection = false;
    std::string content;
  };

  front::Response get(const front::Request &request, const std::string &path) const;
  front::Response put_object(const front::Request &request, const std::string &path);
  front::Response make_collection(const std::string &path);
  front::Response remove(const std::string &path);
  front::Response move(const front::Request &request, const std::string &path);
  front::Response list(const front::Request &request, const std::string &path) const;
  front::Response lock(const front::Request &request, const std::string &path);
  front::Response unlock(const front::Request &request, const std::string &path);
  bool authorized(const front::Request &request) const;
  bool locked(const front::Request &request, const std::string &path) const;
  bool conditions_hold(const front::Request &request, const std::string &path) const;
  bool has_collection(const std::string &path) const;
  std::string description(const std::string &path) const;

  mutable std::mutex mutex_;
  std::string password_ = "right";
  std::size_t room_ = static_cast<std::size_t>(-1);
  std::map<std::string, int> refused_;  // status by method
  int tokens_ = 0;
  std::map<std::string, Node> nodes_;  // without a trailing slash; "" is the root, not here
  std::map<std::string, Lock> locks_;  // by path
};

#endif
