#include <fcntl.h>
#include <glib.h>
#include <json-c/json.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <memory>

#include "backup_transport.h"
#include "device.h"
#include "state/state_file.h"

namespace {

constexpr char kCloudFile[] = "cloud.conf";
constexpr char kCloudGroup[] = "cloud";
constexpr char kConfigVariable[] = "QUARN_CLOUD_CONFIG";
constexpr char kWarningSubject[] = "cloud transport: ";
constexpr const char *kKinds[] = {"file:///", "webdav+https://", "webdav+http://", "s3+https://",
                                  "s3+http://"};
constexpr char kAnyCredential[] = "any";
constexpr mode_t kPrivateFile = 0600;
constexpr std::size_t kMaxPasswordBytes = 4096;

/* ---- the password ---- */

/** Asks whoever sits at a terminal, and keeps what is typed there off the screen. */
class Prompt {
 public:
  Prompt() : shown_(isatty(STDIN_FILENO) != 0 && tcgetattr(STDIN_FILENO, &before_) == 0) {
    if (!shown_) return;
    termios hidden = before_;
    // An interrupt would leave the terminal so.
    hidden.c_lflag &= ~static_cast<tcflag_t>(ECHO | ISIG);
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &hidden);
    std::fputs("Password: ", stderr);
  }
  Prompt(const Prompt &) = delete;
  Prompt &operator=(const Prompt &) = delete;
  ~Prompt() {
    if (!shown_) return;
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &before_);
    std::fputs("\n", stderr);
  }

 private:
  termios before_{};
  bool shown_;
};

std::string read_line(int fd, const std::string &name) {
  std::string line;
  for (char c = 0;;) {
    const ssize_t count = read(fd, &c, 1);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) throw Failure("cannot read " + name + ": " + reason());
    if (count == 0 || c == '\n') break;
    if (line.size() == kMaxPasswordBytes) throw Failure("the password is too long");
    line += c;
  }
  if (!line.empty() && line.back() == '\r') line.pop_back();
  return line;
}

std::string read_password(const std::string &path) {
  std::string password;
  if (path.empty()) {
    const Prompt prompt;
    password = read_line(STDIN_FILENO, "standard input");
  } else {
    const Fd file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (file.fd < 0) throw Failure("cannot read " + path + ": " + reason());
    password = read_line(file.fd, path);
  }
  if (password.empty()) throw Failure("no password was given");
  // A text of C would end there.
  if (password.find('\0') != std::string::npos) throw Failure("the password is no text");
  return password;
}

std::string absolute(const std::string &path) {
  const std::unique_ptr<char, decltype(&std::free)> found(realpath(path.c_str(), nullptr),
                                                          &std::free);
  if (found == nullptr) throw Failure("cannot read " + path + ": " + reason());
  return found.get();
}

std::string text_of(const Cloud &cloud) {
  const embedded::KeyFilePtr file(g_key_file_new());
  const auto put = [&file](const char *key, const std::string &value) {
    if (!value.empty()) g_key_file_set_string(file.get(), kCloudGroup, key, value.c_str());
  };
  put("url", cloud.url);
  put("user", cloud.user);
  put("password", cloud.password);
  put("ca-file", cloud.ca_file);
  put("region", cloud.region);
  put("addressing", cloud.addressing);
  gsize length = 0;
  const embedded::GText text(g_key_file_to_data(file.get(), &length, nullptr));
  return std::string(text.get(), length);
}

/* ---- what the library says ---- */

struct Check {
  GMainLoop *loop = nullptr;
  bool with_store = false;
  backup_trans_cause cause = BACKUP_TRANS_CAUSE_DEVICE;
  backup_trans_error_code error = BACKUP_TRANS_ERROR_NOT_INITIALIZED;
  std::string message;
};

/** The library warns of a configuration that it cannot use; here that is the answer. */
GLogWriterOutput take_warning(GLogLevelFlags, const GLogField *fields, gsize count,
                              gpointer message) {
  for (gsize i = 0; i < count; ++i) {
    if (g_strcmp0(fields[i].key, "MESSAGE") != 0) continue;
    const std::string text = static_cast<const char *>(fields[i].value);
    const std::size_t colon = text.find(kWarningSubject) == 0 ? sizeof kWarningSubject - 1 : 0;
    *static_cast<std::string *>(message) = text.substr(colon);
  }
  return G_LOG_WRITER_HANDLED;
}

void on_checked(backup_trans_error_code error, void *data, backup_trans_cause cause,
                const char *message) {
  Check &check = *static_cast<Check *>(data);
  check.error = error;
  check.cause = cause;
  check.message = message;
  g_main_loop_quit(check.loop);
}

void on_started(backup_trans_error_code error, void *data) {
  Check &check = *static_cast<Check *>(data);
  if (error == BACKUP_TRANS_ERROR_NONE && check.with_store &&
      backup_trans_check_async(backup_trans_create_handle(), data, on_checked) ==
          BACKUP_TRANS_ERROR_NONE)
    return;
  if (!check.with_store) check.error = error;
  g_main_loop_quit(check.loop);
}

