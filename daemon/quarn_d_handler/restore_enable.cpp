#include <memory>
#include <utility>

#include "quarn_common.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_dbus_client.h"

int quarnd_restore_enable(int on, int client, const char *serial_num, const char *pkg_list,
                          void *record) {
  std::unique_ptr<client_cb_data> owned(static_cast<client_cb_data *>(record));
  if (client != QUARN_CLIENT_CLOUD && client != QUARN_CLIENT_COMPANION) return QUARN_BAD_ARGUMENT;
  if (on == 0) {
    disable_restore_mode();
    return QUARN_OK;
  }
  return enable_restore_mode(static_cast<quarn_client_kind>(client),
                             serial_num == nullptr ? "" : serial_num,
                             pkg_list == nullptr ? "" : pkg_list, std::move(owned));
}
