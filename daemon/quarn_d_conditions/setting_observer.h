/**
 * @file setting_observer.h
 * @brief Tells of changes of automatic backup to those who show them. Main thread only.
 */
#ifndef QUARN_D_CONDITIONS_SETTING_OBSERVER_H
#define QUARN_D_CONDITIONS_SETTING_OBSERVER_H

/** Who is told that a condition, an alarm or the setting may have changed; set once at start. */
void set_setting_observer(void (*observer)());
/** Tell it. */
void tell_setting_observer();

#endif
