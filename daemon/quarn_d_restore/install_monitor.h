/**
 * @file install_monitor.h
 * @brief Restores the candidates of restore mode as they are installed. Main thread only.
 */
#ifndef QUARN_D_RESTORE_INSTALL_MONITOR_H
#define QUARN_D_RESTORE_INSTALL_MONITOR_H

/** Follow package events. @return 1 when the monitor runs, else 0 */
[[nodiscard]] int start_install_monitor();
/** @return 1 */
int stop_install_monitor();

#endif
