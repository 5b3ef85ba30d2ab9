#include "quarn_d_main.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <string>
#include <vector>

#include "log_capture.h"
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
void (*end_by_signal)(int) = nullptr;
void (*log_signal)(int) = nullptr;
int grace = 0;
std::vector<int> woken;
int (*wifi_probe)() = nullptr;
bool (*pending_probe)() = nullptr;
int (*restore_disable)() = nullptr;
void (*boot_recovery)() = nullptr;
void (*bus_acquired_hook)(GDBusConnection *) = nullptr;

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
bool quarn_loop_watch_signals(void (*log)(int), void (*end)(int), int grace_ms) {
  step("watch_signals");
  log_signal = log;
  end_by_signal = end;
  grace = grace_ms;
  return watchable;
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
void quarnd_status_export(GDBusConnection *) {}
void quarnd_status_unexport() { step("status_unexport"); }
void quarnd_progress_init() { step("progress_init"); }
void init_backup_resource() { step("init_backup_resource"); }
void deinit_backup_resource() { step("deinit_backup_resource"); }
int start_wifi_monitor() {
  step("start_wifi_monitor");
  return 1;
}
int wifi_connected() { return 1; }
void monitor_auto_backup_status() { step("monitor_auto_backup_status"); }
void init_backup_req_dispatch_thread() { step("init_backup_req_dispatch_thread"); }
bool backup_request_outstanding() { return true; }
void set_backup_wifi_probe(int (*probe)()) { wifi_probe = probe; }
void set_pending_request_probe(bool (*probe)()) { pending_probe = probe; }
void set_restore_disable(int (*disable)()) { restore_disable = disable; }
void set_boot_recovery(void (*recover)()) { boot_recovery = recover; }
void recover_device() { step("recovery"); }
int quarnd_restore_enable(int on, int client, const char *, const char *, void *record) {
  EXPECT_EQ(on, 0);
  EXPECT_EQ(client, 0);
  EXPECT_EQ(record, nullptr);
  step("restore_off");
  return 0;
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
    wifi_probe = nullptr;
    pending_probe = nullptr;
    restore_disable = nullptr;
    boot_recovery = nullptr;
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
  EXPECT_EQ(
      captured_texts(),
      (Texts{"Quarn Daemon start", "account", "watch_signals", "progress_init", "loop_init",
             "dbus_init", "init_backup_resource", "start_wifi_monitor",
             LIVE_STEP "init_backup_req_dispatch_thread", "== main loop begin ==", "loop_begin",
             "deinit_backup_resource", "quarnd_dbus_deinit ~", "status_unexport", "dbus_deinit",
             "ecore_shutdown ~", "loop_shutdown", "Good-Bye from Quarn"}));
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

TEST_F(Main, SignalIsLoggedWithItsNumber) {
  quarn_run();
  restart();
  log_signal(SIGQUIT);
  EXPECT_EQ(captured_texts(), Texts{"SIGNAL 3 received"});
  EXPECT_GT(grace, 0);
  EXPECT_LT(grace, 1000);
}

TEST_F(Main, SignalTearsDownOnceAndEndsWithZero) {
  in_loop = [] {
    quarn_exit_code = -1;
    restart();
    end_by_signal(SIGTERM);
  };
  EXPECT_EQ(quarn_run(), 0);
  EXPECT_EQ(captured_texts(),
            (Texts{"deinit_backup_resource", "quarnd_dbus_deinit ~", "status_unexport",
                   "dbus_deinit", "ecore_shutdown ~", "loop_shutdown", "quit_nested_loops",
                   "loop_quit", "Good-Bye from Quarn"}));
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
  EXPECT_EQ(steps, Texts{"recovery"});
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

TEST_F(Main, LowerFloorsAreGivenTheirProbesFirst) {
  init_quarn();
  ASSERT_NE(wifi_probe, nullptr);
  ASSERT_NE(pending_probe, nullptr);
  ASSERT_NE(restore_disable, nullptr);
  ASSERT_NE(boot_recovery, nullptr);
  EXPECT_EQ(bus_acquired_hook, quarnd_status_export);
  EXPECT_EQ(wifi_probe(), 1);
  EXPECT_TRUE(pending_probe());
  restart();
  EXPECT_EQ(restore_disable(), 0);
  boot_recovery();
  EXPECT_EQ(steps, (Texts{"restore_off", "recovery"}));
}

}  // namespace
