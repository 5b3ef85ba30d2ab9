#include "quarn_d_restore/install_monitor.h"

#include <cstdint>
#include <memory>
#include <string>
#include <utility>

#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/app_restore.h"
#include "quarn_d_restore/hidden_icon.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_restore/restore_mode.h"
#include "quarn_d_restore/restore_progress.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"

namespace {

constexpr std::uint64_t kMinimumFreeSpace = kMaxBackupSize;
/** Long enough for the launcher to know the new application, which it then hides. */
constexpr double kIconHideDelay = 0.5;

package_manager_h pkgmgr_h = nullptr;
bool monitor_running = false;

bool check_restore_enabled(package_info_app_component_type_e /*type*/, const char *appid,
                           void *data) {
  auto *ctx = static_cast<pkg_restore_context *>(data);
  if (!backup_enabled_app(appid)) ctx->backup_enabled = false;
  return true;
}

bool installed_app_info_cb(package_info_app_component_type_e /*type*/, const char *appid,
                           void *data) {
  auto *ctx = static_cast<pkg_restore_context *>(data);
  if (!ctx->backup_enabled || ctx->restore_started) return true;
  ctx->restore_started = true;
  if (!wifi_connected()) {
    LOGE("WIFI disconnected");
    report_restore_end(ctx->pkgid, restore_outcome::skipped, QUARN_NO_SESSION);
  } else if (restore_app_data(appid, ctx) == QUARN_FAILED) {
    report_restore_end(ctx->pkgid, restore_outcome::failed, ctx->result);
  }
  return true;
}

/** The package's text that @p get reads; empty when there is none. */
std::string text_of(package_info_h info, int (*get)(package_info_h, char **), int *result) {
  CString text;
  *result = get(info, out(text));
  return *result == PACKAGE_MANAGER_ERROR_NONE && text != nullptr ? text.get() : "";
}

void skip(const char *package, int reason) {
  report_restore_end(package, restore_outcome::skipped, reason);
}

/** Until it is restored, no backup puts the new package's data in the archive's place. */
void note_owed(const char *package, const std::string &root) {
  if (restores_from_companion()) return;
  note_owed_archive(serial_num_user_select, package, root);
}

/** Nor is anything to be restored of a package that takes no part in backup. */
void skip_for_good(const char *package, const std::string &root, int reason) {
  forget_owed_archive(serial_num_user_select, package, root);
  skip(package, reason);
}

/** Whether a new package can be restored; the reason why not is logged where there is one. */
bool is_restorable(package_info_h info, const char *package, std::string *root) {
  int result = PACKAGE_MANAGER_ERROR_NONE;
  *root = text_of(info, package_info_get_root_path, &result);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_root_path() was failed, ret = [%d]", result);
    skip(package, QUARN_FAILED);
    return false;
  }
  if (root->empty()) {
    LOGE("pkg_root_path is NULL");
    skip(package, QUARN_FAILED);
    return false;
  }
  note_owed(package, *root);
  if (get_dir_available_size(root->c_str()) < kMinimumFreeSpace) {
    LOGE("fail : available space is too small");
    skip(package, QUARN_SKIPPED);
    return false;
  }
  bool preload = false;
  result = package_info_is_preload_package(info, &preload);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_is_preload_package fail, err = [%d]", result);
    skip(package, QUARN_FAILED);
    return false;
  }
  if (preload) skip_for_good(package, *root, QUARN_PRELOADED);
  return !preload;
}

/** Only what the next daemon would show again, should this one end, is hidden. */
void hide_until_restored(const char *package, const std::string &root) {
  if (note_hidden_icon(package, root.c_str())) {
    appear_app_icon(package, false, kIconHideDelay);
  } else {
    LOGE("icon of (%s) stays: that it is hidden cannot be noted", package);
  }
}

void restore_new_package(package_info_h info, const char *package) {
  RestoreContextPtr ctx = std::make_unique<pkg_restore_context>();
  if (!is_restorable(info, package, &ctx->root)) return;
  LOGI("new package install detected : %s", package);
  int result = PACKAGE_MANAGER_ERROR_NONE;
  ctx->version = text_of(info, package_info_get_version, &result);
  ctx->serial = serial_num_user_select;
  ctx->pkgid = package;
  ctx->reserved_flag = true;
  result = package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, check_restore_enabled,
                                                 ctx.get());
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", result);
  }
  if (ctx->backup_enabled) {
    LOGI("backup enabled for (%s)", package);
  } else {
    LOGI("backup disabled for (%s)", package);
    skip_for_good(package, ctx->root, QUARN_DISABLED);
  }
  result = package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, installed_app_info_cb,
                                                 ctx.get());
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() failed");
  } else if (ctx->pending != 0) {
    hide_until_restored(package, ctx->root);
  }
  // Nobody waits for a download that is on its way.
  if (ctx->pending > 0) leave_restore(std::move(ctx));
}

void package_event_cb(const char * /*type*/, const char *package,
                      package_manager_event_type_e event_type,
                      package_manager_event_state_e event_state, int /*progress*/,
                      package_manager_error_e error, void * /*user_data*/) {
  if (error != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager error: %d", error);
    return;
  }
  if (event_type == PACKAGE_MANAGER_EVENT_TYPE_UNINSTALL &&
      event_state == PACKAGE_MANAGER_EVENT_STATE_COMPLETED) {
    note_awaited_package_removed(package);
  }
  if (event_type != PACKAGE_MANAGER_EVENT_TYPE_INSTALL ||
      event_state != PACKAGE_MANAGER_EVENT_STATE_COMPLETED) {
    LOGE("this is not new install event");
    return;
  }
  // No backup comes in between: it would put the new package's data in the archive's place.
  const archive_hold archive(serial_num_user_select, package);
  if (!package_to_be_restored(package) || already_installed_package(package)) return;
  note_owed(package, "");
  PackageInfoPtr info;
  if (package_manager_get_package_info(package, out(info)) != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_get_package_info() failed");
    skip(package, QUARN_BAD_ARGUMENT);
    return;
  }
  restore_new_package(info.get(), package);
}

}  // namespace

int start_install_monitor() {
  if (monitor_running) {
    LOGI("start_install_monitor : already initialized");
    return monitor_running;
  }
  int result = package_manager_create(&pkgmgr_h);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_create() failed %d", result);
    return 0;
  }
  result = package_manager_set_event_cb(pkgmgr_h, package_event_cb, nullptr);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_set_event_cb() failed %d", result);
    package_manager_destroy(pkgmgr_h);
    pkgmgr_h = nullptr;
    return 0;
  }
  monitor_running = true;
  return monitor_running;
}

int stop_install_monitor() {
  if (!monitor_running) {
    LOGI("stop_install_monitor : not initialized");
    return 1;
  }
  if (pkgmgr_h != nullptr) {
    package_manager_unset_event_cb(pkgmgr_h);
    package_manager_destroy(pkgmgr_h);
    pkgmgr_h = nullptr;
  }
  monitor_running = false;
  return 1;
}
