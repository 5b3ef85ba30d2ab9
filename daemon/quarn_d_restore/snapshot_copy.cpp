#include "quarn_d_restore/snapshot_copy.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <utility>

#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "log_scope.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_restore/copy_bytes.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file_attributes.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kCopyMode = 0600;
constexpr mode_t kFolderMode = 0755;
/** As far as it goes by the folder's mode, anybody may have put there what it holds. */
constexpr mode_t kLinksFolderMode = S_IRWXU | S_IWOTH;
constexpr mode_t kSetIdBits = S_ISUID | S_ISGID;
constexpr std::size_t kOpenAtOnce = 32;
/** What the largest archive's can be. */
constexpr std::uint64_t kMostNames = kMaxUnpackedSize - kMaxBackupSize;

std::string folder_of(const std::string &path) { return path.substr(0, path.rfind('/')); }

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
class SnapshotCopy : public TreeVisitor {
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
    return walk_tree(&place, &path_, this) && copied_;
  }

  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    *folders = copy_folder(place.fd());
    return true;
  }

  TreeStep enter(TreePlace *place, const std::string &name) {
    if (table_->names > kMostNames) return refuse("more");
    if (place->down(name.c_str())) return TreeStep::entered;
    LOGE("error : cannot open this path %s", path_.c_str());
    copied_ = false;
    return TreeStep::passed;
  }

  TreeStep too_deep(TreePlace * /*place*/, const std::string & /*name*/) {
    return refuse("deeper");
  }

 private:
  /** To go on would be more than a backup can hold: its table is in memory whole. */
  TreeStep refuse(const char *how) const {
    LOGE("data at %s is %s than a snapshot can hold", folder_of(path_).c_str(), how);
    return TreeStep::ended;
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
    if (!json_object_object_get_ex(table_->root, key.c_str(), &entry)) return;
    const std::optional<const char *> label = read_label(entry);
    if (!label || **label == '\0') return;
    static_cast<void>(smack_setlabel(own_fd_path(fd).c_str(), *label, SMACK_LABEL_ACCESS));
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

std::size_t copy_aside(const char *pkgid, const char *root, const std::vector<std::string> &dirs,
                       const snapshot_copies &copies) {
  SnapshotCopy copy(pkgid, root, copies.snapshot, copies.table, copies.stamps);
  std::size_t copied = 0;
  while (copied < dirs.size() && copy.copy(dirs[copied])) ++copied;
  return copied;
}

int parse_dir_for_copy(const char *dir, const char *temp_dir, const char *pkgid, const char *root,
                       file_info_table_h *table) {
  return copy_aside(pkgid, root, {dir}, {temp_dir, table, nullptr}) == 1 ? 1 : 0;
}
