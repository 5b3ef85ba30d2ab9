#include <cstdint>

#include "platform_settings.h"
#include "quarn_common.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_log.h"

namespace {

constexpr std::uint64_t kUnknownTime = ~std::uint64_t{0};
constexpr double kTimeLimit = 18446744073709551616.0;  // the first that 64 bits do not hold

void store_last_backup_time(std::uint64_t time) {
  if (vconf_set_dbl(kLastTimeKey, static_cast<double>(time)) != VCONF_OK) {
    LOGE("cannot set last backup time to vconf");
    return;
  }
  LOGI("last backup time setted to %llu", static_cast<unsigned long long>(time));
}

}  // namespace

void init_last_backup_time() {
  keep_knowledge_of_last_backup();
  store_last_backup_time(0);
}

void set_last_backup_time() {
  store_last_backup_time(static_cast<std::uint64_t>(_get_current_timestamp()));
}

bool read_last_backup_time(std::uint64_t *time) {
  double value = 0;
  // written so that a stored NaN fails it as well
  if (vconf_get_dbl(kLastTimeKey, &value) != VCONF_OK || !(value >= 0 && value < kTimeLimit)) {
    return false;
  }
  *time = static_cast<std::uint64_t>(value);
  return true;
}

std::uint64_t get_last_backup_time() {
  std::uint64_t time = 0;
  if (!read_last_backup_time(&time)) {
    LOGE("cannot read last backup time from vconf");
    return kUnknownTime;
  }
  LOGI("last backup time is %llu", static_cast<unsigned long long>(time));
  return time;
}
