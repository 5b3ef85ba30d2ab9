#include "quarn_d_utils/own_place.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <vector>

#include "files/safe_path.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kPrivateDirectory = 0700;
constexpr mode_t kOthers = S_IRWXG | S_IRWXO;
constexpr mode_t kOthersMayWrite = S_IWGRP | S_IWOTH;
/** Others may go on making and removing things meanwhile. */
constexpr int kAttempts = 64;

/** A name that nobody can know beforehand. */
std::string name_aside(const std::string &name) {
  std::uint64_t number = 0;
  if (getrandom(&number, sizeof number, 0) != static_cast<ssize_t>(sizeof number)) number = 0;
  char text[2 * sizeof number + 1];
  std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(number));
  return name + ".aside." + text;
}

bool lacks_exchange(int error) { return error == EINVAL || error == ENOSYS; }

void tell_set_aside(const std::string &name, const std::string &aside) {
  LOGW("%s is not the daemon's and was set aside as %s", name.c_str(), aside.c_str());
}

/** Open the directory @p name if it is ours. */
UniqueFd open_own(int parent, const char *name, struct stat *status) {
  UniqueFd dir(openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!dir || fstat(dir.get(), status) != 0) return {};
  if (is_own_file(*status)) return dir;
  errno = EEXIST;
  return {};
}

/** Remove what others have put into a directory of ours. */
void remove_others(int dir, const std::string &path) {
  std::vector<TreeEntry> entries;
  static_cast<void>(list_tree_entries(dir, &entries));  // nobody else can read it any more either
  for (const TreeEntry &entry : entries) {
    const char *name = entry.name.c_str();
    struct stat status = {};
    if (fstatat(dir, name, &status, AT_SYMLINK_NOFOLLOW) != 0) continue;
    const bool own = is_own_file(status) && (S_ISDIR(status.st_mode) || status.st_nlink == 1);
    if (own) continue;
    const bool removed = S_ISDIR(status.st_mode)
                             ? delete_tree_at(dir, name, path + "/" + name, OtherTypes::kRemoved)
                             : unlinkat(dir, name, 0) == 0;
    if (!removed) LOGE("fail to delete file : %s", name);
  }
}

/** Let nobody else into a directory of ours. */
bool close_to_others(int dir, const struct stat &status, const std::string &path) {
  if ((status.st_mode & kOthers) == 0) return true;
  if (fchmod(dir, kPrivateDirectory) != 0) return false;
  if ((status.st_mode & kOthersMayWrite) != 0) remove_others(dir, path);
  return true;
}

/** Rename what lies at @p name. @return false when it is there still */
bool rename_aside(int parent, const std::string &name) {
  const std::string aside = name_aside(name);
  int result = renameat2(parent, name.c_str(), parent, aside.c_str(), RENAME_NOREPLACE);
  if (result != 0 && lacks_exchange(errno)) {
    result = renameat(parent, name.c_str(), parent, aside.c_str());
  }
  if (result != 0) return errno == ENOENT;
  tell_set_aside(name, aside);
  return true;
}

/**
 * Put a new directory of ours in the place of what lies at @p name: in one step, for whoever makes
 * the place again and again would get ahead of us between two.
 * @return false when nothing has changed, and nothing will
 */
bool replace_by_own(int parent, const std::string &name) {
  const std::string made = name_aside(name);
  if (mkdirat(parent, made.c_str(), kPrivateDirectory) != 0) return errno == EEXIST;
  if (renameat2(parent, made.c_str(), parent, name.c_str(), RENAME_EXCHANGE) == 0) {
    struct stat status = {};
    const UniqueFd other = open_own(parent, made.c_str(), &status);
    if (!other) {
      tell_set_aside(name, made);
      return true;
    }
    // Another process of ours was quicker: it may have its lock in there already.
    renameat2(parent, made.c_str(), parent, name.c_str(), RENAME_EXCHANGE);
    unlinkat(parent, made.c_str(), AT_REMOVEDIR);
    return true;
  }
  const int error = errno;
  unlinkat(parent, made.c_str(), AT_REMOVEDIR);
  if (lacks_exchange(error)) return rename_aside(parent, name);
  errno = error;
  return error == ENOENT || error == EEXIST;
}

}  // namespace

bool make_own_directory(const std::string &path) {
  std::string name;
  const std::string above = path.substr(0, path.rfind('/'));
  if (!above.empty() && safe_mkdir_with_parents(above.c_str(), kPrivateDirectory) != 0) {
    return false;
  }
  const UniqueFd parent = safe_open_parent(path.c_str(), &name);
  if (!parent) return false;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    struct stat status = {};
    const UniqueFd dir = open_own(parent.get(), name.c_str(), &status);
    if (dir) return close_to_others(dir.get(), status, path);
    if (errno == ENOENT) {
      if (mkdirat(parent.get(), name.c_str(), kPrivateDirectory) != 0 && errno != EEXIST) {
        return false;
      }
    } else if (!replace_by_own(parent.get(), name)) {
      return false;
    }
  }
  return false;
}

bool move_to_own_place(const std::string &source, const std::string &target) {
  std::string name;
  const UniqueFd dir = safe_open_parent(target.c_str(), &name);
  if (!dir) return false;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    if (renameat(AT_FDCWD, source.c_str(), dir.get(), name.c_str()) == 0) return true;
    if (errno != EISDIR) return false;
    // what made the directory may make it again between two steps
    if (renameat2(AT_FDCWD, source.c_str(), dir.get(), name.c_str(), RENAME_EXCHANGE) == 0) {
      const std::string aside = name_aside(name);
      if (renameat2(AT_FDCWD, source.c_str(), dir.get(), aside.c_str(), RENAME_NOREPLACE) == 0) {
        tell_set_aside(name, aside);
      }
      return true;
    }
    if (errno == ENOENT) continue;
    if (!lacks_exchange(errno) || !rename_aside(dir.get(), name)) return false;
  }
  return false;
}
