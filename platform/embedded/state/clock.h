/**
 * @file clock.h
 * @brief An embedded device's wall clock: clock.ini.
 *
 * It is the machine's, set ahead or behind by as much as the file says. Changes
 * count at once in every process. Times of files are the machine's. Any thread.
 */
#ifndef QUARN_EMBEDDED_CLOCK_H
#define QUARN_EMBEDDED_CLOCK_H

#include <cstdint>
#include <string>

namespace embedded {

inline constexpr char kClockFile[] = "clock.ini";

/** How far the device's clock is ahead of the machine's, in milliseconds; 0 when it is not set. */
std::int64_t clock_offset_ms(const std::string &device);

/** Set the device's clock. False when its file cannot be written. */
bool set_clock_offset_ms(const std::string &device, std::int64_t offset);

/** Milliseconds since the Unix epoch by the device's clock. */
std::int64_t device_now_ms(const std::string &device);

/** The same by the machine's. */
std::int64_t machine_now_ms();

}  // namespace embedded

#endif
