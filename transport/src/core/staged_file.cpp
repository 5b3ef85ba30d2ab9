#include "core/staged_file.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <cstdio>

#include "core/remote_path.h"

namespace transport {
namespace {

constexpr mode_t kFileMode = 0600;

std::atomic<bool> nameless_allowed{true};

bool lacks_nameless_files(int error) {
  return error == EOPNOTSUPP || error == EISDIR || error == EINVAL || error == ENOENT;
}

}  // namespace

void StagedFile::set_nameless_allowed(bool allowed) { nameless_allowed = allowed; }

StagedFile::~StagedFile() {
  if (!temporary_name_.empty()) unlinkat(folder_, temporary_name_.c_str(), 0);
}

bool StagedFile::create(int folder) {
  folder_ = folder;
  if (nameless_allowed) {
    fd_.reset(openat(folder, ".", O_TMPFILE | O_RDWR | O_CLOEXEC, kFileMode));
    if (fd_) return fchmod(fd_.get(), kFileMode) == 0;
    if (!lacks_nameless_files(errno)) return false;
  }
  std::string name = make_temporary_name();
  fd_.reset(
      openat(folder, name.c_str(), O_CREAT | O_EXCL | O_NOFOLLOW | O_RDWR | O_CLOEXEC, kFileMode));
  if (!fd_) return false;
  temporary_name_ = std::move(name);
  return fchmod(fd_.get(), kFileMode) == 0 && flock(fd_.get(), LOCK_EX | LOCK_NB) == 0;
}

bool StagedFile::link_as(int target_folder, const std::string &name) const {
  // The short way needs a capability on older kernels, the long one a mounted /proc.
  if (linkat(fd_.get(), "", target_folder, name.c_str(), AT_EMPTY_PATH) == 0) return true;
  if (errno == EEXIST) return false;
  const std::string self = "/proc/self/fd/" + std::to_string(fd_.get());
  return linkat(AT_FDCWD, self.c_str(), target_folder, name.c_str(), AT_SYMLINK_FOLLOW) == 0;
}

bool StagedFile::publish(int target_folder, const std::string &name) {
  if (temporary_name_.empty()) {
    if (link_as(target_folder, name)) return true;
    if (errno != EEXIST) return false;
    std::string temporary_name = make_temporary_name();
    if (!link_as(folder_, temporary_name)) return false;
    temporary_name_ = std::move(temporary_name);
  }
  if (renameat(folder_, temporary_name_.c_str(), target_folder, name.c_str()) != 0) return false;
  temporary_name_.clear();
  return true;
}

}  // namespace transport
