#include "platform_alarm.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_log.h"

alarm_id_t _alarm_id = kNoAlarm;

namespace {
constexpr time_t kOnce = 0;
}

void remove_condition_alarm() {
  if (_alarm_id == kNoAlarm) return;
  const int ret = alarmmgr_remove_alarm(_alarm_id);
  if (ret == ALARMMGR_RESULT_SUCCESS) {
    LOGI("alarm(id:%d) was removed", _alarm_id);
  } else {
    LOGE("fail : alarmmgr_remove_alarm(id:%d), err=%d", _alarm_id, ret);
  }
  _alarm_id = kNoAlarm;
}

int add_backup_alarm(int seconds, alarm_id_t *id) {
  return alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, seconds, kOnce, kAlarmOwner, id);
}
