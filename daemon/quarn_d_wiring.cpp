#include "quarn_d_wiring.h"

#include "quarn_d_backup/backup_progress.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_conditions/setting_observer.h"
#include "quarn_d_packages.h"
#include "quarn_d_progress.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_status.h"
#include "quarn_d_utils/boot_cleanup.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_server.h"

namespace {

void export_objects(GDBusConnection *connection) {
  quarnd_status_export(connection);
  quarnd_packages_export(connection);
}

}  // namespace

void wire_floors() {
  // The sweep is the backup worker's; what an interrupted restore has left only restore can mend.
  set_boot_recovery(recover_device);
  // Whoever waits to pack a package is in the queue for its archive, which packing knows nothing
  // of.
  set_packing_ended_hook(note_packing_ended);
  // How long a client may let others wait depends on who waits in the worker's queue.
  quarn_dbus_set_patience(others_held_up);
  // The objects stand on a connection that the server has first, but the packages ask the server.
  set_bus_acquired_hook(export_objects);
  // The steps of runs and restores are told on the bus, high above those that make them.
  set_backup_progress_sink(note_backup_progress);
  set_restore_progress_sink(note_restore_progress);
  // The status shows what backups, restore mode and the setting are, and they do not know of it.
  set_backup_end_observer(quarnd_status_refresh);
  set_restore_mode_observer(quarnd_status_refresh);
  set_setting_observer(quarnd_status_refresh);
}
