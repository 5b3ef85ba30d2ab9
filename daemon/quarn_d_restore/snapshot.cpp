#include "quarn_d_restore/snapshot.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kSnapshotMode = 0700;
constexpr std::size_t kSmallFile = 64 << 10;
constexpr mode_t kCopyMode = 0600;
constexpr mode_t kFolderMode = 0755;
/** As far as it goes by the folder's mode, anybody may have put there what it holds. */
constexpr mode_t kLinksFolderMode = S_IRWXU | S_IWOTH;
constexpr char kAsideName[] = "/table";
constexpr mode_t kSetIdBits = S_ISUID | S_ISGID;
constexpr std::size_t kOpenAtOnce = 32;
/** What the largest archive's can be. */
constexpr std::uint64_t kMostNames = kMaxUnpackedSize - kMaxBackupSize;

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
    delete_tree_at(opened.get(), name, path + "/" + entry.name, OtherTypes::kRemoved);
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

/** Copy the bytes from @p at on and before @p end. @return where the file or the copying ended */
off_t copy_piece(int from, int to, off_t at, off_t end) {
  while (at < end) {
    off_t in = at;
    off_t out = at;
    const ssize_t count =
        copy_file_range(from, &in, to, &out, static_cast<std::size_t>(end - at), 0);
    if (count <= 0) break;
    at += count;
  }
  char buffer[kSmallFile];
  while (at < end) {
    const auto wanted = static_cast<std::size_t>(std::min<off_t>(end - at, sizeof(buffer)));
    const ssize_t count = TEMP_FAILURE_RETRY(pread(from, buffer, wanted, at));
    if (count <= 0 || pwrite(to, buffer, static_cast<std::size_t>(count), at) != count) break;
    at += count;
  }
  return at;
}

/** Copy what is no hole: an application may have holes of any size, and a copy's take no room. */
bool copy_data(int from, int to, off_t at, off_t end) {
  while (at < end) {
    off_t data = lseek(from, at, SEEK_DATA);
    if (data < 0 && errno == ENXIO) return true;  // nothing but holes follows
    if (data < 0) data = at;                      // the file system does not tell
    off_t hole = lseek(from, data, SEEK_HOLE);
    if (hole <= data) hole = end;
    at = std::min(hole, end);
    struct stat now = {};
    if (data < at && copy_piece(from, to, data, at) < at &&
        (fstat(from, &now) != 0 || now.st_size >= at)) {
      return false;  // and the file has not become shorter
    }
  }
  return true;
}

/**
 * What a walk has found under one name: a file that is open for reading, where that is allowed,
 * or a descriptor that tells what else it is.
 */
struct Found {
  TreeEntry *entry = nullptr;
  UniqueFd object;
  struct stat status = {};
  bool readable = false;
};

/** Open an entry as the package's user. */
Found find_entry(int dir, TreeEntry *entry) {
  constexpr int kRead = O_RDONLY | O_NONBLOCK | O_NOCTTY;
  const package_user user = user_of_package();
  const char *name = entry->name.c_str();
  Found found;
  found.entry = entry;
  if (entry->type == DT_REG || entry->type == DT_UNKNOWN) {
    found.object = open_as_package(dir, name, kRead | O_NOATIME, 0, user, &found.status);
    if (!found.object && errno == EPERM) {
      found.object = open_as_package(dir, name, kRead, 0, user, &found.status);
    }
    found.readable = found.object && S_ISREG(found.status.st_mode);
    if (found.readable) return found;
  }
  found.object = open_as_package(dir, name, O_PATH, 0, user, &found.status);
  return found;
}

/** Copies one package's directories into its snapshot. */
class SnapshotCopy {
 public:
  SnapshotCopy(const char *pkgid, const char *root, std::string snapshot, file_info_table_h *table,
               StampWriter *stamps)
      : files_(pkgid, root),
        root_(root),
        snapshot_(std::move(snapshot)),
        table_(table),
        stamps_(stamps) {}

