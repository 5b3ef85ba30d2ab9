/**
 * @file device.h
 * @brief quarn-device: what its verbs share.
 *
 * A verb returns the program's exit code. Failures are one line on standard
 * error, thrown as Failure and printed in main().
 */
#ifndef QUARN_DEVICE_H
#define QUARN_DEVICE_H

#include <stdexcept>
#include <string>
#include <vector>

using Arguments = std::vector<std::string>;

/** Owner of the alarms that the daemon is started for. */
inline constexpr char kAlarmOwner[] = "quarn";

/** Exit codes of the tool. */
enum device_exit : int {
  DEVICE_OK = 0,
  DEVICE_FAILED = 1,
  DEVICE_USAGE = 64,
};

/** A verb that cannot go on; its text is what the user reads. */
class Failure : public std::runtime_error {
 public:
  explicit Failure(const std::string &text, int exit_code = DEVICE_FAILED)
      : std::runtime_error(text), code(exit_code) {}
  const int code;
};

/** The absolute path of an existing device; fails when DIR is none. */
std::string open_device(const std::string &dir);

/** The directory that this program lies in. */
std::string program_directory();

/** Bus address of a device. */
std::string bus_address(const std::string &device);

/** The text of errno. */
std::string reason();

/* lifecycle.cpp */
int verb_start(const Arguments &arguments);
int verb_stop(const Arguments &arguments);
int verb_exec(const Arguments &arguments);
/** Hidden: the activation command of the device's bus. */
int verb_daemon(const Arguments &arguments);
/** True when the device's supervisor lives. */
bool is_started(const std::string &device);

/* packages.cpp */
int verb_install(const Arguments &arguments);
int verb_remove(const Arguments &arguments);
int verb_list(const Arguments &arguments);

/* state.cpp */
int verb_create(const Arguments &arguments);
int verb_set(const Arguments &arguments);
int verb_setting(const Arguments &arguments);
int verb_alarms(const Arguments &arguments);
int verb_fire(const Arguments &arguments);
int verb_log(const Arguments &arguments);

#endif
