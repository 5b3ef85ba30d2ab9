#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_d_utils/power.h"

namespace {

using ::testing::_;
using ::testing::InSequence;
using ::testing::NiceMock;
using ::testing::Return;

class PowerTest : public ::testing::Test {
 protected:
  PowerTest() { clear_captured_log(); }

  NiceMock<MockPlatform> platform;
};

TEST_F(PowerTest, TheDaemonIsIdleWhileNobodyHoldsTheLock) {
  EXPECT_TRUE(is_idle_status());
  const InSequence order;
  EXPECT_CALL(platform, device_power_request_lock(POWER_LOCK_CPU, 0)).WillOnce(Return(0));
  EXPECT_CALL(platform, device_power_release_lock(POWER_LOCK_CPU)).WillOnce(Return(0));
  request_power_lock(true);
  EXPECT_FALSE(is_idle_status());
  request_power_lock(false);
  EXPECT_TRUE(is_idle_status());
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(PowerTest, AFailedLockStillMakesTheDaemonBusyUntilTheRelease) {
  EXPECT_CALL(platform, device_power_request_lock).WillOnce(Return(DEVICE_ERROR_OPERATION_FAILED));
  request_power_lock(true);
  EXPECT_FALSE(is_idle_status());
  EXPECT_EQ(count_logged(DLOG_ERROR, "couldn't set cpu lock state"), 1);

  EXPECT_CALL(platform, device_power_release_lock).WillOnce(Return(DEVICE_ERROR_OPERATION_FAILED));
  request_power_lock(false);
  EXPECT_TRUE(is_idle_status());
  EXPECT_EQ(count_logged(DLOG_ERROR, "couldn't set cpu lock state"), 2);
}

TEST_F(PowerTest, TheLockIsReleasedWithItsLastTaker) {
  EXPECT_CALL(platform, device_power_request_lock).Times(2).WillRepeatedly(Return(0));
  EXPECT_CALL(platform, device_power_release_lock).Times(0);
  request_power_lock(true);
  request_power_lock(true);
  request_power_lock(false);
  EXPECT_FALSE(is_idle_status());
  EXPECT_TRUE(::testing::Mock::VerifyAndClearExpectations(&platform));

  EXPECT_CALL(platform, device_power_release_lock).WillOnce(Return(0));
  request_power_lock(false);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PowerTest, AReleaseWithoutATakeDoesNotUnbalanceTheNext) {
  request_power_lock(false);
  EXPECT_TRUE(is_idle_status());
  request_power_lock(true);
  EXPECT_FALSE(is_idle_status());
  request_power_lock(false);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PowerTest, APendingRequestKeepsTheDaemonFromBeingIdle) {
  EXPECT_TRUE(is_idle_status());
  {
    const PendingWork call;
    EXPECT_FALSE(is_idle_status());
    PendingWork::begin();
  }
  EXPECT_FALSE(is_idle_status());
  PendingWork::end();
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PowerTest, TakersOnSeveralThreadsAreCounted) {
  constexpr int kThreads = 4;
  constexpr int kRounds = 200;
  int locked = 0;
  ON_CALL(platform, device_power_request_lock).WillByDefault([&locked](power_lock_e, int) {
    locked = 1;
    return 0;
  });
  ON_CALL(platform, device_power_release_lock).WillByDefault([&locked](power_lock_e) {
    locked = 0;
    return 0;
  });
  request_power_lock(true);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([] {
      for (int round = 0; round < kRounds; ++round) {
        request_power_lock(true);
        EXPECT_FALSE(is_idle_status());
        request_power_lock(false);
      }
    });
  }
  for (auto &thread : threads) thread.join();
  EXPECT_FALSE(is_idle_status());
  EXPECT_EQ(locked, 1);
  request_power_lock(false);
  EXPECT_TRUE(is_idle_status());
  EXPECT_EQ(locked, 0);
}

}  // namespace
