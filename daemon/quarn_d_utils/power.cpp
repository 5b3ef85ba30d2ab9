#include "quarn_d_utils/power.h"

#include "platform_device.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

constexpr int kNoTimeout = 0;

// Held during the device's call too, so that the device sees the takes and
// releases of several threads in the order in which they were counted.
Mutex power_mutex;
unsigned int power_lock_takers QUARN_GUARDED_BY(power_mutex) = 0;
bool power_lock_held QUARN_GUARDED_BY(power_mutex) = false;

}  // namespace

void request_power_lock(bool lock) {
  const MutexLock guard(power_mutex);
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
  const MutexLock guard(power_mutex);
  return !power_lock_held;
}
