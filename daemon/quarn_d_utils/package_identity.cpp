#include "quarn_d_utils/package_identity.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <sys/fsuid.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string>
#include <utility>

#include "files/held_folder.h"
#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_common.h"

namespace {

constexpr char kAccessList[] = "system.posix_acl_access";
constexpr auto kNobody = static_cast<unsigned int>(-1);  // asks and changes nothing
constexpr int kPlaceFlags = O_PATH | O_NOFOLLOW | O_CLOEXEC;

/** What this thread is at the moment; a thread's first answer is the kernel's. */
package_user &identity() {
  thread_local package_user current = {static_cast<uid_t>(setfsuid(kNobody)),
                                       static_cast<gid_t>(setfsgid(kNobody))};
  return current;
}

bool same_user(const package_user &a, const package_user &b) {
  return a.uid == b.uid && a.gid == b.gid;
}

/** Become @p user. The calls themselves never tell whether they have worked. */
bool become(const package_user &user) {
  package_user &current = identity();
  if (same_user(current, user)) return true;
  // Root's own rights are needed for both, and end with the user.
  if (user.uid == 0) setfsuid(user.uid);
  setfsgid(user.gid);
  if (user.uid != 0) setfsuid(user.uid);
  current = {static_cast<uid_t>(setfsuid(kNobody)), static_cast<gid_t>(setfsgid(kNobody))};
  return same_user(current, user);
}

/** Lifts the thread's file modes, not its owner: what it makes stays the package's. */
class WithoutModes {
 public:
  WithoutModes() {
    granted_ = syscall(SYS_capget, &header_, before_) == 0;
    if (!granted_) return;
    __user_cap_data_struct raised[2] = {before_[0], before_[1]};
    for (const int capability : {CAP_DAC_OVERRIDE, CAP_DAC_READ_SEARCH, CAP_MAC_OVERRIDE}) {
      __user_cap_data_struct &word = raised[CAP_TO_INDEX(capability)];
      word.effective |= CAP_TO_MASK(capability) & word.permitted;
    }
    granted_ = syscall(SYS_capset, &header_, raised) == 0;
  }
  ~WithoutModes() {
    const int error = errno;
    if (granted_) syscall(SYS_capset, &header_, before_);
    errno = error;
  }
  WithoutModes(const WithoutModes &) = delete;
  WithoutModes &operator=(const WithoutModes &) = delete;
  explicit operator bool() const { return granted_; }

 private:
  __user_cap_header_struct header_ = {_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct before_[2] = {};
  bool granted_ = false;
};

UniqueFd refuse() {
  errno = EACCES;
  return {};
}

bool can_fill(int dir, const struct stat &status, const package_user &user) {
  if (status.st_uid == user.uid || (status.st_mode & S_IWOTH) != 0) return true;
  if ((status.st_mode & S_IWGRP) == 0) return false;  // that also bounds an access list
  if (status.st_gid == user.gid) return true;
  const ActAsRoot root;
  const ssize_t list = getxattr(own_fd_path(dir).c_str(), kAccessList, nullptr, 0);
  return list >= 0 || (errno != ENODATA && errno != EOPNOTSUPP);
}

/**
 * A folder that was found in its place since this thread took on another identity: whoever walks a
 * tree of somebody else's asks of the same folder for each of its entries, and of the one above it
 * before. What the application cannot move it cannot move meanwhile.
 */
class KnownPlace {
 public:
  bool is(const struct stat &status) const {
    return known_ && status.st_ino == place_.st_ino && status.st_dev == place_.st_dev &&
           status.st_mode == place_.st_mode && status.st_uid == place_.st_uid;
  }
  void remember(const struct stat &status) {
    place_ = status;
    known_ = true;
  }
  void forget() { known_ = false; }

