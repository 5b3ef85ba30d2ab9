#include "core/config.h"

#include <fcntl.h>
#include <glib.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <memory>
#include <utility>

#include "unique_fd.h"

namespace transport {
namespace {

constexpr char kEnvironmentName[] = "QUARN_CLOUD_CONFIG";
constexpr char kSystemPath[] = "/etc/quarn/cloud.conf";
constexpr char kGroup[] = "cloud";
constexpr mode_t kOthers = S_IRWXG | S_IRWXO;
constexpr off_t kMaxBytes = 64 * 1024;

struct KeyFileDeleter {
  void operator()(GKeyFile *file) const { g_key_file_free(file); }
};
using KeyFile = std::unique_ptr<GKeyFile, KeyFileDeleter>;

bool same_file(const struct stat &a, const struct stat &b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino && a.st_size == b.st_size &&
         a.st_mode == b.st_mode && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec && a.st_ctim.tv_sec == b.st_ctim.tv_sec &&
         a.st_ctim.tv_nsec == b.st_ctim.tv_nsec;
}

bool is_plain_text(const std::string &text) {
  return std::none_of(text.begin(), text.end(), [](char c) { return g_ascii_iscntrl(c); });
}

/** @return false when something stands there that is no line of text */
bool read_value(GKeyFile *file, const char *key, std::string *text) {
  if (g_key_file_has_key(file, kGroup, key, nullptr) == FALSE) return true;
  GError *error = nullptr;
  char *value = g_key_file_get_string(file, kGroup, key, &error);
  // An unknown escape is an error, and what could be read until then comes along.
  const bool whole = error == nullptr && value != nullptr;
  if (whole) *text = value;
  g_clear_error(&error);
  g_free(value);
  return whole && is_plain_text(*text);
}

bool read_all(int fd, std::string *text) {
  std::array<char, 4096> buffer{};
  for (;;) {
    const ssize_t count = ::read(fd, buffer.data(), buffer.size());
    if (count == 0) return true;
    if (count < 0 && errno == EINTR) continue;
    if (count < 0 || static_cast<off_t>(text->size()) > kMaxBytes) return false;
    text->append(buffer.data(), static_cast<std::size_t>(count));
  }
}

}  // namespace

std::string ConfigFile::default_path() {
  const char *path = std::getenv(kEnvironmentName);
  return path != nullptr && path[0] != '\0' ? path : kSystemPath;
}

bool ConfigFile::refresh() {
  struct stat now {};
  if (stat(path_.c_str(), &now) != 0) {
    problem_ = path_ + ": " + g_strerror(errno);
    seen_ = {};
    usable_ = false;
    return false;
  }
  if (!same_file(now, seen_)) usable_ = read();
  return usable_;
}

bool ConfigFile::read() {
  seen_ = {};
  config_ = {};
  const UniqueFd fd(open(path_.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  struct stat status {};
  if (!fd || fstat(fd.get(), &status) != 0) {
    problem_ = path_ + ": " + g_strerror(errno);
    return false;
  }
  seen_ = status;
  std::string text;
  if (!S_ISREG(status.st_mode) || status.st_size > kMaxBytes || !read_all(fd.get(), &text)) {
    problem_ = path_ + ": not a readable configuration file";
    return false;
  }
  const KeyFile file(g_key_file_new());
  // The parser's own message would quote a line, and that can be the password's.
  if (g_key_file_load_from_data(file.get(), text.data(), text.size(), G_KEY_FILE_NONE, nullptr) ==
      FALSE) {
    problem_ = path_ + ": not a key file";
    return false;
  }
  const std::pair<const char *, std::string *> values[] = {
      {"url", &config_.url},           {"user", &config_.user},
      {"password", &config_.password}, {"ca-file", &config_.ca_file},
      {"region", &config_.region},     {"addressing", &config_.addressing}};
  for (const auto &[key, value] : values) {
    if (read_value(file.get(), key, value)) continue;
    config_ = {};
    problem_ = path_ + ": " + key + " is not a line of UTF-8 text";
    return false;
  }
  if (!config_.password.empty() && (status.st_mode & kOthers) != 0) {
    config_ = {};
    problem_ = path_ + ": holds a password and is not of mode 0600";
    return false;
  }
  if (config_.url.empty()) {
    problem_ = path_ + ": names no url";
    return false;
  }
  problem_.clear();
  return true;
}

}  // namespace transport
