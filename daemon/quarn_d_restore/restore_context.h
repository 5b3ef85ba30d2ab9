/**
 * @file restore_context.h
 * @brief The state of one package's restore. Main thread only.
 *
 * Whoever begins a restore owns its context, and lends it to the engine until
 * the restore has ended. Who does not want to wait for that leaves the context
 * to the engine, which then deletes it at the end.
 */
#ifndef QUARN_D_RESTORE_RESTORE_CONTEXT_H
#define QUARN_D_RESTORE_RESTORE_CONTEXT_H

#include <memory>
#include <string>

#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"

struct pkg_restore_context {
  int result = QUARN_OK; /**< a #quarn_result; final when pending is back at 0 */
  std::string serial;    /**< of the device whose archive it is */
  int reserved = 0;
  bool wait_for_result = false; /**< for a request, which is told; else an icon is shown again */
  GMainLoopPtr main_loop;       /**< that the request waits in; quit at the end */
  bool reserved_flag = false;
  bool restore_started = false; /**< by the first of the package's applications */
  int pending = 0;              /**< restores that were accepted and have not ended */
  std::string pkgid;
  std::string version;
  std::string root;
  bool backup_enabled = true; /**< none of the package's applications is left out of backup */
  archive_hold archive;       /**< no backup touches the archive before the restore has ended */
};
using RestoreContextPtr = std::unique_ptr<pkg_restore_context>;

/** The engine deletes @p ctx, whose restore was accepted, when that has ended. */
void leave_restore(RestoreContextPtr ctx);
/** The same for a request that does not wait any more: its download is ended. */
void abandon_restore(RestoreContextPtr ctx);
/** True when a request that does not wait any more has left it to the engine. */
[[nodiscard]] bool is_abandoned(const pkg_restore_context &ctx);

#endif
