#include "quarn_d_restore/put_attributes_back.h"

#include <fcntl.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <vector>

#include "files/safe_path.h"
#include "platform_security_server.h"
#include "platform_smack.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/file_attributes.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kPermissionBits = 07777;

void put_label_back(int fd, const char *label, const char *key) {
  if (label[0] == '\0') return;
  CString current;
  // By way of this process's own descriptors reading costs no walk.
  const int result = smack_getlabel(own_fd_path(fd).c_str(), out(current), SMACK_LABEL_ACCESS);
  if (result == 0 && current != nullptr && std::strcmp(current.get(), label) == 0) return;
  const std::string path = fd_path(fd);
  if (security_server_label_access(path.c_str(), label) != SECURITY_SERVER_SUCCESS &&
      smack_setlabel(path.c_str(), label, SMACK_LABEL_ACCESS) != 0) {
    LOGE("fail to put label of %s back", key);
  }
}

/** True for a folder in the data that is the application's, or that it cannot have put there. */
bool is_packages_folder(int folder, const struct stat &status) {
  const UniqueFd parent(openat(folder, "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
  return parent && may_be_changed(parent.get(), folder, status, user_of_package());
}

}  // namespace

json_object *entry_of(json_object *table, const std::string &key) {
  json_object *entry = nullptr;
  const bool found = json_object_object_get_ex(table, key.c_str(), &entry) != 0;
  return found && json_object_is_type(entry, json_type_object) ? entry : nullptr;
}

void put_attributes_back(int fd, const struct stat &before, const char *key, json_object *entry) {
  const file_attributes wanted = read_attributes(entry);
  if (!wanted.complete()) return;
  const mode_t mode = *wanted.mode & kPermissionBits;
  struct stat status = before;
  if (status.st_uid != *wanted.owner || status.st_gid != *wanted.group) {
    // A change of owner clears the bits that run a file as somebody.
    if (change_object_owner(fd, *wanted.owner, *wanted.group) < 0) LOGE("chown: error \n");
    if (fstat(fd, &status) != 0) return;
  }
  if ((status.st_mode & kPermissionBits) != mode && change_object_mode(fd, status, mode) < 0) {
    LOGE("chmod failed");
  }
  put_label_back(fd, *wanted.label, key);
}

void take_from_application(int folder, json_object *entry) {
  const uid_t application = user_of_package().uid;
  const std::optional<uid_t> owner = read_attributes(entry).owner;
  struct stat status = {};
  if (!owner || *owner == application || fstat(folder, &status) != 0 ||
      status.st_uid != application) {
    return;
  }
  if (change_object_owner(folder, 0, 0) < 0 || change_object_mode(folder, status, S_IRWXU) < 0) {
    LOGE("chown: error \n");
    return;
  }
  const UniqueFd opened(openat(folder, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  std::vector<TreeEntry> entries;
  // It is closed to the application by now: what cannot be read it does not reach.
  if (opened) static_cast<void>(list_tree_entries(opened.get(), &entries));
  for (const TreeEntry &one : entries) {
    const char *name = one.name.c_str();
    if (fstatat(folder, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode) &&
        status.st_uid != application) {
      static_cast<void>(unlinkat(folder, name, 0));
    }
  }
}

void put_all_attributes_back(json_object *table, const std::string &top, Objects objects) {
  const UniqueFd dir = safe_open(top.c_str(), O_PATH | O_DIRECTORY);
  if (!dir) return;
  const int flags = O_PATH | O_NOFOLLOW | (objects == Objects::kDirectories ? O_DIRECTORY : 0);
  json_object_object_foreach(table, key, entry) {
    restore_step("rollback-attributes");
    if (!json_object_is_type(entry, json_type_object)) continue;
    const UniqueFd object = safe_open_below(dir.get(), key, flags);
    struct stat status = {};
    if (!object || fstat(object.get(), &status) != 0) continue;
    if (!S_ISDIR(status.st_mode) && !S_ISREG(status.st_mode)) continue;
    if (objects == Objects::kDirectories && !is_packages_folder(object.get(), status)) {
      LOGE("refused : %s was put there from elsewhere", key);
      continue;
    }
    if (objects == Objects::kDirectories) {
      take_from_application(object.get(), entry);
      if (fstat(object.get(), &status) != 0) continue;
    }
    put_attributes_back(object.get(), status, key, entry);
  }
}
