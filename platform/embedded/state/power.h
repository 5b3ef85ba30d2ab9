/**
 * @file power.h
 * @brief The power locks that are held on an embedded device: power.ini.
 */
#ifndef QUARN_EMBEDDED_POWER_H
#define QUARN_EMBEDDED_POWER_H

#include <string>

namespace embedded {

inline constexpr char kPowerFile[] = "power.ini";
inline constexpr char kCpuLock[] = "cpu";
inline constexpr char kDisplayLock[] = "display";

/** Note that process @p pid holds @p lock, or (0) that nobody does. */
bool set_power_lock(const std::string &device, const char *lock, int pid, int timeout_ms);

/** The process that holds @p lock, 0 without one. */
int power_lock_holder(const std::string &device, const char *lock);

/** Drop what a process that ended still held. */
void drop_power_locks(const std::string &device, int pid);

}  // namespace embedded

#endif
