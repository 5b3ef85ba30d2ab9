#include "quarn_d_backup/changes.h"

#include "files/package_files.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/kept_packages.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/pellix.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/single_folders.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package.h"
#include "quarn_log.h"

namespace {

/** What a package says of itself. */
struct package_values {
  CString id;
  CString version;
  CString type;
  CString root;
};

/** Read the values in order; false at the first that is missing. */
bool read_package_values(package_info_h info, package_values *values) {
  int ret = package_info_get_package(info, out(values->id));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_package() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->id) {
    LOGE("pkg_id is NULL");
    return false;
  }
  ret = package_info_get_version(info, out(values->version));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_version() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->version) {
    LOGE("pkg_version is NULL");
    return false;
  }
  ret = package_info_get_type(info, out(values->type));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_type() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->type) {
    LOGE("pkg_type is NULL");
    return false;
  }
  ret = package_info_get_root_path(info, out(values->root));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_root_path() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->root) {
    LOGE("pkg_root_path is NULL");
    return false;
  }
  return true;
}

void begin_package(backup_context *ctx, const package_values &values) {
  ++ctx->packages_examined;
  ctx->zip_made = false;
  ctx->cur_pkg_id = values.id.get();
  ctx->cur_version = values.version.get();
  ctx->cur_pkg_type = values.type.get();
  ctx->cur_root_path = values.root.get();
  ctx->cur_backup_enabled = true;
  ctx->cur_crc = 0;
}

/**
 * Read what a package says of itself. One that cannot be read keeps its backup.
 * @return false for it, and for one that came preloaded
 */
bool is_to_be_examined(backup_context *ctx, package_info_h info, package_values *values) {
  bool preload = false;
  const int ret = package_info_is_preload_package(info, &preload);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_is_preload_package fail, err = [%d]", ret);
    keep_unexamined(ctx, nullptr);
    return false;
  }
  if (preload) return false;

  if (!read_package_values(info, values)) {
    keep_unexamined(ctx, values->id.get());
    return false;
  }
  if (!is_safe_path_component(values->id.get()) || !is_safe_path_component(values->version.get())) {
    LOGE("refused package with unsafe id or version : (%s), (%s)", values->id.get(),
         values->version.get());
    keep_unexamined(ctx, values->id.get());
    return false;
  }
  return true;
}

}  // namespace

int make_backup_items(backup_context *ctx) {
  forget_single_uploads();
  if (!create_app_list_info(ctx)) return QUARN_FAILED;
  look_for_unknown_backup(ctx);
  forget_owed_of_removed_packages();
  const int ret = package_manager_foreach_package_info(foreach_package_info_callback, ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
    ctx->package_walk_complete = false;
  }
  list_kept_packages(ctx);
  static_cast<void>(save_app_list_to_file(ctx));  // whether it is there stands in the notes
  return notes_of(ctx).list_too_large ? QUARN_FAILED : QUARN_OK;
}

bool foreach_package_info_callback(package_info_h info, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  ++notes_of(ctx).packages_seen;
  package_values values;
  if (!is_to_be_examined(ctx, info, &values)) return true;

  begin_package(ctx, values);
  if (leave_to_restore(ctx)) return true;

  int ret =
      package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, check_backup_enabled, ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", ret);
    keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
    return true;
  }
  if (ctx->cur_backup_enabled) {
    LOGI("backup enabled for (%s)", ctx->cur_pkg_id.c_str());
  } else {
    LOGI("backup disabled for (%s)", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::disabled);
  }

  ret = package_info_foreach_app_from_package(
      info, PACKAGE_INFO_ALLAPP, ctx->for_pellix ? pellix_app_info_foreach_cb : app_info_foreach_cb,
      ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", ret);
    withdraw_current_package(ctx);
    keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
    return true;
  }
  if (ctx->abandoned) return false;
  enter_current_package(ctx);
  LOGI("add (%s) to package list", ctx->cur_pkg_id.c_str());
  add_pkg_info_to_app_list(ctx, ctx->cur_pkg_id.c_str(), ctx->cur_version.c_str(), ctx->cur_crc);
  return true;
}

bool check_backup_enabled(package_info_app_component_type_e, const char *app_id, void *user_data) {
  if (!backup_enabled_app(app_id)) {
    static_cast<backup_context *>(user_data)->cur_backup_enabled = false;
  }
  return true;
}

bool app_info_foreach_cb(package_info_app_component_type_e, const char *app_id, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  if (!ctx->cur_backup_enabled || ctx->zip_made) return true;
  ctx->zip_made = true;
  static_cast<void>(make_app_data_zip(ctx, app_id));  // the run goes on, and has its outcome
  return true;
}
