#include "quarn_d_end.h"

#include <glib.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <string>
#include <vector>

#include "lifecycle_world.h"
#include "log_capture.h"
#include "quarn_d_lifecycle.h"
#include "run_until.h"

namespace {

using Texts = std::vector<std::string>;

/** What was asked of the bus, and when the loop was quit, in order. */
Texts steps;

void give_up() { steps.emplace_back("give up"); }
void take_back() { steps.emplace_back("take back"); }

class End : public ::testing::Test {
 protected:
  void SetUp() override {
    unsetenv("SYSTEMD_EXEC_PID");
    unsetenv("INVOCATION_ID");
    set_quarn_bus_name({give_up, take_back});
    restart();
  }
  void TearDown() override {
    run_pending();
    set_quarn_bus_name({nullptr, nullptr});
  }
  static void restart() {
    steps.clear();
    lifecycle_quits = 0;
    lifecycle_idle = true;
    clear_captured_log();
  }
  static bool is_quit_later() {
    return run_until([] { return lifecycle_quits > 0; });
  }
  /** The end is asked for and a call that waits already brings work. */
  static void end_with_work_waiting() {
    g_idle_add_full(
        G_PRIORITY_DEFAULT,
        [](gpointer) -> gboolean {
          cancel_quarn_terminate();
          lifecycle_idle = false;
          return G_SOURCE_REMOVE;
        },
        nullptr, nullptr);
    request_quarn_terminate(0.0, false);
    run_pending();
  }
};

TEST_F(End, GivesTheNameUpBeforeTheLoopIsQuit) {
  request_quarn_terminate(0.0, true);
  EXPECT_EQ(steps, Texts{"give up"});
  EXPECT_EQ(lifecycle_quits, 0);
  run_pending();
  EXPECT_EQ(steps, Texts{"give up"});
  EXPECT_EQ(lifecycle_quits, 1);
  EXPECT_EQ(quarn_exit_code, -1);
}

TEST_F(End, WhatHasArrivedIsDispatchedFirst) {
  int quits_seen = -1;
  g_idle_add_full(
      G_PRIORITY_DEFAULT_IDLE,
      [](gpointer seen) -> gboolean {
        *static_cast<int *>(seen) = lifecycle_quits;
        return G_SOURCE_REMOVE;
      },
      &quits_seen, nullptr);
  request_quarn_terminate(0.0, false);
  run_pending();
  EXPECT_EQ(quits_seen, 0);
  EXPECT_EQ(lifecycle_quits, 1);
}

TEST_F(End, CallThatHasArrivedKeepsTheDaemonAndTheNameIsTakenBack) {
  request_quarn_terminate(0.0, false);
  cancel_quarn_terminate();
  run_pending();
  EXPECT_EQ(steps, (Texts{"give up", "take back"}));
  EXPECT_EQ(lifecycle_quits, 0);
  note_quarn_name(true);
  run_pending();
  EXPECT_EQ(lifecycle_quits, 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "termination cancelled"), 1);
}

TEST_F(End, DeactivationThatHasArrivedLetsTheEndGoOn) {
  request_quarn_terminate(0.0, false);
  cancel_quarn_terminate();
  request_quarn_terminate(0.0, false);
  run_pending();
  EXPECT_EQ(steps, Texts{"give up"});
  EXPECT_EQ(lifecycle_quits, 1);
}

TEST_F(End, WorkThatHasArrivedKeepsTheDaemon) {
  end_with_work_waiting();
  EXPECT_EQ(steps, (Texts{"give up", "take back"}));
  EXPECT_EQ(lifecycle_quits, 0);
}

TEST_F(End, ProcessThatLeavesMeanwhileDoesNotAskForTheNameAgain) {
  request_quarn_terminate(0.0, false);
  cancel_quarn_terminate();
  lifecycle_idle = false;
  leave_quarn_for_good();
  run_pending();
  request_quarn_terminate(0.0, false);
  run_pending();
  EXPECT_EQ(steps, Texts{"give up"});
  EXPECT_EQ(lifecycle_quits, 0);
}

TEST_F(End, WithTheNameBackTheNextEndBeginsAnew) {
  end_with_work_waiting();
  note_quarn_name(true);
  lifecycle_idle = true;
  request_quarn_terminate(0.0, false);
  run_pending();
  EXPECT_EQ(steps, (Texts{"give up", "take back", "give up"}));
  EXPECT_EQ(lifecycle_quits, 1);
}

TEST_F(End, EndAskedForWhileTheNameIsTakenBackFollowsIt) {
  request_quarn_terminate(0.0, false);
  cancel_quarn_terminate();
  run_pending();
  begin_quarn_end();
  EXPECT_EQ(lifecycle_quits, 0);
  note_quarn_name(true);
  run_pending();
  EXPECT_EQ(steps, (Texts{"give up", "take back", "give up"}));
  EXPECT_EQ(lifecycle_quits, 1);
}

