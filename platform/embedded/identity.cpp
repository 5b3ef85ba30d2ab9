// Model name, modem and account: what the device is, read from its facts.
#include <cstring>
#include <string>

#include "platform_account.h"
#include "platform_system_info.h"
#include "platform_telephony.h"
#include "state/facts.h"
#include "state/state_file.h"

struct tapi_handle {
  std::string serial;
};

struct account_s {
  std::string user_name;
};

namespace {

constexpr char kAccountPackageName[] = "com.velmor.velmoraccount";

std::string fact(const char *key) {
  embedded::Fact found;
  embedded::get_fact(embedded::current_device(), key, &found);
  return found.value;
}

}  // namespace

int system_info_get_platform_string(const char *key, char **value) {
  if (key == nullptr || value == nullptr || std::strcmp(key, SYSTEM_INFO_KEY_MODEL_NAME) != 0) {
    return SYSTEM_INFO_ERROR_INVALID_PARAMETER;
  }
  const std::string model = fact(embedded::kModel);
  if (model.empty()) return SYSTEM_INFO_ERROR_IO_ERROR;
  *value = strdup(model.c_str());
  return SYSTEM_INFO_ERROR_NONE;
}

TapiHandle *tel_init(const char *) {
  if (fact(embedded::kModem) != "on") return nullptr;
  return new tapi_handle{fact(embedded::kSerial)};
}

int tel_deinit(TapiHandle *handle) {
  delete handle;
  return TAPI_API_SUCCESS;
}

char *tel_get_misc_me_imei_sync(TapiHandle *handle) {
  if (handle == nullptr || handle->serial.empty()) return nullptr;
  return strdup(handle->serial.c_str());
}

int account_connect(void) {
  return embedded::current_device().empty() ? ACCOUNT_ERROR_DB_FAILED : ACCOUNT_ERROR_NONE;
}

int account_disconnect(void) { return ACCOUNT_ERROR_NONE; }

int account_query_account_by_package_name(account_cb callback, const char *package_name,
                                          void *user_data) {
  if (callback == nullptr || package_name == nullptr) return ACCOUNT_ERROR_INVALID_PARAMETER;
  account_s account{fact(embedded::kAccount)};
  if (account.user_name.empty() || std::strcmp(package_name, kAccountPackageName) != 0) {
    return ACCOUNT_ERROR_RECORD_NOT_FOUND;
  }
  callback(&account, user_data);
  return ACCOUNT_ERROR_NONE;
}

int account_get_user_name(account_h account, char **user_name) {
  if (account == nullptr || user_name == nullptr) return ACCOUNT_ERROR_INVALID_PARAMETER;
  *user_name = strdup(account->user_name.c_str());
  return ACCOUNT_ERROR_NONE;
}
