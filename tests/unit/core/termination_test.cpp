// The loop, the terminate timer and the dispatcher together, on a real bus.
#include <glib.h>
#include <gtest/gtest.h>

#include <string>

#include "log_capture.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_loop.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_server.h"
#include "run_until.h"
#include "scripted_client.h"

namespace {

constexpr double kDelay = 0.3;
constexpr double kLongAfter = 0.6;

bool idle = true;

}  // namespace

bool cloud_restore_running() { return false; }
bool is_idle_status() { return idle; }
void init_last_backup_time() {}
int quarnd_backup_enable(int) { return 0; }
int quarnd_get_last_backed_up_time(unsigned long long *timestamp) {
  *timestamp = 1;
  return 0;
}
int quarnd_get_app_list(int, void *) { return 0; }
int quarnd_manual_backup(void *) { return 0; }
int quarnd_manual_backup_cancel(void *) { return 0; }
int quarnd_backup_app_data(const char *, void *) { return 0; }
int quarnd_restore_app_data(const char *, void *) { return 0; }
int quarnd_make_app_data(const char *, unsigned int, const std::string &) { return 0; }
int quarnd_restore_enable(int, int, const char *, const char *, void *) { return 0; }

namespace {

unsigned char end_of_test(void *ended) {
  *static_cast<bool *>(ended) = true;
  quarn_loop_quit();
  return 0;
}

bool acquired() { return count_logged(DLOG_INFO, "Acquired the name org.orvane.Quarn") > 0; }

class Termination : public ::testing::Test {
 protected:
  void SetUp() override {
    private_bus_address();
    clear_captured_log();
    idle = true;
    quarn_exit_code = 0;
    quarn_loop_init();
    owner_id_ = quarnd_dbus_init();
    ASSERT_TRUE(run_until(acquired));
    client_ = std::make_unique<ScriptedClient>();
  }
  void TearDown() override {
    cancel_quarn_terminate();
    client_.reset();
    quarnd_dbus_deinit(owner_id_);
    quarn_loop_shutdown();
    run_pending();
  }

  /** Run the loop with a pending request and this call. @return whether the daemon stayed */
  bool stays_after(const char *method, const char *arguments) {
    request_quarn_terminate(kDelay, true);
    outcome_ = std::make_shared<CallOutcome>();
    client_->start_call(method, arguments, outcome_);
    bool stayed = false;
    void *limit = quarn_loop_timer_add(kLongAfter, end_of_test, &stayed);
    quarn_loop_begin();
    if (!stayed) quarn_loop_timer_del(limit);
    return stayed;
  }

  unsigned int owner_id_ = 0;
  std::unique_ptr<ScriptedClient> client_;
  std::shared_ptr<CallOutcome> outcome_;
};

TEST_F(Termination, DelayedRequestEndsTheLoopWhenNobodyCalls) {
  request_quarn_terminate(kDelay, true);
  quarn_loop_begin();
  EXPECT_EQ(quarn_exit_code, -1);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 1);
}

TEST_F(Termination, AnyMethodCallLeavesTheDaemonRunning) {
  EXPECT_TRUE(stays_after("last_bu_time", "()"));
  EXPECT_TRUE(outcome_->finished);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 0);
}

TEST_F(Termination, UnknownMethodLeavesTheDaemonRunning) {
  EXPECT_TRUE(stays_after("fly", "()"));
  EXPECT_EQ(outcome_->error_name, "org.freedesktop.DBus.Error.UnknownMethod");
}

TEST_F(Termination, CallWithoutItsArgumentsLeavesTheDaemonRunning) {
  EXPECT_TRUE(stays_after("manual_backup_start", "()"));
  EXPECT_EQ(outcome_->reply, "(-1,)");
}

TEST_F(Termination, CallWithOtherArgumentsLeavesTheDaemonRunning) {
  EXPECT_TRUE(stays_after("manual_backup_start", "('one',)"));
  EXPECT_EQ(outcome_->error_name, "org.freedesktop.DBus.Error.InvalidArgs");
}

TEST_F(Termination, SecondOfTwoRequestsIsTheOneThatEndsTheLoop) {
  request_quarn_terminate(kDelay / 10, true);
  request_quarn_terminate(kDelay, false);
  const gint64 begin = g_get_monotonic_time();
  quarn_loop_begin();
  EXPECT_GE(g_get_monotonic_time() - begin, static_cast<gint64>(kDelay * 0.9 * G_USEC_PER_SEC));
  EXPECT_EQ(quarn_exit_code, 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 1);
}

TEST_F(Termination, DeactivationEndsTheIdleDaemonAndIsAnswered) {
  EXPECT_FALSE(stays_after("set_activation", "(0,)"));
  EXPECT_EQ(quarn_exit_code, 0);
  quarnd_dbus_deinit(owner_id_);
  EXPECT_TRUE(run_until([this] { return outcome_->finished; }));
  EXPECT_EQ(outcome_->reply, "(0,)");
  owner_id_ = 0;
}

TEST_F(Termination, DeactivationOfABusyDaemonIsAnsweredAndDropped) {
  request_quarn_terminate(kLongAfter * 10, true);
  idle = false;
  EXPECT_TRUE(stays_after("set_activation", "(0,)"));
  EXPECT_EQ(outcome_->reply, "(0,)");
  EXPECT_EQ(quarn_exit_code, -1);
  EXPECT_EQ(count_logged(DLOG_INFO, "Not in idle state"), 2);
}

}  // namespace
