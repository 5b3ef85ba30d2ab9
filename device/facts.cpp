// The verbs that make a device and say how it is: what its services tell the daemon.
#include <glib.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <random>

#include "device.h"
#include "state/clock.h"
#include "state/facts.h"
#include "state/state_file.h"

namespace {

namespace fs = std::filesystem;

constexpr char kDefaultModel[] = "Orvane Embedded";
constexpr char kDefaultAccount[] = "user";
constexpr std::int64_t kMillisInSecond = 1000;
/** Others pass through to the bus. */
constexpr mode_t kDeviceMode = 0711;

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

/** What `create` is told of a device. */
struct NewDevice {
  std::string model = kDefaultModel;
  std::string serial; /**< empty: one of its own */
  std::string account = kDefaultAccount;
  std::string cloud; /**< URL; empty: a folder of the device's */
};

std::string *place_of(const std::string &option, NewDevice *made) {
  if (option == "--model") return &made->model;
  if (option == "--serial") return &made->serial;
  if (option == "--account") return &made->account;
  if (option == "--cloud") return &made->cloud;
  return nullptr;
}

NewDevice parse_new_device(const Arguments &arguments) {
  NewDevice made;
  for (std::size_t i = 1; i < arguments.size(); ++i) {
    if (arguments[i] == "--no-account") {
      made.account.clear();
      continue;
    }
    if (i + 1 >= arguments.size()) wrong_use();
    const std::string &value = arguments[i + 1];
    if (!is_text(value)) throw Failure("empty or unprintable " + arguments[i]);
    std::string *place = place_of(arguments[i], &made);
    if (place == nullptr) wrong_use();
    *place = value;
    ++i;
  }
  if (made.serial.find('/') != std::string::npos || made.serial == "." || made.serial == "..") {
    throw Failure("a serial number names a folder in the cloud: no slash, no dots alone");
  }
  if (!made.cloud.empty()) check_cloud_url(made.cloud);
  return made;
}

/** The folders of a new device. @return its path */
std::string make_folders(const std::string &name) {
  const fs::path dir = fs::absolute(name);
  std::error_code error;
  if (fs::exists(dir, error) && !(fs::is_directory(dir, error) && fs::is_empty(dir, error))) {
    throw Failure(name + " is there already and not empty");
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
  return device;
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
  const NewDevice made = parse_new_device(arguments);
  const std::string device = make_folders(arguments[0]);
  set_fact(device, embedded::kModel, made.model);
  set_fact(device, embedded::kSerial, made.serial.empty() ? new_serial() : made.serial);
  set_fact(device, embedded::kAccount, made.account);
  set_fact(device, embedded::kModem, "on");
  set_fact(device, embedded::kNetwork, "wifi");
  set_fact(device, embedded::kCharger, "off");
  set_fact(device, embedded::kDisplay, "on");
  write_cloud(device,
              {made.cloud.empty() ? file_url(device + "/cloud") : made.cloud, "", "", "", "", ""});
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
