#include "quarn_d_restore/moving_back.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <utility>
#include <vector>

#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "log_scope.h"
#include "quarn_d_restore/copy_bytes.h"
#include "quarn_d_restore/put_attributes_back.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kCopyMode = 0600;
constexpr mode_t kFolderMode = 0755;

/** Moves what lies in the snapshot to its place; a name is replaced, so nothing needs space. */
class MovingBack : public TreeVisitor {
 public:
  /** The snapshot, of whose folders "shared/data" is the deepest that holds a package's own. */
  static constexpr int kTopDepth = -1;

  MovingBack(const restore_files &files, std::string root, json_object *table)
      : files_(files), root_(std::move(root)), table_(table) {}

  /** @return true when everything below @p dir, in the snapshot, is in its place */
  bool run(const std::string &dir) {
    const LogScope scope(dir);
    TreePlace source(safe_open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK));
    if (!source) {
      LOGE("error : cannot open this path %s", dir.c_str());
      return false;
    }
    path_ = dir;
    const std::string original = target_path();
    TreePlace target(open_held_as_package(original, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                     TreeAccess::kPackage);
    if (!target) {
      LOGE("error : cannot open this path %s", original.c_str());
      return false;
    }
    Places places{std::move(source), std::move(target)};
    return walk_tree(&places, &path_, this) && moved_;
  }

  /** A folder of the snapshot, and the one in the data that it goes to. */
  struct Places {
    TreePlace source;
    TreePlace target;
    bool up() { return source.up() && target.up(); }
  };

  bool scan(const Places &places, std::vector<std::string> *folders) {
    *folders = move_folder(places.source.fd(), places.target.fd());
    return true;
  }

  TreeStep enter(Places *places, const std::string &name) {
    if (move_whole(places->source.fd(), places->target.fd(), name.c_str())) return TreeStep::passed;
    if (enter_both(&places->source, &places->target, name.c_str())) return TreeStep::entered;
    failed();
    return TreeStep::passed;
  }

  /** Whole it still goes where its place is free; else it stays in the snapshot. */
  TreeStep too_deep(Places *places, const std::string &name) {
    if (!move_whole(places->source.fd(), places->target.fd(), name.c_str())) failed();
    return TreeStep::passed;
  }

  void left(const Places &places, const char *name) const {
    static_cast<void>(unlinkat(places.source.fd(), name, AT_REMOVEDIR));
  }

 private:
  std::string target_path() const {
    return path_.size() > files_.snapshot.size() ? root_ + path_.substr(files_.snapshot.size())
                                                 : root_;
  }

  void failed() {
    LOGE("fail copy : from %s to %s", path_.c_str(), target_path().c_str());
    moved_ = false;
  }

  /** True for what lies in the snapshot without being the application's. */
  bool is_own() const {
    const std::string &top = files_.snapshot;
    const bool at_top = path_.rfind('/') == top.size() && path_.compare(0, top.size(), top) == 0;
    if (at_top) return path_ != top + "/data" && path_ != top + "/shared";
    return path_ == files_.parts.table || files_.own.is_archive(path_);
  }

  /** The files of one directory. @return the directories in it */
  std::vector<std::string> move_folder(int from, int to) {
    std::vector<TreeEntry> entries;
    std::vector<std::string> folders;
    if (!list_tree_entries(from, &entries)) moved_ = false;
    // The daemon replaces names only where the application may, or has no part in the folder.
    const bool closed = !names_may_be_changed(to, user_);
    for (TreeEntry &entry : entries) {
      const PathStep step(&path_, entry.name.c_str());
      if (is_own()) continue;
      restore_step("rollback-entry");
      struct stat status = {};
      const int found = fstatat(from, entry.name.c_str(), &status, AT_SYMLINK_NOFOLLOW);
      if (found != 0) {
        LOGE("error : lstat for %d %s", found, path_.c_str());
      } else if (S_ISDIR(status.st_mode)) {
        folders.push_back(std::move(entry.name));
      } else if (!S_ISREG(status.st_mode)) {
        LOGE("this is unexpected type : %s", path_.c_str());
      } else if (closed ? !move_as_application(from, to, entry.name.c_str(), status)
                        : !move_file(from, to, entry.name.c_str(), status)) {
        failed();
      }
    }
    return folders;
  }

