#include "quarn_d_main.h"

#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstring>

#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_loop.h"
#include "quarn_d_progress.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_status.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_dbus_server.h"
#include "quarn_log.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

std::int32_t quarn_started = 0;
std::uint32_t quarn_dbus_owner_id = 0;

namespace {

/** Milliseconds from a signal to the end of a process whose main thread is blocked. */
constexpr int kSignalGrace = 900;

bool signals_watched = false;

void log_signal(int signo) { LOGI("SIGNAL %d received", signo); }

void end_by_signal(int) {
  deinit_quarn();
  quarn_exit_code = 0;
  quit_nested_loops();
  quarn_loop_quit();
}

void install_signal_handlers() {
  if (!signals_watched) return;
  for (const int signo : {SIGINT, SIGHUP, SIGTERM, SIGQUIT}) signal(signo, signal_handler);
}

int disable_restore() { return quarnd_restore_enable(0, 0, "", "", nullptr); }

/** Lower floors learn how to ask the upper ones. */
void wire_floors() {
  set_backup_wifi_probe(wifi_connected);
  set_pending_request_probe(backup_request_outstanding);
  set_restore_disable(disable_restore);
  set_boot_recovery(recover_device);
  set_bus_acquired_hook(quarnd_status_export);
  quarnd_progress_init();
}

}  // namespace

void signal_handler(int signo) { quarn_loop_wake_from_signal(signo); }

void init_quarn() {
  if (quarn_started != 0) {
    LOGI("Started already");
    return;
  }
  wire_floors();
  quarn_loop_init();
  install_signal_handlers();  // Ecore has installed its own
  quarn_dbus_owner_id = quarnd_dbus_init();
  quarn_started = 1;
  init_backup_resource();
  start_wifi_monitor();
#ifdef QUARN_LIVE_SETTING
  monitor_auto_backup_status();
#endif
}

void deinit_quarn() {
  if (quarn_started == 0) return;
  deinit_backup_resource();
  LOGI("quarnd_dbus_deinit ~");
  quarnd_status_unexport();
  quarnd_dbus_deinit(quarn_dbus_owner_id);
  LOGI("ecore_shutdown ~");
  quarn_loop_shutdown();
  quarn_started = 0;
}

int quarn_run() {
  LOGI("Quarn Daemon start");
  if (!server_util_is_account_exist()) {
    LOGI("no signed-in. Daemon stop");
    return 0;
  }
  signals_watched = quarn_loop_watch_signals(log_signal, end_by_signal, kSignalGrace);
  install_signal_handlers();
  init_quarn();
  init_backup_req_dispatch_thread();
  LOGI("== main loop begin ==");
  quarn_loop_begin();
  deinit_quarn();
  LOGI("Good-Bye from Quarn");
  return quarn_exit_code;
}

int quarn_recover() {
  LOGI("recovery of what an interrupted restore or backup has left");
  recover_device();
  return 0;
}

int main(int argc, char **argv) {
  const bool recovery = argc == 2 && std::strcmp(argv[1], "--recover") == 0;
  const int status = recovery ? quarn_recover() : quarn_run();
  std::fflush(nullptr);
#if defined(__SANITIZE_ADDRESS__)
  __lsan_do_leak_check();
#endif
  // Destructors of globals would pull them from under the backup worker.
  _exit(status);
}
