#include "arguments.h"

#include <glib.h>

#include <algorithm>
#include <cmath>
#include <cstdint>

namespace quarn_client {

namespace {

constexpr double kNoLimit = 0;
constexpr double kShortWait = 30;
// Starting the cloud session alone may take the daemon a minute.
constexpr double kListWait = 180;
constexpr double kTransferWait = 1800;
constexpr double kMaxTimeout = 86400.0 * 366;
constexpr std::size_t kAny = SIZE_MAX;
constexpr std::size_t kSummaryColumn = 42;

struct VerbInfo {
  Verb verb;
  const char *name;
  const char *operands;
  const char *summary;
  const char *details;
  double timeout;
  std::size_t min_operands;
  std::size_t max_operands;
};

constexpr VerbInfo kVerbs[] = {
    {Verb::status, "status", "", "what the daemon and its backups are at",
     "Automatic backup and its conditions, pending alarms, the last backup, what is running, and\n"
     "this device's packages in the cloud's application list. A daemon that does not run is\n"
     "started; without Wi-Fi the list is not asked for.\n",
     kListWait, 0, 0},
    {Verb::activate, "activate", "", "start the daemon, or keep it from ending",
     "The daemon is started when it does not run; one that was about to end stays.\n", kShortWait,
     0, 0},
    {Verb::deactivate, "deactivate", "", "end the daemon when it is idle",
     "The daemon forgets when the last backup was, and ends itself unless it is busy.\n",
     kShortWait, 0, 0},
    {Verb::backup, "backup", "", "back up now and wait for the end",
     "Shows what happens until the backup has ended. An interrupt (Ctrl-C) cancels the backup and\n"
     "waits for its end; a second one leaves at once. After a time-out the backup goes on.\n"
     "\n"
     "A backup removes from the cloud what is no longer installed. When there is such a package "
     "it\n"
     "is named and confirmed first, or the backup is not begun.\n"
     "\n"
     "  --yes              back up, and remove, without a question\n",
     kNoLimit, 0, 0},
    {Verb::cancel, "cancel", "", "cancel the manual backup that is running",
     "Returns when the daemon has taken the request, which may be before the backup has stopped.\n",
     kShortWait, 0, 0},
    {Verb::auto_backup, "auto", "on|off", "switch automatic backup on or off",
     "With automatic backup the device backs up by itself, at most once a day, while it is "
     "charged,\n"
     "has Wi-Fi and its screen is off.\n",
     kShortWait, 1, 1},
    {Verb::last_time, "last-time", "", "print the time that the daemon answers",
     "Prints the daemon's answer to last_bu_time as local time. The daemon answers with the "
     "present\n"
     "time of its clock; when each device was last backed up is shown by quarnctl sets.\n",
     kShortWait, 0, 0},
    {Verb::list, "list", "", "the packages in the cloud, of all devices",
     "A line for each package of each device of the account: device, package, version, crc of its\n"
     "archive (- when the last backup made none) and the time of the backup.\n",
     kListWait, 0, 0},
    {Verb::sets, "sets", "", "the devices that have a backup in the cloud",
     "A line for each device: serial number, model, time of its last backup, number of packages.\n",
     kListWait, 0, 0},
    {Verb::app_backup, "app backup", "PKGID", "back up one package now",
     "Waits until the package's archive is in the cloud.\n", kTransferWait, 1, 1},
    {Verb::app_restore, "app restore", "PKGID", "restore one package's data from the cloud now",
     "Puts this device's own last backup of the package back. When that cannot be finished, the\n"
     "package's data is left as it was.\n",
     kTransferWait, 1, 1},
    {Verb::app_export, "app export", "PKGID", "make a package's archive on the device",
     "Prints where the archive lies, as the device names it. Nothing is sent to the cloud.\n",
     kTransferWait, 1, 1},
    {Verb::restore_on, "restore on",
     "--from SERIAL [PKGID ...] [--watch] | --transfer PKGID ... [--watch]",
     "restore packages as they are installed",
     "From now on the data of each named package is restored as soon as the package is installed,\n"
     "from the backup set of the device SERIAL; of all packages of that set when none is named.\n"
     "\n"
     "  --from SERIAL      the device whose backup is used, as quarnctl sets shows it\n"
     "  --transfer         take the archives that lie in the companion's directory on this "
     "device,\n"
     "                     not those in the cloud; the packages must be named\n"
     "  --watch            follow until the last package is done; --timeout then bounds the whole\n"
     "\n"
     "An interrupt ends the watching, not the restore mode.\n",
     kListWait, 0, kAny},
    {Verb::restore_off, "restore off", "", "end the restore mode",
     "Packages that are installed from now on keep the data they come with.\n", kShortWait, 0, 0},
    {Verb::transfer_list, "transfer list", "", "make archives for a phone, and list them",
     "Makes an archive of each package in the shared data of the phone-transfer companion, which\n"
     "must be installed, and prints where each lies, as the device names it. No cloud is used.\n",
     kTransferWait, 0, 0},
    {Verb::rules_check, "rules check", "SOURCE-or-PKGID", "what an application's rules take in",
     "For authors of applications; needs no daemon. Reads a package's source directory, or a\n"
     "package that is installed, and tells each file in or out and by which element of its rules\n"
     "file, the total against the limit, and what is probably a mistake.\n"
     "\n"
     "Exit status here: 0 nothing to complain about, 1 mistakes found, 2 over the limit, 3 the\n"
     "rules file is ignored, 64 wrong arguments, 66 no such package or source.\n",
     kNoLimit, 1, 1},
    {Verb::rules_explain, "rules explain", "SOURCE-or-PKGID PATH",
     "why one file is backed up or not",
     "For authors of applications; needs no daemon. PATH is relative to the package's root.\n"
     "\n"
     "Exit status here: 0 the answer is printed, 64 wrong arguments, 66 no such package or path.\n",
     kNoLimit, 2, 2},
};

constexpr char kCommonOptions[] =
    "  --json             print one JSON object instead of text, also for an error\n"
    "  --timeout SECONDS  wait at most this long for the daemon; 0 for no limit\n"
    "  --help             this help\n";

constexpr char kExitCodes[] =
    "Exit status: 0 success, 1 to 42 the daemon's result, 64 wrong arguments, 65 not confirmed,\n"
    "69 bus or daemon not reachable, 70 the daemon ended before it answered, 75 time-out,\n"
    "76 unusable answer, 77 not allowed, 130 interrupted.\n";

std::string seconds_text(double seconds) {
  return seconds > 0 ? std::to_string(static_cast<long>(seconds)) + " seconds" : "no limit";
}

std::string usage_of(const VerbInfo &info) {
  std::string text = std::string("quarnctl ") + info.name;
  if (*info.operands != '\0') text += std::string(" ") + info.operands;
  return text;
}

std::string help_of(const VerbInfo &info) {
  return "usage: " + usage_of(info) + " [--json] [--timeout SECONDS]\n\n" + info.details + "\n" +
         kCommonOptions + "\nThe time-out is " + seconds_text(info.timeout) +
         " when none is given.\n" + kExitCodes;
}

std::string general_help() {
  std::string text = "usage: quarnctl VERB [ARGUMENT ...] [--json] [--timeout SECONDS]\n\n";
  for (const VerbInfo &info : kVerbs) {
    std::string line = std::string("  ") + info.name;
    if (*info.operands != '\0') line += std::string(" ") + info.operands;
    if (line.size() + 2 > kSummaryColumn) {
      text += line + "\n";
      line.clear();
    }
    line.append(kSummaryColumn - line.size(), ' ');
    text += line + info.summary + "\n";
  }
  return text + "\n" + kCommonOptions + "  --version          print the version\n\n" +
         "quarnctl VERB --help tells more about a verb.\n" + kExitCodes;
}

const VerbInfo *find_verb(const std::vector<std::string> &words, std::size_t &used) {
  for (const VerbInfo &info : kVerbs) {
    for (std::size_t count = 1; count <= 2 && count <= words.size(); ++count) {
      const std::string name = count == 1 ? words[0] : words[0] + " " + words[1];
      if (name == info.name) {
        used = count;
        return &info;
      }
    }
  }
  return nullptr;
}

bool parse_timeout(const std::string &text, double &seconds) {
  char *end = nullptr;
  const double value = g_ascii_strtod(text.c_str(), &end);
  if (text.empty() || end != text.c_str() + text.size() || !std::isfinite(value) || value < 0 ||
      value > kMaxTimeout) {
    return false;
  }
  seconds = value;
  return true;
}

struct Options {
  bool json = false;
  bool help = false;
  bool version = false;
  bool watch = false;
  bool transfer = false;
  bool yes = false;
  bool from_given = false;
  bool timeout_given = false;
  double timeout = 0;
  std::string serial;
  std::vector<std::string> words;
};

bool take_value(const std::vector<std::string> &arguments, std::size_t &i, const std::string &name,
                std::string &value, std::string &error) {
  const std::string &argument = arguments[i];
  if (argument.size() > name.size()) {
    value = argument.substr(name.size() + 1);
    return true;
  }
  if (i + 1 >= arguments.size()) {
    error = name + " needs a value";
    return false;
  }
  value = arguments[++i];
  return true;
}

bool is_option(const std::string &argument, const std::string &name) {
  return argument == name || argument.compare(0, name.size() + 1, name + "=") == 0;
}

/** The place of the switch that an argument is; null: it is none. */
bool *switch_of(const std::string &argument, Options &options) {
  struct Switch {
    const char *name;
    bool Options::*place;
  };
  constexpr Switch kSwitches[] = {
      {"--json", &Options::json},   {"--help", &Options::help},
      {"-h", &Options::help},       {"--version", &Options::version},
      {"--watch", &Options::watch}, {"--transfer", &Options::transfer},
      {"--yes", &Options::yes},
  };
  for (const Switch &known : kSwitches) {
    if (argument == known.name) return &(options.*known.place);
  }
  return nullptr;
}

/** The option at @p i with its value, which may be the argument behind it. */
bool take_option(const std::vector<std::string> &arguments, std::size_t &i, Options &options,
                 std::string &error) {
  const std::string &argument = arguments[i];
  if (bool *given = switch_of(argument, options)) {
    *given = true;
    return true;
  }
  if (is_option(argument, "--from")) {
    options.from_given = true;
    return take_value(arguments, i, "--from", options.serial, error);
  }
  if (is_option(argument, "--timeout")) {
    std::string value;
    if (!take_value(arguments, i, "--timeout", value, error)) return false;
    if (!parse_timeout(value, options.timeout)) {
      error = "--timeout takes a number of seconds";
      return false;
    }
    options.timeout_given = true;
    return true;
  }
  error = "unknown option " + argument;
  return false;
}

bool split_options(const std::vector<std::string> &arguments, Options &options,
                   std::string &error) {
  bool only_words = false;
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    const std::string &argument = arguments[i];
    if (g_utf8_validate(argument.data(), static_cast<gssize>(argument.size()), nullptr) == FALSE) {
      error = "an argument is not UTF-8 text";
      return false;
    }
    if (only_words || argument.empty() || argument[0] != '-' || argument == "-") {
      options.words.push_back(argument);
    } else if (argument == "--") {
      only_words = true;
    } else if (!take_option(arguments, i, options, error)) {
      return false;
    }
  }
  return true;
}

bool check_operands(const VerbInfo &info, const Options &options, Command &command,
                    std::string &error) {
  const bool is_restore = info.verb == Verb::restore_on;
  if (!is_restore && (options.watch || options.from_given || options.transfer)) {
    const char *option = options.watch ? "--watch" : options.transfer ? "--transfer" : "--from";
    error = std::string(option) + " belongs to restore on";
    return false;
  }
  if (options.yes && info.verb != Verb::backup) {
    error = "--yes belongs to backup";
    return false;
  }
  if (command.packages.size() < info.min_operands || command.packages.size() > info.max_operands) {
    error = "usage: " + usage_of(info);
    return false;
  }
  if (std::any_of(command.packages.begin(), command.packages.end(),
                  [](const std::string &text) { return text.empty(); })) {
    error = "an argument is empty";
    return false;
  }
  if (options.transfer && options.from_given) {
    error = "restore on takes either --from or --transfer";
    return false;
  }
  if (options.transfer && command.packages.empty()) {
    error = "restore on --transfer needs the packages' names";
    return false;
  }
  if (is_restore && options.serial.empty() && !options.transfer) {
    error = "restore on needs --from SERIAL; quarnctl sets shows the devices";
    return false;
  }
  if (info.verb == Verb::auto_backup) {
    if (command.packages[0] != "on" && command.packages[0] != "off") {
      error = "usage: " + usage_of(info);
      return false;
    }
    command.switch_on = command.packages[0] == "on";
    command.packages.clear();
  }
  return true;
}

}  // namespace

