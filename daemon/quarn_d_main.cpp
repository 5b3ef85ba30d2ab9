#include "quarn_d_main.h"

#include <glib.h>
#include <malloc.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <string>

#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_end.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_loop.h"
#include "quarn_d_packages.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_status.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/kernel_settings.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_wiring.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_server.h"
#include "quarn_log.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

std::int32_t quarn_started = 0;
std::uint32_t quarn_dbus_owner_id = 0;

namespace {

/** Milliseconds from a signal to the end of a process whose main thread is blocked. */
constexpr int kSignalGrace = 850;
/** Milliseconds of that time's rest in which the last callbacks are written. */
constexpr unsigned int kLastFlush = 50;
/**
 * Milliseconds that a process may go on with its work when the service manager
 * has asked it to end because it gave its bus name up; it is killed at 90 s.
 */
constexpr int kServiceGrace = 80000;
/** Milliseconds between the questions of a process whose requests wait for its turn. */
constexpr guint kTurnAskMs = 250;
constexpr int kNoEnd = -1;
constexpr int kAtOnce = 0;
constexpr char kLockName[] = "/tmp/quarn/lock";

bool signals_watched = false;

bool ended_by_signal = false;

gboolean cancel_backups(gpointer) {
  LOGI("cancel from the next process");
  manual_backup_canceled = true;
  quarnd_cancel_starting_backups(nullptr);
  cancel_backup(nullptr);
  return G_SOURCE_REMOVE;
}

/** Make room for a process that has requests and waits: this one may have the bus name back. */
void leave_for_the_next() {
  // Restore mode waits for installations, of which another process would know nothing.
  if (current_restore_mode() != restore_mode::off) return;
  request_quarn_terminate(0.0, false);
}

gboolean take_lines(gpointer) {
  for (const std::string &line : take_quarn_turn_lines()) {
    if (line == kLeaveLine) {
      leave_for_the_next();
      continue;
    }
    LOGI("withdrawal from the next process");
    quarnd_cancel_own(line);
  }
  return G_SOURCE_REMOVE;
}

gboolean leave_when_idle(gpointer) {
  end_quarn_when_idle();
  return G_SOURCE_REMOVE;
}

/** On the watching thread, as the two that follow. */
int take_signal(int signo) {
  if (signo == kCancelSignal) {
    g_idle_add_full(G_PRIORITY_DEFAULT, cancel_backups, nullptr, nullptr);
    return kNoEnd;
  }
  if (signo == kWithdrawSignal) {
    g_idle_add_full(G_PRIORITY_DEFAULT, take_lines, nullptr, nullptr);
    return kNoEnd;
  }
  LOGI("SIGNAL %d received", signo);
  if (!is_answer_to_given_up_name(signo)) return kAtOnce;
  g_idle_add_full(G_PRIORITY_DEFAULT, leave_when_idle, nullptr, nullptr);
  return kServiceGrace;
}

void tell_waiting_clients() {
  quarn_dbus_end_requests();
  quarnd_dbus_answer_all();
  quarn_dbus_flush(kLastFlush);
}

void end_by_signal(int) {
  ended_by_signal = true;
  quarn_exit_code = 0;
  // Before those that wait in nested loops go on and find reasons of their own.
  quarn_dbus_end_requests();
  quit_nested_loops();
  quarn_loop_quit();
}

/** What other processes send must not end one that does not listen. */
void ignore_messages() {
  for (const int signo : {kCancelSignal, kWithdrawSignal}) signal(signo, SIG_IGN);
}

void install_signal_handlers() {
  if (!signals_watched) return;
  for (const int signo : {SIGINT, SIGHUP, SIGTERM, SIGQUIT}) signal(signo, signal_handler);
  for (const int signo : {kCancelSignal, kWithdrawSignal}) signal(signo, signal_handler);
}

bool request_pending() { return backup_request_outstanding() || quarnd_calls_deferred(); }

/** An idle process keeps its turn for as long as it has the bus name. */
gboolean ask_for_turn(gpointer) {
  if (is_quarn_turn()) return G_SOURCE_REMOVE;
  if (request_pending()) tell_quarn_predecessor(kLeaveLine, kWithdrawSignal);
  return G_SOURCE_CONTINUE;
}

/** Whoever still waits hears that it is over: only a signal ends what is not idle. */
void leave_clients() {
  quarn_dbus_stop_waiting();
  if (ended_by_signal) quarnd_dbus_leave();
  quarn_dbus_end_requests();
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
  quarnd_packages_unexport();
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
  tell_kernel_settings();
  ignore_messages();
  signals_watched = quarn_loop_watch_signals(
      {take_signal, quarn_dbus_stop_waiting, end_by_signal, tell_waiting_clients, kSignalGrace});
  install_signal_handlers();
  begin_quarn_turn(kLockName, prepare_staging_directory, quarnd_dispatch_deferred);
  if (is_quarn_turn()) sweep_staging_directory(kLockName);
  init_quarn();
  init_backup_req_dispatch_thread();
  if (!is_quarn_turn()) g_timeout_add(kTurnAskMs, ask_for_turn, nullptr);
  LOGI("== main loop begin ==");
  quarn_loop_begin();
  leave_clients();
  deinit_quarn();
  end_quarn_turn();
  LOGI("Good-Bye from Quarn");
  return quarn_exit_code;
}

int quarn_recover() {
  LOGI("recovery of what an interrupted restore or backup has left");
  ignore_messages();
  begin_quarn_turn(kLockName, prepare_staging_directory, nullptr);
  // A daemon that works at this moment has done it at its own start.
  if (is_quarn_turn()) {
    sweep_staging_directory(kLockName);
    recover_device();
  }
  end_quarn_turn();
  return 0;
}

int main(int argc, char **argv) {
  // A heap for each thread keeps what the others could use: 3 MB in a run of 4,000 packages.
  mallopt(M_ARENA_MAX, 1);
  if (!drop_other_groups()) LOGE("fail to leave the groups of the process : %d", errno);
  const bool recovery = argc == 2 && std::strcmp(argv[1], "--recover") == 0;
  const int status = recovery ? quarn_recover() : quarn_run();
  std::fflush(nullptr);
#if defined(__SANITIZE_ADDRESS__)
  __lsan_do_leak_check();
#endif
  // Destructors of globals would pull them from under the backup worker.
  _exit(status);
}
