#include "quarn_d_restore/walk.h"

#include <fcntl.h>

#include <cerrno>
#include <string>
#include <utility>
#include <vector>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "json_ptr.h"
#include "log_scope.h"
#include "platform_security_server.h"
#include "platform_smack.h"
#include "quarn_d_restore/archive_table.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/directory.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

using Transaction = Handle<security_server_transaction, &security_server_perm_abort>;

/** A directory of the walk, which follows. */
struct FoundFolder {
  std::string name;
  struct stat status; /**< as it was looked at */
  bool lacks_info;    /**< it got no attributes, which is a failure unless it holds no file */
};

/** A directory that the walk is in. */
struct Level {
  bool lacks_info = false;
  bool holds_file = false; /**< here or anywhere below */
};

/** What an entry is, and a descriptor to change it by; none, with errno, when it is gone. */
UniqueFd find_entry(int dir, const TreeEntry &entry, struct stat *status) {
  return open_as_package(dir, entry.name.c_str(), O_PATH, 0, user_of_package(), status);
}

bool is_empty_folder(const std::string &path) {
  const ActAsRoot root;
  return is_empty_directory(path.c_str());
}

/** Go into a directory that was looked at; not into another that was put in its place. */
bool enter_checked(TreePlace *place, const std::string &name, const struct stat &checked) {
  struct stat opened = {};
  if (!place->down(name.c_str())) return false;
  if (fstat(place->fd(), &opened) == 0 && is_same_object(checked, opened)) return true;
  static_cast<void>(place->up());
  return false;
}

/** Gives everything below one directory of a package its attributes. */
class AttributesWalk : public TreeVisitor {
 public:
  using Folder = FoundFolder;
  static const std::string &name_of(const FoundFolder &folder) { return folder.name; }

  AttributesWalk(const char *pkgid, const char *root, json_object *table)
      : pkgid_(pkgid), root_(root), table_(table), files_(pkgid, root) {}

  /** @return true when every entry was restored */
  bool run(const std::string &dir) {
    const ActAsPackage acting;
    TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                    TreeAccess::kPackage);
    if (!place) {
      LOGE("error : cannot open this path %s", dir.c_str());
      return false;
    }
    path_ = dir;
    levels_.emplace_back();
    return walk_tree(&place, &path_, this) && restored_;
  }

  /** One directory: everything in it but what lies deeper. */
  bool scan(const TreePlace &place, std::vector<FoundFolder> *folders) {
    std::vector<TreeEntry> entries;
    if (!list_tree_entries(place.fd(), &entries)) restored_ = false;
    for (const TreeEntry &entry : entries) {
      const PathStep step(&path_, entry.name.c_str());
      if (files_.is_skipped(path_)) continue;
      restore_step("attributes");
      if (!restore_entry(place.fd(), entry, folders)) restored_ = false;
    }
    return true;
  }

  TreeStep enter(TreePlace *place, const FoundFolder &folder) {
    if (enter_checked(place, folder.name, folder.status)) {
      levels_.push_back({folder.lacks_info, false});
      return TreeStep::entered;
    }
    judge_folder(folder.lacks_info, folder.lacks_info && !is_empty_folder(path_));
    LOGE("error : cannot open this path %s", path_.c_str());
    restored_ = false;
    return TreeStep::passed;
  }

  /** No archive has anything there: the application has dug, or moved what was unpacked. */
  TreeStep too_deep(TreePlace * /*place*/, const FoundFolder & /*folder*/) {
    LOGE("data at %s is deeper than an archive can hold",
         path_.substr(0, path_.rfind('/')).c_str());
    restored_ = false;
    return TreeStep::passed;
  }

  /** Asked of each folder on its own, this would go over all that lies below it again. */
  void finish() {
    const Level done = levels_.back();
    levels_.pop_back();
    if (!judge_folder(done.lacks_info, done.holds_file)) restored_ = false;
    if (!levels_.empty() && done.holds_file) levels_.back().holds_file = true;
  }

 private:
  /** Give an object its attributes when it is the application's, not put there from elsewhere. */
  bool restore_object(int dir, int object, const struct stat &status) const {
    if (!may_be_changed(dir, object, status, user_of_package())) {
      LOGE("refused : %s is a link to a file elsewhere", path_.c_str());
      return false;
    }
    return restore_object_info(object, status, path_.c_str(), pkgid_, root_, table_) != 0;
  }

  bool restore_entry(int dir, const TreeEntry &entry, std::vector<FoundFolder> *folders) {
    struct stat status = {};
    const UniqueFd object = find_entry(dir, entry, &status);
    if (!object) {
      const bool vanished = errno == ENOENT;
      LOGE("error : lstat for %d %s", -1, path_.c_str());
      return vanished;
    }
    if (S_ISLNK(status.st_mode)) return true;
    if (S_ISDIR(status.st_mode)) {
      const bool restored = restore_object(dir, object.get(), status);
      folders->push_back({entry.name, status, !restored});
      return true;
    }
    if (S_ISREG(status.st_mode)) {
      levels_.back().holds_file = true;
      if (restore_object(dir, object.get(), status)) return true;
      LOGE("fail to restore file info : %s", path_.c_str());
      return false;
    }
    LOGE("this is unexpected type : %s", path_.c_str());
    return false;
  }

  /** Whether a directory may be without attributes of its own, if it is. */
  bool judge_folder(bool lacks_info, bool holds_file) const {
    if (!lacks_info) return true;
    if (!holds_file) {
      LOGI("it is empty folder : %s", path_.c_str());
      return true;
    }
    LOGE("fail to restore file info : %s", path_.c_str());
    return false;
  }

  const char *pkgid_;
  const char *root_;
  json_object *table_;
  const restore_files files_;
  std::string path_;
  std::vector<Level> levels_;
  bool restored_ = true;
};

