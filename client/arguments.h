/**
 * @file arguments.h
 * @brief What quarnctl was asked to do, and its help.
 */
#ifndef QUARN_CLIENT_ARGUMENTS_H
#define QUARN_CLIENT_ARGUMENTS_H

#include <string>
#include <vector>

namespace quarn_client {

/** quarnctl's exit codes that are not results of the daemon. */
enum exit_code : int {
  EXIT_USAGE = 64,        /**< wrong arguments */
  EXIT_UNCONFIRMED = 65,  /**< backup: it would remove packages, and nobody said yes */
  EXIT_NO_INPUT = 66,     /**< rules: no such package, source or path */
  EXIT_UNREACHABLE = 69,  /**< the bus or the daemon cannot be reached */
  EXIT_DAEMON_ENDED = 70, /**< the daemon ended before it had answered */
  EXIT_TIMED_OUT = 75,    /**< no answer in time */
  EXIT_PROTOCOL = 76,     /**< an answer that this program cannot use */
  EXIT_DENIED = 77,       /**< this user may not ask for it */
  EXIT_INTERRUPTED = 130  /**< left on an interrupt without waiting for the end */
};

enum class Verb {
  help,
  version,
  status,
  activate,
  deactivate,
  backup,
  cancel,
  auto_backup,
  last_time,
  list,
  sets,
  app_backup,
  app_restore,
  app_export,
  restore_on,
  restore_off,
  transfer_list,
  rules_check,
  rules_explain
};

/** One invocation. */
struct Command {
  Verb verb = Verb::help;
  std::string name; /**< the verb as typed, "restore on" */
  bool json = false;
  bool watch = false;                /**< restore on: follow until the last package is done */
  bool transfer = false;             /**< restore on: archives in the companion's directory */
  bool yes = false;                  /**< backup: what it removes needs no question */
  bool switch_on = false;            /**< auto: on or off */
  double timeout = 0;                /**< seconds; 0 waits without a limit */
  bool timeout_given = false;        /**< it bounds the watching, too */
  std::string serial;                /**< restore on: the device whose set it is */
  std::vector<std::string> packages; /**< the operands; a path, too, for rules */
  std::string help;                  /**< help: the text to print */
};

/**
 * Reads the arguments after the program's name.
 * @param[out] error one line, when false is returned; @p command.json is still right then
 */
bool parse_arguments(const std::vector<std::string> &arguments, Command &command,
                     std::string &error);

}  // namespace quarn_client

#endif
