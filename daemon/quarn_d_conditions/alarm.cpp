#include "quarn_d_conditions/alarm.h"

#include <cstdint>
#include <map>

#include "platform_alarm.h"
#include "quarn_d_conditions/setting_observer.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_log.h"

alarm_id_t _alarm_id = kNoAlarm;

namespace {

constexpr time_t kOnce = 0;
constexpr std::int64_t kMillisecondsPerSecond = 1000;

/** When the alarms that this process added fall due; the service cannot be asked. */
std::map<alarm_id_t, std::int64_t> &alarms_due() {
  static auto *due = new std::map<alarm_id_t, std::int64_t>;
  return *due;
}

}  // namespace

void remove_condition_alarm() {
  if (_alarm_id == kNoAlarm) return;
  const int ret = alarmmgr_remove_alarm(_alarm_id);
  if (ret == ALARMMGR_RESULT_SUCCESS) {
    LOGI("alarm(id:%d) was removed", _alarm_id);
  } else {
    LOGE("fail : alarmmgr_remove_alarm(id:%d), err=%d", _alarm_id, ret);
  }
  forget_alarm(_alarm_id);
  _alarm_id = kNoAlarm;
  tell_setting_observer();
}

int add_backup_alarm(int seconds, alarm_id_t *id) {
  const int ret = alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, seconds, kOnce, kAlarmOwner, id);
  if (ret == ALARMMGR_RESULT_SUCCESS) {
    alarms_due()[*id] = _get_current_timestamp() + seconds * kMillisecondsPerSecond;
    tell_setting_observer();
  }
  return ret;
}

void forget_alarm(alarm_id_t id) { alarms_due().erase(id); }

bool any_alarm_known() { return !alarms_due().empty(); }

std::int64_t condition_alarm_due() {
  const auto found = alarms_due().find(_alarm_id);
  return found == alarms_due().end() ? 0 : found->second;
}

std::int64_t next_alarm_due() {
  std::int64_t next = 0;
  for (const auto &alarm : alarms_due()) {
    if (next == 0 || alarm.second < next) next = alarm.second;
  }
  return next;
}