  /** @return true when everything below @p dir was recorded and copied */
  bool copy(const std::string &dir) {
    const LogScope scope(dir);
    TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                    TreeAccess::kPackage);
    if (!place) {
      LOGE("error : cannot open this path %s", dir.c_str());
      return false;
    }
    path_ = dir;
    copied_ = true;
    std::vector<std::vector<std::string>> pending;
    pending.push_back(copy_folder(place.fd()));
    while (true) {
      if (pending.back().empty()) {
        pending.pop_back();
        if (pending.empty()) return copied_;
        if (!place.up()) return false;
        path_.resize(path_.rfind('/'));
        continue;
      }
      const std::string name = std::move(pending.back().back());
      pending.back().pop_back();
      const std::size_t length = path_.size();
      if (is_beyond_bounds(place)) return false;
      path_ += "/" + name;
      if (place.down(name.c_str())) {
        pending.push_back(copy_folder(place.fd()));
        continue;
      }
      LOGE("error : cannot open this path %s", path_.c_str());
      copied_ = false;
      path_.resize(length);
    }
  }

 private:
  /** Whether to go deeper would be more than a backup can hold: its table is in memory whole. */
  bool is_beyond_bounds(const TreePlace &place) const {
    const bool deeper = place.depth() >= static_cast<std::size_t>(kMaxDirDepth);
    if (!deeper && table_->names <= kMostNames) return false;
    LOGE("data at %s is %s than a snapshot can hold", path_.c_str(), deeper ? "deeper" : "more");
    return true;
  }

  /** The files of the directory at the walk's path. @return the directories in it */
  std::vector<std::string> copy_folder(int dir) {
    std::vector<TreeEntry> entries;
    std::vector<std::string> folders;
    if (!list_tree_entries(dir, &entries)) {
      LOGE("error : cannot open this path %s", path_.c_str());
      copied_ = false;
    }
    UniqueFd target;  // made with the first file that is copied into it
    for (std::size_t at = 0; at < entries.size();) {
      restore_step("snapshot-folder");
      for (const Found &found : find_some(dir, &entries, &at)) {
        const PathStep step(&path_, found.entry->name.c_str());
        restore_step("snapshot-entry");
        if (copy_entry(found, &target)) folders.push_back(std::move(found.entry->name));
      }
    }
    return folders;
  }

  /** Open the next entries of a folder together, for a change of identity costs as much as one. */
  std::vector<Found> find_some(int dir, std::vector<TreeEntry> *entries, std::size_t *at) {
    const ActAsPackage acting;
    std::vector<Found> some;
    while (*at < entries->size() && some.size() < kOpenAtOnce) {
      TreeEntry *entry = &(*entries)[(*at)++];
      const PathStep step(&path_, entry->name.c_str());
      // by the names of this package, and by the folder that the copies go to
      if (files_.is_skipped(path_) || path_.compare(0, snapshot_.size(), snapshot_) == 0) continue;
      some.push_back(find_entry(dir, entry));
    }
    return some;
  }

  /** Record one entry and copy it when it is a file. @return true for a directory */
  bool copy_entry(const Found &found, UniqueFd *target) {
    const struct stat &status = found.status;
    if (!found.object) {
      LOGE("error : lstat for %d %s", -1, path_.c_str());
      return false;
    }
    if (!S_ISDIR(status.st_mode) && !S_ISREG(status.st_mode)) {
      LOGE("this is unexpected type : %s", path_.c_str());
      return false;
    }
    if (keep_unreadable(found, target)) return false;
    int error = QUARN_OK;
    add_to_file_info_table(table_, root_.c_str(), path_.c_str(), status, &error,
                           found.object.get());
    if (error != QUARN_OK) copied_ = false;
    if (S_ISDIR(status.st_mode)) return true;
    // A table that lies in the data would make the snapshot look complete before it is.
    if (path_ != files_.table) copy_regular(found, target);
    return false;
  }

  /**
   * Keep a file by a second name: somebody else's, which the application cannot read, so that
   * nothing of it may be copied or changed. It goes back as what it is. When this is its last name
   * one day, and the application has let a walk into the snapshot by another, it is refused still.
   */
  bool keep_unreadable(const Found &found, UniqueFd *target) {
    if (!S_ISREG(found.status.st_mode) || found.readable ||
        found.status.st_uid == user_of_package().uid) {
      return false;
    }
    if (!*target) *target = make_folder(path_.substr(root_.size() + 1));
    if (*target && fchmod(target->get(), kLinksFolderMode) == 0 &&
        linkat(AT_FDCWD, own_fd_path(found.object.get()).c_str(), target->get(),
               found.entry->name.c_str(), AT_SYMLINK_FOLLOW) == 0) {
      // known to the table, which has no attributes for it
      json_object_object_add(table_->root, path_.c_str() + root_.size() + 1,
                             json_object_new_object());
      if (stamps_ != nullptr) stamps_->add(found.status);
      return true;
    }
    return false;
  }

  void copy_regular(const Found &found, UniqueFd *target) {
    if (!*target) *target = make_folder(path_.substr(root_.size() + 1));
    if (found.readable && *target &&
        copy_open_file(found.object, found.status, target->get(), found.entry->name.c_str())) {
      return;
    }
    const std::string copy = snapshot_ + path_.substr(root_.size());
    LOGE("fail copy : from %s to %s", path_.c_str(), copy.c_str());
    copied_ = false;
  }

  /** Copy an open file, its label too: setting one may need space, which a rollback must not. */
  bool copy_open_file(const UniqueFd &from, const struct stat &status, int to_dir,
                      const char *name) {
    UniqueFd to(openat(to_dir, name, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, kCopyMode));
    if (!to) return false;
    struct stat copy = {};
    const bool copied = copy_bytes(from.get(), to.get(), status.st_size) &&
                        fstat(to.get(), &copy) == 0 && is_still_the_same(from.get(), status);
    if (copied) label_copy(to.get(), path_.substr(root_.size() + 1));
    if (close(to.release()) == 0 && copied) {
      if (stamps_ != nullptr) {
        stamps_->add(status);
        stamps_->add(copy);
      }
      return true;
    }
    unlinkat(to_dir, name, 0);
    return false;
  }

  /** Another's program whose bytes may have changed since its mode was read is not that program. */
  static bool is_still_the_same(int fd, const struct stat &before) {
    if ((before.st_mode & kSetIdBits) == 0) return true;
    struct stat now = {};
    return fstat(fd, &now) == 0 && now.st_mode == before.st_mode &&
           now.st_ctim.tv_sec == before.st_ctim.tv_sec &&
           now.st_ctim.tv_nsec == before.st_ctim.tv_nsec;
  }

  /** Give a copy the label that the table has for @p key, where this may be done. */
  void label_copy(int fd, const std::string &key) const {
    json_object *entry = nullptr;
    json_object *label = nullptr;
    if (!json_object_object_get_ex(table_->root, key.c_str(), &entry) ||
        !json_object_object_get_ex(entry, "3", &label)) {
      return;
    }
    const char *text = json_object_get_string(label);
    if (text == nullptr || text[0] == '\0') return;
    static_cast<void>(smack_setlabel(own_fd_path(fd).c_str(), text, SMACK_LABEL_ACCESS));
  }

  /** The folder in the snapshot for the file @p key, one name after the other, labels too. */
  UniqueFd make_folder(const std::string &key) const {
    UniqueFd at = safe_open(snapshot_.c_str(), O_RDONLY | O_DIRECTORY);
    std::size_t begin = 0;
    for (std::size_t end = key.find('/'); at && end != std::string::npos;
         begin = end + 1, end = key.find('/', begin)) {
      const std::string name = key.substr(begin, end - begin);
      const bool made = mkdirat(at.get(), name.c_str(), kFolderMode) == 0;
      UniqueFd next(
          openat(at.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (next && made) label_copy(next.get(), key.substr(0, end));
      at = std::move(next);
    }
    return at;
  }

  const restore_files files_;
  const std::string root_;
  const std::string snapshot_;
  file_info_table_h *table_;
  StampWriter *stamps_;
  std::string path_;
  bool copied_ = true;
};

}  // namespace

