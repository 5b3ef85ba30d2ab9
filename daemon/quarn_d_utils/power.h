/**
 * @file power.h
 * @brief The device's CPU lock, and what holds it.
 *
 * Every function logs its failures and reports them by its result only.
 * Any thread.
 */
#ifndef QUARN_D_UTILS_POWER_H
#define QUARN_D_UTILS_POWER_H

/**
 * Take (true) or release (false) the CPU lock. Every taker counts: the device
 * lock is released with the last of them.
 */
void request_power_lock(bool lock);
/** True when nobody holds the CPU lock and nothing is about to: see pending_work.h. */
[[nodiscard]] bool is_idle_status();

#endif
