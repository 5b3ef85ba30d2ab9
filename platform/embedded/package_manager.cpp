#include "platform_package_manager.h"

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "state/packages.h"
#include "state/watch.h"

struct package_info_s {
  embedded::Package package;
};

struct package_manager_s {
  package_manager_event_cb callback = nullptr;
  void *user_data = nullptr;
  std::int64_t next = 1;
  std::unique_ptr<embedded::StateWatch> watch;
};

namespace {

int give(const std::string &text, char **out) {
  if (out == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  *out = strdup(text.c_str());
  return *out == nullptr ? PACKAGE_MANAGER_ERROR_OUT_OF_MEMORY : PACKAGE_MANAGER_ERROR_NONE;
}

package_manager_event_type_e type_of(const std::string &action) {
  if (action == embedded::kActionUninstall) return PACKAGE_MANAGER_EVENT_TYPE_UNINSTALL;
  if (action == embedded::kActionUpdate) return PACKAGE_MANAGER_EVENT_TYPE_UPDATE;
  return PACKAGE_MANAGER_EVENT_TYPE_INSTALL;
}

package_manager_event_state_e state_of(const std::string &state) {
  if (state == embedded::kStateStarted) return PACKAGE_MANAGER_EVENT_STATE_STARTED;
  if (state == embedded::kStateFailed) return PACKAGE_MANAGER_EVENT_STATE_FAILED;
  return PACKAGE_MANAGER_EVENT_STATE_COMPLETED;
}

// Handles whose subscription lives; a callback may end its own or another one.
std::vector<package_manager_h> &subscribed() {
  static auto *handles = new std::vector<package_manager_h>;
  return *handles;
}

bool is_subscribed(package_manager_h manager) {
  for (const package_manager_h one : subscribed()) {
    if (one == manager) return true;
  }
  return false;
}

void unsubscribe(package_manager_h manager) {
  for (auto one = subscribed().begin(); one != subscribed().end(); ++one) {
    if (*one != manager) continue;
    subscribed().erase(one);
    return;
  }
}

void deliver(package_manager_h manager) {
  constexpr int kNoProgress = 0;
  constexpr int kDone = 100;
  for (const embedded::PackageEvent &event :
       embedded::events_from(embedded::current_device(), manager->next)) {
    manager->next = event.number + 1;
    const package_manager_event_state_e state = state_of(event.state);
    manager->callback(event.type.c_str(), event.package.c_str(), type_of(event.action), state,
                      state == PACKAGE_MANAGER_EVENT_STATE_STARTED ? kNoProgress : kDone,
                      state == PACKAGE_MANAGER_EVENT_STATE_FAILED ? PACKAGE_MANAGER_ERROR_IO_ERROR
                                                                  : PACKAGE_MANAGER_ERROR_NONE,
                      manager->user_data);
    if (!is_subscribed(manager)) return;
  }
}

}  // namespace

int package_manager_create(package_manager_h *manager) {
  if (manager == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  if (embedded::current_device().empty()) return PACKAGE_MANAGER_ERROR_IO_ERROR;
  *manager = new package_manager_s;
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_manager_destroy(package_manager_h manager) {
  if (manager == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  unsubscribe(manager);
  delete manager;
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_manager_set_event_cb(package_manager_h manager, package_manager_event_cb callback,
                                 void *user_data) {
  if (manager == nullptr || callback == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  const std::string device = embedded::current_device();
  manager->callback = callback;
  manager->user_data = user_data;
  manager->next = embedded::next_event(device);
  manager->watch = std::make_unique<embedded::StateWatch>(device, embedded::kEventsFile,
                                                          [manager] { deliver(manager); });
  if (!*manager->watch) {
    manager->watch.reset();
    return PACKAGE_MANAGER_ERROR_IO_ERROR;
  }
  unsubscribe(manager);
  subscribed().push_back(manager);
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_manager_unset_event_cb(package_manager_h manager) {
  if (manager == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  unsubscribe(manager);
  manager->watch.reset();
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_manager_foreach_package_info(package_manager_package_info_cb callback,
                                         void *user_data) {
  if (callback == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  const std::string device = embedded::current_device();
  std::vector<std::string> ids;
  if (!embedded::list_packages(device, &ids)) return PACKAGE_MANAGER_ERROR_IO_ERROR;
  for (const std::string &id : ids) {
    package_info_s info;
    if (!embedded::get_package(device, id, &info.package)) continue;
    if (!callback(&info, user_data)) break;
  }
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_manager_get_package_info(const char *package_id, package_info_h *info) {
  if (package_id == nullptr || info == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  auto found = std::make_unique<package_info_s>();
  if (!embedded::get_package(embedded::current_device(), package_id, &found->package)) {
    return PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE;
  }
  *info = found.release();
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_info_destroy(package_info_h info) {
  if (info == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  delete info;
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_info_foreach_app_from_package(package_info_h info,
                                          package_info_app_component_type_e comp_type,
                                          package_info_app_cb callback, void *user_data) {
  if (info == nullptr || callback == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  // The device's manifests have one kind of application: those with a screen.
  if (comp_type == PACKAGE_INFO_SERVICEAPP) return PACKAGE_MANAGER_ERROR_NONE;
  for (const embedded::Application &application : info->package.applications) {
    if (!callback(PACKAGE_INFO_UIAPP, application.id.c_str(), user_data)) break;
  }
  return PACKAGE_MANAGER_ERROR_NONE;
}

int package_info_get_package(package_info_h info, char **package_id) {
  if (info == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  return give(info->package.id, package_id);
}

int package_info_get_version(package_info_h info, char **version) {
  if (info == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  return give(info->package.version, version);
}

int package_info_get_type(package_info_h info, char **type) {
  if (info == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  return give(info->package.type, type);
}

int package_info_get_root_path(package_info_h info, char **path) {
  if (info == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  return give(embedded::package_root(info->package.id), path);
}

int package_info_is_preload_package(package_info_h info, bool *preload) {
  if (info == nullptr || preload == nullptr) return PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  *preload = info->package.preload;
  return PACKAGE_MANAGER_ERROR_NONE;
}
