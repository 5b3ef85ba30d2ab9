#include "platform_security_server.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdarg>
#include <string>
#include <vector>

#include "state/labels.h"

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

/**
 * Label what @p fd holds (an O_PATH descriptor) and, when it is a directory, everything below it.
 * Objects are held while they are labelled, so a link swapped in leads nowhere.
 */
bool relabel_tree(int fd, const std::string &label) {
  if (embedded::write_label(name_of(fd).c_str(), Links::kFollow, LabelKind::kAccess, label) != 0) {
    return false;
  }
  struct stat status {};
  if (fstat(fd, &status) != 0) return false;
  if (!S_ISDIR(status.st_mode)) return true;
  const int folder = openat(fd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  DIR *dir = folder < 0 ? nullptr : fdopendir(folder);
  if (dir == nullptr) {
    if (folder >= 0) close(folder);
    return false;
  }
  bool done = true;
  while (const dirent *entry = readdir(dir)) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    const int child = openat(dirfd(dir), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC);
    if (child < 0) continue;  // it vanished meanwhile
    done = relabel_tree(child, label) && done;
    close(child);
  }
  closedir(dir);
  return done;
}

bool relabel(const std::string &path, const std::string &label) {
  // A descriptor's name leads to what the caller holds; any other link is not followed.
  const int follow = path.compare(0, sizeof(kProc) - 1, kProc) == 0 ? 0 : O_NOFOLLOW;
  const int fd = open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC | follow);
  if (fd < 0) return false;
  const bool done = relabel_tree(fd, label);
  close(fd);
  return done;
}

}  // namespace

int security_server_label_access(const char *path, const char *label) {
  if (path == nullptr || label == nullptr) return SECURITY_SERVER_ERROR_INPUT_PARAM;
  return embedded::write_label(path, Links::kFollow, LabelKind::kAccess, label) == 0
             ? SECURITY_SERVER_SUCCESS
             : SECURITY_SERVER_ERROR_SERVER;
}

int security_server_perm_begin(security_server_perm_h *handle) {
  if (handle == nullptr) return SECURITY_SERVER_ERROR_INPUT_PARAM;
  *handle = new security_server_transaction;
  return SECURITY_SERVER_SUCCESS;
}

int security_server_perm_app_setup_path(security_server_perm_h handle, const char *pkg_id,
                                        const char *path, int path_type, ...) {
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
  bool done = true;
  for (const auto &one : handle->relabels) done = relabel(one.path, one.label) && done;
  delete handle;
  return done ? SECURITY_SERVER_SUCCESS : SECURITY_SERVER_ERROR_SERVER;
}

void security_server_perm_abort(security_server_perm_h handle) { delete handle; }