std::string &last_warning() {
  // A process may set its writer once.
  static std::string *const warning = [] {
    auto *text = new std::string;
    g_log_set_writer_func(take_warning, text, nullptr);
    return text;
  }();
  return *warning;
}

/** Have the library look at a configuration, and try out its store where that is wanted. */
void run(const std::string &config, Check *check) {
  std::string &warning = last_warning();
  warning.clear();
  setenv(kConfigVariable, config.c_str(), 1);
  check->loop = g_main_loop_new(nullptr, FALSE);
  if (backup_trans_init(check, on_started) == BACKUP_TRANS_ERROR_NONE) g_main_loop_run(check->loop);
  g_main_loop_unref(check->loop);
  backup_trans_deinit();
  if (check->message.empty()) check->message = warning;
}

void print_json(const Check &check) {
  json_object *object = json_object_new_object();
  json_object_object_add(object, "verb", json_object_new_string("cloud-check"));
  json_object_object_add(object, "cause",
                         json_object_new_string(backup_trans_cause_word(check.cause)));
  json_object_object_add(object, "error", json_object_new_int(check.error));
  json_object_object_add(object, "message", json_object_new_string(check.message.c_str()));
  std::puts(json_object_to_json_string_ext(object, JSON_C_TO_STRING_PLAIN));
  json_object_put(object);
}

[[noreturn]] void wrong_cloud() {
  throw Failure(
      "usage: quarn-device set DIR cloud URL [--user NAME [--password-file FILE]] "
      "[--ca-file FILE] [--region NAME] [--addressing path|virtual]",
      DEVICE_USAGE);
}

}  // namespace

void check_cloud(const Cloud &cloud) {
  // The URL is never quoted: there may be a password in it.
  if (std::none_of(std::begin(kKinds), std::end(kKinds),
                   [&](const char *kind) { return cloud.url.rfind(kind, 0) == 0; }))
    throw Failure(
        "that is no cloud: use file:///PATH, webdav+https://HOST/PATH or "
        "s3+https://HOST/BUCKET/PREFIX");
  // In memory, where nothing is left of what is refused.
  const Fd memory(memfd_create(kCloudFile, MFD_CLOEXEC));
  const std::string text = text_of(cloud);
  if (memory.fd < 0 || fchmod(memory.fd, kPrivateFile) != 0 ||
      write(memory.fd, text.data(), text.size()) != static_cast<ssize_t>(text.size()))
    throw Failure("cannot look at the cloud's configuration: " + reason());
  const std::string path = "/proc/self/fd/" + std::to_string(memory.fd);
  Check check;
  run(path, &check);
  if (check.error == BACKUP_TRANS_ERROR_NONE) return;
  const std::string place = path + ": ";
  throw Failure(check.message.rfind(place, 0) == 0 ? check.message.substr(place.size())
                                                   : check.message);
}

void check_cloud_url(const std::string &url) {
  check_cloud({url, kAnyCredential, kAnyCredential, "", "", ""});
}

void write_cloud(const std::string &device, const Cloud &cloud) {
  const embedded::StateLock lock(device);
  if (!lock || !embedded::write_state_text(device, kCloudFile, text_of(cloud), kPrivateFile)) {
    throw Failure("cannot write the cloud's configuration: " + reason());
  }
}

void set_cloud(const std::string &device, const Arguments &arguments) {
  Cloud cloud;
  cloud.url = arguments[2];
  std::string password_file;
  for (std::size_t i = 3; i < arguments.size(); i += 2) {
    if (i + 1 >= arguments.size() || arguments[i + 1].empty()) wrong_cloud();
    const std::string &value = arguments[i + 1];
    if (arguments[i] == "--user") {
      cloud.user = value;
    } else if (arguments[i] == "--password-file") {
      password_file = value;
    } else if (arguments[i] == "--ca-file") {
      cloud.ca_file = absolute(value);
    } else if (arguments[i] == "--region") {
      cloud.region = value;
    } else if (arguments[i] == "--addressing") {
      if (value != "path" && value != "virtual") wrong_cloud();
      cloud.addressing = value;
    } else {
      wrong_cloud();
    }
  }
  if (cloud.user.empty() && !password_file.empty()) wrong_cloud();
  // Nobody is asked for a password for what is refused anyway.
  if (!cloud.user.empty()) cloud.password = kAnyCredential;
  check_cloud(cloud);
  if (!cloud.user.empty()) {
    cloud.password = read_password(password_file);
    check_cloud(cloud);
  }
  write_cloud(device, cloud);
}

int verb_cloud_check(const Arguments &arguments) {
  const bool json = arguments.size() == 2 && arguments[1] == "--json";
  if (arguments.empty() || arguments.size() > 2 || (arguments.size() == 2 && !json)) wrong_use();
  Check check;
  check.with_store = true;
  run(embedded::state_path(open_device(arguments[0]), kCloudFile), &check);
  if (json) {
    print_json(check);
  } else {
    std::fprintf(check.cause == BACKUP_TRANS_CAUSE_NONE ? stdout : stderr, "%s: %s\n",
                 backup_trans_cause_word(check.cause), check.message.c_str());
  }
  return check.cause == BACKUP_TRANS_CAUSE_NONE ? DEVICE_OK : DEVICE_CLOUD + check.cause;
}
