#include <fcntl.h>
#include <sys/stat.h>

#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr char kSharedDataDir[] = "/shared/data/";
constexpr char kListName[] = "app_list.txt";
constexpr char kArchiveSuffix[] = ".zip";
constexpr mode_t kArchiveMode = 0777;  // the companion's own rules decide who reads it

std::string companion_dir() { return std::string(kAppsDir) + kPellixPackage + kSharedDataDir; }

/** Give the archive to the companion; what an application put in its place is left alone. */
bool hand_over_archive(const std::string &path) {
  const UniqueFd fd = safe_open(path.c_str(), O_RDONLY | O_NONBLOCK);
  struct stat status = {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_nlink != 1) {
    LOGE("cannot open archive %s", path.c_str());
    return false;
  }
  const std::string held = fd_path(fd.get());
  if (smack_setlabel(held.c_str(), kPellixPackage, SMACK_LABEL_ACCESS) != 0) {
    LOGE("smack_setlabel failed for %s", path.c_str());
  }
  if (chmod(held.c_str(), kArchiveMode) != 0) LOGE("chmod failed");
  return true;
}

void make_companion_archive(backup_context *ctx) {
  if (check_current_backup_size(ctx) != QUARN_OK) return;
  const std::string path =
      companion_dir() + ctx->cur_pkg_id + "_" + ctx->cur_version + kArchiveSuffix;
  int error = QUARN_OK;
  make_zip_data(ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str(), path.c_str(), &error,
                kBackupBounds);
  if (error != QUARN_OK || !hand_over_archive(path)) {
    delete_staged_file(path);
    return;
  }
  json_object_array_add(ctx->app_data_path, json_object_new_string(path.c_str()));
}

}  // namespace

char *get_app_list_for_pellix() {
  LOGI("make_pellix_app_list");
  const BackupContextPtr ctx(new backup_context);
  ctx->for_pellix = true;
  const std::string list_path = companion_dir() + kListName;
  if (!create_app_list_info(ctx.get())) return nullptr;
  // packing would make the directory, and with it half a package that is not installed
  if (!is_directory(companion_dir().c_str())) {
    LOGE("no directory for app list file %s", list_path.c_str());
    return nullptr;
  }
  const int ret = package_manager_foreach_package_info(foreach_package_info_callback, ctx.get());
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
    return nullptr;
  }
  const bool saved = save_app_list_to_file(ctx.get());
  note_request_end(notes_of(ctx.get()).cause);
  if (!saved) return nullptr;
  CString text;
  if (!read_data_from_file(list_path.c_str(), out(text))) {
    LOGE("cannot read app list file...");
    text.reset();
  }
  delete_staged_file(list_path);
  return text.release();
}

bool pellix_app_info_foreach_cb(package_info_app_component_type_e, const char *, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  if (!ctx->cur_backup_enabled || ctx->zip_made) return true;
  ctx->zip_made = true;
  make_companion_archive(ctx);
  return true;
}
