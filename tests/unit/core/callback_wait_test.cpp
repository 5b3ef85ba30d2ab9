// Clients that do not answer their callbacks, on the main thread and off it.
#include <glib.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "log_capture.h"
#include "quarn_common.h"
#include "quarn_d_utils/admission.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_dbus_client.h"
#include "scripted_client.h"

namespace {

using Texts = std::vector<std::string>;

std::atomic<bool> others_wait{false};
std::string asked_for;

/** In a process of its own: the main thread is told once. */
class MainThread {
 public:
  MainThread() : connection_(connect_to_private_bus()) {
    quarn_dbus_connection = connection_.get();
    quarn_dbus_note_main_thread();
  }
  ConnectionHandle connection_;
};

void expect(bool condition, int line) {
  if (!condition) {
    std::fprintf(stderr, "line %d does not hold\n", line);
    std::_Exit(1);
  }
}
#define HOLDS(condition) expect(condition, __LINE__)

/** A handler that tells @p client, waits for its answer, and then has done. */
void start_handler(const ScriptedClient &client, std::uint32_t request, int *ended) {
  auto *record = new client_cb_data{request, client.name(), count_waiting(client.name())};
  run_on_fiber([record, ended] { *ended += quarn_dbus_get_app_list_cb(0, "{}", record) + 1; });
}

void only_the_handler_waits() {
  const MainThread main_thread;
  ScriptedClient mute;
  mute.keep_silent("get_app_list_cb");
  ScriptedClient other;
  int silent = 0;
  int served = 0;
  for (std::uint32_t request = 0; request < 3; ++request) start_handler(mute, request, &silent);
  HOLDS(PendingWork::any());
  HOLDS(mute.wait_for_callbacks(3));
  for (std::uint32_t request = 0; request < 3; ++request) start_handler(other, request, &served);
  HOLDS(run_until([&served] { return served == 3; }));
  HOLDS(silent == 0);
  HOLDS(waiting_requests() == 3);
  HOLDS(mute.callbacks() == (Texts{"get_app_list_cb(0, '{}', 0)", "get_app_list_cb(0, '{}', 1)",
                                   "get_app_list_cb(0, '{}', 2)"}));
  // Who waits for an answer has nothing that could be withdrawn.
  for (const std::uint64_t fiber : fibers_of_caller(mute.name())) HOLDS(!withdraw_waits(fiber));
  quit_nested_loops();
  HOLDS(silent == 3 * 43);
  HOLDS(!PendingWork::any());
  HOLDS(waiting_requests() == 0);
  std::_Exit(0);
}

void nobody_else_waits() {
  const MainThread main_thread;
  ScriptedClient mute;
  mute.keep_silent("restore_enable_cb");
  // As from an idle source: on no fiber.
  auto *record = new client_cb_data{1, mute.name(), count_waiting(mute.name())};
  HOLDS(quarn_dbus_restore_enable_cb(0, "org.example.notes", record) == 42);
  HOLDS(quarn_dbus_restore_enable_cb(0, "restore_stop", record) == 42);
  HOLDS(!PendingWork::any());
  HOLDS(waiting_requests() == 1);
  HOLDS(mute.wait_for_callbacks(2));
  HOLDS(mute.callbacks() == (Texts{"restore_enable_cb(0, 'org.example.notes', 1)",
                                   "restore_enable_cb(0, 'restore_stop', 1)"}));
  quit_nested_loops();
  HOLDS(waiting_requests() == 0);
  std::_Exit(0);
}

void answers_are_taken_from_the_loop() {
  const MainThread main_thread;
  ScriptedClient client;
  client.answer("get_app_list_cb", "(5,)");
  int ended = 0;
  start_handler(client, 1, &ended);
  HOLDS(ended == 0);
  HOLDS(run_until([&ended] { return ended == 6; }));
  std::_Exit(0);
}

void the_number_of_waits_is_bounded() {
  const MainThread main_thread;
  ScriptedClient mute;
  mute.keep_silent("get_app_list_cb");
  int ended = 0;
  for (std::uint32_t request = 0; request < kMostAnswersOfClient; ++request) {
    start_handler(mute, request, &ended);
  }
  HOLDS(ended == 0);
  clear_captured_log();
  start_handler(mute, 1000, &ended);
  HOLDS(ended == 43);
  HOLDS(count_logged(DLOG_ERROR, "(" + mute.name() +
                                     ") has too many callbacks to answer : not waited for") == 1);
  HOLDS(mute.wait_for_callbacks(kMostAnswersOfClient + 1));
  std::_Exit(0);
}

void the_end_ends_every_wait() {
  const MainThread main_thread;
  std::vector<std::unique_ptr<ScriptedClient>> clients;
  int ended = 0;
  for (int i = 0; i < 8; ++i) {
    clients.push_back(std::make_unique<ScriptedClient>());
    clients.back()->keep_silent("get_app_list_cb");
    for (std::uint32_t request = 0; request < 8; ++request) {
      start_handler(*clients.back(), request, &ended);
    }
  }
  std::thread watcher(quarn_dbus_stop_waiting);
  HOLDS(run_until([&ended] { return ended == 64 * 43; }));
  watcher.join();
  std::_Exit(0);
}

class CallbackWaitDeathTest : public ::testing::Test {
 protected:
  void SetUp() override {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    private_bus_address();
  }
};

TEST_F(CallbackWaitDeathTest, OnTheMainThreadOnlyTheHandlerWaitsAndEverybodyElseIsServed) {
  EXPECT_EXIT(only_the_handler_waits(), ::testing::ExitedWithCode(0), "");
}

TEST_F(CallbackWaitDeathTest, WhatCallsBackFromNoFiberGoesOnAndKeepsTheOrder) {
  EXPECT_EXIT(nobody_else_waits(), ::testing::ExitedWithCode(0), "");
}

TEST_F(CallbackWaitDeathTest, AnAnswerIsTheHandlersResult) {
  EXPECT_EXIT(answers_are_taken_from_the_loop(), ::testing::ExitedWithCode(0), "");
}

TEST_F(CallbackWaitDeathTest, AClientThatNeverAnswersHasABoundedNumberOfFibers) {
  EXPECT_EXIT(the_number_of_waits_is_bounded(), ::testing::ExitedWithCode(0), "");
}

TEST_F(CallbackWaitDeathTest, ASignalLetsAllOfThemGoOn) {
  EXPECT_EXIT(the_end_ends_every_wait(), ::testing::ExitedWithCode(0), "");
}

/* ---- off the main thread ---- */

TEST(CallbackPatience, OthersThatHaveWaitedLongEnoughEndTheWait) {
  const ConnectionHandle connection = connect_to_private_bus();
  quarn_dbus_connection = connection.get();
  clear_captured_log();
  ScriptedClient mute;
  mute.keep_silent("manual_backup_status");
  others_wait = false;
  quarn_dbus_set_patience([](const std::string &sender) {
    asked_for = sender;
    return others_wait.load();
  });
  auto *record = new client_cb_data{7, mute.name()};
  const std::int64_t before = quarn_dbus_time_waited();
  int result = 0;
  std::thread worker([&] { result = quarn_dbus_manual_backup_status(0, 4, record); });
  ASSERT_TRUE(mute.wait_for_callbacks(1));
  EXPECT_TRUE(run_until([before] { return quarn_dbus_time_waited() > before; }))
      << "also while the wait lasts";
  others_wait = true;
  worker.join();
  quarn_dbus_set_patience(nullptr);
  EXPECT_EQ(result, 42);
  EXPECT_EQ(asked_for, mute.name());
  EXPECT_EQ(
      count_logged(DLOG_ERROR, "(" + mute.name() + ") does not answer its callback : others go on"),
      1);
  EXPECT_GT(quarn_dbus_time_waited(), before);
  quarn_dbus_connection = nullptr;
  g_dbus_connection_close_sync(connection.get(), nullptr, nullptr);
}

TEST(CallbackPatience, AnAnswerThatComesAfterwardsDisturbsNothing) {
  const ConnectionHandle connection = connect_to_private_bus();
  quarn_dbus_connection = connection.get();
  ScriptedClient mute;
  mute.keep_silent("manual_backup_status");
  quarn_dbus_set_patience([](const std::string &) { return true; });
  std::thread worker([&mute] {
    EXPECT_EQ(quarn_dbus_manual_backup_status(0, 4, new client_cb_data{7, mute.name()}), 42);
  });
  worker.join();
  quarn_dbus_set_patience(nullptr);
  ASSERT_TRUE(mute.wait_for_callbacks(1));
  mute.answer_silent();
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, new client_cb_data{8, mute.name()}), 0);
  quarn_dbus_connection = nullptr;
  g_dbus_connection_close_sync(connection.get(), nullptr, nullptr);
}

}  // namespace
