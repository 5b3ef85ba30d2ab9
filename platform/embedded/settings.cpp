#include "platform_settings.h"

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <list>
#include <memory>
#include <string>

#include "state/state_file.h"
#include "state/values.h"
#include "state/watch.h"

struct _keynode_t {
  std::string key;
};

namespace {

struct Watcher {
  std::string key;
  vconf_callback_fn callback;
  void *user_data;
  std::int64_t writes;
};

bool read_text(const char *key, std::string *text) {
  return key != nullptr && embedded::get_value(embedded::current_device(), key, text);
}

int write_text(const char *key, const std::string &text) {
  return key != nullptr && embedded::set_value(embedded::current_device(), key, text) ? VCONF_OK
                                                                                      : VCONF_ERROR;
}

std::list<Watcher> &watchers() {
  static auto *all = new std::list<Watcher>;
  return *all;
}

void on_change() {
  const std::string device = embedded::current_device();
  for (Watcher &watcher : watchers()) {
    const std::int64_t writes = embedded::value_writes(device, watcher.key);
    if (writes == watcher.writes) continue;
    watcher.writes = writes;
    keynode_t node{watcher.key};
    watcher.callback(&node, watcher.user_data);
  }
}

}  // namespace

int vconf_get_int(const char *key, int *value) {
  std::string text;
  if (value == nullptr || !read_text(key, &text)) return VCONF_ERROR;
  char *end = nullptr;
  errno = 0;
  const long number = std::strtol(text.c_str(), &end, 10);
  if (text.empty() || *end != '\0' || errno != 0 || number != static_cast<int>(number)) {
    return VCONF_ERROR;
  }
  *value = static_cast<int>(number);
  return VCONF_OK;
}

int vconf_set_int(const char *key, int value) { return write_text(key, std::to_string(value)); }

int vconf_get_dbl(const char *key, double *value) {
  std::string text;
  if (value == nullptr || !read_text(key, &text)) return VCONF_ERROR;
  gchar *end = nullptr;
  const double number = g_ascii_strtod(text.c_str(), &end);
  if (text.empty() || *end != '\0' || !std::isfinite(number)) return VCONF_ERROR;
  *value = number;
  return VCONF_OK;
}

int vconf_set_dbl(const char *key, double value) {
  if (!std::isfinite(value)) return VCONF_ERROR;
  char text[G_ASCII_DTOSTR_BUF_SIZE];
  return write_text(key, g_ascii_dtostr(text, sizeof text, value));
}

int vconf_notify_key_changed(const char *key, vconf_callback_fn callback, void *user_data) {
  const std::string device = embedded::current_device();
  if (key == nullptr || callback == nullptr || !embedded::is_value_key(key)) return VCONF_ERROR;
  static auto *watch = new std::unique_ptr<embedded::StateWatch>;
  if (!*watch)
    *watch = std::make_unique<embedded::StateWatch>(device, embedded::kValuesFile, on_change);
  if (!**watch) {
    watch->reset();
    return VCONF_ERROR;
  }
  watchers().push_back({key, callback, user_data, embedded::value_writes(device, key)});
  return VCONF_OK;
}
