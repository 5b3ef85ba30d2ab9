#include "files/held_folder.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "files/safe_path.h"

namespace {

constexpr int kFlags = O_PATH | O_NOFOLLOW | O_CLOEXEC;

thread_local HeldFolder *innermost = nullptr;

}  // namespace

HeldFolder::HeldFolder(std::string path) : HeldFolder(std::move(path), O_DIRECTORY) {}

HeldFolder::HeldFolder(std::string path, int flags) : path_(std::move(path)), outer_(innermost) {
  const HeldFolder *same = of(path_.c_str());
  if (same == nullptr || same->path_ != path_ || !*same) {
    std::string name;
    const UniqueFd parent = safe_open_parent(path_.c_str(), &name);
    if (parent) opened_.reset(openat(parent.get(), name.c_str(), kFlags | flags));
    fd_ = opened_.get();
  } else {
    fd_ = same->fd_;
  }
  innermost = this;
}

HeldFolder::~HeldFolder() {
  HeldFolder **at = &innermost;
  while (*at != this) at = &(*at)->outer_;
  *at = outer_;
}

bool HeldFolder::is_in_place() const {
  std::string name;
  const UniqueFd parent = safe_open_parent(path_.c_str(), &name);
  struct stat named = {};
  struct stat held = {};
  return parent && fstatat(parent.get(), name.c_str(), &named, AT_SYMLINK_NOFOLLOW) == 0 &&
         fd_ >= 0 && fstat(fd_, &held) == 0 && held.st_dev == named.st_dev &&
         held.st_ino == named.st_ino;
}

bool HeldFolder::covers(const char *path) const {
  const std::size_t length = path_.size();
  return std::strncmp(path, path_.c_str(), length) == 0 &&
         (path[length] == '\0' || path[length] == '/');
}

const HeldFolder *HeldFolder::of(const char *path) {
  const HeldFolder *nearest = nullptr;
  const HeldFolder *at = path == nullptr ? nullptr : innermost;
  for (; at != nullptr; at = at->outer_) {
    const bool nearer = nearest == nullptr || at->path_.size() > nearest->path_.size();
    if (nearer && at->covers(path)) nearest = at;
  }
  return nearest;
}

UniqueFd HeldFolder::reopen(int flags) const {
  if (fd_ < 0) {
    errno = ENOENT;
    return {};
  }
  const int how = (flags & ~(O_NOFOLLOW | O_CREAT | O_EXCL)) | O_CLOEXEC;
  UniqueFd folder(openat(fd_, ".", how));
  if (folder || errno != ENOTDIR) return folder;
  return UniqueFd(open(own_fd_path(fd_).c_str(), how));
}

const char *HeldFolder::below(const char *path) const {
  path += path_.size();
  while (*path == '/') ++path;
  return *path == '\0' ? "." : path;
}
