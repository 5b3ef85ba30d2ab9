// The verbs that show what a device keeps, and have an alarm fire.
#include <fcntl.h>
#include <glib.h>
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <iostream>

#include "device.h"
#include "state/alarms.h"
#include "state/clock.h"
#include "state/printable.h"
#include "state/values.h"

namespace {

constexpr gint64 kFireMicroseconds = 20000000;
constexpr gulong kFirePauseMicroseconds = 5000;

std::string json_text(const std::string &text) {
  std::string quoted = "\"";
  for (const char c : text) {
    char escape[8];
    if (c == '"' || c == '\\') {
      quoted += '\\';
      quoted += c;
    } else if (static_cast<unsigned char>(c) < 0x20) {
      std::snprintf(escape, sizeof escape, "\\u%04x", c);
      quoted += escape;
    } else {
      quoted += c;
    }
  }
  return quoted + "\"";
}

std::string local_time(std::int64_t ms) {
  const std::time_t seconds = ms / 1000;
  std::tm parts{};
  localtime_r(&seconds, &parts);
  char text[40];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &parts);
  return text;
}

/** A log may be older than the rule that nothing in it speaks to a terminal. */
void print_log_line(const std::string &line) { std::cout << embedded::printable(line) << "\n"; }

/** Print a log and what is added to it, until somebody ends this. */
[[noreturn]] void follow_log(const std::string &path) {
  int pipe[2];
  if (pipe2(pipe, O_CLOEXEC) != 0) throw Failure("cannot make a pipe: " + reason());
  const Fd out(pipe[0]);
  const pid_t self = getpid();
  const pid_t tail = fork();
  if (tail == 0) {
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (getppid() != self || dup2(pipe[1], STDOUT_FILENO) < 0) _exit(DEVICE_FAILED);
    execlp("tail", "tail", "-n", "+1", "-F", path.c_str(), nullptr);
    _exit(DEVICE_FAILED);
  }
  close(pipe[1]);
  if (tail < 0) throw Failure("cannot run tail: " + reason());
  std::string line;
  char text[4096];
  for (ssize_t length = 0; (length = TEMP_FAILURE_RETRY(read(out.fd, text, sizeof text))) > 0;) {
    for (ssize_t i = 0; i < length; ++i) {
      if (text[i] != '\n') {
        line += text[i];
        continue;
      }
      print_log_line(line);
      line.clear();
    }
    if (!std::cout.flush()) break;
  }
  throw Failure("the log cannot be followed any longer");
}

}  // namespace

int verb_setting(const Arguments &arguments) {
  if (arguments.size() != 2 && arguments.size() != 3) wrong_use();
  const std::string device = open_device(arguments[0]);
  if (!embedded::is_value_key(arguments[1])) {
    throw Failure("\"" + arguments[1] + "\" is no key of a setting");
  }
  if (arguments.size() == 3) {
    if (!embedded::set_value(device, arguments[1], arguments[2])) {
      throw Failure("cannot write the setting: " + reason());
    }
    return DEVICE_OK;
  }
  std::string value;
  if (!embedded::get_value(device, arguments[1], &value)) {
    throw Failure("no setting \"" + arguments[1] + "\"");
  }
  std::cout << value << "\n";
  return DEVICE_OK;
}

int verb_alarms(const Arguments &arguments) {
  const bool json = arguments.size() == 2 && arguments[1] == "--json";
  if (arguments.empty() || (arguments.size() != 1 && !json)) wrong_use();
  std::vector<embedded::Alarm> alarms;
  if (!embedded::list_alarms(open_device(arguments[0]), &alarms)) {
    throw Failure("cannot read the alarms");
  }
  if (json) {
    std::cout << "[";
    for (std::size_t i = 0; i < alarms.size(); ++i) {
      std::cout << (i == 0 ? "" : ",") << "{\"id\":" << alarms[i].id
                << ",\"owner\":" << json_text(alarms[i].owner) << ",\"due_ms\":" << alarms[i].due_ms
                << "}";
    }
    std::cout << "]\n";
    return DEVICE_OK;
  }
  for (const embedded::Alarm &alarm : alarms) {
    std::printf("%6d  %-10s %s\n", alarm.id, embedded::printable(alarm.owner).c_str(),
                local_time(alarm.due_ms).c_str());
  }
  return DEVICE_OK;
}

int verb_fire(const Arguments &arguments) {
  if (arguments.size() != 2) wrong_use();
  const std::string device = open_device(arguments[0]);
  gint64 id = 0;
  if (!g_ascii_string_to_signed(arguments[1].c_str(), 10, 1, G_MAXINT, &id, nullptr)) {
    throw Failure("\"" + arguments[1] + "\" is no alarm's id");
  }
  if (!is_started(device)) throw Failure("the device is not started");
  if (!embedded::fire_alarm(device, static_cast<int>(id), embedded::device_now_ms(device))) {
    throw Failure("no alarm " + arguments[1]);
  }
  // The supervisor starts a daemon that is not running; either way it takes the alarm.
  const gint64 patience = g_get_monotonic_time() + kFireMicroseconds;
  while (embedded::has_fired_alarms(device, kAlarmOwner)) {
    if (g_get_monotonic_time() > patience) throw Failure("the daemon did not take the alarm");
    g_usleep(kFirePauseMicroseconds);
  }
  return DEVICE_OK;
}

int verb_log(const Arguments &arguments) {
  const bool follow = arguments.size() == 2 && arguments[1] == "--follow";
  if (arguments.empty() || (arguments.size() != 1 && !follow)) wrong_use();
  const std::string path = open_device(arguments[0]) + "/log/quarnd.log";
  if (follow) follow_log(path);
  std::ifstream file(path);
  if (!file) {
    if (errno == ENOENT) return DEVICE_OK;  // nothing was logged yet
    throw Failure("cannot read " + path + ": " + reason());
  }
  for (std::string line; std::getline(file, line);) print_log_line(line);
  return DEVICE_OK;
}
