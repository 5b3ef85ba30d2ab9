/**
 * @file alarm.h
 * @brief The alarms that wake the daemon for automatic backups.
 *
 * Main thread only.
 */
#ifndef QUARN_D_CONDITIONS_ALARM_H
#define QUARN_D_CONDITIONS_ALARM_H

#include <cstdint>

#include "platform_alarm.h"

/** The name under which the daemon registers with the alarm service and is woken by it. */
inline constexpr char kAlarmOwner[] = "quarn";
/** No alarm. */
inline constexpr alarm_id_t kNoAlarm = 0;

/** The pending condition alarm, 0 when none. */
extern alarm_id_t _alarm_id;

/** Remove the pending condition alarm, if any, and log it. */
void remove_condition_alarm();
/** Add a one-shot alarm @p seconds from now. @return the service's result */
[[nodiscard]] int add_backup_alarm(int seconds, alarm_id_t *id);
/** An alarm fell due or was removed. */
void forget_alarm(alarm_id_t id);
/** Whether an alarm that this process added is still pending. */
[[nodiscard]] bool any_alarm_known();
/** When the condition alarm is due, milliseconds since the Unix epoch; 0 when none is pending. */
[[nodiscard]] std::int64_t condition_alarm_due();
/** When the first pending alarm of this process is due, likewise. */
[[nodiscard]] std::int64_t next_alarm_due();

#endif
