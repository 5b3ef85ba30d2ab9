#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "files/safe_path.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_utils/directory.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/own_place.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

constexpr char kStagingDirectory[] = "/tmp/quarn";

}  // namespace

bool prepare_staging_directory() {
  if (make_own_directory(kStagingDirectory)) return true;
  LOGE("cannot use staging directory %s", kStagingDirectory);
  return false;
}

void sweep_staging_directory(const char *keep) {
  struct stat status = {};
  if (safe_lstat(kStagingDirectory, &status) != 0 || !is_own_file(status)) return;
  const UniqueFd dir = safe_open(kStagingDirectory, O_RDONLY | O_DIRECTORY);
  std::vector<TreeEntry> entries;
  if (!dir || !list_tree_entries(dir.get(), &entries)) return;
  for (const TreeEntry &entry : entries) {
    const std::string path = std::string(kStagingDirectory) + "/" + entry.name;
    if (path == keep) continue;
    if (is_directory(path.c_str())) {
      clear_directory(path.c_str(), true);
    } else {
      unlinkat(dir.get(), entry.name.c_str(), 0);
    }
  }
}
