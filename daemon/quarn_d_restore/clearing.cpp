#include "quarn_d_restore/clearing.h"

#include <fcntl.h>
#include <unistd.h>

#include <utility>
#include <vector>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "log_scope.h"
#include "quarn_d_restore/put_attributes_back.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/directory.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

/** Empties the data directories of everything that the snapshot will not replace. */
class Clearing : public TreeVisitor {
 public:
  Clearing(const restore_files &files, const std::string &root, json_object *table)
      : files_(files), root_(root), table_(table) {}

  /** @return true when no file is left that there was not */
  bool run() {
    LOGI("clearing app data backup directory");
    const LogScope scope("what a restore has left");
    const ActAsPackage acting(user_);
    for (const auto &dir : files_.dirs) clear(dir);
    return cleared_;
  }

  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    *folders = clear_folder(place.fd());
    return true;
  }

  TreeStep enter(TreePlace *place, const std::string &name) {
    if (place->down(name.c_str())) return TreeStep::entered;
    LOGE("error : cannot open this path %s", path_.c_str());
    return TreeStep::passed;
  }

  /** One that is empty now is not made again, and comes back with what it held. */
  void left(const TreePlace &place, const char *name) const {
    static_cast<void>(unlink_as_package(place.fd(), name, AT_REMOVEDIR, user_));
  }

 private:
  void clear(const std::string &dir) {
    TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                    TreeAccess::kPackage);
    if (!place) {
      LOGE("error : cannot open this path %s", dir.c_str());
      return;
    }
    path_ = dir;
    static_cast<void>(walk_tree(&place, &path_, this));
  }

  /** One directory. @return the directories in it that the snapshot knows */
  std::vector<std::string> clear_folder(int dir) {
    std::vector<TreeEntry> entries;
    std::vector<std::string> folders;
    // What could not be read the unpacking could not fill.
    static_cast<void>(list_tree_entries(dir, &entries));
    for (TreeEntry &entry : entries) {
      const PathStep step(&path_, entry.name.c_str());
      if (files_.is_skipped(path_)) continue;
      restore_step("rollback-clear");
      const char *name = entry.name.c_str();
      struct stat status = {};
      const int found = status_as_package(dir, name, user_, &status);
      if (found != 0) {
        LOGE("error : lstat for %d %s", found, path_.c_str());
      } else if (S_ISDIR(status.st_mode)) {
        if (is_snapshot(status)) continue;
        if (is_known()) {
          folders.push_back(std::move(entry.name));
        } else {
          clear_unknown_folder(dir, name);
        }
      } else if (!S_ISREG(status.st_mode)) {
        LOGE("this is unexpected type : %s", path_.c_str());
      } else if (!is_known() && !is_applications_table(status) &&
                 unlink_as_package(dir, name, 0, user_) != 0) {
        LOGE("fail to delete file : %s", path_.c_str());
        cleared_ = false;
      }
    }
    return folders;
  }

  void clear_unknown_folder(int dir, const char *name) {
    if (delete_tree_at(dir, name, path_, OtherTypes::kStay, TreeAccess::kPackage)) return;
    LOGE("fail to delete dir : %s", path_.c_str());
    const ActAsRoot root;
    // What is refused, a link, is not the archive's.
    if (!is_empty_directory(path_.c_str())) cleared_ = false;
  }

  /** The snapshot, to which the application may have given another name. */
  bool is_snapshot(const struct stat &status) const {
    const HeldFolder *snapshot = HeldFolder::of(files_.snapshot.c_str());
    struct stat held = {};
    return snapshot != nullptr && snapshot->is_at(files_.snapshot.c_str()) &&
           fstat(snapshot->fd(), &held) == 0 && is_same_object(held, status);
  }

  /** What the application calls like the table was set aside while there could be a table. */
  bool is_applications_table(const struct stat &status) const {
    return path_ == files_.table && !is_own_file(status);
  }

  bool is_known() const {
    return path_ != files_.table && entry_of(table_, path_.substr(root_.size() + 1)) != nullptr;
  }

  const restore_files &files_;
  const std::string &root_;
  json_object *table_;
  const package_user user_ = user_of_package();
  std::string path_;
  bool cleared_ = true;
};

}  // namespace

bool clear_for_rollback(const restore_files &files, const std::string &root, json_object *table) {
  return Clearing(files, root, table).run();
}
