#include "quarn_d_utils/power.h"

#include <mutex>

#include "platform_device.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_log.h"

namespace {

constexpr int kNoTimeout = 0;

// Held during the device's call too, so that the device sees the takes and
// releases of several threads in the order in which they were counted.
std::mutex power_mutex;
unsigned int power_lock_takers = 0;
bool power_lock_held = false;

}  // namespace

void request_power_lock(bool lock) {
  const std::lock_guard<std::mutex> guard(power_mutex);
  int ret = DEVICE_ERROR_NONE;
  if (lock) {
    ++power_lock_takers;
    power_lock_held = true;
    ret = device_power_request_lock(POWER_LOCK_CPU, kNoTimeout);
  } else {
    if (power_lock_takers > 0 && --power_lock_takers > 0) return;
    power_lock_held = false;
    ret = device_power_release_lock(POWER_LOCK_CPU);
  }
  if (ret != DEVICE_ERROR_NONE) LOGE("couldn't set cpu lock state");
}

bool is_idle_status() {
  if (PendingWork::any()) return false;
  const std::lock_guard<std::mutex> guard(power_mutex);
  return !power_lock_held;
}
