#include "platform_package_info.h"

#include <memory>
#include <string>

#include "platform_package_client.h"
#include "state/packages.h"

namespace {

struct AppRecord {
  embedded::Package package;
  const embedded::Application *application = nullptr;
};

// Records hand out writable pointers by their interface; nobody writes there.
char *give(const std::string &text) { return const_cast<char *>(text.c_str()); }

int set_visible(const char *pkgid, bool visible) {
  if (pkgid == nullptr) return PKGMGR_R_EINVAL;
  return embedded::set_hidden(embedded::current_device(), pkgid, !visible) ? PKGMGR_R_OK
                                                                           : PKGMGR_R_ERROR;
}

char client_token;

}  // namespace

int pkgmgrinfo_pkginfo_get_pkginfo(const char *pkgid, pkgmgrinfo_pkginfo_h *handle) {
  if (pkgid == nullptr || handle == nullptr) return PMINFO_R_EINVAL;
  auto record = std::make_unique<embedded::Package>();
  if (!embedded::get_package(embedded::current_device(), pkgid, record.get())) {
    return PMINFO_R_ENOENT;
  }
  *handle = record.release();
  return PMINFO_R_OK;
}

int pkgmgrinfo_pkginfo_destroy_pkginfo(pkgmgrinfo_pkginfo_h handle) {
  delete static_cast<embedded::Package *>(handle);
  return PMINFO_R_OK;
}

int pkgmgrinfo_pkginfo_get_version(pkgmgrinfo_pkginfo_h handle, char **version) {
  if (handle == nullptr || version == nullptr) return PMINFO_R_EINVAL;
  *version = give(static_cast<embedded::Package *>(handle)->version);
  return PMINFO_R_OK;
}

int pkgmgrinfo_pkginfo_get_installed_storage(pkgmgrinfo_pkginfo_h handle,
                                             pkgmgrinfo_installed_storage *storage) {
  if (handle == nullptr || storage == nullptr) return PMINFO_R_EINVAL;
  *storage = static_cast<embedded::Package *>(handle)->external ? PMINFO_EXTERNAL_STORAGE
                                                                : PMINFO_INTERNAL_STORAGE;
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_get_appinfo(const char *appid, pkgmgrinfo_appinfo_h *handle) {
  if (appid == nullptr || handle == nullptr) return PMINFO_R_EINVAL;
  auto record = std::make_unique<AppRecord>();
  if (!embedded::get_package_of_app(embedded::current_device(), appid, &record->package)) {
    return PMINFO_R_ENOENT;
  }
  for (const embedded::Application &application : record->package.applications) {
    if (application.id == appid) record->application = &application;
  }
  if (record->application == nullptr) return PMINFO_R_ENOENT;
  *handle = record.release();
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_destroy_appinfo(pkgmgrinfo_appinfo_h handle) {
  delete static_cast<AppRecord *>(handle);
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_get_pkgid(pkgmgrinfo_appinfo_h handle, char **pkgid) {
  if (handle == nullptr || pkgid == nullptr) return PMINFO_R_EINVAL;
  *pkgid = give(static_cast<AppRecord *>(handle)->package.id);
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_get_api_version(pkgmgrinfo_appinfo_h handle, char **api_version) {
  if (handle == nullptr || api_version == nullptr) return PMINFO_R_EINVAL;
  const embedded::Application *application = static_cast<AppRecord *>(handle)->application;
  if (application->api_version.empty()) return PMINFO_R_ERROR;
  *api_version = give(application->api_version);
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_get_metadata_value(pkgmgrinfo_appinfo_h handle, const char *key,
                                          char **value) {
  if (handle == nullptr || key == nullptr || value == nullptr) return PMINFO_R_EINVAL;
  const embedded::Application *application = static_cast<AppRecord *>(handle)->application;
  const auto found = application->metadata.find(key);
  if (found == application->metadata.end()) return PMINFO_R_ENOENT;
  *value = give(found->second);
  return PMINFO_R_OK;
}

pkgmgr_client *pkgmgr_client_new(pkgmgr_client_type) { return &client_token; }

int pkgmgr_client_free(pkgmgr_client *pc) { return pc == nullptr ? PKGMGR_R_EINVAL : PKGMGR_R_OK; }

int pkgmgr_client_activate(pkgmgr_client *pc, const char *, const char *pkgid) {
  return pc == nullptr ? PKGMGR_R_EINVAL : set_visible(pkgid, true);
}

int pkgmgr_client_deactivate(pkgmgr_client *pc, const char *, const char *pkgid) {
  return pc == nullptr ? PKGMGR_R_EINVAL : set_visible(pkgid, false);
}
