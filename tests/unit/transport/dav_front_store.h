/**
 * @file dav_front_store.h
 * @brief The WebDAV store on a server in this process.
 */
#ifndef TRANSPORT_DAV_FRONT_STORE_H
#define TRANSPORT_DAV_FRONT_STORE_H

#include <algorithm>

#include "conformance.h"
#include "dav_model.h"
#include "http_front.h"
#include "webdav/dav_client.h"

class DavFrontStore : public TestStore {
 public:
  std::string config() const override { return config_for("my%20store"); }
  std::string other_config() override { return config_for("other"); }
  std::map<std::string, std::string> content() const override {
    std::map<std::string, std::string> found;
    for (const auto &[path, content] : model_.content(kFolder)) found[path_of(path)] = content;
    return found;
  }
  void put(const std::string &path, const std::string &content) override {
    model_.put(kFolder + transport::stored_path(path), content);
  }
  void hold() override { front_.hold(); }
  void release() override { front_.release(); }
  void fill(std::size_t bytes) override { model_.set_room(bytes); }
  void unfill() override { model_.set_room(static_cast<std::size_t>(-1)); }
  void lock_out() override { model_.set_password("changed"); }
  void let_in() override { model_.set_password("right"); }
  bool lists_timestamps() const override { return false; }

 protected:
  static constexpr char kFolder[] = "/my store";

  DavModel model_;
  front::Front front_{model_};

 private:
  static std::string path_of(const std::string &stored) {
    std::string path;
    for (std::size_t at = 0; at < stored.size();) {
      const std::size_t end = std::min(stored.find('/', at + 1), stored.size());
      path += "/" + transport::name_of_stored(stored.substr(at + 1, end - at - 1));
      at = end;
    }
    return path;
  }

  std::string config_for(const std::string &folder) const {
    return "[cloud]\nurl=webdav+http://127.0.0.1:" + std::to_string(front_.port()) + "/dav/" +
           folder + "\nuser=device\npassword=right\n";
  }
};

/** The same on a server that cannot move. */
class DavInPlaceStore : public DavFrontStore {
 public:
  DavInPlaceStore() { model_.refuse("MOVE", 405); }
};

#endif
