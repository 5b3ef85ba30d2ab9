#include "quarn_d_conditions/conditions.h"

#include <atomic>

#include "platform_device.h"
#include "platform_runtime_info.h"
#include "quarn_d_conditions/alarm.h"
#include "quarn_d_conditions/setting_observer.h"
#include "quarn_log.h"

connection_h g_connection = nullptr;
char auto_backup_enabled = 0;

namespace {

constexpr int kSucceeded = 1;
constexpr int kFailed = 0;
constexpr int kConditionAlarmSeconds = 3600;
/** No state of the display: whatever is seen first is a change. */
constexpr int kNoDisplayState = -1;

// The backup worker reads these two.
std::atomic<int> g_connection_type{CONNECTION_TYPE_DISCONNECTED};
std::atomic<char> wifi_monitor_started{0};

char charger_connected_state = 0;
char charger_monitor_started = 0;
char lcd_off = 0;
char screen_monitor_started = 0;
int last_display_state = kNoDisplayState;

void _connection_type_changed_cb(connection_type_e type, void *) {
  g_connection_type = type;
  if (auto_backup_enabled) check_backup_condition();
  tell_setting_observer();
}

/** Read the charger's state. @return RUNTIME_INFO_ERROR_NONE, or a logged error */
int read_charger(char *connected) {
  bool value = false;
  const int ret = runtime_info_get_value_bool(RUNTIME_INFO_KEY_CHARGER_CONNECTED, &value);
  if (ret != RUNTIME_INFO_ERROR_NONE) {
    LOGE("Getting runtime info failed %d", ret);
    return ret;
  }
  *connected = value ? 1 : 0;
  return ret;
}

void _charger_changed_cb(runtime_info_key_e key, void *) {
  LOGI("_charger_changed_cb");
  if (key != RUNTIME_INFO_KEY_CHARGER_CONNECTED) {
    LOGE("Runtime info key mismatch %d", key);
    return;
  }
  if (read_charger(&charger_connected_state) != RUNTIME_INFO_ERROR_NONE) return;
  check_backup_condition();
}

void _screen_changed_cb(device_callback_e type, void *, void *) {
  if (type != DEVICE_CALLBACK_DISPLAY_STATE) {
    LOGE("unexpected callback : %d", type);
    return;
  }
  display_state_e state = DISPLAY_STATE_NORMAL;
  if (device_display_get_state(&state) != DEVICE_ERROR_NONE) {
    LOGE("Cannot get display state");
    return;
  }
  lcd_off = state == DISPLAY_STATE_SCREEN_OFF ? 1 : 0;
  if (state != last_display_state) check_backup_condition();
  last_display_state = state;
  tell_setting_observer();
}

}  // namespace

int wifi_connected() {
  return wifi_monitor_started && g_connection_type == CONNECTION_TYPE_WIFI ? 1 : 0;
}

int start_wifi_monitor() {
  if (wifi_monitor_started) {
    LOGI("start_wifi_monitor : already initialized");
    return wifi_monitor_started;
  }
  connection_type_e type = CONNECTION_TYPE_DISCONNECTED;
  if (connection_get_type(g_connection, &type) != CONNECTION_ERROR_NONE) {
    LOGE("connection_get_type failed");
    return kFailed;
  }
  g_connection_type = type;
  const int ret =
      connection_set_type_changed_cb(g_connection, _connection_type_changed_cb, nullptr);
  if (ret != CONNECTION_ERROR_NONE) {
    LOGE("connection_set_type_changed_cb failed %d", ret);
    return kFailed;
  }
  // Nobody tells of a change between the first look and the registration.
  if (connection_get_type(g_connection, &type) == CONNECTION_ERROR_NONE) g_connection_type = type;
  wifi_monitor_started = 1;
  return kSucceeded;
}

int stop_wifi_monitor() {
  if (!wifi_monitor_started) {
    LOGI("stop_wifi_monitor : not initialized");
    return kSucceeded;
  }
  const int ret = connection_unset_type_changed_cb(g_connection);
  if (ret != CONNECTION_ERROR_NONE) {
    LOGE("connection_unset_type_changed_cb failed %d", ret);
    return kFailed;
  }
  g_connection_type = CONNECTION_TYPE_DISCONNECTED;
  wifi_monitor_started = 0;
  return kSucceeded;
}

