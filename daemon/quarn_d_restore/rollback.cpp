#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "platform_security_server.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_restore/archive_table.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kPermissionBits = 07777;
constexpr mode_t kCopyMode = 0600;
constexpr mode_t kFolderMode = 0755;
/** Where an earlier release set aside what no snapshot holds. */
constexpr char kKept[] = "/kept";

JsonPtr read_table(const std::string &path) {
  char *raw = nullptr;
  const bool read = read_data_from_file(path.c_str(), &raw);
  const CString text(raw);
  return JsonPtr(read ? parse_file_info_table(text.get()) : nullptr);
}

json_object *entry_of(json_object *table, const std::string &key) {
  json_object *entry = nullptr;
  const bool found = json_object_object_get_ex(table, key.c_str(), &entry) != 0;
  return found && json_object_is_type(entry, json_type_object) ? entry : nullptr;
}

/* ---- attributes ---------------------------------------------------------- */

void put_label_back(int fd, const char *label, const char *key) {
  if (label == nullptr || label[0] == '\0') return;
  CString current;
  // By way of this process's own descriptors reading costs no walk.
  const int result = smack_getlabel(own_fd_path(fd).c_str(), out(current), SMACK_LABEL_ACCESS);
  if (result == 0 && current != nullptr && std::strcmp(current.get(), label) == 0) return;
  const std::string path = fd_path(fd);
  if (security_server_label_access(path.c_str(), label) != SECURITY_SERVER_SUCCESS &&
      smack_setlabel(path.c_str(), label, SMACK_LABEL_ACCESS) != 0) {
    LOGE("fail to put label of %s back", key);
  }
}

/**
 * Make an open object what the snapshot's table says. The table is this
 * device's own, so unlike a restore it may put back any owner, mode and label.
 */
void put_attributes_back(int fd, const struct stat &before, const char *key, json_object *entry) {
  json_object *values[4] = {};
  const char *const keys[4] = {"0", "1", "2", "3"};
  for (int i = 0; i < 4; ++i) {
    if (!json_object_object_get_ex(entry, keys[i], &values[i])) return;
  }
  const auto uid = static_cast<uid_t>(json_object_get_int64(values[1]));
  const auto gid = static_cast<gid_t>(json_object_get_int64(values[2]));
  const mode_t mode = static_cast<mode_t>(json_object_get_int(values[0])) & kPermissionBits;
  struct stat status = before;
  if (status.st_uid != uid || status.st_gid != gid) {
    // A change of owner clears the bits that run a file as somebody.
    if (change_object_owner(fd, uid, gid) < 0) LOGE("chown: error \n");
    if (fstat(fd, &status) != 0) return;
  }
  if ((status.st_mode & kPermissionBits) != mode && change_object_mode(fd, status, mode) < 0) {
    LOGE("chmod failed");
  }
  put_label_back(fd, json_object_get_string(values[3]), key);
}

enum class Objects { kAll, kDirectories };

