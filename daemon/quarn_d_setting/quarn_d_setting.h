/**
 * @file quarn_d_setting.h
 * @brief Automatic backup: the condition monitors, the alarm and the setting.
 *
 * Main thread only, except wifi_connected(). The monitors' operations return 1
 * for success and 0 for failure.
 */
#ifndef QUARN_D_SETTING_H
#define QUARN_D_SETTING_H

#include <cstdint>

#include "platform_alarm.h"
#include "platform_connection.h"

/** The name under which the daemon registers with the alarm service and is woken by it. */
inline constexpr char kAlarmOwner[] = "quarn";
/** No alarm. */
inline constexpr alarm_id_t kNoAlarm = 0;

/** The connection manager's handle; null before init_backup_resource(). */
extern connection_h g_connection;
/** The pending condition alarm, 0 when none. */
extern alarm_id_t _alarm_id;
/** Automatic backup is on. */
extern char auto_backup_enabled;

/** 1 when on Wi-Fi and the monitor runs. Any thread. */
int wifi_connected();
int start_wifi_monitor();
int stop_wifi_monitor();
/** 1 when the charger is connected, read anew at every call. */
int charger_connected();
int start_charger_monitor();
int stop_charger_monitor();
int start_screen_monitor();
int stop_screen_monitor();
/** Start or stop what only automatic backup needs: the screen monitor. */
void start_backup_condition_monitor();
void stop_backup_condition_monitor();
/** 1 when charging, on Wi-Fi and the screen is off. */
int backup_condition_pass();
/** Arm the condition alarm when the conditions hold, disarm it when not. */
void check_backup_condition();

/** Connection manager, alarm service, first alarm. */
void init_backup_resource();
/** Release what init_backup_resource() took. Safe to call twice. */
void deinit_backup_resource();
/** Switch automatic backup. */
void set_auto_backup(int on);
/** Follow the setting from now on, and apply its present value. */
void monitor_auto_backup_status();

/** Remove the pending condition alarm, if any, and log it. */
void remove_condition_alarm();
/** Add a one-shot alarm @p seconds from now. @return the service's result */
int add_backup_alarm(int seconds, alarm_id_t *id);
/** An alarm fell due or was removed. */
void forget_alarm(alarm_id_t id);
/** Whether an alarm that this process added is still pending. */
bool any_alarm_known();
/** When the condition alarm is due, milliseconds since the Unix epoch; 0 when none is pending. */
std::int64_t condition_alarm_due();
/** When the first pending alarm of this process is due, likewise. */
std::int64_t next_alarm_due();

/** Who is told that a condition, an alarm or the setting may have changed; set once at start. */
void set_setting_observer(void (*observer)());
/** Tell it. */
void tell_setting_observer();

#endif