int charger_connected() {
  char connected = 0;
  read_charger(&connected);
  return connected;
}

int start_charger_monitor() {
  if (charger_monitor_started) {
    LOGI("start_charger_monitor : already initialized");
    return charger_monitor_started;
  }
  if (read_charger(&charger_connected_state) != RUNTIME_INFO_ERROR_NONE) return kFailed;
  const int ret =
      runtime_info_set_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED, _charger_changed_cb, nullptr);
  if (ret != RUNTIME_INFO_ERROR_NONE) {
    LOGE("Failed to set changed cb : RUNTIME_INFO_KEY_CHANGER_CONNECTED(%d)", ret);
    return kFailed;
  }
  charger_monitor_started = 1;
  return kSucceeded;
}

int stop_charger_monitor() {
  if (!charger_monitor_started) {
    LOGI("stop_charger_monitor : not initialized");
    return kSucceeded;
  }
  const int ret = runtime_info_unset_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED);
  if (ret != RUNTIME_INFO_ERROR_NONE) {
    LOGE("Failed to unset changed cb : RUNTIME_INFO_KEY_CHANGER_CONNECTED(%d)", ret);
    return kFailed;
  }
  charger_connected_state = 0;
  charger_monitor_started = 0;
  return kSucceeded;
}

int start_screen_monitor() {
  if (screen_monitor_started) {
    LOGI("start_screen_monitor : already initialized");
    return screen_monitor_started;
  }
  display_state_e state = DISPLAY_STATE_NORMAL;
  if (device_display_get_state(&state) != DEVICE_ERROR_NONE) {
    LOGE("fail : device_display_get_state");
    return kFailed;
  }
  lcd_off = state == DISPLAY_STATE_SCREEN_OFF ? 1 : 0;
  const int ret = device_add_callback(DEVICE_CALLBACK_DISPLAY_STATE, _screen_changed_cb, nullptr);
  if (ret != DEVICE_ERROR_NONE) {
    LOGE("Failed to set changed cb for screen : %d", ret);
    return kFailed;
  }
  // Nobody tells of a change between the first look and the registration.
  if (device_display_get_state(&state) == DEVICE_ERROR_NONE) {
    lcd_off = state == DISPLAY_STATE_SCREEN_OFF ? 1 : 0;
  }
  screen_monitor_started = 1;
  return kSucceeded;
}

int stop_screen_monitor() {
  if (!screen_monitor_started) {
    LOGI("stop_screen_monitor : not initialized");
    return kSucceeded;
  }
  const int ret = device_remove_callback(DEVICE_CALLBACK_DISPLAY_STATE, _screen_changed_cb);
  if (ret != DEVICE_ERROR_NONE) {
    LOGE("Failed to unset changed cb for screen : %d", ret);
    return kFailed;
  }
  screen_monitor_started = 0;
  // The display may change while nobody watches: what a new monitor sees first
  // must count as a change again.
  last_display_state = kNoDisplayState;
  return kSucceeded;
}

void start_backup_condition_monitor() {
  if (!start_screen_monitor()) LOGE("fail to start screen monitor");
}

void stop_backup_condition_monitor() {
  if (!stop_screen_monitor()) LOGE("fail to stop screen monitor");
}

int backup_condition_pass() {
  const int charger = charger_connected();
  const int wifi = wifi_connected();
  if (charger && wifi && lcd_off) {
    LOGI("satisfied for auto backup condition");
    return 1;
  }
  LOGI("Charger_Conn=>%d, Wifi_Conn=>%d, Lcd_Off=>%d", charger, wifi, lcd_off);
  return 0;
}

void check_backup_condition() {
  if (backup_condition_pass()) {
    // Anew at every change: the conditions must hold for a whole hour.
    remove_condition_alarm();
    alarm_id_t id = kNoAlarm;
    const int ret = add_backup_alarm(kConditionAlarmSeconds, &id);
    if (ret != ALARMMGR_RESULT_SUCCESS) {
      LOGE("fail : alarmmgr_add_alarm, err=%d", ret);
    } else {
      _alarm_id = id;
      LOGI("alarm registered for auto backup. id:%d", _alarm_id);
    }
  } else if (_alarm_id != kNoAlarm) {
    LOGI("auto backup`s condition was broken");
    remove_condition_alarm();
  }
}