/** True for a folder in the data that is the application's, or that it cannot have put there. */
bool is_packages_folder(int folder, const struct stat &status) {
  const UniqueFd parent(openat(folder, "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
  return parent && may_be_changed(parent.get(), folder, status, user_of_package());
}

/**
 * A folder that goes back to somebody else is closed to the application first, and emptied of
 * what is not its own: whatever it has linked there would count as the other's from then on.
 * Each of those files comes back from the snapshot.
 * @param entry the table's for the folder, null when it has none
 * @param folder may be of the O_PATH kind
 */
void take_from_application(int folder, json_object *entry) {
  const uid_t application = user_of_package().uid;
  json_object *owner = nullptr;
  struct stat status = {};
  if (entry == nullptr || !json_object_object_get_ex(entry, "1", &owner) ||
      static_cast<uid_t>(json_object_get_int64(owner)) == application ||
      fstat(folder, &status) != 0 || status.st_uid != application) {
    return;
  }
  if (change_object_owner(folder, 0, 0) < 0 || change_object_mode(folder, status, S_IRWXU) < 0) {
    LOGE("chown: error \n");
    return;
  }
  const UniqueFd opened(openat(folder, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  std::vector<TreeEntry> entries;
  if (opened) list_tree_entries(opened.get(), &entries);
  for (const TreeEntry &one : entries) {
    const char *name = one.name.c_str();
    if (fstatat(folder, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode) &&
        status.st_uid != application) {
      static_cast<void>(unlinkat(folder, name, 0));
    }
  }
}

/**
 * The attributes of what the table has below the directory @p top. Files get
 * theirs in the snapshot, where the application cannot put another file in
 * their place; what is not there stays away.
 */
void put_all_attributes_back(json_object *table, const std::string &top, Objects objects) {
  const UniqueFd dir = safe_open(top.c_str(), O_PATH | O_DIRECTORY);
  if (!dir) return;
  const int flags = O_PATH | O_NOFOLLOW | (objects == Objects::kDirectories ? O_DIRECTORY : 0);
  json_object_object_foreach(table, key, entry) {
    restore_step("rollback-attributes");
    if (!json_object_is_type(entry, json_type_object)) continue;
    const UniqueFd object = safe_open_below(dir.get(), key, flags);
    struct stat status = {};
    if (!object || fstat(object.get(), &status) != 0) continue;
    if (!S_ISDIR(status.st_mode) && !S_ISREG(status.st_mode)) continue;
    if (objects == Objects::kDirectories && !is_packages_folder(object.get(), status)) {
      LOGE("refused : %s was put there from elsewhere", key);
      continue;
    }
    if (objects == Objects::kDirectories) {
      take_from_application(object.get(), entry);
      if (fstat(object.get(), &status) != 0) continue;
    }
    put_attributes_back(object.get(), status, key, entry);
  }
}

/* ---- what the snapshot does not hold ------------------------------------- */

/** Empties the data directories of everything that the snapshot will not replace. */
class Clearing {
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

 private:
  void clear(const std::string &dir) {
    TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                    TreeAccess::kPackage);
    if (!place) {
      LOGE("error : cannot open this path %s", dir.c_str());
      return;
    }
    path_ = dir;
    std::vector<std::vector<std::string>> pending;
    pending.push_back(clear_folder(place.fd()));
    while (true) {
      if (pending.back().empty()) {
        pending.pop_back();
        if (pending.empty() || !place.up()) return;
        const std::string name = path_.substr(path_.rfind('/') + 1);
        path_.resize(path_.rfind('/'));
        // One that is empty now is not made again, and comes back with what it held.
        static_cast<void>(unlink_as_package(place.fd(), name.c_str(), AT_REMOVEDIR, user_));
        continue;
      }
      const std::string name = std::move(pending.back().back());
      pending.back().pop_back();
      const std::size_t length = path_.size();
      path_ += "/" + name;
      if (place.down(name.c_str())) {
        pending.push_back(clear_folder(place.fd()));
        continue;
      }
      LOGE("error : cannot open this path %s", path_.c_str());
      path_.resize(length);
    }
  }

  /** One directory. @return the directories in it that the snapshot knows */
  std::vector<std::string> clear_folder(int dir) {
    std::vector<TreeEntry> entries;
    std::vector<std::string> folders;
    list_tree_entries(dir, &entries);
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

/* ---- moving the snapshot's files back ------------------------------------ */

/** Moves what lies in the snapshot to its place; a name is replaced, so nothing needs space. */
class MovingBack {
 public:
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
    std::vector<std::vector<std::string>> pending;
    pending.push_back(move_folder(source.fd(), target.fd()));
    while (true) {
      if (pending.back().empty()) {
        pending.pop_back();
        if (pending.empty()) return moved_;
        if (!source.up() || !target.up()) return false;
        const std::string name = path_.substr(path_.rfind('/') + 1);
        path_.resize(path_.rfind('/'));
        static_cast<void>(unlinkat(source.fd(), name.c_str(), AT_REMOVEDIR));
        continue;
      }
      const std::string name = std::move(pending.back().back());
      pending.back().pop_back();
      const std::size_t length = path_.size();
      path_ += "/" + name;
      if (move_whole(source.fd(), target.fd(), name.c_str())) {
        path_.resize(length);
      } else if (enter(&source, &target, name.c_str())) {
        pending.push_back(move_folder(source.fd(), target.fd()));
      } else {
        failed();
        path_.resize(length);
      }
    }
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
    unlink_as_package(to, name, 0, user_);
    UniqueFd copy = open_as_package(to, name, O_WRONLY | O_CREAT, kCopyMode, user_, nullptr);
    const bool copied = source && copy && copy_bytes(source.get(), copy.get(), status.st_size);
    const std::string key = path_.substr(files_.snapshot.size() + 1);
    json_object *entry = entry_of(table_, key);
    if (copied && entry != nullptr && fstat(copy.get(), &status) == 0) {
      put_attributes_back(copy.get(), status, key.c_str(), entry);
    }
    if (copied && close(copy.release()) == 0) return true;
    if (copy) unlink_as_package(to, name, 0, user_);
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

  bool enter(TreePlace *source, TreePlace *target, const char *name) {
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

/** An earlier release that was interrupted has moved some files away. */
void bring_back_kept(const restore_files &files) {
  const std::string kept = files.snapshot + kKept;
  const DirPtr source = safe_opendir(kept.c_str());
  const UniqueFd target = safe_open(files.dirs[1].c_str(), O_PATH | O_DIRECTORY);
  if (source == nullptr || !target) return;
  while (const dirent *entry = readdir(source.get())) {
    const char *name = entry->d_name;
    if (is_dot_entry(name) || renameat(dirfd(source.get()), name, target.get(), name) == 0)
      continue;
    LOGE("fail to move %s from %s to %s", name, kept.c_str(), files.dirs[1].c_str());
  }
}

}  // namespace

rollback_result put_snapshot_back(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  const HeldFolder snapshot(files.snapshot);
  if (state_of_snapshot(files) != snapshot_state::complete) {
    LOGE("there isn't a snapshot of (%s) to roll back to", pkgid);
    return rollback_result::none;
  }
  restore_step("rollback");
  const JsonPtr table = read_table(files.parts.table);
  if (table == nullptr) {
    // What is in its place already and what is the restore's could not be told apart.
    LOGE("snapshot of (%s) cannot be read, so it is kept", pkgid);
    return rollback_result::kept;
  }
  bring_back_kept(files);
  bool whole = Clearing(files, root, table.get()).run();
  restore_step("rollback-cleared");
  put_all_attributes_back(table.get(), files.snapshot, Objects::kAll);
  restore_step("rollback-ready");
  if (!MovingBack(files, root, table.get()).run(files.snapshot)) whole = false;
  restore_step("rollback-moved");
  put_all_attributes_back(table.get(), root, Objects::kDirectories);
  restore_step("rollback-done");
  if (!whole) {
    LOGE("not all data of (%s) could be put back, so its snapshot is kept", pkgid);
    return rollback_result::kept;
  }
  // Where this fails the data stands all the same, and is looked at again by the next start.
  discard_snapshot(pkgid, root);
  return rollback_result::whole;
}

int rollback_to_initial_app_data(const char *pkgid, const char *root) {
  static_cast<void>(put_snapshot_back(pkgid, root));
  return QUARN_OK;
}

int parse_dir_for_rollback(const char *dir, const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  const JsonPtr table =
      file_exist(files.parts.table.c_str()) ? read_table(files.parts.table) : nullptr;
  return MovingBack(files, root, table.get()).run(dir) ? 1 : 0;
}
