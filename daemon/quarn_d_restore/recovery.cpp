#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"

namespace {

/** One installed package of the sweep; always goes on. */
bool recover_package(package_info_h info, void * /*user_data*/) {
  CString pkgid;
  CString root;
  int result = package_info_get_package(info, out(pkgid));
  if (result != PACKAGE_MANAGER_ERROR_NONE || pkgid == nullptr) {
    LOGE("package_info_get_package() was failed, ret = [%d]", result);
    return true;
  }
  result = package_info_get_root_path(info, out(root));
  if (result != PACKAGE_MANAGER_ERROR_NONE || root == nullptr) {
    LOGE("package_info_get_root_path() was failed, ret = [%d]", result);
    return true;
  }
  recover_interrupted_restore(pkgid.get(), root.get());
  return true;
}

}  // namespace

void recover_interrupted_restores() {
  const int result = package_manager_foreach_package_info(recover_package, nullptr);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", result);
  }
}