  /** What a name in a folder means to the application, as the kernel has it. */
  enum class Reach { kNone, kReplace, kSeeOnly };
  Reach reach_of(int folder, const char *name) const {
    const ActAsPackage acting(user_);
    struct stat holder = {};
    struct stat present = {};
    if (!acting || fstat(folder, &holder) != 0 ||
        faccessat(folder, ".", W_OK | X_OK, AT_EACCESS) != 0) {
      return Reach::kNone;
    }
    const bool others_stay = (holder.st_mode & S_ISVTX) != 0 && holder.st_uid != user_.uid;
    if (!others_stay || fstatat(folder, name, &present, AT_SYMLINK_NOFOLLOW) != 0 ||
        present.st_uid == user_.uid) {
      return Reach::kReplace;
    }
    return Reach::kSeeOnly;
  }

  /** Into a folder of somebody else's that the application may write: no more than it could do. */
  bool move_as_application(int from, int to, const char *name, const struct stat &status) {
    switch (reach_of(to, name)) {
      case Reach::kReplace:
        return move_file(from, to, name, status);
      case Reach::kSeeOnly:
        // Nor could the restore, so it is as it was.
        return unlinkat(from, name, 0) == 0;
      case Reach::kNone:
        break;
    }
    return false;
  }

  bool move_file(int from, int to, const char *name, const struct stat &status) {
    struct stat present = {};
    if (fstatat(to, name, &present, AT_SYMLINK_NOFOLLOW) == 0) {
      if (S_ISDIR(present.st_mode) &&
          !delete_tree_at(to, name, target_path(), OtherTypes::kStay, TreeAccess::kPackage)) {
        return false;
      }
      // Two names of one file: renaming one to the other would do nothing.
      if (present.st_ino == status.st_ino && present.st_dev == status.st_dev) {
        return unlinkat(from, name, 0) == 0;
      }
    }
    if (renameat(from, name, to, name) == 0) return true;
    return errno == EXDEV && copy_file_back(from, to, name);
  }

  /** To another file system only a copy leads; the snapshot keeps its own until the end. */
  bool copy_file_back(int from, int to, const char *name) {
    struct stat status = {};
    const UniqueFd source = safe_open_file_at(from, name, &status);
    static_cast<void>(unlink_as_package(to, name, 0, user_));  // what stays is in the copy's way
    UniqueFd copy = open_as_package(to, name, O_WRONLY | O_CREAT, kCopyMode, user_, nullptr);
    const bool copied = source && copy && copy_bytes(source.get(), copy.get(), status.st_size);
    const std::string key = path_.substr(files_.snapshot.size() + 1);
    json_object *entry = entry_of(table_, key);
    if (copied && entry != nullptr && fstat(copy.get(), &status) == 0) {
      put_attributes_back(copy.get(), status, key.c_str(), entry);
    }
    if (copied && close(copy.release()) == 0) return true;
    // A part that stays is replaced when the snapshot is put back again.
    if (copy) static_cast<void>(unlink_as_package(to, name, 0, user_));
    return false;
  }

  /** A directory whose place is free goes there with all that it holds. */
  bool move_whole(int from, int to, const char *name) {
    struct stat present = {};
    if (fstatat(to, name, &present, AT_SYMLINK_NOFOLLOW) == 0) {
      if (S_ISDIR(present.st_mode) || unlink_as_package(to, name, 0, user_) != 0) return false;
    }
    if (!names_may_be_changed(to, user_)) return false;
    // The snapshot's table stays where it is until the end.
    if (files_.parts.table.compare(0, path_.size() + 1, path_ + "/") == 0) return false;
    return renameat(from, name, to, name) == 0;
  }

  bool enter_both(TreePlace *source, TreePlace *target, const char *name) {
    // as a rule it is there
    static_cast<void>(mkdir_as_package(target->fd(), name, kFolderMode, user_));
    if (!target->down(name)) return false;
    take_from_application(target->fd(), entry_of(table_, path_.substr(files_.snapshot.size() + 1)));
    if (source->down(name)) return true;
    static_cast<void>(target->up());
    return false;
  }

  const restore_files &files_;
  const std::string root_;
  json_object *table_;
  const package_user user_ = user_of_package();
  std::string path_;
  bool moved_ = true;
};

}  // namespace

bool move_back(const restore_files &files, const std::string &root, json_object *table,
               const std::string &dir) {
  return MovingBack(files, root, table).run(dir);
}
