#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform_security_server.h"
#include "platform_smack.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/own_file.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kSnapshotMode = 0700;
constexpr std::size_t kSmallFile = 64 << 10;
constexpr mode_t kCopyMode = 0600;
constexpr mode_t kPermissionBits = 07777;
constexpr mode_t kSetIdBits = S_ISUID | S_ISGID;
constexpr char kUnfinishedTable[] = "/table";
constexpr char kKept[] = "/kept";

struct TableRelease {
  void operator()(file_info_table_h *table) const { release_file_info_table(table); }
};
using TablePtr = std::unique_ptr<file_info_table_h, TableRelease>;

using Paths = std::vector<std::string>;

/** The snapshot folder of this daemon: an application can neither make nor enter one. */
bool is_own_snapshot(const std::string &path) {
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode) &&
         status.st_uid == geteuid() && (status.st_mode & ACCESSPERMS) == kSnapshotMode;
}

bool is_complete_snapshot(const restore_files &files) {
  return is_own_snapshot(files.snapshot) && file_exist(files.snapshot_table.c_str());
}

/** Bring everything written so far below @p path onto the disk. */
bool flush(const std::string &path) {
  const UniqueFd dir = safe_open(path.c_str(), O_RDONLY | O_DIRECTORY);
  return dir && syncfs(dir.get()) == 0;
}

/** Bring the entry @p path of its directory, or its absence, onto the disk. */
bool flush_directory(const std::string &path) {
  const std::string dir = path.substr(0, path.rfind('/'));
  const UniqueFd handle = safe_open(dir.c_str(), O_RDONLY | O_DIRECTORY);
  return handle && fsync(handle.get()) == 0;
}

/** Remove one name that is not a directory, without looking where it leads. */
bool unlink_entry(const std::string &path) {
  std::string name;
  const UniqueFd parent = safe_open_parent(path.c_str(), &name);
  return parent && unlinkat(parent.get(), name.c_str(), 0) == 0;
}

