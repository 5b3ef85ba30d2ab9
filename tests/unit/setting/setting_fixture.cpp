#include "setting_fixture.h"

#include <glib.h>

#include <atomic>
#include <cstdint>
#include <cstring>

#include "log_capture.h"
#include "platform_settings.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/pending_work.h"

using ::testing::_;

FakeDaemon fake_daemon;

std::atomic<bool> g_is_backing_up{false};
void request_backup(void *client) {
  PendingWork::begin();
  fake_daemon.backup_requests.push_back(client);
}
std::uint64_t get_last_backup_time() { return fake_daemon.last_backup; }
void request_quarn_terminate(double delay, bool restart) {
  fake_daemon.terminations.push_back({delay, restart});
}
std::int64_t _get_current_timestamp() { return fake_daemon.now; }

namespace {
char connection_object[1];
}

SettingTest::SettingTest() {
  fake_daemon = FakeDaemon{};
  g_is_backing_up = false;

  ON_CALL(platform, connection_create).WillByDefault([](connection_h *connection) {
    *connection = reinterpret_cast<connection_h>(connection_object);
    return CONNECTION_ERROR_NONE;
  });
  ON_CALL(platform, connection_get_type).WillByDefault([this](connection_h, auto *type) {
    *type = network;
    return CONNECTION_ERROR_NONE;
  });
  ON_CALL(platform, connection_set_type_changed_cb)
      .WillByDefault([this](connection_h, connection_type_changed_cb callback, void *) {
        network_callback = callback;
        return CONNECTION_ERROR_NONE;
      });
  ON_CALL(platform, connection_unset_type_changed_cb).WillByDefault([this](connection_h) {
    network_callback = nullptr;
    return CONNECTION_ERROR_NONE;
  });
  ON_CALL(platform, runtime_info_get_value_bool(RUNTIME_INFO_KEY_CHARGER_CONNECTED, _))
      .WillByDefault([this](runtime_info_key_e, bool *value) {
        *value = charger;
        return RUNTIME_INFO_ERROR_NONE;
      });
  ON_CALL(platform, runtime_info_set_changed_cb)
      .WillByDefault([this](runtime_info_key_e, runtime_info_changed_cb callback, void *) {
        charger_callback = callback;
        return RUNTIME_INFO_ERROR_NONE;
      });
  ON_CALL(platform, runtime_info_unset_changed_cb).WillByDefault([this](runtime_info_key_e) {
    charger_callback = nullptr;
    return RUNTIME_INFO_ERROR_NONE;
  });
  ON_CALL(platform, device_display_get_state).WillByDefault([this](display_state_e *state) {
    *state = display;
    return DEVICE_ERROR_NONE;
  });
  ON_CALL(platform, device_add_callback)
      .WillByDefault([this](device_callback_e, device_changed_cb callback, void *) {
        display_callback = callback;
        return DEVICE_ERROR_NONE;
      });
  ON_CALL(platform, device_remove_callback)
      .WillByDefault([this](device_callback_e, device_changed_cb) {
        display_callback = nullptr;
        return DEVICE_ERROR_NONE;
      });
  ON_CALL(platform, alarmmgr_set_cb).WillByDefault([this](alarm_cb_t handler, void *) {
    alarm_callback = handler;
    return ALARMMGR_RESULT_SUCCESS;
  });
  ON_CALL(platform, alarmmgr_add_alarm)
      .WillByDefault([this](int, time_t seconds, time_t, const char *, alarm_id_t *id) {
        *id = ++last_alarm;
        alarms[*id] = seconds;
        return ALARMMGR_RESULT_SUCCESS;
      });
  ON_CALL(platform, alarmmgr_remove_alarm).WillByDefault([this](alarm_id_t id) {
    return alarms.erase(id) == 1 ? ALARMMGR_RESULT_SUCCESS : ERR_ALARM_INVALID_ID;
  });
  ON_CALL(platform, vconf_notify_key_changed)
      .WillByDefault([this](const char *, vconf_callback_fn callback, void *) {
        setting_callback = callback;
        return VCONF_OK;
      });
  ON_CALL(platform, vconf_get_int).WillByDefault([this](const char *, int *value) {
    if (!setting_readable) return VCONF_ERROR;
    *value = setting;
    return VCONF_OK;
  });
  clear_captured_log();
}

SettingTest::~SettingTest() {
  for (alarm_id_t id = 0; id <= last_alarm; ++id) forget_alarm(id);
  // The unit's state is the process's: leave it as it was found.
  ::testing::Mock::VerifyAndClearExpectations(&platform);
  ::testing::Mock::VerifyAndClearExpectations(&transport);
  set_auto_backup(0);
  stop_wifi_monitor();
  stop_charger_monitor();
  stop_screen_monitor();
  deinit_backup_resource();
  for (std::size_t i = 0; i < fake_daemon.backup_requests.size(); ++i) PendingWork::end();
  fake_daemon.backup_requests.clear();
}

void SettingTest::set_charger(bool connected) {
  charger = connected;
  if (charger_callback != nullptr) charger_callback(RUNTIME_INFO_KEY_CHARGER_CONNECTED, nullptr);
}

void SettingTest::set_network(connection_type_e type) {
  network = type;
  if (network_callback != nullptr) network_callback(type, nullptr);
}

void SettingTest::set_display(display_state_e state) {
  display = state;
  if (display_callback != nullptr)
    display_callback(DEVICE_CALLBACK_DISPLAY_STATE, nullptr, nullptr);
}

void SettingTest::satisfy_conditions() {
  set_charger(true);
  set_network(CONNECTION_TYPE_WIFI);
  set_display(DISPLAY_STATE_SCREEN_OFF);
}
