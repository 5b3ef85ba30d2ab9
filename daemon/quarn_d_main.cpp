#include <unistd.h>

#include <csignal>
#include <cstdio>

#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_loop.h"
#include "quarn_d_progress.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_status.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_dbus_server.h"
#include "quarn_log.h"

namespace {

/** A signal ends the process within a second, also one whose main thread waits for a client. */
constexpr int kSignalGraceMs = 900;
constexpr int kSignals[] = {SIGINT, SIGHUP, SIGTERM, SIGQUIT};

bool quarn_started = false;
unsigned int quarn_dbus_owner_id = 0;

void deinit_quarn() {
  if (!quarn_started) return;
  quarn_started = false;
  deinit_backup_resource();
  LOGI("quarnd_dbus_deinit ~");
  quarnd_status_unexport();
  quarnd_dbus_deinit(quarn_dbus_owner_id);
  LOGI("ecore_shutdown ~");
  quarn_loop_shutdown();
}

void log_signal(int signo) { LOGI("SIGNAL %d received", signo); }

void end_by_signal(int) {
  quarn_exit_code = 0;
  deinit_quarn();
  quit_nested_loops();
  quarn_loop_quit();
}

/** Runs in signal context: the signal wakes the loop, which does the rest. */
void signal_handler(int signo) { quarn_loop_wake_from_signal(signo); }

void install_signal_handlers() {
  for (const int signo : kSignals) signal(signo, signal_handler);
}

int disable_restore() { return quarnd_restore_enable(0, 0, "", "", nullptr); }

/** The upward calls of the lower floors. */
void wire_units() {
  set_backup_wifi_probe(wifi_connected);
  set_pending_request_probe(backup_request_outstanding);
  set_restore_disable(disable_restore);
  set_bus_acquired_hook(quarnd_status_export);
  quarnd_progress_init();
}

void init_quarn() {
  if (quarn_started) {
    LOGI("Started already");
    return;
  }
  wire_units();
  quarn_loop_init();
  // Ecore has put handlers of its own in place of ours.
  install_signal_handlers();
  quarn_dbus_owner_id = quarnd_dbus_init();
  quarn_started = true;
  init_backup_resource();
  start_wifi_monitor();
#ifdef QUARN_LIVE_SETTING
  monitor_auto_backup_status();
#endif
}

}  // namespace

int main() {
  LOGI("Quarn Daemon start");
  if (!server_util_is_account_exist()) {
    LOGI("no signed-in. Daemon stop");
    return 0;
  }
  quarn_loop_watch_signals(log_signal, end_by_signal, kSignalGraceMs);
  install_signal_handlers();
  init_quarn();
  init_backup_req_dispatch_thread();
  LOGI("== main loop begin ==");
  quarn_loop_begin();
  deinit_quarn();
  LOGI("Good-Bye from Quarn");
  // The worker has no end of its own: nothing may be destroyed under it.
  std::fflush(nullptr);
  _exit(quarn_exit_code);
}
