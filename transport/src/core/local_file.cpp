#include "core/local_file.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <array>
#include <cerrno>
#include <climits>
#include <deque>

namespace transport {
namespace {

constexpr uid_t kRoot = 0;
constexpr int kMaxLinks = 40;  // what the kernel allows in one path
constexpr mode_t kOthersMayWrite = S_IWGRP | S_IWOTH;
constexpr int kFolderFlags = O_PATH | O_DIRECTORY | O_CLOEXEC;

void prepend_components(const std::string &path, std::deque<std::string> *components) {
  std::deque<std::string> parts;
  for (std::size_t start = 0; start < path.size();) {
    std::size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    if (end > start) parts.push_back(path.substr(start, end - start));
    start = end + 1;
  }
  components->insert(components->begin(), parts.begin(), parts.end());
}

UniqueFd open_start(const std::string &path) {
  return UniqueFd(::open(!path.empty() && path[0] == '/' ? "/" : ".", kFolderFlags));
}

bool is_trusted_link(int folder, const struct stat &link) {
  struct stat status {};
  if (fstat(folder, &status) != 0) return false;
  return link.st_uid == kRoot && status.st_uid == kRoot && (status.st_mode & kOthersMayWrite) == 0;
}

// Component by component, for paths that a trusted link is part of.
UniqueFd walk_folder(const std::string &path) {
  UniqueFd folder = open_start(path);
  std::deque<std::string> components;
  prepend_components(path, &components);
  int links = 0;
  while (folder && !components.empty()) {
    const std::string name = std::move(components.front());
    components.pop_front();
    if (name == ".") continue;
    UniqueFd next(openat(folder.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat status {};
    if (!next || fstat(next.get(), &status) != 0) return {};
    if (S_ISDIR(status.st_mode)) {
      folder = std::move(next);
      continue;
    }
    if (!S_ISLNK(status.st_mode)) {
      errno = ENOTDIR;
      return {};
    }
    std::array<char, PATH_MAX> target{};
    const ssize_t length = readlinkat(next.get(), "", target.data(), target.size() - 1);
    if (++links > kMaxLinks || length <= 0 || !is_trusted_link(folder.get(), status)) {
      errno = ELOOP;
      return {};
    }
    const std::string text(target.data(), static_cast<std::size_t>(length));
    if (text[0] == '/') folder = open_start(text);
    prepend_components(text, &components);
  }
  return folder;
}

UniqueFd open_folder(const std::string &path) {
  struct open_how how {};
  how.flags = kFolderFlags;
  how.resolve = RESOLVE_NO_SYMLINKS;
  UniqueFd folder(static_cast<int>(
      syscall(SYS_openat2, AT_FDCWD, path.empty() ? "." : path.c_str(), &how, sizeof how)));
  if (folder || (errno != ELOOP && errno != ENOSYS && errno != EPERM)) return folder;
  return walk_folder(path);
}

/** The name of what the caller holds: the one link to follow, for nobody can put it elsewhere. */
bool is_own_descriptor(const std::string &path) {
  constexpr char kDescriptors[] = "/proc/self/fd/";
  constexpr std::size_t kStart = sizeof kDescriptors - 1;
  return path.size() > kStart && path.compare(0, kStart, kDescriptors) == 0 &&
         path.find_first_not_of("0123456789", kStart) == std::string::npos;
}

}  // namespace

UniqueFd open_local_parent(const std::string &path, std::string *name) {
  const std::size_t slash = path.rfind('/');
  *name = slash == std::string::npos ? path : path.substr(slash + 1);
  if (name->empty() || *name == "." || *name == "..") {
    errno = EISDIR;
    return {};
  }
  return open_folder(slash == std::string::npos ? "" : path.substr(0, slash + 1));
}

bool LocalSource::open(const std::string &path) {
  // A pipe would block the caller without O_NONBLOCK.
  constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
  if (is_own_descriptor(path)) {
    fd_.reset(::open(path.c_str(), kFlags));
  } else {
    std::string name;
    const UniqueFd folder = open_local_parent(path, &name);
    if (!folder) return false;
    fd_.reset(openat(folder.get(), name.c_str(), kFlags | O_NOFOLLOW));
  }
  struct stat status {};
  if (!fd_ || fstat(fd_.get(), &status) != 0) return false;
  if (!S_ISREG(status.st_mode)) {
    errno = EINVAL;
    return false;
  }
  size_ = status.st_size;
  changed_ = status.st_mtim;
  return true;
}

bool LocalSource::unchanged() const {
  struct stat now {};
  return fstat(fd_.get(), &now) == 0 && now.st_size == size_ &&
         now.st_mtim.tv_sec == changed_.tv_sec && now.st_mtim.tv_nsec == changed_.tv_nsec;
}

bool LocalTarget::open(const std::string &path) {
  const UniqueFd parent = open_local_parent(path, &name_);
  if (!parent) return false;
  folder_.reset(openat(parent.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return static_cast<bool>(folder_);
}

bool LocalTarget::begin() {
  staged_ = std::make_unique<StagedFile>();
  return staged_->create(folder_.get());
}

bool LocalTarget::sync() const { return fsync(staged_->fd()) == 0; }

bool LocalTarget::publish() {
  if (!staged_->publish(folder_.get(), name_)) return false;
  // Whoever may write the directory could have put another file in its place meanwhile.
  struct stat written {};
  struct stat named {};
  const bool same = fstat(staged_->fd(), &written) == 0 &&
                    fstatat(folder_.get(), name_.c_str(), &named, AT_SYMLINK_NOFOLLOW) == 0 &&
                    written.st_ino == named.st_ino && written.st_dev == named.st_dev;
  fsync(folder_.get());
  staged_.reset();
  if (!same) errno = ESTALE;
  return same;
}

}  // namespace transport
