#include "platform_security_server.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <memory>
#include <string>
#include <vector>

#include "fault.h"
#include "state/labels.h"
#include "state/packages.h"

struct security_server_transaction {
  struct Relabel {
    std::string path;
    std::string label;
  };
  std::vector<Relabel> relabels;
};

namespace {

using embedded::LabelKind;
using embedded::Links;

constexpr char kProc[] = "/proc/";

std::string name_of(int fd) { return "/proc/self/fd/" + std::to_string(fd); }

bool relabel_folder(int fd, const struct stat &folder, const std::string &label);

bool others_may_write(const struct stat &folder) {
  return (folder.st_mode & (S_IWGRP | S_IWOTH)) != 0;
}

/**
 * True for what is no second name of somebody else's file. It belongs to the owner of the folder
 * that it lies in, whoever owns what was named: an application's folder in one of root's holds what
 * that application has put there. Else nobody but a service can have put it into its folder.
 */
bool is_given(const struct stat &status, const struct stat &folder) {
  if (status.st_uid == folder.st_uid) return status.st_uid != 0 || !others_may_write(folder);
  return status.st_nlink == 1 && folder.st_uid == 0 && !others_may_write(folder);
}

/** Label what is held as @p fd: a link itself, not its target. */
bool relabel_leaf(int fd, const struct stat &status, const std::string &label) {
  if (embedded::write_label(name_of(fd).c_str(), Links::kFollow, LabelKind::kAccess, label) == 0)
    return true;
  // Where labels are user attributes, links and special files cannot have one.
  return !S_ISREG(status.st_mode) && errno == EPERM;
}

/** What only root may enter is not the application's: a service keeps its own things there. */
bool is_roots_own(const struct stat &folder) {
  return folder.st_uid == 0 && (folder.st_mode & (S_IRWXG | S_IRWXO)) == 0;
}

/**
 * Hold what @p entry names. An open file is labelled at once, what is only held by a walk along its
 * name in /proc; but no more than a file is opened for that.
 */
int hold_entry(int dir, const dirent &entry) {
  if (entry.d_type == DT_REG) {
    constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW | O_NOATIME | O_CLOEXEC;
    const int fd = openat(dir, entry.d_name, kFlags);
    if (fd >= 0) return fd;
  }
  return openat(dir, entry.d_name, O_PATH | O_NOFOLLOW | O_CLOEXEC);
}

/** One entry of the folder that is open as @p dir: what was looked at is what is labelled. */
bool relabel_entry(int dir, const struct stat &folder, const dirent &entry,
                   const std::string &label) {
  const int fd = hold_entry(dir, entry);
  if (fd < 0) return errno == ENOENT;
  struct stat status {};
  bool done = fstat(fd, &status) == 0;
  if (done && S_ISDIR(status.st_mode)) {
    if (!is_roots_own(status)) done = relabel_folder(fd, status, label);
  } else if (done && is_given(status, folder)) {
    done = relabel_leaf(fd, status, label);
  }
  close(fd);
  return done;
}

/**
 * Label the folder @p fd (an O_PATH descriptor) and everything below it. Folders are held while
 * their entries are labelled, so a link swapped in leads nowhere.
 */
bool relabel_folder(int fd, const struct stat &folder, const std::string &label) {
  if (!relabel_leaf(fd, folder, label)) return false;
  const int opened = openat(fd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  DIR *dir = opened < 0 ? nullptr : fdopendir(opened);
  if (dir == nullptr) {
    if (opened >= 0) close(opened);
    return false;
  }
  bool done = true;
  while (const dirent *entry = readdir(dir)) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    done = relabel_entry(opened, folder, *entry, label) && done;
  }
  closedir(dir);
  return done;
}

int open_without_links(int base, const char *path, std::uint64_t more_flags = O_DIRECTORY) {
  open_how how{};
  how.flags = O_PATH | O_CLOEXEC | more_flags;
  how.resolve = RESOLVE_NO_SYMLINKS;
  return static_cast<int>(syscall(SYS_openat2, base, path, &how, sizeof how));
}

bool starts_with(const std::string &text, const std::string &start) {
  return text.compare(0, start.size(), start) == 0;
}

/** The directory to relabel: no link that an application could have made is followed. */
int open_folder(const std::string &path) {
  // A descriptor's name leads to what the caller holds, and has checked.
  if (starts_with(path, kProc)) return open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  const std::string apps = embedded::package_root("");
  if (!starts_with(path, apps)) return open_without_links(AT_FDCWD, path.c_str());
  // The applications' own folder may be a link of the device's.
  const int base = open(apps.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (base < 0) return -1;
  const int fd = open_without_links(base, path.c_str() + apps.size());
  close(base);
  return fd;
}

bool relabel(const std::string &path, const std::string &label) {
  const int fd = open_folder(path);
  if (fd < 0) return false;
  struct stat folder {};
  const bool done = fstat(fd, &folder) == 0 && relabel_folder(fd, folder, label);
  close(fd);
  return done;
}

/** One object, which a name that is not a descriptor's must lead to by no link of either kind. */
bool label_one(const char *path, const std::string &label) {
  if (starts_with(path, kProc))
    return embedded::write_label(path, Links::kFollow, LabelKind::kAccess, label) == 0;
  const int fd = open_without_links(AT_FDCWD, path, O_NOFOLLOW);
  if (fd < 0) return false;
  struct stat status {};
  const bool alone = fstat(fd, &status) == 0 && !S_ISLNK(status.st_mode) &&
                     (S_ISDIR(status.st_mode) || status.st_nlink == 1);
  const bool done = alone && embedded::write_label(name_of(fd).c_str(), Links::kFollow,
                                                   LabelKind::kAccess, label) == 0;
  close(fd);
  return done;
}

}  // namespace

int security_server_label_access(const char *path, const char *label) {
  RETURN_FAULT();
  if (path == nullptr || label == nullptr) return SECURITY_SERVER_ERROR_INPUT_PARAM;
  return label_one(path, label) ? SECURITY_SERVER_SUCCESS : SECURITY_SERVER_ERROR_SERVER;
}

int security_server_perm_begin(security_server_perm_h *handle) {
  RETURN_FAULT();
  if (handle == nullptr) return SECURITY_SERVER_ERROR_INPUT_PARAM;
  *handle = new security_server_transaction;
  return SECURITY_SERVER_SUCCESS;
}

int security_server_perm_app_setup_path(security_server_perm_h handle, const char *pkg_id,
                                        const char *path, int path_type, ...) {
  RETURN_FAULT();
  if (handle == nullptr || pkg_id == nullptr || path == nullptr ||
      path_type != SECURITY_SERVER_PATH_ANY_LABEL) {
    return SECURITY_SERVER_ERROR_INPUT_PARAM;
  }
  va_list args;
  va_start(args, path_type);
  const char *label = va_arg(args, const char *);
  va_end(args);
  if (label == nullptr || !embedded::is_label(label)) return SECURITY_SERVER_ERROR_INPUT_PARAM;
  handle->relabels.push_back({path, label});
  return SECURITY_SERVER_SUCCESS;
}

int security_server_perm_commit(security_server_perm_h handle) {
  if (handle == nullptr) return SECURITY_SERVER_ERROR_INPUT_PARAM;
  const std::unique_ptr<security_server_transaction> transaction(handle);
  RETURN_FAULT();
  bool done = true;
  for (const auto &one : transaction->relabels) done = relabel(one.path, one.label) && done;
  return done ? SECURITY_SERVER_SUCCESS : SECURITY_SERVER_ERROR_SERVER;
}

void security_server_perm_abort(security_server_perm_h handle) { delete handle; }
