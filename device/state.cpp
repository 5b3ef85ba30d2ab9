#include <fcntl.h>
#include <glib.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <random>

#include "device.h"
#include "state/alarms.h"
#include "state/clock.h"
#include "state/facts.h"
#include "state/printable.h"
#include "state/state_file.h"
#include "state/values.h"

namespace {

namespace fs = std::filesystem;

constexpr char kDefaultModel[] = "Orvane Embedded";
constexpr char kDefaultAccount[] = "user";
constexpr gint64 kFireMicroseconds = 20000000;
constexpr std::int64_t kMillisInSecond = 1000;
/** Others pass through to the bus. */
constexpr mode_t kDeviceMode = 0711;
constexpr gulong kFirePauseMicroseconds = 5000;

/** An IMEI: 14 digits of the device's own and their check digit. */
std::string new_serial() {
  constexpr int kDigits = 14;
  std::random_device source;
  std::string digits = "35";
  while (digits.size() < kDigits) digits += static_cast<char>('0' + source() % 10);
  int sum = 0;
  for (int i = 0; i < kDigits; ++i) {
    const int digit = digits[i] - '0';
    const int twice = digit * 2;
    sum += i % 2 == 0 ? digit : twice / 10 + twice % 10;
  }
  return digits + static_cast<char>('0' + (10 - sum % 10) % 10);
}

std::string file_url(const std::string &path) {
  const embedded::GText url(g_filename_to_uri(path.c_str(), nullptr, nullptr));
  if (url == nullptr) throw Failure("no URL can name " + path);
  return url.get();
}

bool is_one_of(const std::string &value, std::initializer_list<const char *> allowed) {
  return std::any_of(allowed.begin(), allowed.end(), [&](const char *one) { return value == one; });
}

/** A text that names something: printable, one line. */
bool is_text(const std::string &value) {
  return !value.empty() && g_utf8_validate(value.c_str(), -1, nullptr) != FALSE &&
         std::none_of(value.begin(), value.end(),
                      [](char c) { return static_cast<unsigned char>(c) < 0x20; });
}

void set_fact(const std::string &device, const char *key, const std::string &value) {
  if (!embedded::set_fact(device, key, value)) {
    throw Failure(std::string("cannot write ") + key + ": " + reason());
  }
}

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

/** The verb `set DIR clock +SECONDS`: how far the device's clock is ahead of the machine's. */
void set_clock(const std::string &device, const std::string &value) {
  // Further than that no device was ever off.
  constexpr gint64 kMaxSeconds = 100LL * 365 * 24 * 3600;
  gint64 seconds = 0;
  const bool with_sign = value.size() > 1 && (value[0] == '+' || value[0] == '-') &&
                         g_ascii_isdigit(value[1]) != FALSE;
  const bool back = value == "real" || value == "0";
  const std::string number = back ? "0" : value.substr(value[0] == '+' ? 1 : 0);
  if ((!with_sign && !back) || g_ascii_string_to_signed(number.c_str(), 10, -kMaxSeconds,
                                                        kMaxSeconds, &seconds, nullptr) == FALSE) {
    throw Failure("\"" + value + "\" is no time of the clock: use +SECONDS, -SECONDS or real");
  }
  const std::int64_t offset = seconds * kMillisInSecond;
  if (embedded::machine_now_ms() + offset < 0) throw Failure("no clock goes back behind 1970");
  if (!embedded::set_clock_offset_ms(device, offset)) {
    throw Failure("cannot write clock: " + reason());
  }
}

}  // namespace

void close_folders(const std::string &device) {
  struct Place {
    const char *name;
    mode_t most;
  };
  constexpr Place kPlaces[] = {
      {"state", 0700}, {"log", 0700}, {"cloud", 0700}, {"run", 0711}, {"state/.lock", 0600}};
  for (const Place &place : kPlaces) {
    const std::string path = device + "/" + place.name;
    struct stat status {};
    if (lstat(path.c_str(), &status) != 0 || S_ISLNK(status.st_mode)) continue;
    const mode_t mode = status.st_mode & 07777;
    if ((mode & ~place.most) != 0 && chmod(path.c_str(), mode & place.most) != 0) {
      throw Failure("cannot close " + path + ": " + reason());
    }
  }
}