TEST_F(End, WithoutTheNameTheWorkIsFinishedFirst) {
  end_with_work_waiting();
  note_quarn_name(false);
  bool looked = false;
  g_timeout_add_full(
      G_PRIORITY_LOW, 200,
      [](gpointer seen) -> gboolean {
        EXPECT_EQ(lifecycle_quits, 0);
        lifecycle_idle = true;
        *static_cast<bool *>(seen) = true;
        return G_SOURCE_REMOVE;
      },
      &looked, nullptr);
  EXPECT_TRUE(is_quit_later());
  EXPECT_TRUE(looked);
  EXPECT_EQ(steps, (Texts{"give up", "take back"}));
}

TEST_F(End, NameThatIsLostWithoutAnEndChangesNothing) {
  note_quarn_name(false);
  run_pending();
  request_quarn_terminate(0.0, false);
  run_pending();
  EXPECT_EQ(steps, Texts{"give up"});
}

TEST_F(End, TimerThatFindsTheDaemonBusyDoesNotEndIt) {
  lifecycle_idle = false;
  terminate_cb(nullptr);
  run_pending();
  EXPECT_EQ(steps, (Texts{"give up", "take back"}));
  EXPECT_EQ(lifecycle_quits, 0);
}

TEST_F(End, DaemonThatIsToGoGoesAsSoonAsItIsIdle) {
  lifecycle_idle = false;
  end_quarn_when_idle();
  run_pending();
  EXPECT_EQ(steps, Texts{});
  lifecycle_idle = true;
  EXPECT_TRUE(is_quit_later());
  EXPECT_EQ(steps, Texts{"give up"});
}

TEST_F(End, CallDoesNotKeepADaemonThatIsToGo) {
  set_quarn_bus_name({[] {
                        give_up();
                        if (steps.size() == 1) withdraw_quarn_end();  // a call that had arrived
                      },
                      take_back});
  end_quarn_when_idle();
  EXPECT_TRUE(is_quit_later());
  EXPECT_EQ(steps, Texts{"give up"});
}

TEST_F(End, WorkKeepsADaemonThatIsToGoUntilItIsDone) {
  set_quarn_bus_name({[] {
                        give_up();
                        lifecycle_idle = steps.size() > 2;  // work that had arrived
                      },
                      [] {
                        take_back();
                        lifecycle_idle = true;
                      }});
  end_quarn_when_idle();
  ASSERT_TRUE(run_until([&] { return steps.size() >= 2; }));
  EXPECT_EQ(lifecycle_quits, 0);
  note_quarn_name(true);
  EXPECT_TRUE(is_quit_later());
  EXPECT_EQ(steps, (Texts{"give up", "take back", "give up"}));
}

TEST_F(End, TerminateSignalIsAnAnswerOnlyForAServiceThatGaveItsNameUp) {
  EXPECT_FALSE(is_answer_to_given_up_name(SIGTERM));
  begin_quarn_end();
  EXPECT_FALSE(is_answer_to_given_up_name(SIGTERM)) << "no service";
}

TEST_F(End, TerminateSignalIsAnAnswerOnce) {
  setenv("SYSTEMD_EXEC_PID", std::to_string(getpid()).c_str(), 1);
  EXPECT_FALSE(is_answer_to_given_up_name(SIGTERM)) << "nothing was given up";
  begin_quarn_end();
  EXPECT_FALSE(is_answer_to_given_up_name(SIGINT));
  EXPECT_TRUE(is_answer_to_given_up_name(SIGTERM));
  EXPECT_FALSE(is_answer_to_given_up_name(SIGTERM));
}

TEST_F(End, ChildOfAServiceIsNone) {
  setenv("SYSTEMD_EXEC_PID", std::to_string(getppid()).c_str(), 1);
  setenv("INVOCATION_ID", "0123", 1);
  begin_quarn_end();
  EXPECT_FALSE(is_answer_to_given_up_name(SIGTERM));
}

TEST_F(End, SecondNameGivenUpIsNotAnsweredAgain) {
  setenv("SYSTEMD_EXEC_PID", std::to_string(getpid()).c_str(), 1);
  end_with_work_waiting();
  note_quarn_name(true);
  EXPECT_TRUE(is_answer_to_given_up_name(SIGTERM));
  end_quarn_when_idle();
  lifecycle_idle = true;
  EXPECT_TRUE(is_quit_later());
  EXPECT_FALSE(is_answer_to_given_up_name(SIGTERM));
}

}  // namespace
