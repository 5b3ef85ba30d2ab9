/**
 * @file conditions.h
 * @brief Whether the device charges, is on Wi-Fi and dark, and since when all of it holds.
 *
 * Main thread only, except wifi_connected(). The monitors' operations return 1 for success and 0
 * for failure, which they have logged.
 */
#ifndef QUARN_D_CONDITIONS_H
#define QUARN_D_CONDITIONS_H

#include "platform_connection.h"

/** The connection manager's handle; null before init_backup_resource(), which owns it. */
extern connection_h g_connection;
/** Automatic backup is on: changes of the network arm and disarm the condition alarm. */
extern char auto_backup_enabled;

/** 1 when on Wi-Fi and the monitor runs. Any thread. */
[[nodiscard]] int wifi_connected();
int start_wifi_monitor();
/** No part of the daemon calls it. */
int stop_wifi_monitor();
/** 1 when the charger is connected, read anew at every call. */
[[nodiscard]] int charger_connected();
/** No part of the daemon calls it. */
int start_charger_monitor();
/** No part of the daemon calls it. */
int stop_charger_monitor();
int start_screen_monitor();
int stop_screen_monitor();
/** Start or stop what only automatic backup needs: the screen monitor. */
void start_backup_condition_monitor();
void stop_backup_condition_monitor();
/** 1 when charging, on Wi-Fi and the screen is off. */
[[nodiscard]] int backup_condition_pass();
/** Arm the condition alarm when the conditions hold, disarm it when not. */
void check_backup_condition();

#endif