/** An empty snapshot folder, whatever lay in its place. */
bool make_snapshot_dir(const restore_files &files) {
  std::string name;
  const UniqueFd parent = safe_open_parent(files.snapshot.c_str(), &name);
  if (!parent) return false;
  struct stat status = {};
  if (fstatat(parent.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0) {
    if (S_ISDIR(status.st_mode)) {
      clear_directory(files.snapshot.c_str(), true);
    } else {
      unlinkat(parent.get(), name.c_str(), 0);
    }
  }
  return mkdirat(parent.get(), name.c_str(), kSnapshotMode) == 0 && is_own_snapshot(files.snapshot);
}

/** Save the table under its name only when it is whole and everything it tells of is on disk. */
int save_snapshot_table(file_info_table_h *table, const restore_files &files) {
  // Beside the copies, not among them, where an application's file could have the name.
  const std::string unfinished = files.snapshot + kUnfinishedTable;
  const int result = save_file_info_table(table, unfinished.c_str());
  if (result != QUARN_OK) return result;
  restore_step("snapshot-table-written");
  if (!create_directory_of_file(files.snapshot_table.c_str()) || !flush(files.snapshot)) {
    return QUARN_REFUSED;
  }
  std::string old_name;
  std::string name;
  const UniqueFd source = safe_open_parent(unfinished.c_str(), &old_name);
  const UniqueFd parent = safe_open_parent(files.snapshot_table.c_str(), &name);
  if (!source || !parent ||
      renameat(source.get(), old_name.c_str(), parent.get(), name.c_str()) != 0) {
    return QUARN_REFUSED;
  }
  return flush_directory(files.snapshot_table) ? QUARN_OK : QUARN_REFUSED;
}

/** Move every entry of one directory that @p wanted takes into another. */
template <typename Wanted>
void move_entries(const std::string &from, const std::string &to, Wanted wanted) {
  const DirPtr source = safe_opendir(from.c_str());
  const UniqueFd target = safe_open(to.c_str(), O_PATH | O_DIRECTORY);
  if (source == nullptr || !target) return;
  while (const dirent *entry = readdir(source.get())) {
    const char *name = entry->d_name;
    if (is_dot_entry(name) || !wanted(from + "/" + name)) continue;
    if (renameat(dirfd(source.get()), name, target.get(), name) != 0) {
      LOGE("fail to move %s from %s to %s", name, from.c_str(), to.c_str());
    }
  }
}

/**
 * What no snapshot holds is not emptied by a rollback either: an archive that
 * a backup run has staged, and what is skipped for its name.
 */
void set_aside(const restore_files &files) {
  const std::string kept = files.snapshot + kKept;
  if (safe_mkdir_with_parents(kept.c_str(), kSnapshotMode) != 0) return;
  move_entries(files.dirs[1], kept, [&](const std::string &path) {
    return files.is_skipped(path) && path != files.snapshot && path != files.download;
  });
}

void bring_back(const restore_files &files) {
  const std::string kept = files.snapshot + kKept;
  move_entries(kept, files.dirs[1], [](const std::string &) { return true; });
  std::string name;
  const UniqueFd parent = safe_open_parent(kept.c_str(), &name);
  if (parent) unlinkat(parent.get(), name.c_str(), AT_REMOVEDIR);
}

/** Copy all of a file's bytes: small ones through memory, which costs less than a set-up. */
bool copy_bytes(int from, int to, off_t size) {
  char buffer[kSmallFile];
  if (size <= static_cast<off_t>(sizeof(buffer))) {
    const ssize_t count = read(from, buffer, sizeof(buffer));
    return count == size && write(to, buffer, static_cast<std::size_t>(count)) == count;
  }
  while (size > 0) {
    const ssize_t count =
        copy_file_range(from, nullptr, to, nullptr, static_cast<std::size_t>(size), 0);
    if (count <= 0) return false;
    size -= count;
  }
  return true;
}

/** Copy an open file the quick way; false, and nothing is left, when that cannot be done. */
bool copy_within(const UniqueFd &from, off_t size, int to_dir, const char *name) {
  if (!from) return false;
  UniqueFd to(openat(to_dir, name, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, kCopyMode));
  if (!to) return false;
  const bool copied = copy_bytes(from.get(), to.get(), size);
  if (close(to.release()) == 0 && copied) return true;
  unlinkat(to_dir, name, 0);
  return false;
}

/** Copy a file out of the snapshot; without room for a copy, the snapshot's own file serves. */
bool put_file_back(const std::string &from, const std::string &to) {
  if (create_directory_of_file(to.c_str()) && copy_file(from.c_str(), to.c_str())) return true;
  std::string from_name;
  std::string to_name;
  const UniqueFd source = safe_open_parent(from.c_str(), &from_name);
  const UniqueFd target = safe_open_parent(to.c_str(), &to_name);
  if (!source || !target) return false;
  unlinkat(target.get(), to_name.c_str(), 0);
  return linkat(source.get(), from_name.c_str(), target.get(), to_name.c_str(), 0) == 0;
}

JsonPtr read_table(const std::string &path) {
  char *raw = nullptr;
  const bool read = read_data_from_file(path.c_str(), &raw);
  const CString text(raw);
  return JsonPtr(read ? parse_file_info_table(text.get()) : nullptr);
}

/**
 * Make one object what the snapshot's table says. The table is this device's
 * own, so unlike a restore it may put back any owner and any label.
 */
void put_object_back(int root, const char *key, json_object *entry) {
  json_object *values[4] = {};
  const char *const keys[4] = {"0", "1", "2", "3"};
  for (int i = 0; i < 4; ++i) {
    if (!json_object_object_get_ex(entry, keys[i], &values[i])) return;
  }
  const UniqueFd object = safe_open_below(root, key, O_PATH | O_NOFOLLOW);
  struct stat status = {};
  if (!object || fstat(object.get(), &status) != 0) return;  // an empty directory stays away
  if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode)) return;

  const auto uid = static_cast<uid_t>(json_object_get_int64(values[1]));
  const auto gid = static_cast<gid_t>(json_object_get_int64(values[2]));
  mode_t mode = static_cast<mode_t>(json_object_get_int(values[0])) & kPermissionBits;
  // Running as somebody else is nothing an application's data may bring about.
  if (uid != kAppUid || gid != kAppGid) mode &= ~kSetIdBits;
  if (status.st_uid != uid || status.st_gid != gid) {
    if (change_object_owner(object.get(), uid, gid) < 0) LOGE("chown: error \n");
    if (fstat(object.get(), &status) != 0) return;
  }
  if ((status.st_mode & kPermissionBits) != mode &&
      change_object_mode(object.get(), status, mode) < 0) {
    LOGE("chmod failed");
  }

  const char *label = json_object_get_string(values[3]);
  const std::string path = fd_path(object.get());
  CString current;
  if (label == nullptr || label[0] == '\0') return;
  if (smack_getlabel(path.c_str(), out(current), SMACK_LABEL_ACCESS) == 0 && current != nullptr &&
      std::strcmp(current.get(), label) == 0) {
    return;
  }
  if (security_server_label_access(path.c_str(), label) != SECURITY_SERVER_SUCCESS &&
      smack_setlabel(path.c_str(), label, SMACK_LABEL_ACCESS) != 0) {
    LOGE("fail to put label of %s back", key);
  }
}