int verb_create(const Arguments &arguments) {
  if (arguments.empty() || arguments[0].empty() || arguments[0][0] == '-') wrong_use();
  std::string model = kDefaultModel;
  std::string serial;
  std::string account = kDefaultAccount;
  std::string cloud;
  for (std::size_t i = 1; i < arguments.size(); ++i) {
    if (arguments[i] == "--no-account") {
      account.clear();
      continue;
    }
    if (i + 1 >= arguments.size()) wrong_use();
    const std::string &value = arguments[i + 1];
    if (!is_text(value)) throw Failure("empty or unprintable " + arguments[i]);
    if (arguments[i] == "--model") {
      model = value;
    } else if (arguments[i] == "--serial") {
      serial = value;
    } else if (arguments[i] == "--account") {
      account = value;
    } else if (arguments[i] == "--cloud") {
      cloud = value;
    } else {
      wrong_use();
    }
    ++i;
  }
  if (serial.find('/') != std::string::npos || serial == "." || serial == "..") {
    throw Failure("a serial number names a folder in the cloud: no slash, no dots alone");
  }
  if (!cloud.empty()) check_cloud_url(cloud);

  const fs::path dir = fs::absolute(arguments[0]);
  std::error_code error;
  if (fs::exists(dir, error) && !(fs::is_directory(dir, error) && fs::is_empty(dir, error))) {
    throw Failure(arguments[0] + " is there already and not empty");
  }
  const bool made = fs::create_directories(dir, error);
  if (error) throw Failure("cannot make " + dir.string() + ": " + error.message());
  check_own_folder(dir);
  if (made) chmod(dir.c_str(), kDeviceMode);
  for (const char *folder : {"root/opt/usr/apps", "root/tmp", "run", "log", "cloud",
                             "state/packages", "state/apps", "state/.tmp"}) {
    fs::create_directories(dir / folder, error);
    if (error) throw Failure("cannot make " + (dir / folder).string() + ": " + error.message());
  }
  const std::string device = fs::canonical(dir).string();
  chmod((device + "/root/tmp").c_str(), 01777);
  close_folders(device);

  set_fact(device, embedded::kModel, model);
  set_fact(device, embedded::kSerial, serial.empty() ? new_serial() : serial);
  set_fact(device, embedded::kAccount, account);
  set_fact(device, embedded::kModem, "on");
  set_fact(device, embedded::kNetwork, "wifi");
  set_fact(device, embedded::kCharger, "off");
  set_fact(device, embedded::kDisplay, "on");
  write_cloud(device, {cloud.empty() ? file_url(device + "/cloud") : cloud, "", "", "", "", ""});
  return DEVICE_OK;
}

int verb_set(const Arguments &arguments) {
  if (arguments.size() < 3) wrong_use();
  const std::string device = open_device(arguments[0]);
  const std::string &key = arguments[1];
  const std::string &value = arguments[2];
  if (key == "cloud") {
    set_cloud(device, arguments);
    return DEVICE_OK;
  }
  if (arguments.size() != 3) wrong_use();
  const auto set_if = [&](const char *name, std::initializer_list<const char *> allowed) {
    if (!is_one_of(value, allowed)) throw Failure("\"" + value + "\" is no state of the " + key);
    set_fact(device, name, value);
  };
  if (key == "network") {
    set_if(embedded::kNetwork, {"wifi", "cellular", "none"});
  } else if (key == "charger") {
    set_if(embedded::kCharger, {"on", "off"});
  } else if (key == "display") {
    set_if(embedded::kDisplay, {"on", "dim", "off"});
  } else if (key == "modem") {
    set_if(embedded::kModem, {"on", "off"});
  } else if (key == "clock") {
    set_clock(device, value);
  } else if (key == "account") {
    if (!is_text(value)) throw Failure("empty or unprintable account name");
    set_fact(device, embedded::kAccount, value == "none" ? "" : value);
  } else {
    throw Failure("no key \"" + key + "\"; see quarn-device set --help");
  }
  return DEVICE_OK;
}

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
