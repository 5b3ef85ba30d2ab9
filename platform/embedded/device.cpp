#include "platform_device.h"

#include <unistd.h>

#include <list>
#include <memory>
#include <string>

#include "state/fact_watch.h"
#include "state/power.h"

namespace {

struct DisplayWatch {
  device_changed_cb callback;
  std::unique_ptr<embedded::FactWatch> watch;
};

std::list<DisplayWatch> &display_watches() {
  static auto *watches = new std::list<DisplayWatch>;
  return *watches;
}

display_state_e state_of(const std::string &display) {
  if (display == "dim") return DISPLAY_STATE_SCREEN_DIM;
  if (display == "off") return DISPLAY_STATE_SCREEN_OFF;
  return DISPLAY_STATE_NORMAL;
}

const char *lock_name(power_lock_e type) {
  return type == POWER_LOCK_CPU ? embedded::kCpuLock : embedded::kDisplayLock;
}

bool known_lock(power_lock_e type) { return type == POWER_LOCK_CPU || type == POWER_LOCK_DISPLAY; }

}  // namespace

int device_display_get_state(display_state_e *state) {
  if (state == nullptr) return DEVICE_ERROR_INVALID_PARAMETER;
  embedded::Fact fact;
  if (!embedded::get_fact(embedded::current_device(), embedded::kDisplay, &fact)) {
    return DEVICE_ERROR_OPERATION_FAILED;
  }
  *state = state_of(fact.value);
  return DEVICE_ERROR_NONE;
}

int device_add_callback(device_callback_e type, device_changed_cb callback, void *user_data) {
  if (type != DEVICE_CALLBACK_DISPLAY_STATE || callback == nullptr) {
    return DEVICE_ERROR_INVALID_PARAMETER;
  }
  auto watch = std::make_unique<embedded::FactWatch>(
      embedded::kDisplay, [type, callback, user_data](const std::string &display) {
        // The value is a number in a pointer's clothes.
        callback(type, reinterpret_cast<void *>(static_cast<intptr_t>(state_of(display))),
                 user_data);
      });
  if (!*watch) return DEVICE_ERROR_OPERATION_FAILED;
  display_watches().push_back({callback, std::move(watch)});
  return DEVICE_ERROR_NONE;
}

int device_remove_callback(device_callback_e type, device_changed_cb callback) {
  if (type != DEVICE_CALLBACK_DISPLAY_STATE) return DEVICE_ERROR_INVALID_PARAMETER;
  for (auto watch = display_watches().begin(); watch != display_watches().end(); ++watch) {
    if (watch->callback != callback) continue;
    display_watches().erase(watch);
    return DEVICE_ERROR_NONE;
  }
  return DEVICE_ERROR_INVALID_PARAMETER;
}

int device_power_request_lock(power_lock_e type, int timeout_ms) {
  if (!known_lock(type) || timeout_ms < 0) return DEVICE_ERROR_INVALID_PARAMETER;
  return embedded::set_power_lock(embedded::current_device(), lock_name(type), getpid(), timeout_ms)
             ? DEVICE_ERROR_NONE
             : DEVICE_ERROR_OPERATION_FAILED;
}

int device_power_release_lock(power_lock_e type) {
  if (!known_lock(type)) return DEVICE_ERROR_INVALID_PARAMETER;
  return embedded::set_power_lock(embedded::current_device(), lock_name(type), 0, 0)
             ? DEVICE_ERROR_NONE
             : DEVICE_ERROR_OPERATION_FAILED;
}
