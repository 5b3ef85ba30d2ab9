#include "quarn_d_utils/cloud_session.h"

#include <glib.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "backup_transport.h"
#include "log_capture.h"
#include "mock_platform.h"
#include "mock_transport.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "run_until.h"

namespace {

using ::testing::_;
using ::testing::NiceMock;
using ::testing::Return;

/** Lengths of the time-outs that the code under test asked for, and the last one's source. */
std::vector<guint> time_outs;
guint last_time_out_source = 0;
/** A time-out runs out as soon as the loop runs, in place of after its seconds. */
bool time_outs_run_out = false;

}  // namespace

extern "C" guint g_timeout_add_seconds(guint seconds, GSourceFunc function, gpointer data) {
  time_outs.push_back(seconds);
  last_time_out_source = g_timeout_add(time_outs_run_out ? 0 : seconds * 1000, function, data);
  return last_time_out_source;
}

namespace {

constexpr guint kSixtySeconds = 60;
constexpr char kTimeOutText[] = "cloud init couldn't be completed over 60 seconds";

char handle_object[1];
const auto handle = reinterpret_cast<backup_trans_handle_h>(handle_object);

class CloudSessionTest : public ::testing::Test {
 protected:
  struct Request {
    void *user_data;
    backup_trans_init_cb callback;
  };

  CloudSessionTest() {
    clear_captured_log();
    cloud_init_done = false;
    _g_handle = nullptr;
    time_outs.clear();
    time_outs_run_out = false;
    ON_CALL(transport, backup_trans_create_handle).WillByDefault(Return(handle));
    ON_CALL(transport, backup_trans_init)
        .WillByDefault([this](void *user_data, backup_trans_init_cb callback) {
          const std::lock_guard<std::mutex> lock(mutex);
          requests.push_back({user_data, callback});
          return BACKUP_TRANS_ERROR_NONE;
        });
  }
  ~CloudSessionTest() override { cloud_init_timeout_seconds = kSixtySeconds; }

  std::size_t request_count() {
    const std::lock_guard<std::mutex> lock(mutex);
    return requests.size();
  }

  void answer(std::size_t request, backup_trans_error_code error) {
    Request given{};
    {
      const std::lock_guard<std::mutex> lock(mutex);
      given = requests.at(request);
    }
    given.callback(error, given.user_data);
  }

  /** Every request is answered on the main loop with @p error. */
  void transport_answers(backup_trans_error_code error) {
    ON_CALL(transport, backup_trans_init)
        .WillByDefault([this, error](void *user_data, backup_trans_init_cb callback) {
          std::size_t index = 0;
          {
            const std::lock_guard<std::mutex> lock(mutex);
            index = requests.size();
            requests.push_back({user_data, callback});
          }
          on_main_loop([this, index, error] { answer(index, error); });
          return BACKUP_TRANS_ERROR_NONE;
        });
  }

  static void on_main_loop(std::function<void()> work) {
    g_idle_add_full(
        G_PRIORITY_DEFAULT,
        [](gpointer data) -> gboolean {
          (*static_cast<std::function<void()> *>(data))();
          return G_SOURCE_REMOVE;
        },
        new std::function<void()>(std::move(work)),
        [](gpointer data) { delete static_cast<std::function<void()> *>(data); });
  }

