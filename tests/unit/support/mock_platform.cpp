#include "mock_platform.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

using ::testing::_;
using ::testing::Return;

namespace {
// Handed out as handles; only their addresses matter.
char this_is_a_handle[1];
MockPlatform *current_mock = nullptr;
}  // namespace

MockPlatform::MockPlatform() {
  current_mock = this;
  ON_CALL(*this, smack_getlabel).WillByDefault([](const char *, char **label, smack_label_type) {
    *label = strdup("_");
    return 0;
  });
  ON_CALL(*this, smack_lgetlabel).WillByDefault([](const char *, char **label, smack_label_type) {
    *label = strdup("_");
    return 0;
  });
  ON_CALL(*this, system_info_get_platform_string).WillByDefault([](const char *, char **value) {
    *value = strdup("Model One");
    return SYSTEM_INFO_ERROR_NONE;
  });
  ON_CALL(*this, tel_init).WillByDefault([](const char *) {
    return reinterpret_cast<TapiHandle *>(this_is_a_handle);
  });
  ON_CALL(*this, tel_get_misc_me_imei_sync).WillByDefault([](TapiHandle *) {
    return strdup("350000000000001");
  });
}

MockPlatform::~MockPlatform() { current_mock = nullptr; }

MockPlatform &MockPlatform::current() {
  if (current_mock == nullptr) {
    std::fputs("no MockPlatform lives\n", stderr);
    std::abort();
  }
  return *current_mock;
}

