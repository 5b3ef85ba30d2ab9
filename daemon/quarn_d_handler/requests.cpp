#include <algorithm>
#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform_settings.h"
#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

namespace {

constexpr char kFailed[] = "failed";

/** A manual backup that is taken, while its client is told so; it lives on its fiber's stack. */
struct starting_backup {
  std::string sender;
  bool cancelled = false;
};
std::vector<starting_backup *> starting;

}  // namespace

std::uint32_t quarnd_cancel_starting_backups(const std::string *sender) {
  std::uint32_t count = 0;
  for (starting_backup *backup : starting) {
    if (backup->cancelled || (sender != nullptr && backup->sender != *sender)) continue;
    backup->cancelled = true;
    ++count;
  }
  return count;
}

int quarnd_backup_enable(int on) {
  vconf_set_int(kBackupStatusKey, on != 0 ? 1 : 0);
  return QUARN_OK;
}

int quarnd_get_last_backed_up_time(unsigned long long *timestamp) {
  LOGI("quarnd_get_last_backed_up_time");
  *timestamp = static_cast<unsigned long long>(_get_current_timestamp());
  return QUARN_OK;
}

int quarnd_get_app_list(int client, void *record) {
  std::unique_ptr<client_cb_data> owned(static_cast<client_cb_data *>(record));
  if (client != QUARN_CLIENT_CLOUD && client != QUARN_CLIENT_COMPANION) {
    quarn_dbus_get_app_list_cb(QUARN_BAD_ARGUMENT, kFailed, owned.release());
    return QUARN_BAD_ARGUMENT;
  }
  request_power_lock(true);
  if (waits_are_ended() || (client == QUARN_CLIENT_CLOUD && !cloud_initialized())) {
    const int reason = waits_are_ended() ? QUARN_CANCELLED : QUARN_NO_SESSION;
    quarn_dbus_get_app_list_cb(reason, kFailed, owned.release());
    request_power_lock(false);
    return reason;
  }
  LOGI("quarnd_get_app_list");
  int result = QUARN_FAILED;
  const auto kind = static_cast<quarn_client_kind>(client);
  run_on_thread_stack([&] { result = get_app_list(kind, std::move(owned)); });
  request_power_lock(false);
  return result;
}

int quarnd_manual_backup(void *record) {
  LOGI("request for manual backup");
  manual_backup_canceled = false;
  // Others are served until the client has answered, and may cancel it.
  starting_backup own{static_cast<const client_cb_data *>(record)->sender};
  starting.push_back(&own);
  quarn_dbus_manual_backup_status(QUARN_OK, QUARN_BACKUP_RUNNING, record);
  starting.erase(std::find(starting.begin(), starting.end(), &own));
  if (own.cancelled) {
    LOGI("reservation for manual backup is canceled");
    quarn_dbus_manual_backup_status(QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, record);
    return QUARN_OK;
  }
  request_backup(record);
  return QUARN_OK;
}

int quarnd_manual_backup_cancel(void *record) {
  LOGI("quarnd_manual_backup_cancel");
  manual_backup_canceled = true;
  quarnd_cancel_starting_backups(nullptr);
  cancel_backup(record);
  quarn_dbus_manual_backup_cancel_result(QUARN_OK, record);
  return QUARN_OK;
}
