#include "quarn_d_main.h"

#include <glib.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "log_capture.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_conditions/setting_observer.h"
#include "quarn_d_end.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_loop.h"
#include "quarn_d_packages.h"
#include "quarn_d_progress.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_status.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/boot_cleanup.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/kernel_settings.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_server.h"
#include "quarn_log.h"
#include "run_until.h"

namespace {

using Texts = std::vector<std::string>;
using Handler = void (*)(int);

constexpr unsigned int kOwner = 77;

/** What was called, in order; logged lines are beside them in the captured log. */
Texts steps;
bool account = true;
bool watchable = true;
/** What happens in the main loop. */
void (*in_loop)() = nullptr;
quarn_signal_watch hooks{};
bool waiting_stopped = false;
bool answer_to_given_up_name = false;
void (*on_turn)() = nullptr;
std::vector<int> woken;
std::vector<void (*)()> observers;
void (*boot_recovery)() = nullptr;
void (*bus_acquired_hook)(GDBusConnection *) = nullptr;
void (*packing_ended_hook)() = nullptr;
callback_patience patience = nullptr;

void step(const char *name) {
  steps.emplace_back(name);
  // One order for both.
  LOGI("%s", name);
}

Handler handler_of(int signo) {
  struct sigaction action {};
  sigaction(signo, nullptr, &action);
  return action.sa_handler;
}

}  // namespace

int quarn_exit_code = 0;

bool server_util_is_account_exist() {
  step("account");
  return account;
}
bool drop_other_groups() { return true; }
int tell_kernel_settings(const char *settings) {
  EXPECT_STREQ(settings, "/proc/sys");
  step("kernel_settings");
  return 0;
}
bool quarn_loop_watch_signals(const quarn_signal_watch &watch) {
  step("watch_signals");
  hooks = watch;
  return watchable;
}
bool is_answer_to_given_up_name(int signo) { return signo == SIGTERM && answer_to_given_up_name; }
void end_quarn_when_idle() { step("end_when_idle"); }
void quarn_dbus_stop_waiting() { waiting_stopped = true; }
void quarn_dbus_end_requests() { step("end_requests"); }
void quarn_dbus_flush(unsigned int ms) {
  EXPECT_LT(ms, 1000u);
  step("flush");
}
void quarnd_dbus_answer_all() {
  EXPECT_TRUE(waiting_stopped);
  step("answer_all");
}
void quarnd_dbus_leave() {
  EXPECT_TRUE(waiting_stopped);
  step("dbus_leave");
}
bool calls_deferred = false;
bool turn_is_there = true;
bool quarnd_calls_deferred() { return calls_deferred; }
restore_mode present_mode = restore_mode::off;
restore_mode current_restore_mode() { return present_mode; }
std::vector<std::string> turn_lines;
bool tell_quarn_predecessor(const std::string &line, int signo) {
  step(("tell " + line + (signo == kWithdrawSignal ? "" : "?")).c_str());
  return true;
}
void request_quarn_terminate(double delay, bool restart) {
  step(delay == 0.0 && !restart ? "terminate" : "terminate?");
}
std::vector<std::string> take_quarn_turn_lines() { return std::exchange(turn_lines, {}); }
std::uint32_t quarnd_cancel_starting_backups(const std::string *) { return 0; }
std::uint32_t quarnd_cancel_own(const std::string &sender) {
  step(("cancel_own " + sender).c_str());
  return 0;
}
void quarnd_dispatch_deferred() { step("dispatch_deferred"); }
bool prepare_staging_directory() { return true; }
void sweep_staging_directory(const char *keep) { step((std::string("sweep but ") + keep).c_str()); }
bool is_quarn_turn() { return turn_is_there; }
void end_quarn_turn() { step("end_turn"); }
void begin_quarn_turn(const char *lock_file, bool (*prepare)(), void (*observer)()) {
  step("begin_turn");
  EXPECT_EQ(prepare, prepare_staging_directory);
  EXPECT_STREQ(lock_file, "/tmp/quarn/lock");
  on_turn = observer;
}
std::atomic<bool> manual_backup_canceled{false};
void cancel_backup(void *client) {
  EXPECT_EQ(client, nullptr);
  step("cancel_backup");
}
void quarn_loop_wake_from_signal(int signo) { woken.push_back(signo); }
void quarn_loop_init() {
  step("loop_init");
  // As Ecore does.
  for (const int signo : {SIGINT, SIGHUP, SIGTERM, SIGQUIT}) signal(signo, SIG_IGN);
}
void quarn_loop_shutdown() { step("loop_shutdown"); }
void quarn_loop_begin() {
  step("loop_begin");
  if (in_loop != nullptr) in_loop();
}
void quarn_loop_quit() { step("loop_quit"); }
unsigned int quarnd_dbus_init() {
  step("dbus_init");
  return kOwner;
}
void quarnd_dbus_deinit(unsigned int owner_id) {
  EXPECT_EQ(owner_id, kOwner);
  step("dbus_deinit");
}
void set_bus_acquired_hook(void (*hook)(GDBusConnection *)) { bus_acquired_hook = hook; }
void note_packing_ended() {}
void set_packing_ended_hook(void (*hook)()) { packing_ended_hook = hook; }
bool others_held_up(const std::string &) { return false; }
void quarn_dbus_set_patience(callback_patience exhausted) { patience = exhausted; }
void quarnd_status_export(GDBusConnection *) { step("status_export"); }
void quarnd_status_unexport() { step("status_unexport"); }
void quarnd_packages_export(GDBusConnection *) { step("packages_export"); }
void quarnd_packages_unexport() { step("packages_unexport"); }
void quarnd_status_refresh() {}
void note_backup_progress(const backup_progress &) {}
void note_restore_progress(const restore_progress &) {}
void set_backup_progress_sink(backup_progress_sink sink) {
  EXPECT_EQ(sink, note_backup_progress);
  step("progress_init");
}
void set_restore_progress_sink(restore_progress_sink sink) {
  EXPECT_EQ(sink, note_restore_progress);
}
void set_backup_end_observer(backup_end_observer observer) { observers.push_back(observer); }
void set_restore_mode_observer(void (*observer)()) { observers.push_back(observer); }
void set_setting_observer(void (*observer)()) { observers.push_back(observer); }
void init_backup_resource() { step("init_backup_resource"); }
void deinit_backup_resource() { step("deinit_backup_resource"); }
int start_wifi_monitor() {
  step("start_wifi_monitor");
  return 1;
}
void monitor_auto_backup_status() { step("monitor_auto_backup_status"); }
void init_backup_req_dispatch_thread() { step("init_backup_req_dispatch_thread"); }
bool backups_outstanding = true;
bool backup_request_outstanding() { return backups_outstanding; }
void set_boot_recovery(void (*recover)()) { boot_recovery = recover; }
void (*in_recovery)() = nullptr;
void recover_device() {
  step("recovery");
  if (in_recovery != nullptr) in_recovery();
}
void quit_nested_loops() { step("quit_nested_loops"); }