bool parse_arguments(const std::vector<std::string> &arguments, Command &command,
                     std::string &error) {
  command = Command();
  // An error, too, is told in the form that was asked for.
  command.json = std::find(arguments.begin(), arguments.end(), "--json") != arguments.end();
  Options options;
  if (!split_options(arguments, options, error)) return false;
  command.json = options.json;
  if (!options.words.empty() && options.words[0] == "help") {
    options.help = true;
    options.words.erase(options.words.begin());
  }
  if (options.version) {
    command.verb = Verb::version;
    return true;
  }
  std::size_t used = 0;
  const VerbInfo *info = find_verb(options.words, used);
  if (info == nullptr) {
    if (options.help) {
      command.help = general_help();
      return true;
    }
    error = options.words.empty()
                ? "no verb is given; quarnctl --help lists them"
                : "unknown verb " + options.words[0] + "; quarnctl --help lists them";
    return false;
  }
  command.name = info->name;
  if (options.help) {
    command.help = help_of(*info);
    return true;
  }
  command.verb = info->verb;
  command.timeout = options.timeout_given ? options.timeout : info->timeout;
  command.timeout_given = options.timeout_given;
  command.watch = options.watch;
  command.transfer = options.transfer;
  command.yes = options.yes;
  command.serial = options.serial;
  command.packages.assign(options.words.begin() + static_cast<std::ptrdiff_t>(used),
                          options.words.end());
  return check_operands(*info, options, command, error);
}

}  // namespace quarn_client
