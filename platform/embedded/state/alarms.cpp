#include "state/alarms.h"

#include <algorithm>
#include <limits>
#include <map>

#include "state/state_file.h"

namespace embedded {
namespace {

constexpr char kCountersGroup[] = "counters";
constexpr char kNextId[] = "next_id";
constexpr char kNextFired[] = "next_fired";
constexpr char kAlarmPrefix[] = "alarm ";
constexpr char kFiredPrefix[] = "fired ";
constexpr char kOwner[] = "owner";
constexpr char kDue[] = "due_ms";
constexpr char kInterval[] = "interval_ms";
constexpr char kId[] = "id";

std::string alarm_group(int id) { return kAlarmPrefix + std::to_string(id); }

Alarm alarm_of(GKeyFile *file, const char *group, int id) {
  return {id, text_of(file, group, kOwner), number_of(file, group, kDue, 0),
          number_of(file, group, kInterval, 0)};
}

/** Number behind @p prefix in a group's name, in the order of the numbers. */
std::map<gint64, std::string> numbered_groups(GKeyFile *file, const char *prefix) {
  std::map<gint64, std::string> found;
  const GTexts groups(g_key_file_get_groups(file, nullptr));
  for (gchar **group = groups.get(); *group != nullptr; ++group) {
    if (!g_str_has_prefix(*group, prefix)) continue;
    gint64 number = 0;
    if (g_ascii_string_to_signed(*group + std::string(prefix).size(), 10, 1,
                                 std::numeric_limits<gint64>::max(), &number, nullptr)) {
      found.emplace(number, *group);
    }
  }
  return found;
}

std::vector<Alarm> alarms_of(GKeyFile *file) {
  std::vector<Alarm> alarms;
  for (const auto &[number, group] : numbered_groups(file, kAlarmPrefix)) {
    alarms.push_back(alarm_of(file, group.c_str(), static_cast<int>(number)));
  }
  std::stable_sort(alarms.begin(), alarms.end(),
                   [](const Alarm &a, const Alarm &b) { return a.due_ms < b.due_ms; });
  return alarms;
}

void queue_firing(GKeyFile *file, const Alarm &alarm, std::int64_t now) {
  const gint64 number = number_of(file, kCountersGroup, kNextFired, 1);
  g_key_file_set_int64(file, kCountersGroup, kNextFired, number + 1);
  const std::string fired = kFiredPrefix + std::to_string(number);
  g_key_file_set_integer(file, fired.c_str(), kId, alarm.id);
  g_key_file_set_string(file, fired.c_str(), kOwner, alarm.owner.c_str());

  const std::string group = alarm_group(alarm.id);
  if (alarm.interval_ms <= 0) {
    g_key_file_remove_group(file, group.c_str(), nullptr);
    return;
  }
  // Periods that passed while nobody looked are one firing, as on a device that slept.
  const std::int64_t missed =
      now > alarm.due_ms ? (now - alarm.due_ms) / alarm.interval_ms : std::int64_t{0};
  g_key_file_set_int64(file, group.c_str(), kDue, alarm.due_ms + (missed + 1) * alarm.interval_ms);
}

}  // namespace

int add_alarm(const std::string &device, const Alarm &alarm) {
  int id = 0;
  // Whoever adds an alarm is about to go on with something else.
  const bool added = edit_state_behind(device, kAlarmsFile, [&](GKeyFile *file) {
    id = static_cast<int>(number_of(file, kCountersGroup, kNextId, 1));
    while (id <= 0 || g_key_file_has_group(file, alarm_group(id).c_str())) {
      id = id <= 0 || id == std::numeric_limits<int>::max() ? 1 : id + 1;
    }
    const int next = id == std::numeric_limits<int>::max() ? 1 : id + 1;
    g_key_file_set_integer(file, kCountersGroup, kNextId, next);
    const std::string group = alarm_group(id);
    g_key_file_set_string(file, group.c_str(), kOwner, alarm.owner.c_str());
    g_key_file_set_int64(file, group.c_str(), kDue, alarm.due_ms);
    g_key_file_set_int64(file, group.c_str(), kInterval, alarm.interval_ms);
    return true;
  });
  return added ? id : 0;
}

bool remove_alarm(const std::string &device, const std::string &owner, int id) {
  return edit_state(device, kAlarmsFile, [&](GKeyFile *file) {
    bool found = false;
    const std::string group = alarm_group(id);
    if (text_of(file, group.c_str(), kOwner) == owner) {
      found = g_key_file_remove_group(file, group.c_str(), nullptr);
    }
    for (const auto &[number, fired] : numbered_groups(file, kFiredPrefix)) {
      if (number_of(file, fired.c_str(), kId, 0) == id &&
          text_of(file, fired.c_str(), kOwner) == owner) {
        found = g_key_file_remove_group(file, fired.c_str(), nullptr) || found;
      }
    }
    return found;
  });
}

bool list_alarms(const std::string &device, std::vector<Alarm> *alarms) {
  // An alarm that was added is listed, also while it is on its way to the disk.
  const StateLock lock(device);
  const KeyFilePtr file = read_state(device, kAlarmsFile);
  if (file == nullptr) return false;
  *alarms = alarms_of(file.get());
  return true;
}

bool fire_alarm(const std::string &device, int id, std::int64_t now) {
  return edit_state(device, kAlarmsFile, [&](GKeyFile *file) {
    const std::string group = alarm_group(id);
    if (!g_key_file_has_group(file, group.c_str())) return false;
    Alarm alarm = alarm_of(file, group.c_str(), id);
    alarm.due_ms = now;
    queue_firing(file, alarm, now);
    return true;
  });
}

int fire_due_alarms(const std::string &device, std::int64_t now) {
  int fired = 0;
  const bool written = edit_state(device, kAlarmsFile, [&](GKeyFile *file) {
    for (const Alarm &alarm : alarms_of(file)) {
      if (alarm.due_ms > now) break;
      queue_firing(file, alarm, now);
      ++fired;
    }
    return fired > 0;
  });
  return written ? fired : 0;
}

std::optional<std::int64_t> next_due(const std::string &device) {
  std::vector<Alarm> alarms;
  if (!list_alarms(device, &alarms) || alarms.empty()) return std::nullopt;
  return alarms.front().due_ms;
}

bool has_fired_alarms(const std::string &device, const std::string &owner) {
  const KeyFilePtr file = read_state(device, kAlarmsFile);
  if (file == nullptr) return false;
  const auto fired = numbered_groups(file.get(), kFiredPrefix);
  return std::any_of(fired.begin(), fired.end(), [&](const auto &one) {
    return text_of(file.get(), one.second.c_str(), kOwner) == owner;
  });
}

std::vector<int> take_fired_alarms(const std::string &device, const std::string &owner) {
  std::vector<int> taken;
  const bool written = edit_state(device, kAlarmsFile, [&](GKeyFile *file) {
    for (const auto &[number, group] : numbered_groups(file, kFiredPrefix)) {
      if (text_of(file, group.c_str(), kOwner) != owner) continue;
      taken.push_back(static_cast<int>(number_of(file, group.c_str(), kId, 0)));
      g_key_file_remove_group(file, group.c_str(), nullptr);
    }
    return !taken.empty();
  });
  if (!written) taken.clear();
  return taken;
}

}  // namespace embedded
