#include "quarn_d_utils/boot_cleanup.h"

#include <atomic>

#include "platform_package_manager.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

void (*boot_recovery)() = nullptr;

}  // namespace

std::atomic<bool> boot_cleanup_done{false};

bool boot_foreach_package_info_callback(package_info_h info, void *) {
  bool preload = false;
  int ret = package_info_is_preload_package(info, &preload);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_is_preload_package fail, err = [%d]", ret);
    return true;
  }
  if (preload) return true;

  CString pkg_id;
  ret = package_info_get_package(info, out(pkg_id));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_package() was failed, ret = [%d]", ret);
    return true;
  }
  if (!pkg_id) {
    LOGE("pkg_id is NULL");
    return true;
  }
  CString root;
  ret = package_info_get_root_path(info, out(root));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_root_path() was failed, ret = [%d]", ret);
    return true;
  }
  if (!root) {
    LOGE("pkg_root_path is NULL");
    return true;
  }

  sweep_working_files(pkg_id.get(), root.get());
  return true;
}

void boot_cleanup_backup_items() {
  if (boot_cleanup_done.exchange(true)) return;
  LOGI("checking if previous backup item exist");
  const int ret = package_manager_foreach_package_info(boot_foreach_package_info_callback, nullptr);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
  }
  if (boot_recovery != nullptr) boot_recovery();
}

void set_boot_recovery(void (*recover)()) { boot_recovery = recover; }
