/**
 * @file boot_cleanup.h
 * @brief The state of the sweep, apart from its functions.
 */
#ifndef QUARN_D_UTILS_BOOT_CLEANUP_H
#define QUARN_D_UTILS_BOOT_CLEANUP_H

#include <atomic>

/** The sweep of this process was made. */
extern std::atomic<bool> boot_cleanup_done;
#endif
