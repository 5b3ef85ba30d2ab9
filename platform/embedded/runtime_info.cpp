#include "platform_runtime_info.h"

#include <memory>
#include <string>

#include "state/fact_watch.h"

namespace {

std::unique_ptr<embedded::FactWatch> &charger_watch() {
  static auto *watch = new std::unique_ptr<embedded::FactWatch>;
  return *watch;
}

}  // namespace

int runtime_info_get_value_bool(runtime_info_key_e key, bool *value) {
  if (key != RUNTIME_INFO_KEY_CHARGER_CONNECTED || value == nullptr) {
    return RUNTIME_INFO_ERROR_INVALID_PARAMETER;
  }
  embedded::Fact fact;
  if (!embedded::get_fact(embedded::current_device(), embedded::kCharger, &fact)) {
    return RUNTIME_INFO_ERROR_IO_ERROR;
  }
  *value = fact.value == "on";
  return RUNTIME_INFO_ERROR_NONE;
}

int runtime_info_set_changed_cb(runtime_info_key_e key, runtime_info_changed_cb callback,
                                void *user_data) {
  if (key != RUNTIME_INFO_KEY_CHARGER_CONNECTED || callback == nullptr) {
    return RUNTIME_INFO_ERROR_INVALID_PARAMETER;
  }
  charger_watch() = std::make_unique<embedded::FactWatch>(
      embedded::kCharger,
      [key, callback, user_data](const std::string &) { callback(key, user_data); });
  if (*charger_watch()) return RUNTIME_INFO_ERROR_NONE;
  charger_watch().reset();
  return RUNTIME_INFO_ERROR_IO_ERROR;
}

int runtime_info_unset_changed_cb(runtime_info_key_e key) {
  if (key != RUNTIME_INFO_KEY_CHARGER_CONNECTED || !charger_watch()) {
    return RUNTIME_INFO_ERROR_INVALID_PARAMETER;
  }
  charger_watch().reset();
  return RUNTIME_INFO_ERROR_NONE;
}
