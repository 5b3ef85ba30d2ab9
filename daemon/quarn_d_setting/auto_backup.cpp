
#include <cstdint>

#include "backup_transport.h"
#include "platform_settings.h"
#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_conditions/alarm.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_conditions/setting_observer.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/power.h"
#include "quarn_log.h"

namespace {

constexpr std::uint64_t kBackupPeriodMs = 86400000;
constexpr std::uint64_t kMillisecondsPerSecond = 1000;
constexpr int kPeriodicAlarmSeconds = 43200;
constexpr double kAtOnce = 0.0;
constexpr int kSettingOn = 1;
constexpr int kSettingOff = 0;

bool alarm_service_joined = false;

/** An alarm that nobody removes. */
void add_periodic_alarm() {
  alarm_id_t id = kNoAlarm;
  const int ret = add_backup_alarm(kPeriodicAlarmSeconds, &id);
  if (ret != ALARMMGR_RESULT_SUCCESS) LOGI("alarmmgr_add_alarm failed[%d]", ret);
}

void request_auto_backup() {
  LOGI("request for auto backup");
  if (!backup_condition_pass() || !auto_backup_enabled) {
    LOGI("auto backup condition is invalid");
  } else if (g_is_backing_up) {
    LOGI("cannot request back up.(now backing up)");
  } else {
    request_backup(nullptr);
  }
}

int _alarm_timer_expired_cb(alarm_id_t alarm_id, void *) {
  _alarm_id = kNoAlarm;
  forget_alarm(alarm_id);
  tell_setting_observer();
  // Unsigned: a last backup in the future, or one that cannot be read, is due.
  const std::uint64_t term =
      static_cast<std::uint64_t>(_get_current_timestamp()) - get_last_backup_time();
  LOGI("alarm(id:%d) was expired. backup time term in second = %llu", alarm_id,
       static_cast<unsigned long long>(term / kMillisecondsPerSecond));
  if (term <= kBackupPeriodMs) {
    LOGI("auto backup period wasn't expired yet");
  } else {
    request_auto_backup();
  }

  if (is_idle_status()) {
    // A process that lived until its own alarm has no other one pending: without a new one nothing
    // would start the daemon again, and automatic backup would have ended for good.
    if (auto_backup_enabled && !any_alarm_known()) add_periodic_alarm();
    LOGI("terminate quarn");
    request_quarn_terminate(kAtOnce, false);
  } else {
    LOGI("add alarm for 5 min");
    add_periodic_alarm();
  }
  return 0;
}

/** Read the setting. @return true, or false with a log line */
bool read_backup_status(int *status) {
  if (vconf_get_int(kBackupStatusKey, status) != VCONF_OK) {
    LOGE("cannot read backup status value from vconf");
    return false;
  }
  return true;
}

void _backup_status_change_cb(keynode_t *, void *) {
  int status = kSettingOff;
  if (!read_backup_status(&status)) return;
  if (status == kSettingOn) {
    LOGI("try to backup setting on");
    set_auto_backup(kSettingOn);
  } else if (status == kSettingOff) {
    LOGI("try to backup setting off");
    set_auto_backup(kSettingOff);
  }
}

}  // namespace

void init_backup_resource() {
  LOGI("init backup resource");
  if (connection_create(&g_connection) != CONNECTION_ERROR_NONE) LOGE("connection_create failed");
  alarm_service_joined = true;
  if (alarmmgr_init(kAlarmOwner) != ALARMMGR_RESULT_SUCCESS) LOGE("alarmmgr_init failed");
  if (alarmmgr_set_cb(_alarm_timer_expired_cb, nullptr) != ALARMMGR_RESULT_SUCCESS) {
    LOGE("alarmmgr_set_cb failed");
  }
  add_periodic_alarm();
}

void deinit_backup_resource() {
  LOGI("connection destroy ~");
  if (g_connection != nullptr && connection_destroy(g_connection) != CONNECTION_ERROR_NONE) {
    LOGE("connection_destroy failed");
  }
  g_connection = nullptr;
  LOGI("backup-transport deinit ~");
  backup_trans_deinit();
  LOGI("remove alarm ~");
  remove_condition_alarm();
  if (alarm_service_joined) alarmmgr_fini();
  alarm_service_joined = false;
}

void set_auto_backup(int on) {
  const char wanted = on != 0 ? 1 : 0;
  if (auto_backup_enabled == wanted) {
    LOGI("backup state is aleady %d", on);
    return;
  }
  auto_backup_enabled = wanted;
  if (auto_backup_enabled) {
    start_backup_condition_monitor();
    check_backup_condition();
  } else {
    stop_backup_condition_monitor();
    if (_alarm_id != kNoAlarm) {
      LOGI("auto backup`s condition is broken");
      remove_condition_alarm();
    }
  }
  LOGI("now auto backup state is %d", auto_backup_enabled);
  tell_setting_observer();
}

void monitor_auto_backup_status() {
  if (vconf_notify_key_changed(kBackupStatusKey, _backup_status_change_cb, nullptr) != VCONF_OK) {
    LOGE("vconf_notify_key_changed() failed");
  }
  int status = kSettingOff;
  if (!read_backup_status(&status)) return;
  if (status == kSettingOn) {
    LOGI("try to backup setting on");
    set_auto_backup(kSettingOn);
  } else {
    LOGI("backup off");
  }
}
