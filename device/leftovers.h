/**
 * @file leftovers.h
 * @brief Ending what still runs inside a device.
 */
#ifndef QUARN_DEVICE_LEFTOVERS_H
#define QUARN_DEVICE_LEFTOVERS_H

#include <sys/types.h>

#include <string>

/** How long a process that is ended has for it. */
inline constexpr int kStopSeconds = 12;

/** Which mount namespace a process is in, empty when it cannot be told. */
std::string namespace_of(const std::string &pid);
/** Wait for a process to end. False when it has not within the time. */
bool wait_for_end(pid_t pid, int seconds);

/**
 * End all that runs inside the device but for our own ancestors, with force what does not end.
 * @param space the device's mount namespace, empty where it has none: then the environment tells
 */
void end_leftovers(const std::string &device, const std::string &space);

#endif
