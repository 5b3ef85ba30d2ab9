#include "core/remote_path.h"

#include <glib.h>
#include <sys/random.h>

#include <array>
#include <cstring>

#include "backup_transport.h"

namespace transport {
namespace {

constexpr std::string_view kTemporaryPrefix = BACKUP_TRANS_TEMPORARY_PREFIX;
constexpr std::size_t kTemporaryRandomBytes = 12;
constexpr std::size_t kHexPerByte = 2;
constexpr char kHexDigits[] = "0123456789abcdef";
constexpr unsigned kHighNibble = 4;
constexpr unsigned kNibbleMask = 0xF;

bool is_component(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.size() <= kMaxComponentBytes &&
         !is_temporary_name(name);
}

}  // namespace

bool is_object_path(const char *path) {
  if (path == nullptr || path[0] != '/') return false;
  const std::size_t length = std::strlen(path);
  if (length > kMaxPathBytes ||
      g_utf8_validate(path, static_cast<gssize>(length), nullptr) == FALSE)
    return false;
  std::string_view rest(path + 1, length - 1);
  for (;;) {
    const std::size_t slash = rest.find('/');
    if (!is_component(rest.substr(0, slash))) return false;
    if (slash == std::string_view::npos) return true;
    rest.remove_prefix(slash + 1);
  }
}

bool parse_folder_path(const char *path, std::string *folder) {
  if (path == nullptr || path[0] != '/') return false;
  std::string trimmed(path);
  if (trimmed.back() == '/') trimmed.pop_back();
  if (!trimmed.empty() && !is_object_path(trimmed.c_str())) return false;
  *folder = std::move(trimmed);
  return true;
}

std::vector<std::string> split_path(std::string_view path) {
  std::vector<std::string> components;
  while (!path.empty()) {
    path.remove_prefix(1);
    const std::size_t slash = path.find('/');
    components.emplace_back(path.substr(0, slash));
    path.remove_prefix(slash == std::string_view::npos ? path.size() : slash);
  }
  return components;
}

std::string parent_of(const std::string &path) { return path.substr(0, path.rfind('/')); }

std::string name_of(const std::string &path) { return path.substr(path.rfind('/') + 1); }

std::string make_temporary_name() {
  std::array<unsigned char, kTemporaryRandomBytes> random{};
  if (getrandom(random.data(), random.size(), 0) != static_cast<ssize_t>(random.size())) {
    for (unsigned char &byte : random) byte = static_cast<unsigned char>(g_random_int());
  }
  std::string name(kTemporaryPrefix);
  for (const unsigned char byte : random) {
    name += kHexDigits[byte >> kHighNibble];
    name += kHexDigits[byte & kNibbleMask];
  }
  return name;
}

bool is_temporary_name(std::string_view name) {
  constexpr std::size_t kSize = kTemporaryPrefix.size() + kTemporaryRandomBytes * kHexPerByte;
  if (name.size() < kSize || name.substr(0, kTemporaryPrefix.size()) != kTemporaryPrefix ||
      name.substr(0, kSize).find_first_not_of(kHexDigits, kTemporaryPrefix.size()) !=
          std::string_view::npos)
    return false;
  return name.size() == kSize || name[kSize] == '.';
}

}  // namespace transport
