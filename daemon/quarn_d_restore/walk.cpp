#include "quarn_d_restore/walk.h"

#include <fcntl.h>

#include <cerrno>
#include <utility>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "platform_security_server.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_restore/archive_table.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/settle.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/table_text.h"
#include "quarn_d_utils/tree_walk.h"
#include "quarn_d_utils/unpacked_file.h"
#include "quarn_log.h"

namespace {

using Transaction = Handle<security_server_transaction, &security_server_perm_abort>;

constexpr mode_t kFolderMode = 0755;
constexpr mode_t kSettledMode = 0600;

/** What stays the same in the walk over one package. */
struct walk_context {
  const char *pkgid;
  const char *root;
  json_object *table;
  restore_files files;
};

/** A directory of the walk, which follows. */
struct FoundFolder {
  std::string name;
  struct stat status; /**< as it was looked at */
  bool lacks_info;    /**< it got no attributes, which is a failure unless it holds no file */
};

/** A directory that the walk is in. */
struct Level {
  std::vector<FoundFolder> folders; /**< those in it that are still to be entered */
  bool lacks_info = false;
  bool holds_file = false; /**< here or anywhere below */
};

/** What an entry is, and a descriptor to change it by; none, with errno, when it is gone. */
UniqueFd find_entry(int dir, const TreeEntry &entry, struct stat *status) {
  return open_as_package(dir, entry.name.c_str(), O_PATH, 0, user_of_package(), status);
}

/** Give an object its attributes when it is the application's, not put there from elsewhere. */
bool restore_object(const walk_context &ctx, int dir, int object, const struct stat &status,
                    const std::string &path) {
  if (!may_be_changed(dir, object, status, user_of_package())) {
    LOGE("refused : %s is a link to a file elsewhere", path.c_str());
    return false;
  }
  return restore_object_info(object, status, path.c_str(), ctx.pkgid, ctx.root, ctx.table) != 0;
}

bool is_empty_folder(const std::string &path) {
  const ActAsRoot root;
  return is_empty_directory(path.c_str());
}

int restore_entry(const walk_context &ctx, int dir, const TreeEntry &entry, const std::string &path,
                  Level *level) {
  struct stat status = {};
  const UniqueFd object = find_entry(dir, entry, &status);
  if (!object) {
    const bool vanished = errno == ENOENT;
    LOGE("error : lstat for %d %s", -1, path.c_str());
    return vanished ? 1 : 0;
  }
  if (S_ISLNK(status.st_mode)) return 1;
  if (S_ISDIR(status.st_mode)) {
    const bool restored = restore_object(ctx, dir, object.get(), status, path);
    level->folders.push_back({entry.name, status, !restored});
    return 1;
  }
  if (S_ISREG(status.st_mode)) {
    level->holds_file = true;
    if (restore_object(ctx, dir, object.get(), status, path)) return 1;
    LOGE("fail to restore file info : %s", path.c_str());
    return 0;
  }
  LOGE("this is unexpected type : %s", path.c_str());
  return 0;
}

/** One directory: everything in it but what lies deeper. @return 1, or 0 when anything failed */
int restore_folder(const walk_context &ctx, int dir, std::string *path, Level *level) {
  std::vector<TreeEntry> entries;
  int result = list_tree_entries(dir, &entries) ? 1 : 0;
  for (const TreeEntry &entry : entries) {
    const PathStep step(path, entry.name.c_str());
    if (ctx.files.is_skipped(*path)) continue;
    restore_step("attributes");
    if (!restore_entry(ctx, dir, entry, *path, level)) result = 0;
  }
  return result;
}

/** What a directory without attributes of its own comes to. @return 1, or 0 for a failure */
int judge_folder(const std::string &path, bool lacks_info, bool holds_file) {
  if (!lacks_info) return 1;
  if (!holds_file) {
    LOGI("it is empty folder : %s", path.c_str());
    return 1;
  }
  LOGE("fail to restore file info : %s", path.c_str());
  return 0;
}

/** Go into a directory that was looked at; not into another that was put in its place. */
bool enter_checked(TreePlace *place, const std::string &name, const struct stat &checked) {
  struct stat opened = {};
  if (!place->down(name.c_str())) return false;
  if (fstat(place->fd(), &opened) == 0 && is_same_object(checked, opened)) return true;
  static_cast<void>(place->up());
  return false;
}

int walk_directory(const walk_context &ctx, const std::string &dir) {
  const ActAsPackage acting;
  TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                  TreeAccess::kPackage);
  if (!place) {
    LOGE("error : cannot open this path %s", dir.c_str());
    return 0;
  }
  std::string path = dir;
  std::vector<Level> pending(1);
  int result = restore_folder(ctx, place.fd(), &path, &pending.back());
  while (true) {
    if (pending.back().folders.empty()) {
      const Level left = std::move(pending.back());
      pending.pop_back();
      // Asked of each folder on its own, this would go over all that lies below it again.
      if (!judge_folder(path, left.lacks_info, left.holds_file)) result = 0;
      if (pending.empty()) return result;
      if (left.holds_file) pending.back().holds_file = true;
      if (!place.up()) return 0;
      path.resize(path.rfind('/'));
      continue;
    }
    const FoundFolder next = std::move(pending.back().folders.back());
    pending.back().folders.pop_back();
    const std::size_t length = path.size();
    path += "/" + next.name;
    if (enter_checked(&place, next.name, next.status)) {
      pending.push_back({{}, next.lacks_info, false});
      if (!restore_folder(ctx, place.fd(), &path, &pending.back())) result = 0;
    } else {
      judge_folder(path, next.lacks_info, next.lacks_info && !is_empty_folder(path));
      LOGE("error : cannot open this path %s", path.c_str());
      result = 0;
      path.resize(length);
    }
  }
}

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

