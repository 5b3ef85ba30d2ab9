#include <fcntl.h>
#include <unistd.h>

#include <optional>
#include <string>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/file_attributes.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kFolderMode = 0755;

/** True for a name that stays below the root: no leading slash, no "..". */
bool stays_below(const std::string &name) {
  if (name.empty() || name.front() == '/') return false;
  const std::string framed = "/" + name + "/";
  return framed.find("/../") == std::string::npos;
}

/** Make the folders that a link lies in, as the package's. */
bool make_parents(const std::string &path) {
  const HeldFolder *package = HeldFolder::of(path.c_str());
  if (package == nullptr || !*package) return false;
  const package_user user = user_of_package();
  std::string below = package->below(path.c_str());
  UniqueFd at = package->reopen(O_PATH | O_DIRECTORY);
  for (std::size_t end = below.find('/'); at && end != std::string::npos; end = below.find('/')) {
    const std::string name = below.substr(0, end);
    below.erase(0, end + 1);
    if (name.empty() || name == ".") continue;
    static_cast<void>(mkdir_as_package(at.get(), name.c_str(), kFolderMode, user));
    at = open_as_package(at.get(), name.c_str(), O_PATH | O_DIRECTORY, 0, user, nullptr);
  }
  return static_cast<bool>(at);
}

void make_link(const std::string &path, const link_info &link) {
  std::string name;
  UniqueFd parent;
  UniqueFd object;
  struct stat status = {};
  const ActAsPackage acting;
  if (make_parents(path)) parent = safe_open_parent(path.c_str(), &name);
  if (parent && symlinkat(link.target, parent.get(), name.c_str()) == 0) {
    object.reset(openat(parent.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  }
  if (!object || fstat(object.get(), &status) != 0 || !S_ISLNK(status.st_mode)) {
    LOGE("error : fail to make lnk for %s -> %s", path.c_str(), link.target);
    return;
  }
  if (change_object_mode(object.get(), status, *link.attributes.mode) < 0) LOGE("chmod failed");
  if (change_object_owner(object.get(), kAppUid, kAppGid) < 0) LOGE("chown: error \n");
  const char *label = *link.attributes.label;
  if (label[0] == '\0') {
    LOGE("error : there isn't smack info of %s", path.c_str());
    return;
  }
  const ActAsRoot root;
  const std::string labelled = fd_path(parent.get()) + "/" + name;
  const int result = smack_lsetlabel(labelled.c_str(), label, SMACK_LABEL_ACCESS);
  if (result != 0) LOGE("fail : smack_lsetlabel for %s (err=%d)", path.c_str(), result);
}

}  // namespace

int restore_symlnk(const char * /*pkgid*/, const char *root, json_object *table) {
  const LogScope scope(root);
  const HeldFolder package(root);
  json_object *list = nullptr;
  if (!json_object_object_get_ex(table, kLinkListKey, &list) ||
      !json_object_is_type(list, json_type_array)) {
    return 1;
  }
  const std::size_t count = json_object_array_length(list);
  for (std::size_t i = 0; i < count; ++i) {
    const std::optional<link_info> link = read_link(json_object_array_get_idx(list, i));
    if (!link) return 1;
    if (!stays_below(link->name)) {
      LOGE("refused : link outside of the application (%s)", link->name);
      continue;
    }
    make_link(std::string(root) + "/" + link->name, *link);
  }
  return 1;
}