/**
 * restore_app_info() stops at the first thing that a restore may not do, a
 * security service that refuses, say. The data goes back all the same.
 */
void put_attributes_back(json_object *table, const char *root) {
  const UniqueFd dir = safe_open(root, O_PATH | O_DIRECTORY);
  if (!dir || table == nullptr) return;
  json_object_object_foreach(table, key, entry) {
    restore_step("rollback-attributes");
    if (json_object_is_type(entry, json_type_object)) put_object_back(dir.get(), key, entry);
  }
}

}  // namespace

bool discard_snapshot(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  // Without its table a half-deleted snapshot is never taken for a whole one.
  if (file_exist(files.snapshot_table.c_str())) {
    if (!flush(files.dirs[1])) {
      LOGE("data of (%s) is not on the disk, so its snapshot is kept", pkgid);
      return false;
    }
    delete_file(files.snapshot_table.c_str());
    flush_directory(files.snapshot_table);
  }
  restore_step("snapshot-released");
  clear_directory(files.snapshot.c_str(), true);
  return true;
}

int temp_backup_initial_app_data(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  file_info_table_h *raw = nullptr;
  ready_file_info_table(&raw);
  const TablePtr table(raw);
  if (table == nullptr) {
    LOGE("file_info_table is NULL");
    return QUARN_REFUSED;
  }
  restore_step("snapshot");
  if (!make_snapshot_dir(files)) {
    LOGE("fail to make snapshot directory : %s", files.snapshot.c_str());
    return QUARN_REFUSED;
  }
  for (const auto &dir : files.dirs) {
    if (!parse_dir_for_copy(dir.c_str(), files.snapshot.c_str(), pkgid, root, table.get())) {
      LOGE("fail to temp backup : %s", dir.c_str());
      clear_directory(files.snapshot.c_str(), true);
      return QUARN_REFUSED;
    }
  }
  restore_step("snapshot-copied");
  const int result = save_snapshot_table(table.get(), files);
  if (result != QUARN_OK) {
    LOGE("fail. temp_backup_initial_app_data : %d", result);
    return result;
  }
  restore_step("snapshot-complete");
  return QUARN_OK;
}

