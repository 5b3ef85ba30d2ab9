#include <cstring>
#include <string>
#include <vector>

#include "platform_package_info.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"

std::vector<std::string> install_complete_pkgs;
Mutex installed_check_mutex;

namespace {

constexpr char kBackupMetadataKey[] = "backup";
constexpr char kBackupDisabledValue[] = "disable";

const char *package_error_text(int error) {
  switch (error) {
    case PACKAGE_MANAGER_ERROR_INVALID_PARAMETER:
      return "invalid parameter";
    case PACKAGE_MANAGER_ERROR_OUT_OF_MEMORY:
      return "out of memory";
    case PACKAGE_MANAGER_ERROR_IO_ERROR:
      return "input or output error";
    case PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE:
      return "no such package";
    default:
      return "unknown error";
  }
}

/** The application's record and API version; both null, with a log line, on failure. */
AppRecordPtr get_app_record(const char *appid, const char **api_version) {
  AppRecordPtr app;
  if (pkgmgrinfo_appinfo_get_appinfo(appid, out(app)) != PMINFO_R_OK) {
    LOGE("cannot get app info of %s", appid);
    return nullptr;
  }
  char *version = nullptr;
  if (pkgmgrinfo_appinfo_get_api_version(app.get(), &version) != PMINFO_R_OK ||
      version == nullptr) {
    LOGE("cannot get api-version of %s", appid);
    return nullptr;
  }
  *api_version = version;
  return app;
}

}  // namespace

bool app_support_api_version(const char *appid, const char *version) {
  const char *api_version = nullptr;
  const AppRecordPtr app = get_app_record(appid, &api_version);
  return app && std::strcmp(api_version, version) >= 0;
}

bool backup_enabled_app(const char *appid) {
  const char *api_version = nullptr;
  const AppRecordPtr app = get_app_record(appid, &api_version);
  if (!app) return false;

  char *value = nullptr;
  if (pkgmgrinfo_appinfo_get_metadata_value(app.get(), kBackupMetadataKey, &value) == PMINFO_R_OK &&
      value != nullptr && std::strcmp(value, kBackupDisabledValue) == 0) {
    LOGI("backup disabled for %s => metadata set to disable", appid);
    return false;
  }
  LOGI("backup enabled for %s", appid);
  return true;
}

bool already_installed_package(const char *pkgid) {
  const MutexLock lock(installed_check_mutex);
  for (const std::string &installed : install_complete_pkgs) {
    if (installed == pkgid) return true;
  }
  return false;
}

bool app_data_storage_is_external(const char *pkgid) {
  PkgRecordPtr pkg;
  int ret = pkgmgrinfo_pkginfo_get_pkginfo(pkgid, out(pkg));
  if (ret != PMINFO_R_OK) {
    LOGE("pkgmgrinfo_pkginfo_get_pkginfo() Fail %d", ret);
    return false;
  }
  pkgmgrinfo_installed_storage storage = PMINFO_INTERNAL_STORAGE;
  ret = pkgmgrinfo_pkginfo_get_installed_storage(pkg.get(), &storage);
  if (ret != PMINFO_R_OK) {
    LOGE("pkgmgrinfo_pkginfo_get_installed_storage() Fail %d", ret);
    return false;
  }
  return storage == PMINFO_EXTERNAL_STORAGE;
}

int get_pkg_info(const char *appid, char **pkgid, char **version) {
  AppRecordPtr app;
  int ret = pkgmgrinfo_appinfo_get_appinfo(appid, out(app));
  if (ret != PMINFO_R_OK) {
    LOGE("pkgmgrinfo_appinfo_get_appinfo() Fail %d", ret);
    return QUARN_FAILED;
  }
  char *app_pkgid = nullptr;
  ret = pkgmgrinfo_appinfo_get_pkgid(app.get(), &app_pkgid);
  if (ret != PMINFO_R_OK || app_pkgid == nullptr) {
    LOGE("pkgmgrinfo_appinfo_get_pkgid() Fail %d", ret);
    return QUARN_FAILED;
  }
  PkgRecordPtr pkg;
  ret = pkgmgrinfo_pkginfo_get_pkginfo(app_pkgid, out(pkg));
  if (ret != PMINFO_R_OK) {
    LOGE("pkgmgrinfo_pkginfo_get_pkginfo() Fail %d", ret);
    return QUARN_FAILED;
  }
  char *pkg_version = nullptr;
  ret = pkgmgrinfo_pkginfo_get_version(pkg.get(), &pkg_version);
  if (ret != PMINFO_R_OK || pkg_version == nullptr) {
    LOGE("pkgmgrinfo_pkginfo_get_version() Fail %d", ret);
    return QUARN_FAILED;
  }
  *pkgid = strdup(app_pkgid);
  *version = strdup(pkg_version);
  return QUARN_OK;
}

char *get_app_root_path(const char *pkgid) {
  PackageInfoPtr info;
  int ret = package_manager_get_package_info(pkgid, out(info));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("Fail: package_manager_get_package_info : %s", package_error_text(ret));
    return nullptr;
  }
  CString root;
  ret = package_info_get_root_path(info.get(), out(root));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("Fail: package_info_get_root_path : %s", package_error_text(ret));
    return nullptr;
  }
  return root.release();
}

int get_string_app_root_path(const char *pkgid, std::string &root) {
  const CString path(get_app_root_path(pkgid));
  if (!path) {
    LOGE("cannot get root path info of (%s)...", pkgid);
    return QUARN_REFUSED;
  }
  root = path.get();
  return QUARN_OK;
}
