#include <Ecore.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

constexpr double kNoDelay = 0.0;
/** Packages of every type. */
constexpr const char *kAnyPackageType = nullptr;

/** One pending delayed hide. */
struct icon_hide_delay_arg {
  std::string pkg_id;
  Ecore_Timer *timer = nullptr;
};
using IconHidePtr = std::unique_ptr<icon_hide_delay_arg>;

Mutex icon_hide_delay_mutex;
std::vector<IconHidePtr> icon_hide_delay_timer_list QUARN_GUARDED_BY(icon_hide_delay_mutex);

/** Take the first pending hide that @p wanted picks out of the list; null when there is none. */
template <typename Wanted>
IconHidePtr take_pending_hide(Wanted wanted) {
  const MutexLock lock(icon_hide_delay_mutex);
  const auto found =
      std::find_if(icon_hide_delay_timer_list.begin(), icon_hide_delay_timer_list.end(), wanted);
  if (found == icon_hide_delay_timer_list.end()) return nullptr;
  IconHidePtr arg = std::move(*found);
  icon_hide_delay_timer_list.erase(found);
  return arg;
}

int activate(const char *pkg_id) {
  const PkgClientPtr client(pkgmgr_client_new(PC_REQUEST));
  if (!client) return PKGMGR_R_ERROR;
  return pkgmgr_client_activate(client.get(), kAnyPackageType, pkg_id);
}

int deactivate(const char *pkg_id) {
  const PkgClientPtr client(pkgmgr_client_new(PC_REQUEST));
  if (!client) return PKGMGR_R_ERROR;
  return pkgmgr_client_deactivate(client.get(), kAnyPackageType, pkg_id);
}

Eina_Bool _icon_hide_delay_cb(void *data) {
  // By identity: another hide of the same package may have been asked for
  // earlier and still have longer to wait.
  const IconHidePtr arg =
      take_pending_hide([data](const IconHidePtr &a) { return a.get() == data; });
  const int ret = deactivate(arg->pkg_id.c_str());
  if (ret == PKGMGR_R_OK) {
    LOGI("success to hide icon of (%s) by delay!", arg->pkg_id.c_str());
  } else {
    LOGE("fail to hide icon of (%s) by delay... err:%d", arg->pkg_id.c_str(), ret);
  }
  return ECORE_CALLBACK_CANCEL;
}

void show_icon(const char *pkg_id) {
  delete_icon_hide_delay_timer(pkg_id);
  {
    const MutexLock lock(installed_check_mutex);
    install_complete_pkgs.emplace_back(pkg_id);
  }
  const int ret = activate(pkg_id);
  if (ret == PKGMGR_R_OK) {
    LOGI("success to appear icon of (%s)!", pkg_id);
  } else {
    LOGE("fail to appear icon of (%s)... err:%d", pkg_id, ret);
  }
}

void hide_icon_now(const char *pkg_id) {
  const int ret = deactivate(pkg_id);
  if (ret == PKGMGR_R_OK) {
    LOGI("success to hide icon of (%s)!", pkg_id);
  } else {
    LOGE("fail to hide icon of (%s)... err:%d", pkg_id, ret);
  }
}

void hide_icon_later(const char *pkg_id, double delay) {
  auto arg = std::make_unique<icon_hide_delay_arg>();
  arg->pkg_id = pkg_id;
  const MutexLock lock(icon_hide_delay_mutex);
  arg->timer = ecore_timer_add(delay, _icon_hide_delay_cb, arg.get());
  if (arg->timer == nullptr) {
    LOGE("fail to hide icon of (%s) by delay... err:%d", pkg_id, PKGMGR_R_ERROR);
    return;
  }
  icon_hide_delay_timer_list.push_back(std::move(arg));
}

}  // namespace

void appear_app_icon(const char *pkg_id, bool show, double delay) {
  if (show) {
    show_icon(pkg_id);
  } else if (delay != kNoDelay) {
    hide_icon_later(pkg_id, delay);
  } else {
    hide_icon_now(pkg_id);
  }
}

void delete_icon_hide_delay_timer(const char *pkg_id) {
  const IconHidePtr arg =
      take_pending_hide([pkg_id](const IconHidePtr &a) { return a->pkg_id == pkg_id; });
  if (arg) ecore_timer_del(arg->timer);
}

void init_icon_hide_delay_timer_list() {
  LOGI("init_icon_hide_delay_timer_list");
  const MutexLock lock(icon_hide_delay_mutex);
  for (const IconHidePtr &arg : icon_hide_delay_timer_list) ecore_timer_del(arg->timer);
  icon_hide_delay_timer_list.clear();
}

void init_install_complete_pkgs_list() {
  LOGI("init_install_complete_pkgs_list");
  const MutexLock lock(installed_check_mutex);
  install_complete_pkgs.clear();
}
