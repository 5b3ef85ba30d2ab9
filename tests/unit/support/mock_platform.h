/**
 * @file mock_platform.h
 * @brief The device's services, scripted: GoogleMock behind their C symbols.
 *
 * Make one (a NiceMock, say) in the test or fixture: while it lives, the C
 * functions call it. Defaults are those of a working device; script the rest
 * with ON_CALL and EXPECT_CALL.
 */
#ifndef MOCK_PLATFORM_H
#define MOCK_PLATFORM_H

#include <gmock/gmock.h>

#include "platform_account.h"
#include "platform_alarm.h"
#include "platform_connection.h"
#include "platform_device.h"
#include "platform_package_client.h"
#include "platform_package_info.h"
#include "platform_package_manager.h"
#include "platform_runtime_info.h"
#include "platform_security_server.h"
#include "platform_settings.h"
#include "platform_smack.h"
#include "platform_system_info.h"
#include "platform_telephony.h"

class MockPlatform {
 public:
  MockPlatform();
  virtual ~MockPlatform();
  MockPlatform(const MockPlatform &) = delete;
  MockPlatform &operator=(const MockPlatform &) = delete;

  /** The one that lives; the process ends with a message when there is none. */
  static MockPlatform &current();

  MOCK_METHOD(int, account_connect, ());
  MOCK_METHOD(int, account_disconnect, ());
  MOCK_METHOD(int, account_query_account_by_package_name, (account_cb, const char *, void *));
  MOCK_METHOD(int, account_get_user_name, (account_h, char **));
  MOCK_METHOD(int, alarmmgr_init, (const char *));
  MOCK_METHOD(void, alarmmgr_fini, ());
  MOCK_METHOD(int, alarmmgr_set_cb, (alarm_cb_t, void *));
  MOCK_METHOD(int, alarmmgr_add_alarm, (int, time_t, time_t, const char *, alarm_id_t *));
  MOCK_METHOD(int, alarmmgr_remove_alarm, (alarm_id_t));
  MOCK_METHOD(int, connection_create, (connection_h *));
  MOCK_METHOD(int, connection_destroy, (connection_h));
  MOCK_METHOD(int, connection_get_type, (connection_h, connection_type_e *));
  MOCK_METHOD(int, connection_set_type_changed_cb,
              (connection_h, connection_type_changed_cb, void *));
  MOCK_METHOD(int, connection_unset_type_changed_cb, (connection_h));
  MOCK_METHOD(int, device_display_get_state, (display_state_e *));
  MOCK_METHOD(int, device_add_callback, (device_callback_e, device_changed_cb, void *));
  MOCK_METHOD(int, device_remove_callback, (device_callback_e, device_changed_cb));
  MOCK_METHOD(int, device_power_request_lock, (power_lock_e, int));
  MOCK_METHOD(int, device_power_release_lock, (power_lock_e));
  MOCK_METHOD(pkgmgr_client *, pkgmgr_client_new, (pkgmgr_client_type));
  MOCK_METHOD(int, pkgmgr_client_free, (pkgmgr_client *));
  MOCK_METHOD(int, pkgmgr_client_activate, (pkgmgr_client *, const char *, const char *));
  MOCK_METHOD(int, pkgmgr_client_deactivate, (pkgmgr_client *, const char *, const char *));
  MOCK_METHOD(int, pkgmgrinfo_pkginfo_get_pkginfo, (const char *, pkgmgrinfo_pkginfo_h *));
  MOCK_METHOD(int, pkgmgrinfo_pkginfo_destroy_pkginfo, (pkgmgrinfo_pkginfo_h));
  MOCK_METHOD(int, pkgmgrinfo_pkginfo_get_version, (pkgmgrinfo_pkginfo_h, char **));
  MOCK_METHOD(int, pkgmgrinfo_pkginfo_get_installed_storage,
              (pkgmgrinfo_pkginfo_h, pkgmgrinfo_installed_storage *));
  MOCK_METHOD(int, pkgmgrinfo_appinfo_get_appinfo, (const char *, pkgmgrinfo_appinfo_h *));
  MOCK_METHOD(int, pkgmgrinfo_appinfo_destroy_appinfo, (pkgmgrinfo_appinfo_h));
  MOCK_METHOD(int, pkgmgrinfo_appinfo_get_pkgid, (pkgmgrinfo_appinfo_h, char **));
  MOCK_METHOD(int, pkgmgrinfo_appinfo_get_api_version, (pkgmgrinfo_appinfo_h, char **));
  MOCK_METHOD(int, pkgmgrinfo_appinfo_get_metadata_value,
              (pkgmgrinfo_appinfo_h, const char *, char **));
  MOCK_METHOD(int, package_manager_create, (package_manager_h *));
  MOCK_METHOD(int, package_manager_destroy, (package_manager_h));
  MOCK_METHOD(int, package_manager_set_event_cb,
              (package_manager_h, package_manager_event_cb, void *));
  MOCK_METHOD(int, package_manager_unset_event_cb, (package_manager_h));
  MOCK_METHOD(int, package_manager_foreach_package_info, (package_manager_package_info_cb, void *));
  MOCK_METHOD(int, package_manager_get_package_info, (const char *, package_info_h *));
  MOCK_METHOD(int, package_info_destroy, (package_info_h));
  MOCK_METHOD(int, package_info_foreach_app_from_package,
              (package_info_h, package_info_app_component_type_e, package_info_app_cb, void *));
  MOCK_METHOD(int, package_info_get_package, (package_info_h, char **));
  MOCK_METHOD(int, package_info_get_version, (package_info_h, char **));
  MOCK_METHOD(int, package_info_get_type, (package_info_h, char **));
  MOCK_METHOD(int, package_info_get_root_path, (package_info_h, char **));
  MOCK_METHOD(int, package_info_is_preload_package, (package_info_h, bool *));
  MOCK_METHOD(int, runtime_info_get_value_bool, (runtime_info_key_e, bool *));
  MOCK_METHOD(int, runtime_info_set_changed_cb,
              (runtime_info_key_e, runtime_info_changed_cb, void *));
  MOCK_METHOD(int, runtime_info_unset_changed_cb, (runtime_info_key_e));
  MOCK_METHOD(int, security_server_label_access, (const char *, const char *));
  MOCK_METHOD(int, security_server_perm_begin, (security_server_perm_h *));
  MOCK_METHOD(int, security_server_perm_app_setup_path,
              (security_server_perm_h, const char *, const char *, int, const char *));
  MOCK_METHOD(int, security_server_perm_commit, (security_server_perm_h));
  MOCK_METHOD(void, security_server_perm_abort, (security_server_perm_h));
  MOCK_METHOD(int, vconf_get_int, (const char *, int *));
  MOCK_METHOD(int, vconf_set_int, (const char *, int));
  MOCK_METHOD(int, vconf_get_dbl, (const char *, double *));
  MOCK_METHOD(int, vconf_set_dbl, (const char *, double));
  MOCK_METHOD(int, vconf_notify_key_changed, (const char *, vconf_callback_fn, void *));
  MOCK_METHOD(int, smack_getlabel, (const char *, char **, enum smack_label_type));
  MOCK_METHOD(int, smack_lgetlabel, (const char *, char **, enum smack_label_type));
  MOCK_METHOD(int, smack_setlabel, (const char *, const char *, enum smack_label_type));
  MOCK_METHOD(int, smack_lsetlabel, (const char *, const char *, enum smack_label_type));
  MOCK_METHOD(int, system_info_get_platform_string, (const char *, char **));
  MOCK_METHOD(TapiHandle *, tel_init, (const char *));
  MOCK_METHOD(int, tel_deinit, (TapiHandle *));
  MOCK_METHOD(char *, tel_get_misc_me_imei_sync, (TapiHandle *));
};

#endif
