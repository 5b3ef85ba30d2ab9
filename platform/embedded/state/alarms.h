/**
 * @file alarms.h
 * @brief An embedded device's alarms: alarms.ini.
 *
 * An alarm that fell due is queued as fired until its owner takes it; each
 * firing is taken once. Any thread.
 */
#ifndef QUARN_EMBEDDED_ALARMS_H
#define QUARN_EMBEDDED_ALARMS_H

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace embedded {

inline constexpr char kAlarmsFile[] = "alarms.ini";

struct Alarm {
  int id = 0;
  std::string owner;
  std::int64_t due_ms = 0;      /**< Unix epoch, milliseconds */
  std::int64_t interval_ms = 0; /**< 0: once */
};

/**
 * Add an alarm, whose own id is ignored; it is on its way to the disk when this
 * returns, see wait_for_state(). @return its id, 0 on failure
 */
int add_alarm(const std::string &device, const Alarm &alarm);

/** Remove an alarm of @p owner, with its firings that were not taken. False when there is none. */
bool remove_alarm(const std::string &device, const std::string &owner, int id);

/** The pending alarms, the next one first. False when they cannot be read. */
bool list_alarms(const std::string &device, std::vector<Alarm> *alarms);

/** Queue the alarm @p id as fired at @p now_ms; false when there is none. */
bool fire_alarm(const std::string &device, int id, std::int64_t now_ms);

/** Queue every alarm that is due. @return how many were */
int fire_due_alarms(const std::string &device, std::int64_t now_ms);

/** When the next alarm falls due; none without an alarm. */
std::optional<std::int64_t> next_due(const std::string &device);

/** True while firings wait to be taken by @p owner. */
bool has_fired_alarms(const std::string &device, const std::string &owner);

/** Take the firings of @p owner off the queue, first ones first. */
std::vector<int> take_fired_alarms(const std::string &device, const std::string &owner);

}  // namespace embedded

#endif
