#include "state/power.h"

#include "state/clock.h"
#include "state/state_file.h"

namespace embedded {
namespace {

constexpr char kHolder[] = "pid";
constexpr char kUntil[] = "until_ms";

}  // namespace

bool set_power_lock(const std::string &device, const char *lock, int pid, int timeout_ms) {
  return edit_state(device, kPowerFile, [&](GKeyFile *file) {
    g_key_file_remove_group(file, lock, nullptr);
    if (pid != 0) {
      g_key_file_set_integer(file, lock, kHolder, pid);
      if (timeout_ms > 0) g_key_file_set_int64(file, lock, kUntil, machine_now_ms() + timeout_ms);
    }
    return true;
  });
}

int power_lock_holder(const std::string &device, const char *lock) {
  const KeyFilePtr file = read_state(device, kPowerFile);
  if (file == nullptr) return 0;
  const gint64 until = number_of(file.get(), lock, kUntil, 0);
  if (until != 0 && until <= machine_now_ms()) return 0;
  return static_cast<int>(number_of(file.get(), lock, kHolder, 0));
}

void drop_power_locks(const std::string &device, int pid) {
  edit_state(device, kPowerFile, [pid](GKeyFile *file) {
    bool dropped = false;
    for (const char *lock : {kCpuLock, kDisplayLock}) {
      if (number_of(file, lock, kHolder, 0) == pid) {
        dropped = g_key_file_remove_group(file, lock, nullptr) || dropped;
      }
    }
    return dropped;
  });
}

}  // namespace embedded
