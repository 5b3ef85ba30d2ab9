/**
 * @file platform_handles.h
 * @brief Owners for the handles of the device's services.
 *
 * Used as those of handles.h; out() passes an empty one to a function that
 * fills it: `package_manager_get_package_info(id, out(info))`.
 */
#ifndef QUARN_D_UTILS_PLATFORM_HANDLES_H
#define QUARN_D_UTILS_PLATFORM_HANDLES_H

#include "platform_package_client.h"
#include "platform_package_info.h"
#include "platform_package_manager.h"
#include "platform_telephony.h"
#include "quarn_d_utils/handles.h"

using PackageInfoPtr = Handle<package_info_s, &package_info_destroy>;
using PkgRecordPtr = Handle<void, &pkgmgrinfo_pkginfo_destroy_pkginfo>;
using AppRecordPtr = Handle<void, &pkgmgrinfo_appinfo_destroy_appinfo>;
using PkgClientPtr = Handle<pkgmgr_client, &pkgmgr_client_free>;
using TelephonyPtr = Handle<TapiHandle, &tel_deinit>;

/** Receives a handle through an out pointer. */
template <typename T, auto Release>
class HandleOut {
 public:
  explicit HandleOut(Handle<T, Release> &owner) : owner_(owner) {}
  ~HandleOut() {
    if (raw_ != nullptr) owner_.reset(raw_);
  }
  HandleOut(const HandleOut &) = delete;
  HandleOut &operator=(const HandleOut &) = delete;
  operator T **() { return &raw_; }  // NOLINT: meant to be passed as an argument

 private:
  Handle<T, Release> &owner_;
  T *raw_ = nullptr;
};
template <typename T, auto Release>
HandleOut<T, Release> out(std::unique_ptr<T, Releaser<Release>> &owner) {
  return HandleOut<T, Release>(owner);
}

#endif