/** The program's own. */
int quarnd_main(int argc, char **argv);

/** main() with these arguments. */
int run_program(std::vector<const char *> arguments) {
  arguments.push_back(nullptr);
  return quarnd_main(static_cast<int>(arguments.size()) - 1, const_cast<char **>(arguments.data()));
}

namespace {

class Main : public ::testing::Test {
 protected:
  void SetUp() override {
    account = true;
    watchable = true;
    in_loop = nullptr;
    quarn_exit_code = 0;
    woken.clear();
    waiting_stopped = false;
    answer_to_given_up_name = false;
    calls_deferred = false;
    backups_outstanding = true;
    manual_backup_canceled = false;
    observers.clear();
    boot_recovery = nullptr;
    packing_ended_hook = nullptr;
    patience = nullptr;
    for (const int signo : signals_) signal(signo, SIG_DFL);
    restart();
  }
  void TearDown() override {
    deinit_quarn();
    for (const int signo : signals_) signal(signo, SIG_DFL);
  }
  static void restart() {
    steps.clear();
    clear_captured_log();
  }
  static constexpr int signals_[] = {SIGINT, SIGHUP, SIGTERM, SIGQUIT};
};

#ifdef QUARN_LIVE_SETTING
#define LIVE_STEP "monitor_auto_backup_status",
#else
#define LIVE_STEP
#endif

TEST_F(Main, RunsItsStepsInOrder) {
  EXPECT_EQ(quarn_run(), 0);
  EXPECT_EQ(captured_texts(), (Texts{"Quarn Daemon start",
                                     "account",
                                     "kernel_settings",
                                     "watch_signals",
                                     "begin_turn",
                                     "sweep but /tmp/quarn/lock",
                                     "progress_init",
                                     "loop_init",
                                     "dbus_init",
                                     "init_backup_resource",
                                     "start_wifi_monitor",
                                     LIVE_STEP "init_backup_req_dispatch_thread",
                                     "== main loop begin ==",
                                     "loop_begin",
                                     "end_requests",
                                     "deinit_backup_resource",
                                     "quarnd_dbus_deinit ~",
                                     "packages_unexport",
                                     "status_unexport",
                                     "dbus_deinit",
                                     "ecore_shutdown ~",
                                     "loop_shutdown",
                                     "end_turn",
                                     "Good-Bye from Quarn"}));
}

TEST_F(Main, WithoutAnAccountNothingIsStarted) {
  account = false;
  EXPECT_EQ(quarn_run(), 0);
  EXPECT_EQ(captured_texts(),
            (Texts{"Quarn Daemon start", "account", "no signed-in. Daemon stop"}));
  for (const int signo : signals_) EXPECT_EQ(handler_of(signo), SIG_DFL);
}

TEST_F(Main, AnswersTheExitCodeOfARestartRequest) {
  in_loop = [] { quarn_exit_code = -1; };
  EXPECT_EQ(quarn_run(), -1);
}

TEST_F(Main, ProcessStatusIsZeroOr255WhenARestartIsWanted) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(run_program({"quarnd"}), ::testing::ExitedWithCode(0), "");
  in_loop = [] { quarn_exit_code = -1; };
  EXPECT_EXIT(run_program({"quarnd"}), ::testing::ExitedWithCode(255), "");
}

