#include "quarn_d_restore/attributes.h"

#include <fcntl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "files/safe_path.h"
#include "platform_security_server.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_utils/file_attributes.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/table_reader.h"
#include "quarn_log.h"

namespace {

constexpr char kDatabaseLabel[] = "wrt::db_origin";
constexpr char kNativeSuffix[] = ".native";

#ifdef SYS_fchmodat2
constexpr long kFchmodat2 = SYS_fchmodat2;
#else
constexpr long kFchmodat2 = 452;  // newer than some headers
#endif

constexpr mode_t kPermissionBits = 07777;
constexpr mode_t kSetIdBits = S_ISUID | S_ISGID;

}  // namespace

int get_file_info_from_backup(json_object *table, const char * /*pkgid*/, const char *root,
                              const char *path, int *mode, unsigned int *uid, unsigned int *gid,
                              char **label) {
  if (table == nullptr) {
    LOGE("file info for %s not exist...", path);
    return QUARN_NO_FILE_INFO;
  }
  const std::size_t prefix = std::strlen(root) + 1;
  const char *key = std::strlen(path) > prefix ? path + prefix : "";
  json_object *entry = nullptr;
  if (!json_object_object_get_ex(table, key, &entry)) {
    LOGI("cannot get file info : %s", path);
    return QUARN_UNREADABLE;
  }
  const file_attributes found = read_attributes(attributes_in_table(table, entry));
  if (!found.mode) {
    LOGE("cannot get permission info...");
    return QUARN_UNREADABLE;
  }
  *mode = static_cast<int>(*found.mode);
  if (!found.owner) {
    LOGE("cannot get uid info...");
    return QUARN_UNREADABLE;
  }
  *uid = *found.owner;
  if (!found.group) {
    LOGE("cannot get gid info...");
    return QUARN_UNREADABLE;
  }
  *gid = *found.group;
  if (!found.label) {
    LOGE("cannot get smack info...");
    return QUARN_UNREADABLE;
  }
  *label = const_cast<char *>(*found.label);
  return QUARN_OK;
}

int change_object_mode(int fd, const struct stat &status, mode_t mode) {
  if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode)) {
    errno = EOPNOTSUPP;
    return -1;
  }
  mode &= kPermissionBits;
  // The only one for descriptors of either kind. Kernels before 6.6, and filters that do not know
  // the call, leave fchmod(), and the way through /proc for the O_PATH kind.
  int result = static_cast<int>(syscall(kFchmodat2, fd, "", mode, AT_EMPTY_PATH));
  if (result == 0 || (errno != ENOSYS && errno != EPERM)) return result;
  result = fchmod(fd, mode);
  if (result == 0 || errno != EBADF) return result;
  return chmod(own_fd_path(fd).c_str(), mode);
}

int change_object_owner(int fd, uid_t uid, gid_t gid) {
  const int result = fchown(fd, uid, gid);
  if (result == 0 || errno != EBADF) return result;
  return fchownat(fd, "", uid, gid, AT_EMPTY_PATH);
}

namespace {

/** Mode and owner, in the order that lets nothing run as another in between. */
bool give_to_application(int fd, const struct stat &status, mode_t mode) {
  if (status.st_uid == kAppUid && status.st_gid == kAppGid) {
    // Its user's rights suffice, and would not for another's file.
    const ActAsPackage acting;
    if (change_object_mode(fd, status, mode) == 0) return true;
    LOGE("chmod failed");
    return false;
  }
  const ActAsRoot root;
  // The set-id bits wait for the owner: the file must never run as the daemon's
  // user, and a change of owner clears them anyway.
  if (change_object_mode(fd, status, mode & ~kSetIdBits) < 0) {
    LOGE("chmod failed");
    return false;
  }
  if (change_object_owner(fd, kAppUid, kAppGid) < 0) {
    LOGE("chown: error \n");
    return false;
  }
  if ((mode & kSetIdBits) != 0 && change_object_mode(fd, status, mode) < 0) {
    LOGE("chmod failed");
    return false;
  }
  return true;
}

}  // namespace

int restore_object_info(int fd, const struct stat &status, const char *path, const char *pkgid,
                        const char *root, json_object *table) {
  int stored_mode = 0;
  unsigned int uid = 0;
  unsigned int gid = 0;
  char *label = nullptr;
  if (get_file_info_from_backup(table, pkgid, root, path, &stored_mode, &uid, &gid, &label) !=
      QUARN_OK) {
    return 0;
  }
  if (!give_to_application(fd, status, static_cast<mode_t>(stored_mode) & kPermissionBits))
    return 0;
  if (label[0] == '\0') {
    LOGE("error : there isn't smack info of %s", path);
    return 0;
  }
  const std::string own = own_place_path(fd);
  CString current;
  int result = smack_getlabel(own.c_str(), out(current), SMACK_LABEL_ACCESS);
  if (result != 0) {
    // its mode or its label may be closed to the package's user by now
    const ActAsRoot root_once;
    result = smack_getlabel(own.c_str(), out(current), SMACK_LABEL_ACCESS);
  }
  if (result != 0) {
    LOGE("error : cannot get smack label of %s (err=%d)", path, result);
    return 0;
  }
  if (current != nullptr && std::strcmp(label, current.get()) == 0) return 1;
  if (is_known_exception_label(path, label, pkgid) == 0) {
    LOGE("fail : unknown smack label...");
    return 0;
  }
  const ActAsRoot root_again;
  result = security_server_label_access(fd_path(fd).c_str(), label);
  if (result != SECURITY_SERVER_SUCCESS) {
    LOGE("fail : security_server_label_access...(err=%d)", result);
    return 0;
  }
  LOGI("smack label setted for %s", path);
  return 1;
}

int restore_file_info(const char *path, const char *pkgid, const char *root, json_object *table) {
  std::string name;
  const UniqueFd parent = safe_open_parent(path, &name);
  UniqueFd object;
  struct stat status = {};
  if (parent) object.reset(openat(parent.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  // What cannot be opened is left without a type, so that its mode cannot be changed either.
  if (object && fstat(object.get(), &status) != 0) status = {};
  const bool has_mode = S_ISREG(status.st_mode) || S_ISDIR(status.st_mode);
  if (object && has_mode &&
      !may_be_changed(parent.get(), object.get(), status, user_of_package())) {
    LOGE("refused : %s is a link to a file elsewhere", path);
    return 0;
  }
  return restore_object_info(object.get(), status, path, pkgid, root, table);
}

int is_known_exception_label(const char *path, const char *label, const char *pkgid) {
  const std::string native = std::string(pkgid) + kNativeSuffix;
  if (std::strcmp(label, kDatabaseLabel) == 0 || native == label) {
    LOGI("OK : smack label of %s is known exception label", path);
    return 1;
  }
  LOGE("Critical! : smack label %s of %s is unknown exception label", label, path);
  return 0;
}
