#include "quarn_d_restore/snapshot.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <vector>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot_copy.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kSnapshotMode = 0700;
constexpr char kAsideName[] = "/table";

struct TableRelease {
  void operator()(file_info_table_h *table) const { release_file_info_table(table); }
};
using TablePtr = std::unique_ptr<file_info_table_h, TableRelease>;

std::string folder_of(const std::string &path) { return path.substr(0, path.rfind('/')); }

/** A directory that an application can neither make nor enter. */
bool is_own_snapshot(const struct stat &status) {
  return S_ISDIR(status.st_mode) && status.st_uid == geteuid() &&
         (status.st_mode & ACCESSPERMS) == kSnapshotMode;
}

bool rename_path(const std::string &from, const std::string &to) {
  std::string old_name;
  std::string name;
  const UniqueFd source = safe_open_parent(from.c_str(), &old_name);
  const UniqueFd target = safe_open_parent(to.c_str(), &name);
  return source && target &&
         renameat(source.get(), old_name.c_str(), target.get(), name.c_str()) == 0;
}

bool unlink_path(const std::string &path) {
  std::string name;
  const UniqueFd parent = safe_open_parent(path.c_str(), &name);
  return parent && (unlinkat(parent.get(), name.c_str(), 0) == 0 || errno == ENOENT);
}

/** Remove what is the daemon's own; what the application calls the same stays. */
bool remove_own(const std::string &path) {
  std::string name;
  const UniqueFd parent = safe_open_parent(path.c_str(), &name);
  if (!parent) return false;
  struct stat status = {};
  if (fstatat(parent.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
    return errno == ENOENT;
  }
  if (!is_own_file(status)) return false;
  if (!S_ISDIR(status.st_mode)) return unlinkat(parent.get(), name.c_str(), 0) == 0;
  // One of root's that others may write the application may have moved there, with what it holds.
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) return false;
  return delete_tree_at(parent.get(), name.c_str(), path, OtherTypes::kRemoved, TreeAccess::kDaemon,
                        &status);
}

