#include "files/safe_path.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <vector>

#include "files/held_folder.h"

namespace {

constexpr int kMaxLinks = 40;  // the kernel's own limit

std::atomic<bool> openat2_missing{false};

int open_without_links(int dir, const char *path, int flags, mode_t mode, std::uint64_t resolve) {
  struct open_how how = {};
  how.flags = static_cast<std::uint64_t>(flags | O_NOFOLLOW | O_CLOEXEC);
  if ((flags & O_CREAT) != 0) how.mode = mode;
  how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | resolve;
  return static_cast<int>(syscall(SYS_openat2, dir, path, &how, sizeof(how)));
}

/** True when the kernel, or a filter around this process, does not offer openat2(). */
bool no_openat2(int error) {
  if (error == ENOSYS) openat2_missing = true;
  return error == ENOSYS || error == EPERM;
}

void push_components(std::vector<std::string> *stack, const std::string &path) {
  std::size_t end = path.size();
  while (end > 0) {
    const std::size_t slash = path.rfind('/', end - 1);
    const std::size_t begin = slash == std::string::npos ? 0 : slash + 1;
    if (begin < end) stack->push_back(path.substr(begin, end - begin));
    end = slash == std::string::npos ? 0 : slash;
  }
}

/** True when nobody but root could have put the link where it is. */
bool is_trusted_link(const struct stat &link, int dir) {
  struct stat holder = {};
  if (fstat(dir, &holder) != 0) return false;
  return link.st_uid == 0 && holder.st_uid == 0 && (holder.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

UniqueFd fail(int error) {
  errno = error;
  return {};
}

enum class Missing { kFails, kIsMade };

constexpr int kPlace = O_PATH | O_DIRECTORY | O_CLOEXEC;

/** Where the way to an absolute path begins: a held folder, or the root of all. */
class Start {
 public:
  explicit Start(const char *path)
      : folder_(HeldFolder::of(path)), path_(is_root() ? path : folder_->below(path)) {}
  /** False below a held folder that there is not. */
  explicit operator bool() const { return is_root() || static_cast<bool>(*folder_); }
  bool is_root() const { return folder_ == nullptr; }
  int dir() const { return is_root() ? AT_FDCWD : folder_->fd(); }
  const char *path() const { return path_; }

 private:
  const HeldFolder *folder_;
  const char *path_;
};

/** Open without a link on the way; none, with errno, also where there is a trusted one. */
UniqueFd open_from_start(const char *path, int flags, mode_t mode) {
  const Start start(path);
  if (!start) return fail(ENOENT);
  const std::uint64_t below = start.is_root() ? 0 : RESOLVE_BENEATH;
  return UniqueFd(open_without_links(start.dir(), start.path(), flags, mode, below));
}

/** One name of a path; a directory where it is missing and that is made. */
UniqueFd open_or_make(int dir, const std::string &name, int flags, Missing missing, mode_t mode) {
  UniqueFd found(openat(dir, name.c_str(), flags));
  if (found || errno != ENOENT || missing != Missing::kIsMade) return found;
  if (mkdirat(dir, name.c_str(), mode) != 0 && errno != EEXIST) return {};
  return UniqueFd(openat(dir, name.c_str(), flags));
}

/** Where the link that is open as @p fd leads. @return false with errno */
bool read_link(int fd, std::string *target) {
  char text[PATH_MAX];
  const ssize_t length = readlinkat(fd, "", text, sizeof(text));
  if (length < 0) return false;
  if (static_cast<std::size_t>(length) == sizeof(text)) {
    errno = ENAMETOOLONG;
    return false;
  }
  target->assign(text, static_cast<std::size_t>(length));
  return true;
}

/** Walk to the directory @p path, following trusted links only. */
UniqueFd walk_to_directory(const std::string &path, Missing missing, mode_t mode) {
  const Start start(path.c_str());
  if (!start) return fail(ENOENT);
  UniqueFd current(openat(start.dir(), start.is_root() ? "/" : ".", kPlace));
  std::vector<std::string> rest;  // the next component is the last of it
  push_components(&rest, start.path());
  int links = 0;
  while (current && !rest.empty()) {
    const std::string name = std::move(rest.back());
    rest.pop_back();
    if (name == ".") continue;
    UniqueFd next =
        open_or_make(current.get(), name, O_PATH | O_NOFOLLOW | O_CLOEXEC, missing, mode);
    struct stat status = {};
    if (!next || fstat(next.get(), &status) != 0) return {};
    if (S_ISLNK(status.st_mode)) {
      std::string target;
      if (++links > kMaxLinks || !is_trusted_link(status, current.get())) return fail(ELOOP);
      if (!read_link(next.get(), &target)) return {};
      push_components(&rest, target);
      if (target.compare(0, 1, "/") == 0) current.reset(open("/", kPlace));
      continue;
    }
    if (!S_ISDIR(status.st_mode)) return fail(ENOTDIR);
    current = std::move(next);
  }
  return current;
}

/** Split an absolute path; the name is neither empty nor "." nor "..". */
bool split_path(const char *path, std::string *parent, std::string *name) {
  if (path == nullptr || path[0] != '/') {
    errno = EINVAL;
    return false;
  }
  std::size_t end = std::strlen(path);
  while (end > 1 && path[end - 1] == '/') --end;
  std::size_t begin = end;
  while (begin > 0 && path[begin - 1] != '/') --begin;
  name->assign(path + begin, end - begin);
  parent->assign(path, begin > 1 ? begin - 1 : 1);
  if (name->empty() || *name == "." || *name == "..") {
    errno = EINVAL;
    return false;
  }
  return true;
}

bool is_plain_relative(const char *path) {
  if (path == nullptr || path[0] == '\0' || path[0] == '/') return false;
  std::vector<std::string> names;
  push_components(&names, path);
  for (const auto &name : names) {
    if (name == "..") return false;
  }
  return !names.empty();
}

/** The parent of a relative path below @p dir, by one open per component. */
UniqueFd walk_below(int dir, const char *path, Missing missing, mode_t mode, std::string *last) {
  std::vector<std::string> rest;
  push_components(&rest, path);
  UniqueFd current(openat(dir, ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  while (current && !rest.empty()) {
    const std::string name = std::move(rest.back());
    rest.pop_back();
    if (name == ".") continue;
    if (rest.empty() && last != nullptr) {
      *last = name;
      return current;
    }
    const int flags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    current = open_or_make(current.get(), name, flags, missing, mode);
  }
  if (current && last != nullptr) return fail(EINVAL);
  return current;
}

}  // namespace

UniqueFd safe_open(const char *path, int flags, mode_t mode) {
  if (path == nullptr || path[0] != '/') return fail(EINVAL);
  if (const HeldFolder *held = HeldFolder::of(path); held != nullptr && held->is_at(path)) {
    return held->reopen(flags);
  }
  if (!openat2_missing) {
    UniqueFd fd = open_from_start(path, flags, mode);
    if (fd || (errno != ELOOP && !no_openat2(errno))) return fd;
  }
  std::string parent;
  std::string name;
  if (!split_path(path, &parent, &name)) {
    // "/" itself, or a path that ends in "." or "..": a directory in any case
    const UniqueFd dir = walk_to_directory(path, Missing::kFails, 0);
    if (!dir) return {};
    return UniqueFd(openat(dir.get(), ".", flags | O_CLOEXEC, mode));
  }
  const UniqueFd dir = walk_to_directory(parent, Missing::kFails, 0);
  if (!dir) return {};
  return UniqueFd(openat(dir.get(), name.c_str(), flags | O_NOFOLLOW | O_CLOEXEC, mode));
}

UniqueFd safe_open_parent(const char *path, std::string *name) {
  std::string parent;
  if (!split_path(path, &parent, name)) return {};
  if (!openat2_missing) {
    UniqueFd fd = open_from_start(parent.c_str(), O_PATH | O_DIRECTORY, 0);
    // ENOTDIR: the parent itself may be a link that is to be followed
    if (fd || (errno != ELOOP && errno != ENOTDIR && !no_openat2(errno))) return fd;
  }
  return walk_to_directory(parent, Missing::kFails, 0);
}

int safe_lstat(const char *path, struct stat *status) {
  const UniqueFd fd = safe_open(path, O_PATH);
  if (!fd) return -1;
  return fstat(fd.get(), status);
}

DirPtr safe_opendir(const char *path) {
  UniqueFd fd = safe_open(path, O_RDONLY | O_DIRECTORY | O_NONBLOCK);
  if (!fd) return nullptr;
  DirPtr dir(fdopendir(fd.get()));
  if (dir != nullptr) fd.release();
  return dir;
}

DirPtr safe_opendir_at(int dir, const char *name) {
  UniqueFd fd(openat(dir, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd) return nullptr;
  DirPtr opened(fdopendir(fd.get()));
  if (opened != nullptr) fd.release();
  return opened;
}

UniqueFd safe_open_file_at(int dir, const char *name, struct stat *status) {
  const int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
  // To look after a file is not to use it, and each new time of access would be written to the
  // disk.
  UniqueFd fd(openat(dir, name, flags | O_NOATIME));
  if (!fd && errno == EPERM) fd.reset(openat(dir, name, flags));
  if (!fd || fstat(fd.get(), status) != 0 || !S_ISREG(status->st_mode)) return {};
  return fd;
}

bool is_dot_entry(const char *name) {
  return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

int safe_mkdir_with_parents(const char *path, mode_t mode) {
  if (path == nullptr || path[0] != '/') {
    errno = EINVAL;
    return -1;
  }
  return walk_to_directory(path, Missing::kIsMade, mode) ? 0 : -1;
}

UniqueFd safe_open_below(int dir, const char *path, int flags, mode_t mode) {
  if (!is_plain_relative(path)) return fail(EINVAL);
  if (!openat2_missing) {
    UniqueFd fd(open_without_links(dir, path, flags, mode, RESOLVE_BENEATH));
    // a path may be longer than the kernel takes at once
    if (fd || (errno != ENAMETOOLONG && !no_openat2(errno))) return fd;
  }
  std::string name;
  const UniqueFd parent = walk_below(dir, path, Missing::kFails, 0, &name);
  if (!parent) return {};
  return UniqueFd(openat(parent.get(), name.c_str(), flags | O_NOFOLLOW | O_CLOEXEC, mode));
}

UniqueFd safe_mkdir_below(int dir, const char *path, mode_t mode) {
  if (!is_plain_relative(path)) return fail(EINVAL);
  return walk_below(dir, path, Missing::kIsMade, mode, nullptr);
}

std::string fd_path(int fd) {
  return "/proc/" + std::to_string(getpid()) + "/fd/" + std::to_string(fd);
}

std::string own_fd_path(int fd) { return "/proc/self/fd/" + std::to_string(fd); }

std::string own_place_path(int fd) { return "/proc/thread-self/fd/" + std::to_string(fd); }