/** Give the unpacked files of one folder that have no attributes those of any new file. */
bool settle_folder(int dir, const std::string &path, const restore_files &files, const char *label,
                   TreeFolders *folders) {
  const package_user user = user_of_package();
  std::vector<TreeEntry> entries;
  list_tree_entries(dir, &entries);
  for (TreeEntry &entry : entries) {
    if (files.is_skipped(path + "/" + entry.name)) continue;
    struct stat status = {};
    const UniqueFd object = open_as_package(dir, entry.name.c_str(), O_PATH, 0, user, &status);
    if (object && S_ISDIR(status.st_mode)) folders->push_back(std::move(entry.name));
    if (!object || !is_being_unpacked(status) || status.st_uid != user.uid) continue;
    if (change_object_mode(object.get(), status, kSettledMode) < 0) LOGE("chmod failed");
    if (label == nullptr) continue;
    const ActAsRoot root;
    static_cast<void>(smack_setlabel(own_fd_path(object.get()).c_str(), label, SMACK_LABEL_ACCESS));
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

/** One element of the link list. */
struct stored_link {
  const char *name;
  const char *target;
  mode_t mode;
  const char *label;
};

bool read_link(json_object *element, stored_link *link) {
  json_object *name = nullptr;
  json_object *target = nullptr;
  json_object *perm = nullptr;
  json_object *values[4] = {};
  const char *const keys[4] = {"0", "1", "2", "3"};
  const json_type types[4] = {json_type_int, json_type_int, json_type_int, json_type_string};
  if (!json_object_object_get_ex(element, "real_name", &name) ||
      !json_object_is_type(name, json_type_string) ||
      !json_object_object_get_ex(element, "lnk", &target) ||
      !json_object_is_type(target, json_type_string) ||
      !json_object_object_get_ex(element, "perm", &perm)) {
    return false;
  }
  for (int i = 0; i < 4; ++i) {
    if (!json_object_object_get_ex(perm, keys[i], &values[i]) ||
        !json_object_is_type(values[i], types[i])) {
      return false;
    }
  }
  link->name = json_object_get_string(name);
  link->target = json_object_get_string(target);
  link->mode = static_cast<mode_t>(json_object_get_int(values[0]));
  link->label = json_object_get_string(values[3]);
  return true;
}

/** True for a name that stays below the root: no leading slash, no "..". */
bool stays_below(const std::string &name) {
  if (name.empty() || name.front() == '/') return false;
  const std::string framed = "/" + name + "/";
  return framed.find("/../") == std::string::npos;
}

/** Make the folders that a link lies in, as the package's. */
bool make_parents(const std::string &path) {
  const HeldFolder *package = HeldFolder::of(path.c_str());
  if (package == nullptr || !*package) return false;
  const package_user user = user_of_package();
  std::string below = package->below(path.c_str());
  UniqueFd at = package->reopen(O_PATH | O_DIRECTORY);
  for (std::size_t end = below.find('/'); at && end != std::string::npos; end = below.find('/')) {
    const std::string name = below.substr(0, end);
    below.erase(0, end + 1);
    if (name.empty() || name == ".") continue;
    static_cast<void>(mkdir_as_package(at.get(), name.c_str(), kFolderMode, user));
    at = open_as_package(at.get(), name.c_str(), O_PATH | O_DIRECTORY, 0, user, nullptr);
  }
  return static_cast<bool>(at);
}

void make_link(const std::string &path, const stored_link &link) {
  std::string name;
  UniqueFd parent;
  UniqueFd object;
  struct stat status = {};
  const ActAsPackage acting;
  if (make_parents(path)) parent = safe_open_parent(path.c_str(), &name);
  if (parent && symlinkat(link.target, parent.get(), name.c_str()) == 0) {
    object.reset(openat(parent.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  }
  if (!object || fstat(object.get(), &status) != 0 || !S_ISLNK(status.st_mode)) {
    LOGE("error : fail to make lnk for %s -> %s", path.c_str(), link.target);
    return;
  }
  if (change_object_mode(object.get(), status, link.mode) < 0) LOGE("chmod failed");
  if (change_object_owner(object.get(), kAppUid, kAppGid) < 0) LOGE("chown: error \n");
  if (link.label[0] == '\0') {
    LOGE("error : there isn't smack info of %s", path.c_str());
    return;
  }
  const ActAsRoot root;
  const std::string labelled = fd_path(parent.get()) + "/" + name;
  const int result = smack_lsetlabel(labelled.c_str(), link.label, SMACK_LABEL_ACCESS);
  if (result != 0) LOGE("fail : smack_lsetlabel for %s (err=%d)", path.c_str(), result);
}

}  // namespace

void (*restore_step_hook)(const char *step) = nullptr;

int restore_app_info(const char *pkgid, const char *root) {
  if (restore_tree(pkgid, root)) return 1;
  LOGE("app data restore failed, so will be cleared");
  return 0;
}

void settle_unpacked_files(const char *pkgid, const char *root) {
  const LogScope scope(root);
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  for (const auto &dir : files.dirs) {
    TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                    TreeAccess::kPackage);
    CString label;
    if (place &&
        smack_getlabel(own_fd_path(place.fd()).c_str(), out(label), SMACK_LABEL_ACCESS) != 0) {
      label.reset();
    }
    const ActAsPackage acting;
    walk_tree(std::move(place), dir, [&](int fd, const std::string &path, TreeFolders *folders) {
      return settle_folder(fd, path, files, label.get(), folders);
    });
  }
}

int parse_app_dir_for_restore(const char *dir, const char *pkgid, const char *root,
                              json_object *table) {
  const LogScope scope(dir);
  const HeldFolder package(root);
  const walk_context ctx{pkgid, root, table, restore_files(pkgid, root)};
  return walk_directory(ctx, dir);
}

int restore_symlnk(const char * /*pkgid*/, const char *root, json_object *table) {
  const LogScope scope(root);
  const HeldFolder package(root);
  json_object *list = nullptr;
  if (!json_object_object_get_ex(table, kLinkListKey, &list) ||
      !json_object_is_type(list, json_type_array)) {
    return 1;
  }
  const std::size_t count = json_object_array_length(list);
  for (std::size_t i = 0; i < count; ++i) {
    stored_link link = {};
    if (!read_link(json_object_array_get_idx(list, i), &link)) return 1;
    if (!stays_below(link.name)) {
      LOGE("refused : link outside of the application (%s)", link.name);
      continue;
    }
    make_link(std::string(root) + "/" + link.name, link);
  }
  return 1;
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
