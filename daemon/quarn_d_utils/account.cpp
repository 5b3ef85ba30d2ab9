#include "platform_account.h"
#include "quarn_common.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

bool __server_util_account_callback(account_h account, void *result) {
  if (account == nullptr) {
    LOGE("account is NULL");
    return false;
  }
  CString user_name;
  if (account_get_user_name(account, out(user_name)) != ACCOUNT_ERROR_NONE) {
    LOGE("account_get_user_name failed");
    return false;
  }
  LOGI("account exist!");
  *static_cast<bool *>(result) = true;
  return true;
}

}  // namespace

bool server_util_is_account_exist() {
  if (account_connect() != ACCOUNT_ERROR_NONE) {
    LOGE("account_connect fail");
    return false;
  }
  bool exists = false;
  const int ret = account_query_account_by_package_name(__server_util_account_callback,
                                                        kAccountPackage, &exists);
  if (ret != ACCOUNT_ERROR_NONE) LOGE("account_query_account_by_package_name fail %d", ret);
  if (account_disconnect() != ACCOUNT_ERROR_NONE) LOGE("account_disconnect fail");
  return exists;
}
