#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "json_ptr.h"
#include "quarn_common.h"
#include "quarn_d_restore/archive_table.h"
#include "quarn_d_restore/clearing.h"
#include "quarn_d_restore/moving_back.h"
#include "quarn_d_restore/put_attributes_back.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

/** Where an earlier release set aside what no snapshot holds. */
constexpr char kKept[] = "/kept";

JsonPtr read_table(const std::string &path) {
  char *raw = nullptr;
  const bool read = read_data_from_file(path.c_str(), &raw);
  const CString text(raw);
  return JsonPtr(read ? parse_file_info_table(text.get()) : nullptr);
}

/** An earlier release that was interrupted has moved some files away. */
void bring_back_kept(const restore_files &files) {
  const std::string kept = files.snapshot + kKept;
  const DirPtr source = safe_opendir(kept.c_str());
  const UniqueFd target = safe_open(files.dirs[1].c_str(), O_PATH | O_DIRECTORY);
  if (source == nullptr || !target) return;
  while (const dirent *entry = readdir(source.get())) {
    const char *name = entry->d_name;
    if (is_dot_entry(name) || renameat(dirfd(source.get()), name, target.get(), name) == 0)
      continue;
    LOGE("fail to move %s from %s to %s", name, kept.c_str(), files.dirs[1].c_str());
  }
}

}  // namespace

rollback_result put_snapshot_back(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  const HeldFolder snapshot(files.snapshot);
  if (state_of_snapshot(files) != snapshot_state::complete) {
    LOGE("there isn't a snapshot of (%s) to roll back to", pkgid);
    return rollback_result::none;
  }
  restore_step("rollback");
  const JsonPtr table = read_table(files.parts.table);
  if (table == nullptr) {
    // What is in its place already and what is the restore's could not be told apart.
    LOGE("snapshot of (%s) cannot be read, so it is kept", pkgid);
    return rollback_result::kept;
  }
  bring_back_kept(files);
  bool whole = clear_for_rollback(files, root, table.get());
  restore_step("rollback-cleared");
  put_all_attributes_back(table.get(), files.snapshot, Objects::kAll);
  restore_step("rollback-ready");
  if (!move_back(files, root, table.get(), files.snapshot)) whole = false;
  restore_step("rollback-moved");
  put_all_attributes_back(table.get(), root, Objects::kDirectories);
  restore_step("rollback-done");
  if (!whole) {
    LOGE("not all data of (%s) could be put back, so its snapshot is kept", pkgid);
    return rollback_result::kept;
  }
  // Where this fails the data stands all the same, and is looked at again by the next start.
  static_cast<void>(discard_snapshot(pkgid, root));
  return rollback_result::whole;
}

int rollback_to_initial_app_data(const char *pkgid, const char *root) {
  static_cast<void>(put_snapshot_back(pkgid, root));
  return QUARN_OK;
}

int parse_dir_for_rollback(const char *dir, const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  const JsonPtr table =
      file_exist(files.parts.table.c_str()) ? read_table(files.parts.table) : nullptr;
  return move_back(files, root, table.get(), dir) ? 1 : 0;
}
