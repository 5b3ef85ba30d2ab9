/**
 * @file daemon_run.h
 * @brief Running the daemon inside the device, as a service manager would.
 */
#ifndef QUARN_DEVICE_DAEMON_RUN_H
#define QUARN_DEVICE_DAEMON_RUN_H

#include <string>

/** What a device does once after it has booted, before anybody may use its bus. */
void recover_after_boot();

/** How often it was restarted in a row is counted anew. */
void forget_restarts(const std::string &device);

#endif