bool copy_bytes(int from, int to, off_t size) {
  struct stat now = {};
  off_t copied = 0;
  if (size <= static_cast<off_t>(kSmallFile)) {
    // small ones through memory, which costs less than a set-up
    char buffer[kSmallFile];
    const ssize_t count = read(from, buffer, sizeof(buffer));
    if (count < 0 || write(to, buffer, static_cast<std::size_t>(count)) != count) return false;
    if (count == size) return true;
    copied = count;
  }
  if (fstat(from, &now) != 0) return false;
  const off_t end = now.st_size;
  if (!copy_data(from, to, copied, end) || fstat(from, &now) != 0) return false;
  // its last hole, or what it has lost meanwhile
  return ftruncate(to, std::min(end, now.st_size)) == 0;
}

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
  sync_directory(files.dirs[1]);
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
    sync_directory(folder_of(files.parts.table));
  }
  restore_step("snapshot-released");
  if (state_of_snapshot(files) != snapshot_state::told) remove_snapshot(files);
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
  SnapshotCopy copy(pkgid, root, files.snapshot, table.get(), &stamps);
  for (const auto &dir : files.dirs) {
    if (!copy.copy(dir)) {
      LOGE("fail to temp backup : %s", dir.c_str());
      remove_snapshot(files);
      return QUARN_REFUSED;
    }
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

int parse_dir_for_copy(const char *dir, const char *temp_dir, const char *pkgid, const char *root,
                       file_info_table_h *table) {
  return SnapshotCopy(pkgid, root, temp_dir, table, nullptr).copy(dir) ? 1 : 0;
}
