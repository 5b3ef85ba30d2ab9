/**
 * @file dav_server.h
 * @brief A real WebDAV server on loopback, as long as the process lives.
 */
#ifndef CLOUD_DAV_SERVER_H
#define CLOUD_DAV_SERVER_H

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "harness.h"

/** A WebDAV server with its files on a small file system of its own. */
class DavServer {
 public:
  /** Puts cert.pem and key.pem into a folder. */
  using Certify = std::function<void(const std::string &dir)>;

  /**
   * @param kind "apache", "nginx", "lighttpd" or "rclone"
   * @param defines switches of apache's configuration file
   * @param certify for the switch TLS
   */
  explicit DavServer(const std::string &kind, const std::vector<std::string> &defines = {},
                     const Certify &certify = nullptr);
  DavServer(const DavServer &) = delete;
  DavServer &operator=(const DavServer &) = delete;
  ~DavServer();

  int port() const { return port_; }
  int tls_port() const { return tls_port_; }
  /** Where the server keeps its logs. */
  std::string state() const { return base_ / "state"; }
  /** Where the files of /dav/ lie. */
  std::string root() const { return base_ / "disk"; }
  /** From now on only this password is accepted. */
  void accept_password(const std::string &password);
  /** Stop the server in its tracks, and let it go on. */
  void freeze() const;
  void thaw() const;
  /** Some remember what lies in a folder. */
  void changed_behind_its_back() const;

 private:
  void start(const std::vector<std::string> &defines);

  const std::string kind_;
  harness::TempDir base_;
  int port_ = 0;
  int tls_port_ = 0;  // rclone: of its remote control
  pid_t pid_ = -1;
};

#endif
