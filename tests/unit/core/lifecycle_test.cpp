#include "quarn_d_lifecycle.h"

#include <gtest/gtest.h>

#include <vector>

#include "lifecycle_world.h"
#include "log_capture.h"
#include "quarn_d_loop.h"
#include "quarn_d_utils/power.h"

bool lifecycle_idle = true;
int lifecycle_quits = 0;

namespace {

struct Timer {
  double seconds;
  unsigned char (*callback)(void *);
  void *data;
};

std::vector<Timer *> timers;
int timers_made = 0;

void delete_timer(void *timer) {
  const auto found = std::find(timers.begin(), timers.end(), static_cast<Timer *>(timer));
  ASSERT_NE(found, timers.end()) << "not a pending timer";
  delete *found;
  timers.erase(found);
}

/** As Ecore does: a callback that returns 0 was the timer's last. */
void fire(Timer *timer) {
  if (timer->callback(timer->data) == 0) delete_timer(timer);
}

class Lifecycle : public ::testing::Test {
 protected:
  void SetUp() override {
    cancel_quarn_terminate();
    quarn_exit_code = 0;
    lifecycle_idle = true;
    lifecycle_quits = 0;
    timers_made = 0;
    clear_captured_log();
  }
  void TearDown() override {
    cancel_quarn_terminate();
    EXPECT_TRUE(timers.empty());
  }
};

TEST_F(Lifecycle, RequestWithRestartQuitsAtOnceWithMinusOne) {
  request_quarn_terminate(0.0, true);
  EXPECT_EQ(lifecycle_quits, 1);
  EXPECT_EQ(quarn_exit_code, -1);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 1);
  EXPECT_TRUE(timers.empty());
}

TEST_F(Lifecycle, RequestWithoutRestartQuitsAtOnceWithZero) {
  quarn_exit_code = -1;
  request_quarn_terminate(0.0, false);
  EXPECT_EQ(lifecycle_quits, 1);
  EXPECT_EQ(quarn_exit_code, 0);
}

TEST_F(Lifecycle, DelayedRequestQuitsWhenItsTimerFires) {
  request_quarn_terminate(5.0, true);
  EXPECT_EQ(lifecycle_quits, 0);
  EXPECT_EQ(quarn_exit_code, -1);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 0);
  ASSERT_EQ(timers.size(), 1u);
  EXPECT_EQ(timers[0]->seconds, 5.0);
  fire(timers[0]);
  EXPECT_EQ(lifecycle_quits, 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 1);
}

TEST_F(Lifecycle, TimerThatFiredIsNotDeletedAgain) {
  request_quarn_terminate(5.0, false);
  fire(timers[0]);
  cancel_quarn_terminate();
  EXPECT_TRUE(timers.empty());
}

TEST_F(Lifecycle, TerminateCallbackDoesNotRepeat) { EXPECT_EQ(terminate_cb(nullptr), 0); }

TEST_F(Lifecycle, TwoDelayedRequestsLeaveOneTimerTheSecond) {
  request_quarn_terminate(5.0, false);
  request_quarn_terminate(7.0, false);
  ASSERT_EQ(timers.size(), 1u);
  EXPECT_EQ(timers[0]->seconds, 7.0);
  EXPECT_EQ(timers_made, 2);
}

TEST_F(Lifecycle, LaterDelayedRequestDecidesTheExitCode) {
  request_quarn_terminate(5.0, true);
  request_quarn_terminate(7.0, false);
  EXPECT_EQ(quarn_exit_code, 0);
}

TEST_F(Lifecycle, CancelDropsThePendingTimer) {
  request_quarn_terminate(5.0, false);
  cancel_quarn_terminate();
  EXPECT_TRUE(timers.empty());
  EXPECT_EQ(lifecycle_quits, 0);
}

TEST_F(Lifecycle, CancelWithoutATimerDoesNothing) {
  cancel_quarn_terminate();
  EXPECT_EQ(lifecycle_quits, 0);
}

TEST_F(Lifecycle, RequestWhileTheNameIsAskedForWaitsForIt) {
  hold_quarn_terminate();
  request_quarn_terminate(0.0, true);
  EXPECT_EQ(lifecycle_quits, 0);
  release_quarn_terminate();
  EXPECT_EQ(lifecycle_quits, 1);
  EXPECT_EQ(quarn_exit_code, -1);
  release_quarn_terminate();
  EXPECT_EQ(lifecycle_quits, 1);
}

TEST_F(Lifecycle, RequestThatWaitedIsDroppedWhenTheDaemonIsBusyByThen) {
  hold_quarn_terminate();
  request_quarn_terminate(0.0, false);
  lifecycle_idle = false;
  release_quarn_terminate();
  EXPECT_EQ(lifecycle_quits, 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "Not in idle state"), 1);
}

TEST_F(Lifecycle, CallDropsARequestThatWaits) {
  hold_quarn_terminate();
  request_quarn_terminate(0.0, false);
  cancel_quarn_terminate();
  release_quarn_terminate();
  EXPECT_EQ(lifecycle_quits, 0);
}

TEST_F(Lifecycle, RequestWhileBusyChangesNothingNotEvenTheExitCode) {
  request_quarn_terminate(5.0, true);
  const Timer *pending = timers[0];
  lifecycle_idle = false;
  for (const double delay : {0.0, 3.0}) request_quarn_terminate(delay, false);
  EXPECT_EQ(quarn_exit_code, -1);
  EXPECT_EQ(lifecycle_quits, 0);
  ASSERT_EQ(timers.size(), 1u);
  EXPECT_EQ(timers[0], pending);
  EXPECT_EQ(count_logged(DLOG_INFO, "Not in idle state"), 2);
  EXPECT_EQ(count_logged(DLOG_INFO, "terminate quarn"), 0);
}

}  // namespace

bool is_idle_status() { return lifecycle_idle; }
void quarn_loop_quit() { ++lifecycle_quits; }
void *quarn_loop_timer_add(double seconds, unsigned char (*callback)(void *), void *data) {
  ++timers_made;
  timers.push_back(new Timer{seconds, callback, data});
  return timers.back();
}
void quarn_loop_timer_del(void *timer) { delete_timer(timer); }