/** Read the table and remove its file; null with the reason logged. */
JsonPtr take_table(const std::string &path) {
  const HeldFile table_file(path);
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
    LOGE("there isn't file-info file...");
    return nullptr;
  }
  if (!is_own_file(status) || status.st_nlink != 1) {  // the application has exchanged it
    LOGE("cannot read file-info file...");
    delete_file(path.c_str());
    return nullptr;
  }
  archive_table found = read_archive_table(path.c_str());
  delete_file(path.c_str());
  if (!found.readable) {
    LOGE("cannot read file-info file...");
  } else if (found.table == nullptr) {
    LOGE("cannot read json info...");
  }
  return std::move(found.table);
}

/** Everything below each data directory takes the directory's own label. */
bool relabel_directories(const char *pkgid, const restore_files &files) {
  security_server_perm_h raw = nullptr;
  int result = security_server_perm_begin(&raw);
  if (result != SECURITY_SERVER_SUCCESS) {
    LOGE("fail : security_server_perm_begin...(err=%d)", result);
    return false;
  }
  Transaction transaction(raw);
  // Held until the commit: the service is told of the directories by these.
  std::vector<UniqueFd> held;
  for (const auto &dir : files.dirs) {
    held.push_back(safe_open(dir.c_str(), O_PATH | O_DIRECTORY));
    const std::string object = fd_path(held.back().get());
    CString label;
    result = held.back() ? smack_getlabel(object.c_str(), out(label), SMACK_LABEL_ACCESS) : -1;
    if (result != 0 || label == nullptr) {
      LOGE("error : cannot get smack label of %s (err=%d)", dir.c_str(), result);
      return false;
    }
    result = security_server_perm_app_setup_path(transaction.get(), pkgid, object.c_str(),
                                                 SECURITY_SERVER_PATH_ANY_LABEL, label.get());
    if (result != SECURITY_SERVER_SUCCESS) {
      LOGE("error : security_server_perm_app_setup_path %s (err=%d)", dir.c_str(), result);
      return false;
    }
    LOGI("success : set smack label all files under %s", dir.c_str());
  }
  restore_step("relabel");
  result = security_server_perm_commit(transaction.release());
  if (result != SECURITY_SERVER_SUCCESS) {
    LOGE("fail : security_server_perm_commit...(err=%d)", result);
    return false;
  }
  return true;
}

bool restore_tree(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  restore_step("table");
  const JsonPtr table = take_table(files.table);
  if (table == nullptr) return false;
  restore_step("labels");
  if (!relabel_directories(pkgid, files)) return false;
  for (const auto &dir : files.dirs) {
    if (!parse_app_dir_for_restore(dir.c_str(), pkgid, root, table.get())) {
      LOGE("fail to restore directory : %s...", dir.c_str());
      return false;
    }
  }
  return true;
}

}  // namespace

void (*restore_step_hook)(const char *step) = nullptr;

int restore_app_info(const char *pkgid, const char *root) {
  if (restore_tree(pkgid, root)) return 1;
  LOGE("app data restore failed, so will be cleared");
  return 0;
}

int parse_app_dir_for_restore(const char *dir, const char *pkgid, const char *root,
                              json_object *table) {
  const LogScope scope(dir);
  const HeldFolder package(root);
  return AttributesWalk(pkgid, root, table).run(dir) ? 1 : 0;
}

void clear_app_dir(const char *pkgid, const char *root) {
  const LogScope scope(root);
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  LOGI("clearing app data backup directory");
  clear_directory(files.dirs[0].c_str(), false);
  clear_shared_data_dir_except_temp_backup(files.dirs[1].c_str(), files.snapshot.c_str());
  clear_directory(files.dirs[2].c_str(), false);
}
