#include "platform_alarm.h"

#include <glib.h>

#include <limits>
#include <memory>
#include <string>

#include "state/alarms.h"
#include "state/state_file.h"
#include "state/watch.h"

namespace {

constexpr std::int64_t kMillisInSecond = 1000;
/** The longest span that is accepted, so that its end is still a time. */
constexpr time_t kMaxSeconds = std::numeric_limits<int>::max();

struct Owner {
  std::string name;
  alarm_cb_t handler = nullptr;
  void *user_data = nullptr;
  guint pending = 0;
  std::unique_ptr<embedded::StateWatch> watch;
};

Owner &owner() {
  static auto *registered = new Owner;
  return *registered;
}

void deliver() {
  const std::string device = embedded::current_device();
  if (owner().handler == nullptr || !embedded::has_fired_alarms(device, owner().name)) return;
  for (const int id : embedded::take_fired_alarms(device, owner().name)) {
    if (owner().handler != nullptr) owner().handler(id, owner().user_data);
  }
}

gboolean deliver_later(gpointer) {
  owner().pending = 0;
  deliver();
  return G_SOURCE_REMOVE;
}

}  // namespace

int alarmmgr_init(const char *pkg_name) {
  if (pkg_name == nullptr || *pkg_name == '\0') return ERR_ALARM_INVALID_PARAM;
  if (embedded::current_device().empty()) return ERR_ALARM_SYSTEM_FAIL;
  owner().name = pkg_name;
  return ALARMMGR_RESULT_SUCCESS;
}

void alarmmgr_fini(void) {
  embedded::wait_for_state();
  if (owner().pending != 0) g_source_remove(owner().pending);
  owner().pending = 0;
  owner().handler = nullptr;
  owner().watch.reset();
  owner().name.clear();
}

int alarmmgr_set_cb(alarm_cb_t handler, void *user_param) {
  if (owner().name.empty()) return ERR_ALARM_NOT_INITIALIZED;
  if (handler == nullptr) return ERR_ALARM_INVALID_PARAM;
  owner().handler = handler;
  owner().user_data = user_param;
  owner().watch = std::make_unique<embedded::StateWatch>(embedded::current_device(),
                                                         embedded::kAlarmsFile, deliver);
  if (!*owner().watch) return ERR_ALARM_SYSTEM_FAIL;
  // What fired before anybody listened follows once the caller has finished its start.
  if (owner().pending == 0) owner().pending = g_idle_add(deliver_later, nullptr);
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_add_alarm(int alarm_type, time_t trigger_at_time, time_t interval,
                       const char *destination, alarm_id_t *alarm_id) {
  if (owner().name.empty()) return ERR_ALARM_NOT_INITIALIZED;
  if (alarm_type != ALARM_TYPE_DEFAULT || trigger_at_time < 0 || trigger_at_time > kMaxSeconds ||
      interval < 0 || interval > kMaxSeconds || destination == nullptr || *destination == '\0' ||
      alarm_id == nullptr) {
    return ERR_ALARM_INVALID_PARAM;
  }
  embedded::Alarm alarm;
  alarm.owner = destination;
  alarm.due_ms = embedded::now_ms() + trigger_at_time * kMillisInSecond;
  alarm.interval_ms = interval * kMillisInSecond;
  const int id = embedded::add_alarm(embedded::current_device(), alarm);
  if (id == 0) return ERR_ALARM_SYSTEM_FAIL;
  *alarm_id = id;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_remove_alarm(alarm_id_t alarm_id) {
  if (owner().name.empty()) return ERR_ALARM_NOT_INITIALIZED;
  return embedded::remove_alarm(embedded::current_device(), owner().name, alarm_id)
             ? ALARMMGR_RESULT_SUCCESS
             : ERR_ALARM_INVALID_ID;
}
