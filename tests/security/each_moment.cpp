#include "each_moment.h"

#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>

#include "quarn_common.h"

thread_local std::function<void()> *at_each_moment = nullptr;

AsApplication::AsApplication()
    : group_(syscall(SYS_setfsgid, kAppGid)), user_(syscall(SYS_setfsuid, kAppUid)) {}

AsApplication::~AsApplication() {
  syscall(SYS_setfsuid, user_);
  syscall(SYS_setfsgid, group_);
}

namespace {

void moment() {
  if (at_each_moment == nullptr) return;
  const int error = errno;
  std::function<void()> *const action = at_each_moment;
  at_each_moment = nullptr;
  (*action)();
  at_each_moment = action;
  errno = error;
}

/** The C library's function of that name, between two moments. */
template <typename Function, typename... Arguments>
auto between(const char *name, Arguments... arguments) {
  auto *const real = reinterpret_cast<Function *>(dlsym(RTLD_NEXT, name));
  moment();
  const auto result = real(arguments...);
  moment();
  return result;
}

}  // namespace

extern "C" {
int open(const char *path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = va_arg(arguments, mode_t);
  va_end(arguments);
  return between<int(const char *, int, ...)>("open", path, flags, mode);
}
int openat(int dir, const char *path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = va_arg(arguments, mode_t);
  va_end(arguments);
  return between<int(int, const char *, int, ...)>("openat", dir, path, flags, mode);
}
int fstat(int fd, struct stat *status) noexcept {
  return between<int(int, struct stat *)>("fstat", fd, status);
}
int fstatat(int dir, const char *path, struct stat *status, int flags) noexcept {
  return between<int(int, const char *, struct stat *, int)>("fstatat", dir, path, status, flags);
}
dirent *readdir(DIR *dir) { return between<dirent *(DIR *)>("readdir", dir); }
ssize_t read(int fd, void *data, std::size_t size) {
  return between<ssize_t(int, void *, std::size_t)>("read", fd, data, size);
}
int mkdirat(int dir, const char *path, mode_t mode) noexcept {
  return between<int(int, const char *, mode_t)>("mkdirat", dir, path, mode);
}
int unlinkat(int dir, const char *path, int flags) noexcept {
  return between<int(int, const char *, int)>("unlinkat", dir, path, flags);
}
int renameat(int from, const char *old, int to, const char *name) noexcept {
  return between<int(int, const char *, int, const char *)>("renameat", from, old, to, name);
}
int renameat2(int from, const char *old, int to, const char *name, unsigned int flags) noexcept {
  return between<int(int, const char *, int, const char *, unsigned int)>("renameat2", from, old,
                                                                          to, name, flags);
}
int fchmod(int fd, mode_t mode) noexcept { return between<int(int, mode_t)>("fchmod", fd, mode); }
int chmod(const char *path, mode_t mode) noexcept {
  return between<int(const char *, mode_t)>("chmod", path, mode);
}
int fchown(int fd, uid_t user, gid_t group) noexcept {
  return between<int(int, uid_t, gid_t)>("fchown", fd, user, group);
}
int fchownat(int dir, const char *path, uid_t user, gid_t group, int flags) noexcept {
  return between<int(int, const char *, uid_t, gid_t, int)>("fchownat", dir, path, user, group,
                                                            flags);
}
}
