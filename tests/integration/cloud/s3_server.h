/**
 * @file s3_server.h
 * @brief A real S3 service on loopback, as long as the process lives.
 *
 * The service also speaks an interface of its own, over which the tests see and
 * change what it holds.
 */
#ifndef CLOUD_S3_SERVER_H
#define CLOUD_S3_SERVER_H

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "harness.h"

class S3Server {
 public:
  static constexpr char kBucket[] = "devices";

  /** @param kind "swift" or "ceph" */
  static std::unique_ptr<S3Server> make(const std::string &kind);
  S3Server(const S3Server &) = delete;
  S3Server &operator=(const S3Server &) = delete;
  virtual ~S3Server();

  int port() const { return port_; }
  /** The same with TLS, 0 where there is none, and who signed its certificate. */
  int tls_port() const { return tls_port_; }
  std::string authority() const { return path("cert.pem"); }
  virtual std::string user() const = 0;
  static constexpr char kSecret[] = "never-to-be-seen-7c1f";

  /** From now on only this secret is accepted. */
  virtual void accept_secret(const std::string &secret) = 0;
  /** There is room for @p bytes more. */
  virtual void limit(const std::string &bucket, uint64_t bytes) = 0;
  virtual void unlimit(const std::string &bucket) = 0;
  /** How many of the three servers that hold the objects are dead from now on. */
  virtual void kill_nodes(int count) = 0;
  virtual void restart_nodes() = 0;
  /** Does it take a condition on a PUT? */
  virtual bool has_conditions() const = 0;

  /** What its servers logged. */
  std::string logs() const;

  /** Stop the service in its tracks, and let it go on. */
  void freeze() const;
  void thaw() const;

  void make_bucket(const std::string &bucket);
  void put(const std::string &bucket, const std::string &key, const std::string &content);
  /** Objects by what follows @p prefix in their keys. */
  std::map<std::string, std::string> content(const std::string &bucket, const std::string &prefix);

 protected:
  explicit S3Server(const std::string &script);

  /** Wait until the service says that it is ready for the @p times th time. */
  void wait_ready(int times);
  pid_t pid_of(const std::string &server) const;
  void tell(int signal) const;
  virtual std::string front() const = 0;
  /** Credentials of the other interface. */
  virtual std::vector<std::string> login() const = 0;
  std::string path(const std::string &name) const { return dir_ / name; }
  std::string call(const char *method, const std::string &what,
                   const std::vector<std::string> &headers = {}, const std::string &body = "");
  std::string bucket_header(const std::string &bucket, const std::string &name);

 private:
  void log_in();

  harness::TempDir dir_;
  pid_t pid_ = -1;
  int port_ = 0;
  int tls_port_ = 0;
  std::string storage_;
  std::string token_;
};

/** The one of this process, with its bucket. */
S3Server &the_s3_server();

#endif
