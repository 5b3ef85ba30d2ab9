#include "quarn_d_utils/working_files.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

/** What tells a file from every other: none that nobody else may write keeps these and differs. */
struct FileMark {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  timespec changed = {};

  FileMark() = default;
  explicit FileMark(const struct stat &status)
      : device(status.st_dev),
        inode(status.st_ino),
        size(status.st_size),
        changed(status.st_mtim) {}
  bool operator==(const FileMark &other) const {
    return device == other.device && inode == other.inode && size == other.size &&
           changed.tv_sec == other.changed.tv_sec && changed.tv_nsec == other.changed.tv_nsec;
  }
};

Mutex claimed_mutex;
/** Paths that are this process's own, and what was made there. */
std::map<std::string, std::optional<FileMark>> &claimed() QUARN_REQUIRES(claimed_mutex) {
  static auto *paths = new std::map<std::string, std::optional<FileMark>>;
  return *paths;
}

/** A file that nobody but the daemon has made, and that has no other name. */
bool is_own_single_file(const struct stat &status) {
  return S_ISREG(status.st_mode) && is_own_file(status) && status.st_nlink == 1;
}

/** True when something lies at @p path that the daemon has not made. */
bool is_applications(const std::string &path) {
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 && !is_own_file(status);
}

constexpr mode_t kPrivateFile = 0600;

/** Remove the file at @p path when it is the daemon's, and no longer used. */
void sweep_file(const std::string &path, mode_t modes = ALLPERMS) {
  const MutexLock lock(claimed_mutex);
  struct stat status = {};
  if (claimed().count(path) != 0 || safe_lstat(path.c_str(), &status) != 0) return;
  if (is_own_single_file(status) && (status.st_mode & ALLPERMS & ~modes) == 0)
    delete_file(path.c_str());
}

/** Remove a part of a download when no transfer holds it. */
void sweep_part(int dir, const char *name) {
  struct stat status = {};
  const UniqueFd file = safe_open_file_at(dir, name, &status);
  if (!file || !is_own_leftover(name, status)) return;
  if (flock(file.get(), LOCK_EX | LOCK_NB) != 0) return;
  if (unlinkat(dir, name, 0) != 0) LOGE("fail to delete file : %s", name);
}

}  // namespace

bool is_own_leftover(const char *name, const struct stat &status) {
  return is_part_name(name) && is_own_single_file(status);
}

bool is_own_leftover(const std::string &path) {
  const std::size_t slash = path.rfind('/');
  const char *name = path.c_str() + (slash == std::string::npos ? 0 : slash + 1);
  if (!is_part_name(name)) return false;
  const ActAsRoot root;  // who walks may not enter every directory above
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 && is_own_leftover(name, status);
}

std::string WorkingFiles::download_place() const {
  if (!is_applications(download())) return download();
  return is_applications(download_aside()) ? "" : download_aside();
}

std::string WorkingFiles::snapshot_place() const {
  const std::string beside = snapshot_beside();
  struct stat status = {};
  // One that lies there counts, also when the application has made room meanwhile.
  const bool used = safe_lstat(beside.c_str(), &status) == 0 && is_own_file(status);
  return used || is_applications(snapshot()) ? beside : snapshot();
}

void claim_working_file(const std::string &path) {
  const MutexLock lock(claimed_mutex);
  claimed()[path].reset();
}

void forget_working_file(const std::string &path) {
  const MutexLock lock(claimed_mutex);
  claimed().erase(path);
}

void note_working_file(const std::string &path, int fd) {
  struct stat status = {};
  if (fstat(fd, &status) != 0) return;
  const MutexLock lock(claimed_mutex);
  claimed()[path] = FileMark(status);
}

UniqueFd open_working_file(const std::string &path) {
  UniqueFd file = safe_open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY);
  struct stat status = {};
  if (!file || fstat(file.get(), &status) != 0) return {};
  const MutexLock lock(claimed_mutex);
  const auto known = claimed().find(path);
  const bool noted = known != claimed().end() && known->second;
  if (is_own_single_file(status) && (!noted || *known->second == FileMark(status))) return file;
  errno = ESTALE;
  return {};
}

void sweep_working_files(const std::string &pkg_id, const std::string &root) {
  const WorkingFiles files(pkg_id, root);
  const PackageDataLock lock(pkg_id, PackageUse::kChange);
  sweep_file(files.upload());
  sweep_file(files.upload_aside());
  sweep_file(files.download());
  sweep_file(files.download_aside());
  sweep_file(files.table(), kPrivateFile);
  const UniqueFd dir = safe_open(files.folder().c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK);
  std::vector<TreeEntry> entries;
  if (!dir || !list_tree_entries(dir.get(), &entries)) return;
  for (const TreeEntry &entry : entries) {
    if (is_part_name(entry.name.c_str())) sweep_part(dir.get(), entry.name.c_str());
  }
}
