/**
 * @file config.h
 * @brief The file that tells which store is used.
 */
#ifndef BACKUP_TRANSPORT_CONFIG_H
#define BACKUP_TRANSPORT_CONFIG_H

#include <sys/stat.h>

#include <string>

namespace transport {

struct Config {
  std::string url;
  std::string user;
  std::string password;
  std::string ca_file;    /**< PEM file used instead of the system's authorities; may be empty */
  std::string region;     /**< s3 only; empty: "us-east-1" */
  std::string addressing; /**< s3 only: "path" or "virtual"; empty: path */

  bool operator==(const Config &other) const {
    return url == other.url && user == other.user && password == other.password &&
           ca_file == other.ca_file && region == other.region && addressing == other.addressing;
  }
};

/** Follows one configuration file. One thread at a time. */
class ConfigFile {
 public:
  /** $QUARN_CLOUD_CONFIG, else the system's. */
  static std::string default_path();

  explicit ConfigFile(std::string path) : path_(std::move(path)) {}

  /**
   * Look at the file, and read it when it is another one than the last time.
   * @return whether config() can be used; else problem() tells why
   */
  [[nodiscard]] bool refresh();

  const Config &config() const { return config_; }
  const std::string &problem() const { return problem_; }

 private:
  [[nodiscard]] bool read();

  std::string path_;
  struct stat seen_ = {};
  bool usable_ = false;
  Config config_;
  std::string problem_;
};

}  // namespace transport

#endif