 private:
  struct stat place_ = {};
  bool known_ = false;
};
thread_local KnownPlace known_place;
/** The application's own folder above it, which folders beside it have above them as well. */
thread_local KnownPlace known_home;
thread_local int identities = 0;

bool lies_at(int top, const char *path, const struct stat &status) {
  struct stat found = {};
  return fstatat(top, path, &found, AT_SYMLINK_NOFOLLOW) == 0 && found.st_ino == status.st_ino &&
         found.st_dev == status.st_dev;
}

/** True for the root of a package: what it lies in is none of the applications' doing. */
bool is_package_root(int top, const package_user &user) {
  struct stat holder = {};
  const UniqueFd above(openat(top, "..", kPlaceFlags | O_DIRECTORY));
  return above && fstat(above.get(), &holder) == 0 && !can_fill(above.get(), holder, user);
}

/**
 * One of the folders for a package's data: where the package's root is its own the application
 * could exchange these as well, but what others keep right there is to be backed up and restored.
 */
bool is_data_folder(int dir, const struct stat &status, const package_user &user) {
  UniqueFd top(openat(dir, "..", kPlaceFlags | O_DIRECTORY));
  if (top && lies_at(top.get(), kDataDirs[0], status) && is_package_root(top.get(), user))
    return true;
  // the other two have a folder between them and the root
  top.reset(openat(dir, "../..", kPlaceFlags | O_DIRECTORY));
  return top &&
         (lies_at(top.get(), kDataDirs[1], status) || lies_at(top.get(), kDataDirs[2], status)) &&
         is_package_root(top.get(), user);
}

/**
 * False when a folder is one that the application may have moved to where it is now, or lies in
 * such a one: up to a folder for data or the root of all, for what the application owns it can move
 * with all that it holds. A sticky folder keeps nobody from moving something into it.
 */
bool is_in_its_place(int dir, struct stat status, const package_user &user) {
  const struct stat asked = status;
  struct stat home = {};
  const ActAsRoot root;
  UniqueFd held;
  while (!known_place.is(status) && !known_home.is(status)) {
    UniqueFd above(openat(dir, "..", kPlaceFlags | O_DIRECTORY));
    struct stat holder = {};
    if (!root || !above || fstat(above.get(), &holder) != 0) return false;
    if (holder.st_ino == status.st_ino && holder.st_dev == status.st_dev) break;
    if (status.st_uid == user.uid && home.st_nlink == 0) home = status;
    if (can_fill(dir, status, user) && can_fill(above.get(), holder, user)) {
      if (is_data_folder(dir, status, user)) break;
      return false;
    }
    held = std::move(above);
    dir = held.get();
    status = holder;
  }
  known_place.remember(asked);
  if (home.st_nlink != 0) known_home.remember(home);
  return true;
}

/** True when the application cannot have put somebody else's object where it lies. */
bool lies_by_others_doing(int dir, int object, const struct stat &status,
                          const package_user &user) {
  struct stat holder = {};
  if (fstat(dir, &holder) != 0) return false;
  if (!can_fill(dir, holder, user)) {
    return (S_ISDIR(status.st_mode) || status.st_nlink == 1) && is_in_its_place(dir, holder, user);
  }
  // A folder has one name, and goes elsewhere only with the right to write it, or with its holder.
  return S_ISDIR(status.st_mode) && holder.st_uid == user.uid && !can_fill(object, status, user) &&
         is_in_its_place(dir, holder, user);
}

/** What is refused to the user: by root, on the object that was looked at. */
UniqueFd open_looked_at(int dir, const char *name, int flags, const package_user &user,
                        struct stat *status) {
  const ActAsRoot root;
  if (!root) return refuse();
  UniqueFd object(openat(dir, name, kPlaceFlags));
  if (!object || fstat(object.get(), status) != 0) return {};
  if ((flags & O_PATH) != 0) {
    if ((flags & O_DIRECTORY) == 0 || S_ISDIR(status->st_mode)) return object;
    errno = ENOTDIR;
    return {};
  }
  if (!S_ISREG(status->st_mode) && !S_ISDIR(status->st_mode)) return refuse();
  if (!may_be_changed(dir, object.get(), *status, user)) return refuse();
  UniqueFd opened(open(own_fd_path(object.get()).c_str(), (flags & ~O_NOFOLLOW) | O_CLOEXEC));
  if (opened && fstat(opened.get(), status) != 0) return {};
  return opened;
}

/** Do what the user was refused once more, without the modes, where that is right. */
template <typename Call>
int again_in(int dir, const package_user &user, Call call) {
  if (!names_may_be_changed(dir, user)) {
    errno = EACCES;
    return -1;
  }
  const WithoutModes lifted;
  if (!lifted) {
    errno = EACCES;
    return -1;
  }
  return call();
}

/** As the user first; @p call answers -1 for a failure. */
template <typename Call>
int as_package(int dir, const package_user &user, Call call) {
  const ActAsPackage acting(user);
  if (!acting) {
    errno = EPERM;
    return -1;
  }
  const int result = call();
  if (result >= 0 || errno != EACCES) return result;
  return again_in(dir, user, call);
}

}  // namespace

package_user user_of_package() { return {kAppUid, kAppGid}; }

bool drop_other_groups() { return geteuid() != 0 || setgroups(0, nullptr) == 0; }

FileIdentity::FileIdentity(package_user user) : before_(identity()), granted_(true) {
  if (identities++ == 0) {
    known_place.forget();
    known_home.forget();
  }
  // Only root can become another; who is it already needs not ask.
  if (!same_user(before_, user) && geteuid() == 0) granted_ = become(user);
}

FileIdentity::~FileIdentity() {
  const int error = errno;
  --identities;
  become(before_);
  errno = error;
}

bool names_may_be_changed(int dir, const package_user &user) {
  struct stat status = {};
  if (fstat(dir, &status) != 0) return false;
  if (status.st_uid == user.uid) return true;
  return !can_fill(dir, status, user) && is_in_its_place(dir, status, user);
}

UniqueFd open_as_package(int dir, const char *name, int flags, mode_t mode,
                         const package_user &user, struct stat *status) {
  flags |= O_NOFOLLOW | O_CLOEXEC;
  if ((flags & O_CREAT) != 0) flags |= O_EXCL;
  UniqueFd fd;
  if ((flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE) {
    fd.reset(as_package(dir, user, [&] { return openat(dir, name, flags, mode); }));
  } else {
    const ActAsPackage acting(user);
    if (acting) fd.reset(openat(dir, name, flags));
    if (!acting || (!fd && errno == EACCES)) {
      struct stat looked_at = {};
      return open_looked_at(dir, name, flags, user, status != nullptr ? status : &looked_at);
    }
  }
  if (fd && status != nullptr && fstat(fd.get(), status) != 0) return {};
  return fd;
}

UniqueFd open_below_as_package(int dir, const char *path, int flags, mode_t mode,
                               const package_user &user, struct stat *status) {
  const ActAsPackage acting(user);
  if (acting && (flags & O_CREAT) == 0) {
    UniqueFd fd = safe_open_below(dir, path, flags);
    if (!fd && errno != EACCES) return {};
    if (fd && status != nullptr && fstat(fd.get(), status) != 0) return {};
    if (fd) return fd;
  }
  const std::string whole = path == nullptr ? "" : path;
  if (whole.empty() || whole.front() == '/') {
    errno = EINVAL;
    return {};
  }
  UniqueFd held;
  int at = dir;
  for (std::size_t begin = 0;;) {
    const std::size_t end = std::min(whole.find('/', begin), whole.size());
    const std::string name = whole.substr(begin, end - begin);
    if (name.empty() || name == "..") {
      errno = EINVAL;
      return {};
    }
    if (end == whole.size()) return open_as_package(at, name.c_str(), flags, mode, user, status);
    UniqueFd next = open_as_package(at, name.c_str(), O_PATH | O_DIRECTORY, 0, user, nullptr);
    if (!next) return {};
    held = std::move(next);
    at = held.get();
    begin = end + 1;
  }
}

int status_as_package(int dir, const char *name, const package_user &user, struct stat *status) {
  const ActAsPackage acting(user);
  const int result = fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
  if (result == 0 || errno != EACCES) return result;
  const ActAsRoot root;
  return fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
}

bool may_be_changed(int dir, int object, const struct stat &status, const package_user &user) {
  return status.st_uid == user.uid || lies_by_others_doing(dir, object, status, user);
}

int mkdir_as_package(int dir, const char *name, mode_t mode, const package_user &user) {
  return as_package(dir, user, [&] { return mkdirat(dir, name, mode); });
}

int unlink_as_package(int dir, const char *name, int flags, const package_user &user) {
  return as_package(dir, user, [&] { return unlinkat(dir, name, flags); });
}

UniqueFd open_held_as_package(const std::string &path, int flags) {
  const HeldFolder *folder = HeldFolder::of(path.c_str());
  if (folder == nullptr) return safe_open(path.c_str(), flags);
  const package_user user = user_of_package();
  UniqueFd fd =
      open_below_as_package(folder->fd(), folder->below(path.c_str()), flags, 0, user, nullptr);
  // the device maker's links are followed
  if (!fd && errno == ELOOP) fd = safe_open(path.c_str(), flags);
  return fd;
}
