#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_directory.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"
#include "rules/path_matcher.h"
#include "rules/rules_file.h"

thread_local std::vector<std::string> backup_include_list;
thread_local std::vector<std::string> backup_exclude_list;
thread_local bool xml_has_include_field = false;

namespace {

thread_local rules_state loaded_state = rules_state::none;

thread_local RuleIndex included_rules(&backup_include_list);
thread_local RuleIndex excluded_rules(&backup_exclude_list);

void take_rule(const rules_element &element) {
  // an include that names nothing must not shut out everything
  if (!element.is_rule || !element.has_path) return;
  if (element.include) xml_has_include_field = true;
  add_to_path_info_list(element.path.c_str(),
                        element.include ? &backup_include_list : &backup_exclude_list);
}

/** What lies there, whoever may enter the directory. */
int look_at(int dir, const char *name, struct stat *status) {
  const int found = fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
  if (found == 0 || errno != EACCES) return found;
  const ActAsRoot root;
  return fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
}

/** Adds up what an archive would take of one directory. */
class Measuring {
 public:
  using Entries = EntriesAsTheyCome;

  Measuring(const char *pkg_id, const char *root) : working_(pkg_id, root) {}
  std::uint64_t sum() const { return sum_; }

  static bool ended() { return false; }

  EntryVisit visit(int dir, const WalkEntry &entry, const std::string &path) {
    if (working_.contain(path)) return EntryVisit::passed;
    struct stat status = {};
    const int result = look_at(dir, entry.name, &status);
    if (result != 0) {
      LOGE("error : lstat for %d %s", result, path.c_str());
    } else if (S_ISDIR(status.st_mode)) {
      return EntryVisit::folder;
    } else if (S_ISREG(status.st_mode)) {
      if (is_backup_file(path.c_str())) sum_ += static_cast<std::uint64_t>(status.st_size);
    } else if (S_ISLNK(status.st_mode)) {
      if (!is_backup_file(path.c_str())) return EntryVisit::passed;
      sum_ += static_cast<std::uint64_t>(status.st_size);
      LOGI("size of lnk file %s : %d", path.c_str(), static_cast<int>(status.st_size));
    } else {
      LOGE("this is unexpected type : %s", path.c_str());
    }
    return EntryVisit::passed;
  }

  static DirPtr open(int dir, const char *name, struct stat * /*status*/) {
    return open_directory_as_package(dir, name, user_of_package());
  }

  void missed(const std::string &path, int /*depth*/) {
    LOGE("error : cannot open this path %s", path.c_str());
    sum_ += kUnmeasurableSize;
  }

  static bool left(int /*dir*/, const struct stat & /*status*/, const std::string & /*path*/,
                   bool counted) {
    return counted;
  }

 private:
  const WorkingFiles working_;
  std::uint64_t sum_ = 0;
};

}  // namespace

rules_state backup_rules_state() { return loaded_state; }

bool backup_rules_usable() { return rules_usable(loaded_state); }

void reset_backup_path_info() {
  backup_include_list.clear();
  backup_exclude_list.clear();
  included_rules.forget();
  excluded_rules.forget();
  xml_has_include_field = false;
  loaded_state = rules_state::none;
}

void parse_backup_path_xml(const char *pkg_id, const char *pkg_type, const char *root) {
  reset_backup_path_info();
  const std::string path = std::string(root) + "/" + rules_file_of(pkg_type);
  if (!file_exist(path.c_str())) return;
  LOGI("(%s) has xml file(for include/exlude path)", pkg_id);

  const RulesFile file(path);
  loaded_state = file.state();
  if (loaded_state != rules_state::loaded) {
    LOGE("Could not load xml file.\n");
    if (!backup_rules_usable()) {
      LOGE("rules file of (%s) cannot be used: %s", pkg_id, rules_state_text(loaded_state));
    }
    return;
  }
  if (file.root_name() == nullptr) LOGE("empty document.\n");
  if (file.root_name() != nullptr && !file.has_rules()) {
    LOGE("root name %s error!\n", file.root_name());
  }
  if (!file.has_rules()) loaded_state = rules_state::ignored;
  file.for_each(root, take_rule);
}

void add_to_path_info_list(const char *path, std::vector<std::string> *list) {
  struct stat status = {};
  if (safe_lstat(path, &status) == 0) list->emplace_back(path);
}

bool is_backup_file(const char *path) {
  return rules_take(&included_rules, &excluded_rules, xml_has_include_field, path);
}

std::uint64_t get_dir_backup_size(const char *dir_path, const char *pkg_id, const char *root) {
  const DirPtr dir = safe_opendir(dir_path);
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", dir_path);
    return kUnmeasurableSize;
  }
  const LogScope lines(dir_path);
  Measuring measuring(pkg_id, root);
  std::string path = dir_path;
  const ActAsPackage acting;
  if (!acting) return kUnmeasurableSize;
  walk_in_order(dir.get(), &path, &measuring);
  return measuring.sum();
}
