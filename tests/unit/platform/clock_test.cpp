#include "state/clock.h"

#include <cmath>
#include <thread>

#include "device_fixture.h"
#include "platform_alarm.h"
#include "platform_clock.h"
#include "state/alarms.h"

namespace {

constexpr std::int64_t kHourMs = 3600000;
/** Between two looks at a clock. */
constexpr std::int64_t kSlackMs = 60000;

class DeviceClock : public DeviceTest {
 protected:
  void expect_ahead(std::int64_t offset) const {
    EXPECT_EQ(embedded::clock_offset_ms(device()), offset);
    EXPECT_EQ(platform_clock_offset_ms(), offset);
    EXPECT_LT(std::abs(embedded::now_ms() - embedded::machine_now_ms() - offset), kSlackMs);
    EXPECT_LT(std::abs(embedded::device_now_ms(device()) - embedded::machine_now_ms() - offset),
              kSlackMs);
  }
};

TEST_F(DeviceClock, IsTheMachinesUntilItIsSet) { expect_ahead(0); }

TEST_F(DeviceClock, FollowsEachSettingAtOnce) {
  for (const std::int64_t offset :
       {25 * kHourMs, -25 * kHourMs, std::int64_t{1}, std::int64_t{0}}) {
    ASSERT_TRUE(embedded::set_clock_offset_ms(device(), offset));
    expect_ahead(offset);
  }
}

TEST_F(DeviceClock, IsSeenByEveryThread) {
  for (int round = 1; round <= 50; ++round) {
    ASSERT_TRUE(embedded::set_clock_offset_ms(device(), round));
    std::int64_t seen = 0;
    std::thread other([&] { seen = platform_clock_offset_ms(); });
    EXPECT_EQ(platform_clock_offset_ms(), round);
    other.join();
    EXPECT_EQ(seen, round);
  }
}

TEST_F(DeviceClock, IsTheMachinesWithoutADeviceAndWithASpoiltFile) {
  ASSERT_TRUE(embedded::set_clock_offset_ms(device(), kHourMs));
  spoil(embedded::kClockFile);
  expect_ahead(0);
  ASSERT_FALSE(embedded::set_clock_offset_ms(device(), kHourMs)) << "what is spoilt is not guessed";
  leave_device();
  EXPECT_EQ(platform_clock_offset_ms(), 0);
}

TEST_F(DeviceClock, IsWhatAlarmsAreDueBy) {
  ASSERT_EQ(alarmmgr_init("quarn"), ALARMMGR_RESULT_SUCCESS);
  alarm_id_t id = 0;
  ASSERT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 3600, 0, "quarn", &id), ALARMMGR_RESULT_SUCCESS);
  const auto fired = [this] {
    return embedded::fire_due_alarms(device(), embedded::device_now_ms(device()));
  };
  EXPECT_EQ(fired(), 0);
  ASSERT_TRUE(embedded::set_clock_offset_ms(device(), -kHourMs));
  EXPECT_EQ(fired(), 0);
  ASSERT_TRUE(embedded::set_clock_offset_ms(device(), kHourMs + 1000));
  EXPECT_EQ(fired(), 1);
  EXPECT_EQ(fired(), 0);
  // An hour from now is an hour from the device's now.
  ASSERT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 3600, 0, "quarn", &id), ALARMMGR_RESULT_SUCCESS);
  EXPECT_EQ(fired(), 0);
  std::vector<embedded::Alarm> alarms;
  ASSERT_TRUE(embedded::list_alarms(device(), &alarms));
  ASSERT_EQ(alarms.size(), 1U);
  EXPECT_LT(std::abs(alarms[0].due_ms - embedded::machine_now_ms() - 2 * kHourMs), kSlackMs);
  alarmmgr_fini();
}

}  // namespace
