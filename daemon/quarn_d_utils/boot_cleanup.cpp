#include "quarn_d_utils/boot_cleanup.h"

#include "quarn_d_utils/own_file.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr char kSharedDataDir[] = "/shared/data/";
constexpr char kAsideDir[] = "/shared/data/quarn_tmp_rst_dir.";
constexpr const char *kArchiveSuffixes[] = {"_upload.zip", "_download.zip"};

void (*boot_recovery)() = nullptr;

timespec file_clock_now() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME_COARSE, &now);
  return now;
}

// The sweep runs beside the main thread, where a request may already have
// staged or downloaded an archive of its own.
bool left_by_an_earlier_process(const char *path) {
  struct stat status {};
  if (safe_lstat(path, &status) != 0 || !is_own_file(status)) return false;
  const timespec &changed = status.st_ctim;
  return changed.tv_sec < quarn_process_start.tv_sec ||
         (changed.tv_sec == quarn_process_start.tv_sec &&
          changed.tv_nsec < quarn_process_start.tv_nsec);
}

}  // namespace

std::atomic<bool> boot_cleanup_done{false};
timespec quarn_process_start = file_clock_now();

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

  for (const char *suffix : kArchiveSuffixes) {
    for (const char *dir : {kSharedDataDir, kAsideDir}) {
      const std::string archive = std::string(root.get()) + dir + pkg_id.get() + suffix;
      if (file_exist(archive.c_str()) && left_by_an_earlier_process(archive.c_str())) {
        delete_file(archive.c_str());
      }
    }
  }
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
