#include <sys/time.h>

#include <cstdint>

#include "platform_clock.h"
#include "platform_system_info.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"

namespace {
constexpr std::int64_t kMillisecondsPerSecond = 1000;
constexpr std::int64_t kMicrosecondsPerMillisecond = 1000;
}  // namespace

void get_device_info(char **model, char **serial) {
  const int ret = system_info_get_platform_string(SYSTEM_INFO_KEY_MODEL_NAME, model);
  if (ret != SYSTEM_INFO_ERROR_NONE) LOGE("Failed to get system information(%d)", ret);

  const TelephonyPtr modem(tel_init(nullptr));
  if (!modem) {
    LOGE("Fail: to get device serial number");
    *serial = nullptr;
    return;
  }
  *serial = tel_get_misc_me_imei_sync(modem.get());
}

std::int64_t _get_current_timestamp() {
  timeval now{};
  gettimeofday(&now, nullptr);
  const std::int64_t time =
      now.tv_sec * kMillisecondsPerSecond + now.tv_usec / kMicrosecondsPerMillisecond;
  return platform_clock_offset_ms == nullptr ? time : time + platform_clock_offset_ms();
}
