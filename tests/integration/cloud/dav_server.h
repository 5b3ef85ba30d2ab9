/**
 * @file dav_server.h
 * @brief A real WebDAV server on loopback, as long as the process lives.
 */
#ifndef CLOUD_DAV_SERVER_H
#define CLOUD_DAV_SERVER_H

#include <sys/types.h>

#include <memory>
#include <string>

#include "harness.h"

/** A WebDAV server with its files on a small file system of its own. */
class DavServer {
 public:
  /** @param kind "apache" or "lighttpd" */
  explicit DavServer(const std::string &kind);
  DavServer(const DavServer &) = delete;
  DavServer &operator=(const DavServer &) = delete;
  ~DavServer();

  int port() const { return port_; }
  /** Where the files of /dav/ lie. */
  std::string root() const { return base_ / "disk"; }
  /** From now on only this password is accepted. */
  void accept_password(const std::string &password);
  /** Stop the server in its tracks, and let it go on. */
  void freeze() const;
  void thaw() const;

 private:
  void start(const std::string &kind);

  harness::TempDir base_;
  int port_ = 0;
  pid_t pid_ = -1;
};

#endif