int parse_dir_for_copy(const char *dir, const char *temp_dir, const char *pkgid, const char *root,
                       file_info_table_h *table) {
  const restore_files files(pkgid, root);
  const std::string snapshot = temp_dir;
  const std::size_t root_length = std::strlen(root);
  Paths pending{dir};
  int result = 1;
  while (!pending.empty()) {
    const std::string current = std::move(pending.back());
    pending.pop_back();
    const DirPtr handle = safe_opendir(current.c_str());
    if (handle == nullptr) {
      LOGE("error : cannot open this path %s", current.c_str());
      result = 0;
      continue;
    }
    UniqueFd target;  // made with the first file that is copied into it
    std::string path = current;
    while (const dirent *entry = readdir(handle.get())) {
      if (is_dot_entry(entry->d_name)) continue;
      const PathStep step(&path, entry->d_name);
      if (files.is_archive(path) || path.compare(0, snapshot.size(), snapshot) == 0) continue;
      restore_step("snapshot-entry");
      struct stat status = {};
      UniqueFd file;  // what the directory calls a file need not be looked at twice
      if (entry->d_type == DT_REG)
        file = safe_open_file_at(dirfd(handle.get()), entry->d_name, &status);
      const int found =
          file ? 0 : fstatat(dirfd(handle.get()), entry->d_name, &status, AT_SYMLINK_NOFOLLOW);
      if (found != 0) {
        LOGE("error : lstat for %d %s", found, path.c_str());
        continue;
      }
      if (!S_ISDIR(status.st_mode) && !S_ISREG(status.st_mode)) {
        LOGE("this is unexpected type : %s", path.c_str());
        continue;
      }
      int error = QUARN_OK;
      add_to_file_info_table(table, root, path.c_str(), status, &error, file.get());
      if (error != QUARN_OK) result = 0;
      if (S_ISDIR(status.st_mode)) {
        pending.push_back(path);
        continue;
      }
      // A table that lies in the data would make the snapshot look complete before it is.
      if (path == files.table) continue;
      const std::string copy = snapshot + path.substr(root_length);
      if (!target && create_directory_of_file(copy.c_str())) {
        std::string name;
        target = safe_open_parent(copy.c_str(), &name);
      }
      if (copy_within(file, status.st_size, target.get(), entry->d_name)) continue;
      if (!create_directory_of_file(copy.c_str()) || !copy_file(path.c_str(), copy.c_str())) {
        LOGE("fail copy : from %s to %s", path.c_str(), copy.c_str());
        result = 0;
      }
    }
  }
  return result;
}

int rollback_to_initial_app_data(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  if (!is_complete_snapshot(files)) {
    LOGE("there isn't a snapshot of (%s) to roll back to", pkgid);
    return QUARN_OK;
  }
  restore_step("rollback");
  const JsonPtr table = read_table(files.snapshot_table);
  bring_back(files);  // of a rollback that was interrupted
  set_aside(files);
  restore_step("rollback-set-aside");
  clear_app_dir(pkgid, root);
  restore_step("rollback-cleared");
  bring_back(files);
  parse_dir_for_rollback(files.snapshot.c_str(), pkgid, root);
  restore_app_info(pkgid, root);
  put_attributes_back(table.get(), root);
  restore_step("rollback-done");
  discard_snapshot(pkgid, root);
  return QUARN_OK;
}

int parse_dir_for_rollback(const char *dir, const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  const std::string kept = files.snapshot + kKept;
  Paths pending{dir};
  int result = 1;
  while (!pending.empty()) {
    const std::string current = std::move(pending.back());
    pending.pop_back();
    const DirPtr handle = safe_opendir(current.c_str());
    if (handle == nullptr) {
      LOGE("error : cannot open this path %s", current.c_str());
      result = 0;
      continue;
    }
    std::string path = current;
    while (const dirent *entry = readdir(handle.get())) {
      if (is_dot_entry(entry->d_name)) continue;
      const PathStep step(&path, entry->d_name);
      if (files.is_archive(path) || path == kept) continue;
      restore_step("rollback-entry");
      struct stat status = {};
      const int found = fstatat(dirfd(handle.get()), entry->d_name, &status, AT_SYMLINK_NOFOLLOW);
      if (found != 0) {
        LOGE("error : lstat for %d %s", found, path.c_str());
        continue;
      }
      if (S_ISDIR(status.st_mode)) {
        pending.push_back(path);
      } else if (S_ISREG(status.st_mode)) {
        const std::string original = root + path.substr(files.snapshot.size());
        if (!put_file_back(path, original)) {
          LOGE("fail copy : from %s to %s", path.c_str(), original.c_str());
          result = 0;
        }
      } else {
        LOGE("this is unexpected type : %s", path.c_str());
      }
    }
  }
  return result;
}

bool recover_interrupted_restore(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  struct stat status = {};
  if (safe_lstat(files.snapshot.c_str(), &status) != 0) return false;
  if (!is_own_file(status)) return false;  // the application's own, of the same name
  const std::lock_guard<std::mutex> lock(package_data_mutex);
  if (is_complete_snapshot(files)) {
    LOGI("restore of (%s) was interrupted, so its data will be put back", pkgid);
    rollback_to_initial_app_data(pkgid, root);
    return true;
  }
  // The table is written last: without it the data was not touched, or is whole again.
  if (S_ISDIR(status.st_mode)) {
    clear_directory(files.snapshot.c_str(), true);
  } else {
    unlink_entry(files.snapshot);
  }
  return false;
}