  NiceMock<MockPlatform> platform;
  NiceMock<MockTransport> transport;
  std::mutex mutex;
  std::vector<Request> requests;
};

TEST_F(CloudSessionTest, ThereIsNoHandleAtFirst) { EXPECT_EQ(cloud_handler(), nullptr); }

TEST_F(CloudSessionTest, TheMainThreadWaitsForTheAnswerInANestedLoop) {
  transport_answers(BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(cloud_handler(), handle);
  EXPECT_EQ(time_outs, std::vector<guint>{kSixtySeconds});
  char handle_text[64];
  std::snprintf(handle_text, sizeof handle_text, "_g_handle is 0x%x",
                static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(handle)));
  EXPECT_EQ(captured_texts(),
            (std::vector<std::string>{"try to init cloud", "backup_trans_init successful!",
                                      handle_text}));
}

TEST_F(CloudSessionTest, TheTimeOutEndsWithTheWait) {
  transport_answers(BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(g_main_context_find_source_by_id(nullptr, last_time_out_source), nullptr);
}

TEST_F(CloudSessionTest, ASecondCallAfterSuccessDoesNotAskTheLibrary) {
  transport_answers(BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, AnErrorAnswerIsRetriedByTheNextCall) {
  transport_answers(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_FALSE(cloud_initialized());
  EXPECT_EQ(count_logged(DLOG_ERROR, "backup_trans_init error : 11"), 1);
  EXPECT_EQ(cloud_handler(), nullptr);
  transport_answers(BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(request_count(), 2U);
}

TEST_F(CloudSessionTest, ARefusedRequestDoesNotWait) {
  EXPECT_CALL(transport, backup_trans_init).WillOnce(Return(BACKUP_TRANS_ERROR_NOT_INITIALIZED));
  EXPECT_FALSE(cloud_initialized());
  EXPECT_TRUE(time_outs.empty());
  EXPECT_EQ(count_logged(DLOG_ERROR, "backup_trans_init error : 2"), 1);
}

TEST_F(CloudSessionTest, SuccessWithoutAHandleIsFailure) {
  EXPECT_CALL(transport, backup_trans_create_handle).WillOnce(Return(nullptr));
  transport_answers(BACKUP_TRANS_ERROR_NONE);
  EXPECT_FALSE(cloud_initialized());
  EXPECT_FALSE(cloud_init_done);
  EXPECT_EQ(count_logged(DLOG_INFO, "backup_trans_init successful!"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get cloud handler"), 1);
}

TEST_F(CloudSessionTest, AnAnswerFromWithinTheRequestNeedsNoLoop) {
  EXPECT_CALL(transport, backup_trans_init)
      .WillOnce([](void *user_data, backup_trans_init_cb callback) {
        callback(BACKUP_TRANS_ERROR_NONE, user_data);
        return BACKUP_TRANS_ERROR_NONE;
      });
  EXPECT_TRUE(cloud_initialized());
  EXPECT_TRUE(time_outs.empty());
}

TEST_F(CloudSessionTest, WithoutAnAnswerTheWaitEndsAndALaterCallStartsAnew) {
  time_outs_run_out = true;
  EXPECT_FALSE(cloud_initialized());
  EXPECT_EQ(time_outs, std::vector<guint>{kSixtySeconds});
  EXPECT_EQ(count_logged(DLOG_ERROR, kTimeOutText), 1);
  EXPECT_FALSE(cloud_initialized());
  EXPECT_EQ(request_count(), 2U);
  EXPECT_EQ(count_logged(DLOG_ERROR, kTimeOutText), 2);
}

TEST_F(CloudSessionTest, ALateAnswerStillMakesTheTransportReady) {
  time_outs_run_out = true;
  EXPECT_FALSE(cloud_initialized());
  answer(0, BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(cloud_handler(), handle);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, ALateAnswerOfAnEarlierAttemptServesTheWaitingOne) {
  time_outs_run_out = true;
  EXPECT_FALSE(cloud_initialized());
  time_outs_run_out = false;
  on_main_loop([this] { answer(0, BACKUP_TRANS_ERROR_NONE); });
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(request_count(), 2U);

  EXPECT_CALL(transport, backup_trans_create_handle).Times(0);
  answer(1, BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(cloud_handler(), handle);
}

TEST_F(CloudSessionTest, ALateErrorOfAnEarlierAttemptDoesNotEndTheWaitingOne) {
  time_outs_run_out = true;
  EXPECT_FALSE(cloud_initialized());
  time_outs_run_out = false;
  on_main_loop([this] {
    answer(0, BACKUP_TRANS_ERROR_NETWORK);
    on_main_loop([this] { answer(1, BACKUP_TRANS_ERROR_NONE); });
  });
  EXPECT_TRUE(cloud_initialized());
}

TEST_F(CloudSessionTest, ACallFromWithinTheWaitSharesTheAttempt) {
  bool inner_result = false;
  on_main_loop([this, &inner_result] {
    on_main_loop([this] { answer(0, BACKUP_TRANS_ERROR_NONE); });
    inner_result = cloud_initialized();
  });
  EXPECT_TRUE(cloud_initialized());
  EXPECT_TRUE(inner_result);
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, ACallFromWithinTheWaitSharesAFailureToo) {
  bool inner_result = true;
  on_main_loop([this, &inner_result] {
    on_main_loop([this] { answer(0, BACKUP_TRANS_ERROR_AUTHENTICATION); });
    inner_result = cloud_initialized();
  });
  EXPECT_FALSE(cloud_initialized());
  EXPECT_FALSE(inner_result);
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, AnotherThreadWaitsOnAConditionWhileTheMainLoopAnswers) {
  auto worker = std::async(std::launch::async, [] { return cloud_initialized(); });
  ASSERT_TRUE(run_until([this] { return request_count() == 1; }));
  answer(0, BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(worker.get());
  EXPECT_EQ(cloud_handler(), handle);
  EXPECT_TRUE(time_outs.empty());
}

TEST_F(CloudSessionTest, AnotherThreadSharesTheMainThreadsAttempt) {
  std::future<bool> worker;
  on_main_loop([this, &worker] {
    worker = std::async(std::launch::async, [] { return cloud_initialized(); });
    ASSERT_TRUE(run_until([] { return count_logged(DLOG_INFO, "try to init cloud") == 2; }));
    on_main_loop([this] { answer(0, BACKUP_TRANS_ERROR_NONE); });
  });
  EXPECT_TRUE(cloud_initialized());
  EXPECT_TRUE(worker.get());
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, TheMainThreadSharesAnotherThreadsAttempt) {
  auto worker = std::async(std::launch::async, [] { return cloud_initialized(); });
  ASSERT_TRUE(run_until([this] { return request_count() == 1; }));
  on_main_loop([this] { answer(0, BACKUP_TRANS_ERROR_NONE); });
  EXPECT_TRUE(cloud_initialized());
  EXPECT_TRUE(worker.get());
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, AnotherThreadGivesUpAfterTheSameTime) {
  cloud_init_timeout_seconds = 0;
  auto worker = std::async(std::launch::async, [] { return cloud_initialized(); });
  EXPECT_FALSE(worker.get());
  EXPECT_EQ(count_logged(DLOG_ERROR, "cloud init couldn't be completed over 0 seconds"), 1);
  cloud_init_timeout_seconds = kSixtySeconds;
  transport_answers(BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(cloud_initialized());
  EXPECT_EQ(request_count(), 2U);
}

TEST_F(CloudSessionTest, TheWaitIsSixtySeconds) { EXPECT_EQ(cloud_init_timeout_seconds, 60U); }

TEST_F(CloudSessionTest, ManyThreadsShareOneAttempt) {
  constexpr int kThreads = 4;
  std::vector<std::future<bool>> workers;
  for (int i = 0; i < kThreads; ++i) {
    workers.push_back(std::async(std::launch::async, [] { return cloud_initialized(); }));
  }
  ASSERT_TRUE(run_until([] { return count_logged(DLOG_INFO, "try to init cloud") == kThreads; }));
  ASSERT_TRUE(run_until([this] { return request_count() == 1; }));
  answer(0, BACKUP_TRANS_ERROR_NONE);
  for (auto &worker : workers) EXPECT_TRUE(worker.get());
  EXPECT_EQ(request_count(), 1U);
}

// Whoever made the attempt is refused while others join it, look, or wait already.
TEST_F(CloudSessionTest, ARefusalReachesEveryoneWheneverItComes) {
  constexpr int kRounds = 200;
  ON_CALL(transport, backup_trans_init).WillByDefault(Return(BACKUP_TRANS_ERROR_NOT_INITIALIZED));
  std::atomic<bool> over{false};
  std::thread worker([&over] {
    while (!over) EXPECT_FALSE(cloud_initialized());
  });
  for (int round = 0; round < kRounds; ++round) EXPECT_FALSE(cloud_initialized());
  over = true;
  worker.join();
}

TEST_F(CloudSessionTest, EveryRequestOnAFiberHasTheAnswer) {
  constexpr int kRequests = 5;
  int ready = 0;
  for (int i = 0; i < kRequests; ++i) {
    run_on_fiber([&ready] { ready += cloud_initialized() ? 1 : 0; });
  }
  EXPECT_EQ(ready, 0);
  answer(0, BACKUP_TRANS_ERROR_NONE);
  ASSERT_TRUE(run_until([&ready] { return ready == kRequests; }));
  EXPECT_EQ(request_count(), 1U);
}

TEST_F(CloudSessionTest, WhoWithdrawsLeavesTheAttemptToTheOthers) {
  std::uint64_t first = 0;
  std::vector<std::string> results;
  run_on_fiber([&] {
    first = fiber_id(current_fiber());
    results.emplace_back(cloud_initialized() ? "first ready" : "first not");
  });
  run_on_fiber([&] { results.emplace_back(cloud_initialized() ? "second ready" : "second not"); });
  EXPECT_TRUE(withdraw_waits(first));
  ASSERT_TRUE(run_until([&results] { return results.size() == 1; }));
  run_on_fiber([&] { results.emplace_back(cloud_initialized() ? "third ready" : "third not"); });
  EXPECT_EQ(request_count(), 1U) << "the third shares it";
  answer(0, BACKUP_TRANS_ERROR_NONE);
  ASSERT_TRUE(run_until([&results] { return results.size() == 3; }));
  EXPECT_EQ(results, (std::vector<std::string>{"first not", "second ready", "third ready"}));
  EXPECT_EQ(count_logged(DLOG_ERROR, kTimeOutText), 0);
}

TEST_F(CloudSessionTest, TheEndOfTheProcessEndsTheWait) {
  // In a process of its own, because nested loops are refused from then on.
  EXPECT_EXIT(
      {
        on_main_loop([] { quit_nested_loops(); });
        const bool ready = cloud_initialized();
        std::_Exit(!ready && count_logged(DLOG_ERROR, kTimeOutText) == 0 ? EXIT_SUCCESS
                                                                         : EXIT_FAILURE);
      },
      ::testing::ExitedWithCode(EXIT_SUCCESS), "");
}

}  // namespace