/** Remove everything in a directory of the daemon's. */
void delete_entries(int dir, const std::string &path) {
  const UniqueFd opened(openat(dir, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  std::vector<TreeEntry> entries;
  if (!opened || !list_tree_entries(opened.get(), &entries)) return;
  for (const TreeEntry &entry : entries) {
    const char *name = entry.name.c_str();
    if (unlinkat(opened.get(), name, 0) == 0) continue;
    // What cannot go is logged, and lies where nobody looks for a snapshot.
    static_cast<void>(
        delete_tree_at(opened.get(), name, path + "/" + entry.name, OtherTypes::kRemoved));
  }
}

/** An empty snapshot folder; one that is only kept makes way. */
bool make_snapshot_dir(const restore_files &files, std::optional<HeldFolder> *held) {
  if (state_of_snapshot(files) == snapshot_state::told) {
    if (!remove_own(files.aside) || !rename_path(files.snapshot, files.aside)) return false;
  }
  if (!remove_snapshot(files)) return false;
  std::string name;
  const UniqueFd parent = safe_open_parent(files.snapshot.c_str(), &name);
  if (!parent || mkdirat(parent.get(), name.c_str(), kSnapshotMode) != 0) return false;
  held->emplace(files.snapshot);
  return state_of_snapshot(files) == snapshot_state::incomplete;
}

/** Save the table under its name only when it is whole and everything it tells of is on disk. */
int save_snapshot_table(file_info_table_h *table, const restore_files &files) {
  // Beside the copies, not among them, where an application's file could have the name.
  const int result = save_file_info_table(table, files.parts.unfinished_table.c_str());
  if (result != QUARN_OK) return result;
  restore_step("snapshot-table-written");
  // The snapshot's own name is in the folder that it lies in.
  if (!create_directory_of_file(files.parts.table.c_str()) || !sync_tree(files.snapshot) ||
      !sync_directory(folder_of(files.snapshot))) {
    return QUARN_REFUSED;
  }
  if (!rename_path(files.parts.unfinished_table, files.parts.table)) return QUARN_REFUSED;
  return sync_directory(folder_of(files.parts.table)) ? QUARN_OK : QUARN_REFUSED;
}

}  // namespace

snapshot_state state_of_snapshot(const restore_files &files) {
  struct stat status = {};
  if (safe_lstat(files.snapshot.c_str(), &status) != 0) return snapshot_state::none;
  if (!is_own_snapshot(status)) return snapshot_state::foreign;
  if (file_exist(files.parts.table.c_str())) return snapshot_state::complete;
  return file_exist(files.parts.told.c_str()) ? snapshot_state::told : snapshot_state::incomplete;
}

bool remove_snapshot(const restore_files &files) {
  const HeldFolder snapshot(files.snapshot);
  // The application may have given it another name: what it holds goes all the same.
  if (snapshot && !snapshot.is_in_place() && state_of_snapshot(files) != snapshot_state::foreign) {
    delete_entries(snapshot.fd(), files.snapshot);
  }
  return remove_own(files.snapshot);
}

bool set_own_table_aside(const restore_files &files) {
  struct stat status = {};
  if (safe_lstat(files.table.c_str(), &status) != 0) return errno == ENOENT;
  // No archive's table takes a directory's place, so there is nothing to save it from.
  if (is_own_file(status) || S_ISDIR(status.st_mode)) return true;
  std::string name;
  const UniqueFd parent = safe_open_parent(files.table_aside.c_str(), &name);
  if (!parent || (mkdirat(parent.get(), name.c_str(), kSnapshotMode) != 0 && errno != EEXIST)) {
    return false;
  }
  return safe_lstat(files.table_aside.c_str(), &status) == 0 && is_own_snapshot(status) &&
         rename_path(files.table, files.table_aside + kAsideName) &&
         sync_directory(files.table_aside) && sync_directory(files.dirs[1]);
}

void put_own_table_back(const restore_files &files) {
  struct stat status = {};
  if (safe_lstat(files.table_aside.c_str(), &status) != 0 || !is_own_snapshot(status)) return;
  const std::string aside = files.table_aside + kAsideName;
  const bool written_since = safe_lstat(files.table.c_str(), &status) == 0 && !is_own_file(status);
  if (!written_since && safe_lstat(aside.c_str(), &status) == 0 &&
      !rename_path(aside, files.table)) {
    LOGE("fail copy : from %s to %s", aside.c_str(), files.table.c_str());
    return;
  }
  // Should that be lost with the power, it lies aside still, and comes back with the next start.
  static_cast<void>(sync_directory(files.dirs[1]));
  if (!remove_own(files.table_aside)) {
    LOGE("fail to delete dir : %s", files.table_aside.c_str());
  }
}

void forget_told_snapshot(const restore_files &files) {
  struct stat status = {};
  if (safe_lstat(files.aside.c_str(), &status) != 0 || !is_own_file(status)) return;
  if (!remove_own(files.aside)) LOGE("fail to delete dir : %s", files.aside.c_str());
}

bool keep_told_snapshot(const restore_files &files) {
  return rename_path(files.parts.table, files.parts.told) && sync_directory(files.snapshot);
}

bool discard_snapshot(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  const HeldFolder snapshot(files.snapshot);
  // Without its table a half-deleted snapshot is never taken for a whole one.
  if (state_of_snapshot(files) == snapshot_state::complete) {
    const auto skipped = [&](const std::string &path) { return files.is_skipped(path); };
    for (const auto &dir : files.dirs) {
      if (sync_tree(dir, skipped)) continue;
      LOGE("data of (%s) is not on the disk, so its snapshot is kept", pkgid);
      return false;
    }
    if (!unlink_path(files.parts.table)) {
      LOGE("snapshot of (%s) cannot be released, so it is kept", pkgid);
      return false;
    }
    // Should that be lost with the power, the snapshot is put back: its data is whole as well.
    static_cast<void>(sync_directory(folder_of(files.parts.table)));
  }
  restore_step("snapshot-released");
  // What stays counts for nothing, and goes with the next one.
  if (state_of_snapshot(files) != snapshot_state::told) static_cast<void>(remove_snapshot(files));
  return true;
}

int take_snapshot(const char *pkgid, const char *root, std::optional<HeldFolder> *held) {
  const restore_files files(pkgid, root);
  file_info_table_h *raw = nullptr;
  ready_file_info_table(&raw);
  const TablePtr table(raw);
  if (table == nullptr) {
    LOGE("file_info_table is NULL");
    return QUARN_REFUSED;
  }
  restore_step("snapshot");
  if (!make_snapshot_dir(files, held)) {
    LOGE("fail to make snapshot directory : %s", files.snapshot.c_str());
    return QUARN_REFUSED;
  }
  StampWriter stamps(files.parts.stamps);
  const std::size_t copied = copy_aside(pkgid, root, {files.dirs.begin(), files.dirs.end()},
                                        {files.snapshot, table.get(), &stamps});
  if (copied < files.dirs.size()) {
    LOGE("fail to temp backup : %s", files.dirs[copied].c_str());
    static_cast<void>(remove_snapshot(files));  // what stays is incomplete
    return QUARN_REFUSED;
  }
  restore_step("snapshot-copied");
  const int result =
      stamps.finish() ? save_snapshot_table(table.get(), files) : static_cast<int>(QUARN_REFUSED);
  if (result != QUARN_OK) {
    LOGE("fail. temp_backup_initial_app_data : %d", result);
    return result;
  }
  restore_step("snapshot-complete");
  return QUARN_OK;
}

int temp_backup_initial_app_data(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  std::optional<HeldFolder> snapshot;
  return take_snapshot(pkgid, root, &snapshot);
}
