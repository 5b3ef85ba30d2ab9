#include "quarn_d_utils/directory.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <string>
#include <utility>
#include <vector>

#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "log_scope.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_at.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_log.h"

namespace {

/** Looks for a regular file, everywhere, so that all that is odd, or a removal has left, is told
 * of. */
class Search : public TreeVisitor {
 public:
  explicit Search(std::string path) : path_(std::move(path)) {}

  /** @return true when one lies anywhere below @p dir */
  bool run(UniqueFd dir) {
    const LogScope scope(path_);
    TreePlace place(std::move(dir));
    static_cast<void>(walk_tree(&place, &path_, this));
    return found_;
  }

  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    std::vector<TreeEntry> entries;
    static_cast<void>(list_tree_entries(place.fd(), &entries));  // unreadable counts as empty
    for (TreeEntry &entry : entries) {
      const std::string below = path_ + "/" + entry.name;
      struct stat status = {};
      const int result = fstatat(place.fd(), entry.name.c_str(), &status, AT_SYMLINK_NOFOLLOW);
      if (result != 0) {
        LOGE("error : lstat for %d %s", result, below.c_str());
      } else if (S_ISDIR(status.st_mode)) {
        folders->push_back(std::move(entry.name));
      } else if (S_ISREG(status.st_mode)) {
        found_ = true;
      } else {
        LOGE("this is unexpected type : %s", below.c_str());
      }
    }
    return true;
  }

  TreeStep enter(TreePlace *place, const std::string &name) {
    if (place->down(name.c_str())) return TreeStep::entered;
    LOGE("error : cannot open this path %s", path_.c_str());
    return TreeStep::passed;
  }

  /** As deep as a removal goes. */
  TreeStep too_deep(TreePlace *place, const std::string &name) { return enter(place, name); }

 private:
  std::string path_;
  bool found_ = false;
};

/** Empty a directory but for the entry whose full path is @p keep (null: nothing is kept). */
bool empty_directory(const char *path_text, const char *keep) {
  const LogScope scope(path_text);
  const DirPtr dir = safe_opendir(path_text);
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", path_text);
    return false;
  }
  bool emptied = true;
  std::string path = path_text;
  while (const dirent *entry = readdir(dir.get())) {
    if (is_dot_entry(entry->d_name)) continue;
    const PathStep step(&path, entry->d_name);
    if (keep != nullptr && path == keep) continue;
    struct stat status = {};
    const int result = fstatat(dirfd(dir.get()), entry->d_name, &status, AT_SYMLINK_NOFOLLOW);
    if (result != 0) {
      LOGE("error : lstat for %d %s", result, path.c_str());
    } else if (S_ISDIR(status.st_mode)) {
      if (!delete_tree_at(dirfd(dir.get()), entry->d_name, path)) {
        LOGE("fail to delete dir : %s", path.c_str());
        emptied = false;
      }
    } else if (S_ISREG(status.st_mode)) {
      if (!delete_file_at(dirfd(dir.get()), entry->d_name)) {
        LOGE("fail to delete file : %s", path.c_str());
        emptied = false;
      }
    } else {
      LOGE("this is unexpected type : %s", path.c_str());
    }
  }
  return emptied;
}

}  // namespace

bool file_exist_in_directory(const char *dir_path) {
  UniqueFd dir = safe_open(dir_path, O_RDONLY | O_DIRECTORY | O_NONBLOCK);
  if (!dir) {
    LOGE("error : cannot open this path %s", dir_path);
    return false;
  }
  return Search(dir_path).run(std::move(dir));
}

bool is_empty_directory(const char *dir) { return !file_exist_in_directory(dir); }

bool delete_directory_util(const char *dir_path) {
  if (dir_path == nullptr) {
    LOGE("directory_path is NULL");
    return false;
  }
  std::string name;
  const UniqueFd parent = safe_open_parent(dir_path, &name);
  struct stat status = {};
  if (!parent || fstatat(parent.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0 ||
      !S_ISDIR(status.st_mode)) {
    LOGE("directory_path is not directory");
    return false;
  }
  return delete_tree_at(parent.get(), name.c_str(), dir_path);
}

bool clear_directory(const char *dir, bool remove_directory) {
  if (!is_directory(dir)) return true;
  if (remove_directory) return delete_directory_util(dir);
  return empty_directory(dir, nullptr);
}

bool clear_shared_data_dir_except_temp_backup(const char *dir, const char *keep) {
  return empty_directory(dir, keep);
}
