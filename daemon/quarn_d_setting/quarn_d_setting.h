/**
 * @file quarn_d_setting.h
 * @brief Automatic backup: when one is due, and its setting.
 *
 * Main thread only. Failures are logged and otherwise passed over.
 */
#ifndef QUARN_D_SETTING_H
#define QUARN_D_SETTING_H

/** Connection manager, alarm service, first alarm. */
void init_backup_resource();
/** Release what init_backup_resource() took. Safe to call twice. */
void deinit_backup_resource();
/** Switch automatic backup: 0 is off, anything else on. */
void set_auto_backup(int on);
/** Follow the setting from now on, and apply its present value. */
void monitor_auto_backup_status();

#endif
