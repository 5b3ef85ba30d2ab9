#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "device.h"
#include "state/printable.h"

namespace {

struct Verb {
  const char *name;
  int (*run)(const Arguments &arguments);
  const char *synopsis;
  const char *help;
};

constexpr Verb kVerbs[] = {
    {"create", verb_create,
     "create DIR [--model NAME] [--serial IMEI] [--account NAME | --no-account] [--cloud URL]",
     "Make a device in the directory DIR, which must be missing or empty. The default cloud is "
     "the\n"
     "folder DIR/cloud."},
    {"start", verb_start, "start DIR",
     "Start the device: its bus is up when this returns, and the daemon is started when it is\n"
     "called or an alarm falls due."},
    {"stop", verb_stop, "stop DIR",
     "Stop the device; no process of it is left. Stopped already: fine."},
    {"exec", verb_exec, "exec DIR -- CMD ...",
     "Run CMD inside the device, with the device's bus as the system bus. Exits with CMD's "
     "status."},
    {"install", verb_install, "install DIR SOURCE",
     "Install the package in the directory SOURCE (package.ini, data/, shared/data/,\n"
     "shared/trusted/, res/), or update it when its id is installed: an update replaces res/ and\n"
     "adds files to the data directories, but never changes or removes one there."},
    {"remove", verb_remove, "remove DIR PKGID", "Remove a package with its data."},
    {"list", verb_list, "list DIR [--json]", "List the installed packages."},
    {"set", verb_set, "set DIR KEY VALUE",
     "Change what the device finds around it:\n"
     "  network wifi|cellular|none    charger on|off    display on|dim|off\n"
     "  account NAME|none             modem on|off\n"
     "  clock +SECONDS|-SECONDS|real  ahead of the machine's clock, or behind it\n"
     "  cloud URL [--user NAME [--password-file FILE]] [--ca-file FILE]\n"
     "            [--region NAME] [--addressing path|virtual]\n"
     "The password of --user is read from the file, else from standard input. --ca-file names\n"
     "authorities to be trusted instead of the system's; the last two are for s3."},
    {"cloud-check", verb_cloud_check, "cloud-check DIR [--json]",
     "Find out whether the device's cloud can be used: an object of a few bytes is put there, "
     "read\nback and removed. One line tells what to look at: address, certificate, password, "
     "space,\nnetwork, server or device."},
    {"setting", verb_setting, "setting DIR KEY [VALUE]", "Print or write a setting."},
    {"alarms", verb_alarms, "alarms DIR [--json]", "List the pending alarms."},
    {"fire", verb_fire, "fire DIR ALARM-ID",
     "Make an alarm due now. A daemon that is not running is started for it."},
    {"log", verb_log, "log DIR [--follow]", "Print the daemon's log."},
};

// Called by the device's own bus; not for people.
constexpr Verb kDaemonVerb = {"daemon", verb_daemon, "daemon DIR", ""};

void print_usage(std::FILE *file) {
  std::fputs(
      "usage: quarn-device VERB DIR ...\n\nAn embedded device kept in the directory DIR.\n\n",
      file);
  for (const Verb &verb : kVerbs) std::fprintf(file, "  %s\n", verb.synopsis);
  std::fputs("\nquarn-device VERB --help tells more.\n", file);
}

const Verb *find_verb(const std::string &name) {
  if (name == kDaemonVerb.name) return &kDaemonVerb;
  for (const Verb &verb : kVerbs) {
    if (name == verb.name) return &verb;
  }
  return nullptr;
}

bool asks_for_help(const Arguments &arguments) {
  for (const std::string &argument : arguments) {
    if (argument == "--") return false;
    if (argument == "--help" || argument == "-h") return true;
  }
  return false;
}

}  // namespace

std::string reason() { return std::strerror(errno); }

void wrong_use() { throw Failure("", DEVICE_USAGE); }

std::string program_directory() {
  char path[PATH_MAX];
  const ssize_t length = readlink("/proc/self/exe", path, sizeof path);
  if (length <= 0) throw Failure("cannot tell where this program lies: " + reason());
  const std::string program(path, static_cast<std::size_t>(length));
  return program.substr(0, program.rfind('/'));
}

std::string open_device(const std::string &dir) {
  char *path = realpath(dir.c_str(), nullptr);
  if (path == nullptr) throw Failure("no device in " + dir + ": " + reason());
  std::string device = path;
  std::free(path);
  struct stat status {};
  if (stat((device + "/state/device.ini").c_str(), &status) != 0) {
    throw Failure("no device in " + dir);
  }
  for (const char *folder : {"", "/state", "/run", "/root"}) check_own_folder(device + folder);
  return device;
}

void check_own_folder(const std::string &path) {
  struct stat status {};
  if (lstat(path.c_str(), &status) != 0) throw Failure("cannot look at " + path + ": " + reason());
  if (!S_ISDIR(status.st_mode)) throw Failure(path + " is no directory");
  if (status.st_uid != geteuid()) throw Failure(path + " is not this user's own");
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) throw Failure("others may write to " + path);
}

int main(int argc, char **argv) {
  // What a device keeps is read by the processes of its applications' user as well.
  umask(022);
  const Arguments words(argv + 1, argv + argc);
  if (words.empty()) {
    print_usage(stderr);
    return DEVICE_USAGE;
  }
  if (words[0] == "--help" || words[0] == "-h" || words[0] == "help") {
    print_usage(stdout);
    return DEVICE_OK;
  }
  if (words[0] == "--version") {
    std::puts("quarn-device " QUARN_VERSION);
    return DEVICE_OK;
  }
  const Verb *verb = find_verb(words[0]);
  if (verb == nullptr) {
    std::fprintf(stderr, "quarn-device: no verb \"%s\"; see quarn-device --help\n",
                 words[0].c_str());
    return DEVICE_USAGE;
  }
  const Arguments arguments(words.begin() + 1, words.end());
  if (asks_for_help(arguments)) {
    std::printf("usage: quarn-device %s\n\n%s\n", verb->synopsis, verb->help);
    return DEVICE_OK;
  }
  try {
    return verb->run(arguments);
  } catch (const Failure &failure) {
    if (failure.code == DEVICE_USAGE && failure.what()[0] == '\0') {
      std::fprintf(stderr, "quarn-device: usage: quarn-device %s\n", verb->synopsis);
    } else {
      // There may be a name in it that anybody has chosen.
      std::fprintf(stderr, "quarn-device: %s\n", embedded::printable(failure.what()).c_str());
    }
    return failure.code;
  } catch (const std::exception &error) {
    std::fprintf(stderr, "quarn-device: %s\n", embedded::printable(error.what()).c_str());
    return DEVICE_FAILED;
  }
}
