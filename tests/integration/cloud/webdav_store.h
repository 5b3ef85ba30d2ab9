/**
 * @file webdav_store.h
 * @brief A store of the WebDAV backend, seen from behind its server.
 */
#ifndef CLOUD_WEBDAV_STORE_H
#define CLOUD_WEBDAV_STORE_H

#include <map>
#include <string>

#include "conformance.h"
#include "dav_server.h"

/** A collection of its own on the server that serves all cases of this program. */
class WebdavStore : public TestStore {
 public:
  WebdavStore();

  std::string config() const override { return config_for(name_); }
  std::string other_config() override { return config_for(name_ + " other"); }
  std::map<std::string, std::string> content() const override;
  void put(const std::string &object, const std::string &content) override;
  void hold() override { server_.freeze(); }
  void release() override { server_.thaw(); }
  void fill(std::size_t bytes) override;
  void unfill() override;
  void lock_out() override { server_.accept_password("another"); }
  void let_in() override { server_.accept_password("right"); }
  bool lists_timestamps() const override { return false; }

  int port() const { return server_.port(); }
  /** Does it look at the proof of a lock where there is none? */
  bool checks_proofs() const;
  /** The folder of the objects. */
  std::string root() const { return server_.root() + "/" + name_; }
  /** Something was changed in there past the server. */
  void changed() { server_.changed_behind_its_back(); }
  /** Store a file whose name the library could have made up, last changed so long ago. */
  void put_raw(const std::string &path, std::chrono::seconds age);

 private:
  std::string config_for(const std::string &name) const;
  void write(const std::string &path, const std::string &content);

  static int count_;
  DavServer &server_;
  const std::string name_;
};

#endif
