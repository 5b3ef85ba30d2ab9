#include <glib.h>
#include <json-c/json.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <memory>

#include "backup_transport.h"
#include "device.h"
#include "state/state_file.h"
#include "state/values.h"

namespace {

constexpr char kCloudFile[] = "cloud.conf";
constexpr char kCloudGroup[] = "cloud";
constexpr char kConfigVariable[] = "QUARN_CLOUD_CONFIG";
constexpr char kWarningSubject[] = "cloud transport: ";
constexpr mode_t kPrivateFile = 0600;

bool is_loopback(const std::string &host) {
  return host == "localhost" || host == "127.0.0.1" || host == "::1" || host == "[::1]";
}

std::string read_line(std::istream &in) {
  std::string line;
  std::getline(in, line);
  if (!line.empty() && line.back() == '\r') line.pop_back();
  return line;
}

std::string read_password(const std::string &path) {
  std::string password;
  if (path.empty()) {
    password = read_line(std::cin);
  } else {
    std::ifstream file(path);
    if (!file) throw Failure("cannot read " + path + ": " + reason());
    password = read_line(file);
  }
  if (password.empty()) throw Failure("no password was given");
  return password;
}

std::string absolute(const std::string &path) {
  const std::unique_ptr<char, decltype(&std::free)> found(realpath(path.c_str(), nullptr),
                                                          &std::free);
  if (found == nullptr) throw Failure("cannot read " + path + ": " + reason());
  return found.get();
}

/* ---- the check ---- */

struct Check {
  GMainLoop *loop = nullptr;
  backup_trans_cause cause = BACKUP_TRANS_CAUSE_DEVICE;
  backup_trans_error_code error = BACKUP_TRANS_ERROR_NOT_INITIALIZED;
  std::string message;
};

/** The library warns of a configuration that it cannot use; here that is the answer. */
GLogWriterOutput take_warning(GLogLevelFlags, const GLogField *fields, gsize count,
                              gpointer check) {
  for (gsize i = 0; i < count; ++i) {
    if (g_strcmp0(fields[i].key, "MESSAGE") != 0) continue;
    const std::string text = static_cast<const char *>(fields[i].value);
    const std::size_t colon = text.find(kWarningSubject) == 0 ? sizeof kWarningSubject - 1 : 0;
    static_cast<Check *>(check)->message = text.substr(colon);
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
  if (error == BACKUP_TRANS_ERROR_NONE &&
      backup_trans_check_async(backup_trans_create_handle(), data, on_checked) ==
          BACKUP_TRANS_ERROR_NONE)
    return;
  g_main_loop_quit(check.loop);
}

void run(Check *check) {
  g_log_set_writer_func(take_warning, check, nullptr);
  check->loop = g_main_loop_new(nullptr, FALSE);
  if (backup_trans_init(check, on_started) == BACKUP_TRANS_ERROR_NONE) g_main_loop_run(check->loop);
  g_main_loop_unref(check->loop);
  backup_trans_deinit();
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

}  // namespace

void check_cloud_url(const std::string &url) {
  GError *error = nullptr;
  GUri *uri = g_uri_parse(url.c_str(), G_URI_FLAGS_NONE, &error);
  if (uri == nullptr) {
    const std::string text = error->message;
    g_error_free(error);
    throw Failure("\"" + url + "\" is no cloud URL: " + text);
  }
  const std::string scheme = g_uri_get_scheme(uri);
  const std::string host = g_uri_get_host(uri) == nullptr ? "" : g_uri_get_host(uri);
  const std::string path = g_uri_get_path(uri);
  const bool has_user = g_uri_get_userinfo(uri) != nullptr;
  g_uri_unref(uri);
  if (has_user) throw Failure("a cloud URL holds no user or password: use --user");
  if (scheme == "file") {
    if (!host.empty() || path.empty() || path[0] != '/') {
      throw Failure("a folder is named file:///PATH");
    }
    return;
  }
  const bool encrypted = scheme == "webdav+https" || scheme == "s3+https";
  const bool plain = scheme == "webdav+http" || scheme == "s3+http";
  if (!encrypted && !plain) {
    throw Failure("\"" + scheme + "\" is no kind of cloud: use file, webdav+https or s3+https");
  }
  if (host.empty()) throw Failure("\"" + url + "\" names no host");
  if (plain && !is_loopback(host)) throw Failure("plain http is for this machine only: use https");
}

void write_cloud(const std::string &device, const Cloud &cloud) {
  check_cloud_url(cloud.url);
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
  if (!embedded::write_state_text(device, kCloudFile, std::string(text.get(), length),
                                  kPrivateFile)) {
    throw Failure("cannot write the cloud's configuration: " + reason());
  }
}

void set_cloud(const std::string &device, const Arguments &arguments) {
  Cloud cloud;
  cloud.url = arguments[2];
  std::string password_file;
  for (std::size_t i = 3; i < arguments.size(); i += 2) {
    if (i + 1 >= arguments.size() || arguments[i + 1].empty()) wrong_use();
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
      if (value != "path" && value != "virtual") wrong_use();
      cloud.addressing = value;
    } else {
      wrong_use();
    }
  }
  if (cloud.user.empty() && !password_file.empty()) wrong_use();
  // Nobody is asked for a password for an address that is refused.
  check_cloud_url(cloud.url);
  if (!cloud.user.empty()) cloud.password = read_password(password_file);
  write_cloud(device, cloud);
}

int verb_cloud_check(const Arguments &arguments) {
  const bool json = arguments.size() == 2 && arguments[1] == "--json";
  if (arguments.empty() || arguments.size() > 2 || (arguments.size() == 2 && !json)) wrong_use();
  setenv(kConfigVariable, embedded::state_path(open_device(arguments[0]), kCloudFile).c_str(), 1);
  Check check;
  run(&check);
  if (json) {
    print_json(check);
  } else {
    std::fprintf(check.cause == BACKUP_TRANS_CAUSE_NONE ? stdout : stderr, "%s: %s\n",
                 backup_trans_cause_word(check.cause), check.message.c_str());
  }
  return check.cause == BACKUP_TRANS_CAUSE_NONE ? DEVICE_OK : DEVICE_CLOUD + check.cause;
}
