/**
 * @file boot_cleanup.h
 * @brief The state of the sweep, apart from its functions.
 */
#ifndef QUARN_D_UTILS_BOOT_CLEANUP_H
#define QUARN_D_UTILS_BOOT_CLEANUP_H

#include <atomic>
#include <ctime>

/** The sweep of this process was made. */
extern std::atomic<bool> boot_cleanup_done;
/**
 * When this process began, by the file system's clock: a file whose status
 * changed then or later was not left behind by an earlier process.
 */
extern timespec quarn_process_start;

#endif
