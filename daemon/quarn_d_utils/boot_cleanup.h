/**
 * @file boot_cleanup.h
 * @brief The state of the sweep, apart from its functions.
 */
#ifndef QUARN_D_UTILS_BOOT_CLEANUP_H
#define QUARN_D_UTILS_BOOT_CLEANUP_H

#include <atomic>
#include "platform_package_manager.h"

/** The sweep of this process was made. */
extern std::atomic<bool> boot_cleanup_done;

/** Delete archives that an interrupted run left behind; once per process. */
void boot_cleanup_backup_items();
/** One package of that sweep. */
bool boot_foreach_package_info_callback(package_info_h info, void *user_data);
/** What else an earlier process may have left is mended after the sweep. Set once at start. */
void set_boot_recovery(void (*recover)());

#endif
