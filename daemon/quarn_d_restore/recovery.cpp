#include "quarn_d_restore/recovery.h"

#include "files/held_folder.h"
#include "quarn_d_restore/hidden_icon.h"
#include "quarn_d_restore/settle.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

/** One installed package of a walk over all of them, which always goes on. */
template <void (*Visit)(const char *pkgid, const char *root)>
bool visit_package(package_info_h info, void * /*user_data*/) {
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
  Visit(pkgid.get(), root.get());
  return true;
}

void visit_packages(package_manager_package_info_cb visit) {
  const int result = package_manager_foreach_package_info(visit, nullptr);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", result);
  }
}

void recover_package(const char *pkgid, const char *root) {
  recover_interrupted_restore(pkgid, root);
}

void recover_all_of_package(const char *pkgid, const char *root) {
  {
    const PackageDataLock lock(pkgid, PackageUse::kChange);
    static_cast<void>(recover_package_data(pkgid, root));  // the log tells of each
  }
  sweep_working_files(pkgid, root);
  show_hidden_icon(pkgid, root);
}

recovery_result recover_snapshot(const char *pkgid, const char *root, const restore_files &files) {
  const HeldFolder snapshot(files.snapshot);
  std::string written;
  switch (state_of_snapshot(files)) {
    case snapshot_state::none:
    case snapshot_state::told:
    case snapshot_state::foreign:
      return recovery_result::nothing;
    case snapshot_state::incomplete:
      static_cast<void>(remove_snapshot(files));  // what stays is incomplete still
      return recovery_result::nothing;
    case snapshot_state::complete:
      break;
  }
  if (application_has_written(files, &written)) {
    LOGE(
        "application (%s) has written %s since its restore was interrupted, so its data stays; "
        "the data from before is kept in %s",
        pkgid, written.c_str(), files.snapshot.c_str());
    return keep_told_snapshot(files) ? recovery_result::told : recovery_result::kept;
  }
  LOGI("restore of (%s) was interrupted, so its data will be put back", pkgid);
  return put_snapshot_back(pkgid, root) == rollback_result::whole ? recovery_result::put_back
                                                                  : recovery_result::kept;
}

}  // namespace

recovery_result recover_package_data(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  const recovery_result result = recover_snapshot(pkgid, root, files);
  settle_interrupted_unpacking(pkgid, root);
  put_own_table_back(files);
  return result;
}

bool recover_interrupted_restore(const char *pkgid, const char *root) {
  const PackageDataLock lock(pkgid, PackageUse::kChangeUnlessPacked);
  return lock && recover_package_data(pkgid, root) == recovery_result::put_back;
}

void recover_interrupted_restores() { visit_packages(visit_package<recover_package>); }

void recover_device() { visit_packages(visit_package<recover_all_of_package>); }