extern "C" {

int account_connect() { return MockPlatform::current().account_connect(); }

int account_disconnect() { return MockPlatform::current().account_disconnect(); }

int account_query_account_by_package_name(account_cb callback, const char *package_name,
                                          void *user_data) {
  return MockPlatform::current().account_query_account_by_package_name(callback, package_name,
                                                                       user_data);
}

int account_get_user_name(account_h account, char **user_name) {
  return MockPlatform::current().account_get_user_name(account, user_name);
}

int alarmmgr_init(const char *pkg_name) { return MockPlatform::current().alarmmgr_init(pkg_name); }

void alarmmgr_fini() { return MockPlatform::current().alarmmgr_fini(); }

int alarmmgr_set_cb(alarm_cb_t handler, void *user_param) {
  return MockPlatform::current().alarmmgr_set_cb(handler, user_param);
}

int alarmmgr_add_alarm(int alarm_type, time_t trigger_at_time, time_t interval,
                       const char *destination, alarm_id_t *alarm_id) {
  return MockPlatform::current().alarmmgr_add_alarm(alarm_type, trigger_at_time, interval,
                                                    destination, alarm_id);
}

int alarmmgr_remove_alarm(alarm_id_t alarm_id) {
  return MockPlatform::current().alarmmgr_remove_alarm(alarm_id);
}

int connection_create(connection_h *connection) {
  return MockPlatform::current().connection_create(connection);
}

int connection_destroy(connection_h connection) {
  return MockPlatform::current().connection_destroy(connection);
}

int connection_get_type(connection_h connection, connection_type_e *type) {
  return MockPlatform::current().connection_get_type(connection, type);
}

int connection_set_type_changed_cb(connection_h connection, connection_type_changed_cb callback,
                                   void *user_data) {
  return MockPlatform::current().connection_set_type_changed_cb(connection, callback, user_data);
}

int connection_unset_type_changed_cb(connection_h connection) {
  return MockPlatform::current().connection_unset_type_changed_cb(connection);
}

int device_display_get_state(display_state_e *state) {
  return MockPlatform::current().device_display_get_state(state);
}

int device_add_callback(device_callback_e type, device_changed_cb callback, void *user_data) {
  return MockPlatform::current().device_add_callback(type, callback, user_data);
}

int device_remove_callback(device_callback_e type, device_changed_cb callback) {
  return MockPlatform::current().device_remove_callback(type, callback);
}

int device_power_request_lock(power_lock_e type, int timeout_ms) {
  return MockPlatform::current().device_power_request_lock(type, timeout_ms);
}

int device_power_release_lock(power_lock_e type) {
  return MockPlatform::current().device_power_release_lock(type);
}

pkgmgr_client *pkgmgr_client_new(pkgmgr_client_type type) {
  return MockPlatform::current().pkgmgr_client_new(type);
}

int pkgmgr_client_free(pkgmgr_client *pc) { return MockPlatform::current().pkgmgr_client_free(pc); }

int pkgmgr_client_activate(pkgmgr_client *pc, const char *pkg_type, const char *pkgid) {
  return MockPlatform::current().pkgmgr_client_activate(pc, pkg_type, pkgid);
}

int pkgmgr_client_deactivate(pkgmgr_client *pc, const char *pkg_type, const char *pkgid) {
  return MockPlatform::current().pkgmgr_client_deactivate(pc, pkg_type, pkgid);
}

int pkgmgrinfo_pkginfo_get_pkginfo(const char *pkgid, pkgmgrinfo_pkginfo_h *handle) {
  return MockPlatform::current().pkgmgrinfo_pkginfo_get_pkginfo(pkgid, handle);
}

int pkgmgrinfo_pkginfo_destroy_pkginfo(pkgmgrinfo_pkginfo_h handle) {
  return MockPlatform::current().pkgmgrinfo_pkginfo_destroy_pkginfo(handle);
}

int pkgmgrinfo_pkginfo_get_version(pkgmgrinfo_pkginfo_h handle, char **version) {
  return MockPlatform::current().pkgmgrinfo_pkginfo_get_version(handle, version);
}

int pkgmgrinfo_pkginfo_get_installed_storage(pkgmgrinfo_pkginfo_h handle,
                                             pkgmgrinfo_installed_storage *storage) {
  return MockPlatform::current().pkgmgrinfo_pkginfo_get_installed_storage(handle, storage);
}

int pkgmgrinfo_appinfo_get_appinfo(const char *appid, pkgmgrinfo_appinfo_h *handle) {
  return MockPlatform::current().pkgmgrinfo_appinfo_get_appinfo(appid, handle);
}

int pkgmgrinfo_appinfo_destroy_appinfo(pkgmgrinfo_appinfo_h handle) {
  return MockPlatform::current().pkgmgrinfo_appinfo_destroy_appinfo(handle);
}

int pkgmgrinfo_appinfo_get_pkgid(pkgmgrinfo_appinfo_h handle, char **pkgid) {
  return MockPlatform::current().pkgmgrinfo_appinfo_get_pkgid(handle, pkgid);
}

int pkgmgrinfo_appinfo_get_api_version(pkgmgrinfo_appinfo_h handle, char **api_version) {
  return MockPlatform::current().pkgmgrinfo_appinfo_get_api_version(handle, api_version);
}

int pkgmgrinfo_appinfo_get_metadata_value(pkgmgrinfo_appinfo_h handle, const char *key,
                                          char **value) {
  return MockPlatform::current().pkgmgrinfo_appinfo_get_metadata_value(handle, key, value);
}

int package_manager_create(package_manager_h *manager) {
  return MockPlatform::current().package_manager_create(manager);
}

int package_manager_destroy(package_manager_h manager) {
  return MockPlatform::current().package_manager_destroy(manager);
}

int package_manager_set_event_cb(package_manager_h manager, package_manager_event_cb callback,
                                 void *user_data) {
  return MockPlatform::current().package_manager_set_event_cb(manager, callback, user_data);
}

int package_manager_unset_event_cb(package_manager_h manager) {
  return MockPlatform::current().package_manager_unset_event_cb(manager);
}

int package_manager_foreach_package_info(package_manager_package_info_cb callback,
                                         void *user_data) {
  return MockPlatform::current().package_manager_foreach_package_info(callback, user_data);
}

int package_manager_get_package_info(const char *package_id, package_info_h *info) {
  return MockPlatform::current().package_manager_get_package_info(package_id, info);
}

int package_info_destroy(package_info_h info) {
  return MockPlatform::current().package_info_destroy(info);
}

int package_info_foreach_app_from_package(package_info_h info,
                                          package_info_app_component_type_e comp_type,
                                          package_info_app_cb callback, void *user_data) {
  return MockPlatform::current().package_info_foreach_app_from_package(info, comp_type, callback,
                                                                       user_data);
}

int package_info_get_package(package_info_h info, char **package_id) {
  return MockPlatform::current().package_info_get_package(info, package_id);
}

int package_info_get_version(package_info_h info, char **version) {
  return MockPlatform::current().package_info_get_version(info, version);
}

int package_info_get_type(package_info_h info, char **type) {
  return MockPlatform::current().package_info_get_type(info, type);
}

int package_info_get_root_path(package_info_h info, char **path) {
  return MockPlatform::current().package_info_get_root_path(info, path);
}

int package_info_is_preload_package(package_info_h info, bool *preload) {
  return MockPlatform::current().package_info_is_preload_package(info, preload);
}

int runtime_info_get_value_bool(runtime_info_key_e key, bool *value) {
  return MockPlatform::current().runtime_info_get_value_bool(key, value);
}

int runtime_info_set_changed_cb(runtime_info_key_e key, runtime_info_changed_cb callback,
                                void *user_data) {
  return MockPlatform::current().runtime_info_set_changed_cb(key, callback, user_data);
}

int runtime_info_unset_changed_cb(runtime_info_key_e key) {
  return MockPlatform::current().runtime_info_unset_changed_cb(key);
}

int security_server_label_access(const char *path, const char *label) {
  return MockPlatform::current().security_server_label_access(path, label);
}

int security_server_perm_begin(security_server_perm_h *handle) {
  return MockPlatform::current().security_server_perm_begin(handle);
}

int security_server_perm_app_setup_path(security_server_perm_h handle, const char *pkg_id,
                                        const char *path, int path_type, ...) {
  va_list args;
  va_start(args, path_type);
  const char *label = va_arg(args, const char *);
  va_end(args);
  return MockPlatform::current().security_server_perm_app_setup_path(handle, pkg_id, path,
                                                                     path_type, label);
}

int security_server_perm_commit(security_server_perm_h handle) {
  return MockPlatform::current().security_server_perm_commit(handle);
}

void security_server_perm_abort(security_server_perm_h handle) {
  return MockPlatform::current().security_server_perm_abort(handle);
}

int vconf_get_int(const char *key, int *value) {
  return MockPlatform::current().vconf_get_int(key, value);
}

int vconf_set_int(const char *key, int value) {
  return MockPlatform::current().vconf_set_int(key, value);
}

int vconf_get_dbl(const char *key, double *value) {
  return MockPlatform::current().vconf_get_dbl(key, value);
}

int vconf_set_dbl(const char *key, double value) {
  return MockPlatform::current().vconf_set_dbl(key, value);
}

int vconf_notify_key_changed(const char *key, vconf_callback_fn callback, void *user_data) {
  return MockPlatform::current().vconf_notify_key_changed(key, callback, user_data);
}

int smack_getlabel(const char *path, char **label, enum smack_label_type type) {
  return MockPlatform::current().smack_getlabel(path, label, type);
}

int smack_lgetlabel(const char *path, char **label, enum smack_label_type type) {
  return MockPlatform::current().smack_lgetlabel(path, label, type);
}

int smack_setlabel(const char *path, const char *label, enum smack_label_type type) {
  return MockPlatform::current().smack_setlabel(path, label, type);
}

int smack_lsetlabel(const char *path, const char *label, enum smack_label_type type) {
  return MockPlatform::current().smack_lsetlabel(path, label, type);
}

int system_info_get_platform_string(const char *key, char **value) {
  return MockPlatform::current().system_info_get_platform_string(key, value);
}

TapiHandle *tel_init(const char *cp_name) { return MockPlatform::current().tel_init(cp_name); }

int tel_deinit(TapiHandle *handle) { return MockPlatform::current().tel_deinit(handle); }

char *tel_get_misc_me_imei_sync(TapiHandle *handle) {
  return MockPlatform::current().tel_get_misc_me_imei_sync(handle);
}

}  // extern "C"
