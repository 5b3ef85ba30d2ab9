/**
 * @file platform_clock.h
 * @brief A wall clock of the device's own, for platforms that have one.
 *
 * A device's clock is the system's: what gettimeofday() tells. A platform whose
 * clock can be moved for a trial offers this function beside it; it is looked
 * for when the program is linked, and may be missing. Any thread.
 */
#ifndef QUARN_PLATFORM_CLOCK_H
#define QUARN_PLATFORM_CLOCK_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/** How far the device's clock is ahead of the system's now, in milliseconds; below 0: behind. */
__attribute__((weak)) int64_t platform_clock_offset_ms(void);

#ifdef __cplusplus
}
#endif
#endif
