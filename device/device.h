/**
 * @file device.h
 * @brief quarn-device: what its verbs share.
 *
 * A verb returns the program's exit code. Failures are one line on standard
 * error, thrown as Failure and printed in main().
 */
#ifndef QUARN_DEVICE_H
#define QUARN_DEVICE_H

#include <unistd.h>

#include <stdexcept>
#include <string>
#include <vector>

using Arguments = std::vector<std::string>;

/** Owner of the alarms that the daemon is started for. */
inline constexpr char kAlarmOwner[] = "quarn";

/** The daemon's name on the device's bus. */
inline constexpr char kBusName[] = "org.orvane.Quarn";

/** Exit codes of the tool. */
enum device_exit : int {
  DEVICE_OK = 0,
  DEVICE_FAILED = 1,
  /** cloud-check: this and the cause's number. */
  DEVICE_CLOUD = 10,
  DEVICE_USAGE = 64,
};

/** Closes the descriptor it holds, unless that is negative. */
struct Fd {
  explicit Fd(int number = -1) : fd(number) {}
  ~Fd() {
    if (fd >= 0) close(fd);
  }
  Fd(const Fd &) = delete;
  Fd &operator=(const Fd &) = delete;
  int fd;
};

/** A verb that cannot go on; its text is what the user reads. */
class Failure : public std::runtime_error {
 public:
  explicit Failure(const std::string &text, int exit_code = DEVICE_FAILED)
      : std::runtime_error(text), code(exit_code) {}
  const int code;
};

/** The absolute path of an existing device; fails when DIR is none, or one that others can change.
 */
std::string open_device(const std::string &dir);

/** Fails where anybody but this user could change what lies in @p path. */
void check_own_folder(const std::string &path);

/** What the device keeps is nobody else's to read, nor to lock; the way to its bus stays open. */
void close_folders(const std::string &device);

/** The directory that this program lies in. */
std::string program_directory();

/** Bus address of a device. */
std::string bus_address(const std::string &device);

/** Replace the text of a small file; fails when it cannot be written. */
void write_file(const std::string &path, const std::string &text);

/**
 * Write what the device's bus reads, with the policy that is shipped with the daemon.
 * @return the configuration's path
 */
std::string write_bus_files(const std::string &device);

/** The text of errno. */
std::string reason();

/** The verb was called the wrong way. */
[[noreturn]] void wrong_use();

/** True when the device's supervisor lives. */
bool is_started(const std::string &device);

/* lifecycle.cpp */
int verb_start(const Arguments &arguments);
int verb_stop(const Arguments &arguments);
int verb_exec(const Arguments &arguments);

/* daemon_run.cpp */
/** Hidden: the activation command of the device's bus. */
int verb_daemon(const Arguments &arguments);

/* cloud.cpp */
struct Cloud {
  std::string url;
  std::string user;       /**< empty: no credentials */
  std::string password;   /**< never shown */
  std::string ca_file;    /**< empty: the system's authorities */
  std::string region;     /**< s3 only; empty: the usual one */
  std::string addressing; /**< s3 only; empty: the usual one */
};
/** Fails when the transport could not take it. */
void check_cloud(const Cloud &cloud);
/** The same for a URL alone, whose credentials come later. */
void check_cloud_url(const std::string &url);
/** Replaces the device's cloud, which the daemon uses from its next request on. */
void write_cloud(const std::string &device, const Cloud &cloud);
/** The verb `set DIR cloud URL ...`. */
void set_cloud(const std::string &device, const Arguments &arguments);
int verb_cloud_check(const Arguments &arguments);

/* packages.cpp */
int verb_install(const Arguments &arguments);
int verb_remove(const Arguments &arguments);
int verb_list(const Arguments &arguments);

/* facts.cpp */
int verb_create(const Arguments &arguments);
int verb_set(const Arguments &arguments);

/* state.cpp */
int verb_setting(const Arguments &arguments);
int verb_alarms(const Arguments &arguments);
int verb_fire(const Arguments &arguments);
int verb_log(const Arguments &arguments);

#endif
