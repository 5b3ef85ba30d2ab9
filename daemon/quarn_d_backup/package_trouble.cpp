#include "quarn_d_backup/package_trouble.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <string>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_directory.h"

namespace {

/** Looks for what keeps a backup from the folders of a package; what is too deep ends the search.
 */
class TroubleWalk {
 public:
  using Entries = EntriesAsTheyCome;

  backup_outcome found() const { return found_; }
  bool ended() const { return found_ == backup_outcome::too_deep; }

  void look_through(const std::string &folder) {
    const DirPtr dir = safe_opendir(folder.c_str());
    std::string path = folder;
    if (dir == nullptr) {
      found_ = backup_outcome::unreadable;
    } else {
      static_cast<void>(walk_in_order(dir.get(), &path, this));  // nothing is counted
    }
  }

  EntryVisit visit(int dir, const WalkEntry &entry, const std::string & /*path*/) const {
    struct stat status = {};
    const bool is_folder =
        fstatat(dir, entry.name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(status.st_mode);
    return is_folder ? EntryVisit::folder : EntryVisit::passed;
  }

  DirPtr open(int parent, const char *name, struct stat *status) const {
    return open_directory_as_package(parent, name, user_of_package(), status);
  }

  void missed(const std::string & /*path*/, int depth) {
    found_ = is_too_deep(depth) ? backup_outcome::too_deep : backup_outcome::unreadable;
  }

  bool left(int /*fd*/, const struct stat & /*status*/, const std::string & /*path*/,
            bool counted) const {
    return counted;
  }

 private:
  backup_outcome found_ = backup_outcome::none;
};

}  // namespace

backup_outcome find_package_trouble(const std::string &root) {
  if (!is_directory(root.c_str())) return backup_outcome::removed;
  TroubleWalk walk;
  for (const char *name : kDataDirs) {
    if (!walk.ended()) walk.look_through(root + "/" + name);
  }
  // it may have gone meanwhile
  return is_directory(root.c_str()) ? walk.found() : backup_outcome::removed;
}
