#include "quarn_d_backup/package_trouble.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <string>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_directory.h"

namespace {

/** The worse of two findings: what is too deep stays so, whoever looks. */
backup_outcome worse(backup_outcome one, backup_outcome other) {
  if (one == backup_outcome::too_deep || other == backup_outcome::none) return one;
  return other;
}

backup_outcome look_below(DIR *dir, int depth) {
  backup_outcome found = backup_outcome::none;
  while (const dirent *entry = readdir(dir)) {
    if (is_dot_entry(entry->d_name)) continue;
    struct stat status = {};
    if (fstatat(dirfd(dir), entry->d_name, &status, AT_SYMLINK_NOFOLLOW) != 0 ||
        !S_ISDIR(status.st_mode)) {
      continue;
    }
    if (depth >= kMaxDirDepth) return backup_outcome::too_deep;
    const DirPtr child = open_directory_as_package(dirfd(dir), entry->d_name, user_of_package());
    found = worse(
        found, child == nullptr ? backup_outcome::unreadable : look_below(child.get(), depth + 1));
    if (found == backup_outcome::too_deep) return found;
  }
  return found;
}

}  // namespace

backup_outcome find_package_trouble(const std::string &root) {
  if (!is_directory(root.c_str())) return backup_outcome::removed;
  backup_outcome found = backup_outcome::none;
  for (const char *name : kDataDirs) {
    const DirPtr dir = safe_opendir((root + "/" + name).c_str());
    found = worse(found, dir == nullptr ? backup_outcome::unreadable : look_below(dir.get(), 1));
  }
  // it may have gone meanwhile
  return is_directory(root.c_str()) ? found : backup_outcome::removed;
}
