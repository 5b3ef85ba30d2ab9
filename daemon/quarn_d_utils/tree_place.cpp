#include "quarn_d_utils/tree_place.h"

#include <dirent.h>
#include <fcntl.h>
#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "glib_handles.h"
#include "log_scope.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_log.h"

namespace {

constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

int status_of(int dir, const char *name, TreeAccess access, struct stat *status) {
  if (access == TreeAccess::kDaemon) return fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
  return status_as_package(dir, name, user_of_package(), status);
}

UniqueFd open_folder(int dir, const char *name, TreeAccess access) {
  if (access == TreeAccess::kDaemon) return UniqueFd(openat(dir, name, kFolderFlags));
  return open_as_package(dir, name, kFolderFlags, 0, user_of_package(), nullptr);
}

int remove_name(int dir, const char *name, int flags, TreeAccess access) {
  if (access == TreeAccess::kDaemon) return unlinkat(dir, name, flags);
  return unlink_as_package(dir, name, flags, user_of_package());
}

bool delete_entry(int dir, const char *name, OtherTypes others, TreeAccess access) {
  if (others == OtherTypes::kRemoved) return remove_name(dir, name, 0, access) == 0;
  struct stat status = {};
  if (status_of(dir, name, access, &status) != 0 || !S_ISREG(status.st_mode)) {
    LOGE("file is not exist");
    return false;
  }
  if (remove_name(dir, name, 0, access) == 0) return true;
  LOGE("file was not deleted");
  return false;
}

/** Removes one tree bottom up; a directory's folders are remembered while it is open. */
class Removal : public TreeVisitor {
 public:
  Removal(int parent, std::string path, OtherTypes others, TreeAccess access)
      : place_(open_folder(parent, ".", access), access),
        path_(std::move(path)),
        others_(others),
        access_(access) {}

  bool run(const char *name, const struct stat *looked_at) {
    if (looked_at != nullptr && !is_at(name, *looked_at)) return false;
    if (!go_into(&place_, name)) return false;
    if (!walk_tree(&place_, &path_, this)) {
      LOGE("Directory delete was failed");
      LOGE("fail to delete dir : %s", path_.c_str());
      return false;
    }
    if (place_.up()) return remove_folder(place_.fd(), name);
    LOGE("Directory delete was failed");
    return false;
  }

  /** Delete what is no folder. */
  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    bool deleted = true;
    for (TreeEntry &entry : entries_) {
      struct stat status = {};
      const bool folder = entry.type == DT_DIR ||
                          (entry.type == DT_UNKNOWN &&
                           status_of(place.fd(), entry.name.c_str(), access_, &status) == 0 &&
                           S_ISDIR(status.st_mode));
      if (folder) {
        folders->push_back(std::move(entry.name));
      } else if (!delete_entry(place.fd(), entry.name.c_str(), others_, access_)) {
        LOGE("fail to delete file : %s", (path_ + "/" + entry.name).c_str());
        deleted = false;
      }
    }
    deleted_.push_back(deleted);
    return true;
  }

  TreeStep enter(TreePlace *place, const std::string &name) {
    if (go_into(place, name.c_str())) return TreeStep::entered;
    failed_below();
    return TreeStep::passed;
  }

  /** Whatever lies in an application's folder can be removed. */
  TreeStep too_deep(TreePlace *place, const std::string &name) { return enter(place, name); }

  void left(const TreePlace &place, const char *name) {
    if (!remove_folder(place.fd(), name)) failed_below();
  }

 private:
  void failed_below() {
    LOGE("fail to delete dir : %s", path_.c_str());
    deleted_.back() = false;
  }

  /** Go into the folder that was looked at, and no other. */
  bool is_at(const char *name, const struct stat &looked_at) {
    struct stat opened = {};
    if (!place_ || !place_.down(name)) return false;
    entered_ = true;
    return fstat(place_.fd(), &opened) == 0 && is_same_object(opened, looked_at);
  }

  /** Go into a folder, and see what it holds. */
  bool go_into(TreePlace *place, const char *name) {
    if (*place && (std::exchange(entered_, false) || place->down(name))) {
      if (list_tree_entries(place->fd(), &entries_)) return true;
      const int reason = errno;
      static_cast<void>(place->up());
      errno = reason;
    }
    const GErrorPtr error(g_error_new(G_FILE_ERROR, g_file_error_from_errno(errno),
                                      "Error opening directory “%s”: %s", path_.c_str(),
                                      g_strerror(errno)));
    LOGE("directory open failed, err = [%s]", error->message);
    return false;
  }

  /** Remove the folder that was left. @return true when all of it is gone */
  bool remove_folder(int parent, const char *name) {
    const bool emptied = deleted_.back();
    deleted_.pop_back();
    if (remove_name(parent, name, AT_REMOVEDIR, access_) == 0) return emptied;
    LOGE("Directory delete was failed");
    return false;
  }

  TreePlace place_;
  std::string path_;
  const OtherTypes others_;
  const TreeAccess access_;
  std::vector<TreeEntry> entries_;  // of the folder that was entered last
  std::vector<bool> deleted_;       // for each folder on the way whether all in it is gone
  bool entered_ = false;
};

}  // namespace

TreePlace::TreePlace(UniqueFd top, TreeAccess access) : here_(std::move(top)), access_(access) {
  struct stat status = {};
  if (here_ && fstat(here_.get(), &status) == 0) identity_ = {status.st_dev, status.st_ino};
}

bool TreePlace::down(const char *name) {
  UniqueFd next = open_folder(here_.get(), name, access_);
  struct stat status = {};
  if (!next || fstat(next.get(), &status) != 0) return false;
  above_.push_back(identity_);
  identity_ = {status.st_dev, status.st_ino};
  here_ = std::move(next);
  return true;
}

bool TreePlace::up() {
  UniqueFd next(openat(here_.get(), "..", kFolderFlags));
  if (!next && errno == EACCES && access_ == TreeAccess::kPackage) {
    const ActAsRoot root;  // back to where the walk has been, which is made sure of
    next.reset(openat(here_.get(), "..", kFolderFlags));
  }
  struct stat status = {};
  if (!next || fstat(next.get(), &status) != 0) return false;
  if (above_.empty() || above_.back().device != status.st_dev ||
      above_.back().inode != status.st_ino) {
    errno = ESTALE;
    return false;
  }
  identity_ = above_.back();
  above_.pop_back();
  here_ = std::move(next);
  return true;
}

bool list_tree_entries(int dir, std::vector<TreeEntry> *entries) {
  entries->clear();
  UniqueFd copy(fcntl(dir, F_DUPFD_CLOEXEC, 0));
  const DirPtr handle(copy ? fdopendir(copy.get()) : nullptr);
  if (handle == nullptr) return false;
  static_cast<void>(copy.release());
  rewinddir(handle.get());
  while (const dirent *entry = readdir(handle.get())) {
    if (!is_dot_entry(entry->d_name)) entries->push_back({entry->d_name, entry->d_type});
  }
  return true;
}

bool delete_tree_at(int parent, const char *name, const std::string &path, OtherTypes others,
                    TreeAccess access, const struct stat *looked_at) {
  const LogScope scope(path);
  Removal removal(parent, path, others, access);
  if (access == TreeAccess::kDaemon) return removal.run(name, looked_at);
  const ActAsPackage acting;
  return acting && removal.run(name, looked_at);
}
