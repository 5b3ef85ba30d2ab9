#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <string>

#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/entry_writer.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_directory.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/packing.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

/** What lies there, whoever may enter the directory. */
int look_at(int parent, const char *name, struct stat *status) {
  const int found = fstatat(parent, name, status, AT_SYMLINK_NOFOLLOW);
  if (found == 0 || errno != EACCES) return found;
  const ActAsRoot root;
  return fstatat(parent, name, status, AT_SYMLINK_NOFOLLOW);
}

/** Takes what lies in one data directory into the archive, each directory behind what it holds. */
class PackingWalk {
 public:
  using Entries = EntriesAsTheyCome;

  PackingWalk(const char *pkg_id, const char *root, zipFile zip, file_info_table_h *table,
              int *error)
      : root_(root), working_(pkg_id, root), zip_(zip), table_(table), error_(error) {}

  const package_user &user() const { return user_; }

  static bool ended() { return packing_ended(); }

  EntryVisit visit(int parent, const WalkEntry &entry, const std::string &path) {
    if (working_.contain(path) || (packing != nullptr && path == packing->path)) {
      return EntryVisit::passed;
    }
    if (entry.type == DT_REG) {
      if (!is_backup_file(path.c_str())) return EntryVisit::passed;
      if (add_usual_file(parent, entry.name, path)) return EntryVisit::counted;
    }
    return look_closely(parent, entry.name, path);
  }

  DirPtr open(int parent, const char *name, struct stat *status) const {
    return open_directory_as_package(parent, name, user_, status);
  }

  void missed(const std::string &path, int depth) {
    const bool full = is_too_deep(depth) && packing != nullptr && packing->refuses_depth(depth);
    if (full) {
      LOGE("archive is full at %s", path.c_str());
    } else {
      LOGE("error : cannot open this path %s", path.c_str());
    }
    *error_ = QUARN_REFUSED;
  }

  /** A directory of which nothing is backed up is not recorded either. */
  bool left(int dir, const struct stat &status, const std::string &path, bool counted) {
    if (!counted || packing_ended() || !admit(path, 0)) return counted;
    add_to_file_info_table(table_, root_.c_str(), path.c_str(), status, error_, dir);
    admit_in_table(path);
    return true;
  }

 private:
  /** Whether the archive takes one more member: none after the first that it does not take. */
  bool admit(const std::string &path, off_t size) {
    const std::uint64_t name = path.size() - root_.size() - 1;
    if (name <= kMaxNameSize &&
        (packing == nullptr || packing->admit(*table_, static_cast<std::uint64_t>(size), name))) {
      return true;
    }
    LOGE("archive is full at %s", path.c_str());
    *error_ = QUARN_REFUSED;
    return false;
  }

  /** The same once it is a member of the table. */
  void admit_in_table(const std::string &path) {
    if (packing == nullptr || packing->admit(*table_)) return;
    LOGE("archive is full at %s", path.c_str());
    *error_ = QUARN_REFUSED;
  }

  /** Open a regular file with the rights of the application, as safe_open_file_at() does. */
  UniqueFd open_file(int parent, const char *name, struct stat *status) const {
    constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY;
    UniqueFd fd = open_as_package(parent, name, kFlags | O_NOATIME, 0, user_, status);
    if (!fd && errno == EPERM) fd = open_as_package(parent, name, kFlags, 0, user_, status);
    if (!fd || !S_ISREG(status->st_mode)) return {};
    return fd;
  }

  /** What the directory calls a regular file, and is one that can be opened: the usual case. */
  bool add_usual_file(int parent, const char *name, const std::string &path) {
    struct stat status {};
    const UniqueFd fd = open_file(parent, name, &status);
    if (fd) add_regular(path, fd, status);
    return static_cast<bool>(fd);
  }

  /** Record a file and pack it, when it could be opened. */
  void add_regular(const std::string &path, const UniqueFd &fd, const struct stat &status) {
    if (status.st_nlink > 1 && status.st_uid != kAppUid) {
      // by such a link an application would get a copy of what it may not read
      LOGE("refused : %s is a link to another owner's file", path.c_str());
      *error_ = QUARN_REFUSED;
      return;
    }
    if (!admit(path, status.st_size)) return;
    add_to_file_info_table(table_, root_.c_str(), path.c_str(), status, error_, fd.get());
    admit_in_table(path);
    if (fd) {
      // A failure is in *error_.
      static_cast<void>(add_open_file(zip_, path.c_str(), path.c_str() + root_.size() + 1, fd.get(),
                                      status, error_));
    } else {
      LOGE("fopen() failed, file is NULL");
      *error_ = QUARN_REFUSED;
    }
  }

  /** A file by what lies there, whatever the directory calls it. */
  EntryVisit add_file(int parent, const char *name, const std::string &path,
                      const struct stat &status) {
    if (!is_backup_file(path.c_str())) return EntryVisit::passed;
    struct stat opened {};
    const UniqueFd fd = open_file(parent, name, &opened);
    if (!fd && errno == EACCES && status.st_uid != kAppUid && status.st_nlink == 1) {
      // its other name may be gone, and it then looks like any file
      LOGE("refused : %s is another owner's file, and its application may not read it",
           path.c_str());
      *error_ = QUARN_REFUSED;
    } else {
      add_regular(path, fd, fd ? opened : status);
    }
    return EntryVisit::counted;
  }

  EntryVisit look_closely(int parent, const char *name, const std::string &path) {
    struct stat status {};
    const int found = look_at(parent, name, &status);
    if (found != 0) {
      LOGE("error : lstat for %d %s", found, path.c_str());
      *error_ = QUARN_REFUSED;
      return EntryVisit::passed;
    }
    if (S_ISDIR(status.st_mode)) return EntryVisit::folder;
    if (S_ISREG(status.st_mode)) return add_file(parent, name, path, status);
    if (S_ISLNK(status.st_mode)) {
      if (!is_backup_file(path.c_str()) || !admit(path, 0)) return EntryVisit::passed;
      add_sym_info_to_file_info_table(table_, root_.c_str(), path.c_str(), status, error_, parent);
      admit_in_table(path);
      return EntryVisit::counted;
    }
    LOGE("this is unexpected type : %s", path.c_str());
    *error_ = QUARN_REFUSED;
    return EntryVisit::passed;
  }

  const std::string root_;
  const WorkingFiles working_;
  zipFile zip_;
  file_info_table_h *table_;
  int *error_;
  const package_user user_ = user_of_package();
};

}  // namespace

bool parse_app_dir_for_zip(const char *pkg_id, const char *root, zipFile zip, const char *dir,
                           file_info_table_h *table, int *error) {
  const DirPtr opened = safe_opendir(dir);
  if (opened == nullptr) {
    LOGE("error : cannot open this path %s", dir);
    *error = QUARN_REFUSED;
    return false;
  }
  PackingWalk walk(pkg_id, root, zip, table, error);
  if (packing != nullptr) {
    packing->data_dirs.emplace_back(fcntl(dirfd(opened.get()), F_DUPFD_CLOEXEC, 0));
  }
  std::string path = dir;
  const ActAsPackage acting(walk.user());
  if (!acting) {
    LOGE("cannot act as user %u : %d", walk.user().uid, errno);
    *error = QUARN_REFUSED;
    return false;
  }
  return walk_in_order(opened.get(), &path, &walk);
}
