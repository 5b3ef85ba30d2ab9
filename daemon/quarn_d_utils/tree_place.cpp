#include "quarn_d_utils/tree_place.h"

#include <dirent.h>
#include <fcntl.h>
#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

bool is_regular_at(int dir, const char *name) {
  struct stat status = {};
  return fstatat(dir, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode);
}

bool delete_entry(int dir, const char *name, OtherTypes others) {
  if (others == OtherTypes::kRemoved) return unlinkat(dir, name, 0) == 0;
  if (!is_regular_at(dir, name)) {
    LOGE("file is not exist");
    return false;
  }
  if (unlinkat(dir, name, 0) == 0) return true;
  LOGE("file was not deleted");
  return false;
}

/** Removes one tree bottom up; a directory's folders are remembered while it is open. */
class Removal {
 public:
  Removal(int parent, std::string path, OtherTypes others)
      : place_(UniqueFd(openat(parent, ".", kFolderFlags))),
        path_(std::move(path)),
        others_(others) {}

  bool run(const char *name) {
    if (!enter(name)) return false;
    while (true) {
      Level &level = levels_.back();
      if (level.folders.empty()) {
        const bool deleted = leave();
        if (levels_.empty()) return deleted;
        if (!deleted) failed_below();
        path_.resize(path_.rfind('/'));
        if (lost_) return false;
        continue;
      }
      const std::string folder = std::move(level.folders.back());
      level.folders.pop_back();
      path_ += "/" + folder;
      if (enter(folder.c_str())) continue;
      failed_below();
      path_.resize(path_.rfind('/'));
    }
  }

 private:
  struct Level {
    std::string name;
    std::vector<std::string> folders;
    bool deleted = true;
  };

  void failed_below() {
    LOGE("fail to delete dir : %s", path_.c_str());
    levels_.back().deleted = false;
  }

  /** Go into a folder and delete what is no folder in it. */
  bool enter(const char *name) {
    std::vector<TreeEntry> entries;
    if (!place_ || !place_.down(name) || !list_tree_entries(place_.fd(), &entries)) {
      const GErrorPtr error(g_error_new(G_FILE_ERROR, g_file_error_from_errno(errno),
                                        "Error opening directory “%s”: %s", path_.c_str(),
                                        g_strerror(errno)));
      LOGE("directory open failed, err = [%s]", error->message);
      return false;
    }
    Level level;
    level.name = name;
    for (TreeEntry &entry : entries) {
      struct stat status = {};
      const bool folder = entry.type == DT_DIR || (entry.type == DT_UNKNOWN &&
                                                   fstatat(place_.fd(), entry.name.c_str(), &status,
                                                           AT_SYMLINK_NOFOLLOW) == 0 &&
                                                   S_ISDIR(status.st_mode));
      if (folder) {
        level.folders.push_back(std::move(entry.name));
      } else if (!delete_entry(place_.fd(), entry.name.c_str(), others_)) {
        LOGE("fail to delete file : %s", (path_ + "/" + entry.name).c_str());
        level.deleted = false;
      }
    }
    levels_.push_back(std::move(level));
    return true;
  }

  /** Go back out of the last folder and remove it. */
  bool leave() {
    const Level level = std::move(levels_.back());
    levels_.pop_back();
    lost_ = !place_.up();
    if (!lost_ && unlinkat(place_.fd(), level.name.c_str(), AT_REMOVEDIR) == 0) {
      return level.deleted;
    }
    LOGE("Directory delete was failed");
    return false;
  }

  TreePlace place_;
  std::string path_;
  const OtherTypes others_;
  std::vector<Level> levels_;
  bool lost_ = false;
};

}  // namespace

TreePlace::TreePlace(UniqueFd top) : here_(std::move(top)) {
  struct stat status = {};
  if (here_ && fstat(here_.get(), &status) == 0) identity_ = {status.st_dev, status.st_ino};
}

bool TreePlace::down(const char *name) {
  UniqueFd next(openat(here_.get(), name, kFolderFlags));
  struct stat status = {};
  if (!next || fstat(next.get(), &status) != 0) return false;
  above_.push_back(identity_);
  identity_ = {status.st_dev, status.st_ino};
  here_ = std::move(next);
  return true;
}

bool TreePlace::up() {
  UniqueFd next(openat(here_.get(), "..", kFolderFlags));
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

bool delete_tree_at(int parent, const char *name, const std::string &path, OtherTypes others) {
  return Removal(parent, path, others).run(name);
}
