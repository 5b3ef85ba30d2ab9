/**
 * @file supervisor.h
 * @brief The process that a started device lives by: it runs the bus and waits for alarms.
 */
#ifndef QUARN_DEVICE_SUPERVISOR_H
#define QUARN_DEVICE_SUPERVISOR_H

#include <sys/types.h>

#include <string>

/** The file, below the device, that names the process and when that began. */
inline constexpr char kSupervisorFile[] = "run/supervisor";
/** The first byte that a supervisor tells when the device is ready; a note follows, or nothing. */
inline constexpr char kReady = 'R';

/** A device's supervisor. */
struct Supervisor {
  pid_t pid = 0;
  bool own_namespace = false;
};

/** False when the device has none that lives. */
bool find_supervisor(const std::string &device, Supervisor *supervisor);

/** Start time of a process in clock ticks, empty when there is none: a number is used again. */
std::string birth_of(pid_t pid);

/** Fork the supervisor. @return the end of the pipe on which it tells how it went */
int fork_supervisor(const std::string &device, int lock);

#endif