TEST_F(Main, HandlersStandAgainAfterEcoreHasReplacedThem) {
  in_loop = [] {
    for (const int signo : signals_) EXPECT_EQ(handler_of(signo), signal_handler) << signo;
  };
  quarn_run();
}

TEST_F(Main, SignalsKeepTheirDefaultWhenNobodyCanWatchThem) {
  watchable = false;
  in_loop = [] {
    for (const int signo : signals_) EXPECT_NE(handler_of(signo), signal_handler) << signo;
  };
  quarn_run();
}

TEST_F(Main, HandlerOnlyWakesTheWatcher) {
  for (const int signo : signals_) signal_handler(signo);
  EXPECT_EQ(woken, (std::vector<int>{SIGINT, SIGHUP, SIGTERM, SIGQUIT}));
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(Main, SignalIsLoggedWithItsNumberAndEndsTheProcessAtOnce) {
  quarn_run();
  restart();
  EXPECT_EQ(hooks.take(SIGQUIT), 0);
  EXPECT_EQ(captured_texts(), Texts{"SIGNAL 3 received"});
  EXPECT_EQ(hooks.begin_end, quarn_dbus_stop_waiting);
  EXPECT_GT(hooks.grace_ms, 0);
  EXPECT_LT(hooks.grace_ms, 1000);
}

TEST_F(Main, SignalTellsTheClientsTearsDownOnceAndEndsWithZero) {
  in_loop = [] {
    quarn_exit_code = -1;
    restart();
    hooks.end(SIGTERM);
  };
  EXPECT_EQ(quarn_run(), 0);
  EXPECT_EQ(captured_texts(),
            (Texts{"end_requests", "quit_nested_loops", "loop_quit", "dbus_leave", "end_requests",
                   "deinit_backup_resource", "quarnd_dbus_deinit ~", "packages_unexport",
                   "status_unexport", "dbus_deinit", "ecore_shutdown ~", "loop_shutdown",
                   "end_turn", "Good-Bye from Quarn"}));
}

TEST_F(Main, ProcessThatDoesNotEndTellsItsClientsLast) {
  quarn_run();
  restart();
  hooks.begin_end();
  hooks.last();
  EXPECT_EQ(steps, (Texts{"end_requests", "answer_all", "flush"}));
}

TEST_F(Main, ServiceManagersAnswerToTheNameGivenUpLeavesTimeForTheWork) {
  quarn_run();
  restart();
  answer_to_given_up_name = true;
  EXPECT_EQ(hooks.take(SIGTERM), 80000);
  EXPECT_EQ(steps, Texts{});
  run_pending();
  EXPECT_EQ(steps, Texts{"end_when_idle"});
}

TEST_F(Main, CancelFromTheNextProcessIsCarriedOutOnTheMainThread) {
  quarn_run();
  restart();
  EXPECT_LT(hooks.take(kCancelSignal), 0);
  EXPECT_FALSE(manual_backup_canceled);
  run_pending();
  EXPECT_TRUE(manual_backup_canceled);
  EXPECT_EQ(captured_texts(), (Texts{"cancel from the next process", "cancel_backup"}));
}

TEST_F(Main, WithdrawalsFromTheNextProcessAreCarriedOutOnTheMainThread) {
  quarn_run();
  restart();
  turn_lines = {":1.5", ":1.7"};
  EXPECT_LT(hooks.take(kWithdrawSignal), 0);
  EXPECT_EQ(steps, Texts{});
  run_pending();
  EXPECT_EQ(steps, (Texts{"cancel_own :1.5", "cancel_own :1.7"}));
}

TEST_F(Main, IdleProcessLeavesForTheRequestsOfTheNext) {
  quarn_run();
  restart();
  const auto leave = [] {
    turn_lines = {kLeaveLine};
    hooks.take(kWithdrawSignal);
    run_pending();
    return std::exchange(steps, {});
  };
  EXPECT_EQ(leave(), Texts{"terminate"});
  for (const restore_mode mode : {restore_mode::companion, restore_mode::cloud}) {
    present_mode = mode;
    EXPECT_EQ(leave(), Texts{}) << "restore mode is this process's";
  }
  present_mode = restore_mode::off;
}

TEST_F(Main, ProcessWhoseRequestsWaitAsksTheEarlierOneToLeaveUntilItsTurnComes) {
  turn_is_there = false;
  backups_outstanding = false;
  in_loop = [] {
    steps.clear();
    backups_outstanding = true;
    while (std::count(steps.begin(), steps.end(), "tell leave") < 2) {
      g_main_context_iteration(nullptr, TRUE);
    }
    // The one that finds the turn there is the last.
    turn_is_there = true;
    steps.clear();
    g_main_context_iteration(nullptr, TRUE);
    EXPECT_EQ(std::count(steps.begin(), steps.end(), "tell leave"), 0);
  };
  EXPECT_EQ(quarn_run(), 0);
  backups_outstanding = false;
}

TEST_F(Main, CallsThatWaitForTheEarlierProcessFollowIt) {
  quarn_run();
  EXPECT_EQ(on_turn, quarnd_dispatch_deferred);
}

TEST_F(Main, InitTwiceLogsAndAsksForTheBusOnce) {
  init_quarn();
  EXPECT_EQ(quarn_started, 1);
  EXPECT_EQ(quarn_dbus_owner_id, kOwner);
  restart();
  init_quarn();
  EXPECT_EQ(captured_texts(), Texts{"Started already"});
}

TEST_F(Main, DeinitTwiceTearsDownOnce) {
  init_quarn();
  deinit_quarn();
  EXPECT_EQ(quarn_started, 0);
  restart();
  deinit_quarn();
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(Main, CanBeStartedAgainAfterItsTearDown) {
  init_quarn();
  deinit_quarn();
  restart();
  init_quarn();
  EXPECT_EQ(quarn_started, 1);
  EXPECT_EQ(std::count(steps.begin(), steps.end(), "dbus_init"), 1);
}

TEST_F(Main, TheRecoveryNeedsNoAccountAndNoBus) {
  account = false;
  EXPECT_EQ(quarn_recover(), 0);
  EXPECT_EQ(steps, (Texts{"begin_turn", "sweep but /tmp/quarn/lock", "recovery", "end_turn"}));
}

TEST_F(Main, TheRecoveryIsNotEndedByWhatADaemonTellsItsPredecessor) {
  in_recovery = [] {
    for (const int signo : {SIGUSR1, SIGUSR2}) EXPECT_EQ(handler_of(signo), SIG_IGN) << signo;
  };
  quarn_recover();
  in_recovery = nullptr;
}

TEST_F(Main, TheRecoveryIsLeftToADaemonThatWorks) {
  turn_is_there = false;
  EXPECT_EQ(quarn_recover(), 0);
  turn_is_there = true;
  EXPECT_EQ(steps, (Texts{"begin_turn", "end_turn"}));
}

TEST_F(Main, OnlyTheRecoveryIsMadeWhenItIsAskedFor) {
  account = false;
  EXPECT_EXIT(run_program({"quarnd", "--recover"}), ::testing::ExitedWithCode(0), "");
  // with an account it would be in its main loop, which asks for a restart here
  account = true;
  in_loop = [] { quarn_exit_code = -1; };
  EXPECT_EXIT(run_program({"quarnd", "--recover"}), ::testing::ExitedWithCode(0), "");
  EXPECT_EXIT(run_program({"quarnd"}), ::testing::ExitedWithCode(255), "");
}

TEST_F(Main, LowerFloorsAreGivenTheirHooksFirst) {
  init_quarn();
  ASSERT_NE(boot_recovery, nullptr);
  ASSERT_NE(bus_acquired_hook, nullptr);
  EXPECT_EQ(packing_ended_hook, note_packing_ended);
  EXPECT_EQ(patience, others_held_up);
  EXPECT_EQ(observers.size(), 3U);
  for (void (*const observer)() : observers) EXPECT_EQ(observer, quarnd_status_refresh);
  restart();
  boot_recovery();
  bus_acquired_hook(nullptr);
  EXPECT_EQ(steps, (Texts{"recovery", "status_export", "packages_export"}));
}

}  // namespace
