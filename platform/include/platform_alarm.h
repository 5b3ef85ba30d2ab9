/**
 * @file platform_alarm.h
 * @brief Alarms that outlive the process.
 *
 * When an alarm falls due and its owner's daemon is not running, the service
 * starts it. Functions return #ALARMMGR_RESULT_SUCCESS or a negative error.
 * Main thread; the callback runs on the main loop.
 */
#ifndef QUARN_PLATFORM_ALARM_H
#define QUARN_PLATFORM_ALARM_H

#include <time.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ALARMMGR_RESULT_SUCCESS 0
#define ERR_ALARM_INVALID_PARAM (-1)
#define ERR_ALARM_INVALID_ID (-2)
#define ERR_ALARM_SYSTEM_FAIL (-4)
#define ERR_ALARM_NOT_INITIALIZED (-6)

/** An alarm kept over a reboot only when the type says so; one-shot when the interval is 0. */
#define ALARM_TYPE_DEFAULT 0x0

typedef int alarm_id_t;

/** An alarm fell due. The result is ignored. */
typedef int (*alarm_cb_t)(alarm_id_t alarm_id, void *user_param);

/** Register as the owner @p pkg_name. */
int alarmmgr_init(const char *pkg_name);
/** End the registration; pending alarms stay. */
void alarmmgr_fini(void);
/** Set the callback; alarms that fell due while nobody listened follow on the main loop. */
int alarmmgr_set_cb(alarm_cb_t handler, void *user_param);
/**
 * Add an alarm.
 * @param alarm_type             #ALARM_TYPE_DEFAULT
 * @param trigger_at_time        seconds from now
 * @param interval               seconds between repetitions, 0 for once
 * @param destination            owner to wake
 * @param[out] alarm_id          positive id
 */
int alarmmgr_add_alarm(int alarm_type, time_t trigger_at_time, time_t interval,
                       const char *destination, alarm_id_t *alarm_id);
/** Remove one of the owner's alarms. */
int alarmmgr_remove_alarm(alarm_id_t alarm_id);

#ifdef __cplusplus
}
#endif
#endif
