#include "platform_alarm.h"

#include <vector>

#include "device_fixture.h"
#include "state/alarms.h"

namespace {

constexpr char kOwner[] = "quarn";
constexpr std::int64_t kHourMs = 3600000;
constexpr time_t kHour = 3600;

class Alarms : public DeviceTest {
 protected:
  void SetUp() override { ASSERT_EQ(alarmmgr_init(kOwner), ALARMMGR_RESULT_SUCCESS); }
  void TearDown() override { alarmmgr_fini(); }

  static int on_alarm(alarm_id_t id, void *ids) {
    static_cast<std::vector<int> *>(ids)->push_back(id);
    return 0;
  }
  void listen() { ASSERT_EQ(alarmmgr_set_cb(on_alarm, &fired_), ALARMMGR_RESULT_SUCCESS); }
  static int add(time_t seconds, time_t interval = 0, const char *owner = kOwner) {
    alarm_id_t id = 0;
    EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, seconds, interval, owner, &id),
              ALARMMGR_RESULT_SUCCESS);
    return id;
  }
  std::vector<embedded::Alarm> pending() const {
    std::vector<embedded::Alarm> alarms;
    EXPECT_TRUE(embedded::list_alarms(device(), &alarms));
    return alarms;
  }

  std::vector<int> fired_;
};

TEST_F(Alarms, HavePositiveIdsThatAreNotUsedAgain) {
  const int first = add(kHour);
  const int second = add(kHour);
  EXPECT_GT(first, 0);
  EXPECT_NE(first, second);
  EXPECT_EQ(alarmmgr_remove_alarm(second), ALARMMGR_RESULT_SUCCESS);
  EXPECT_NE(add(kHour), second);
}

TEST_F(Alarms, SurviveTheProcessesThatAddedThem) {
  const std::int64_t before = embedded::now_ms();
  const int later = add(2 * kHour);
  const int sooner = add(kHour);
  alarmmgr_fini();
  const auto alarms = pending();
  ASSERT_EQ(alarms.size(), 2U);
  EXPECT_EQ(alarms[0].id, sooner);
  EXPECT_EQ(alarms[1].id, later);
  EXPECT_EQ(alarms[0].owner, kOwner);
  EXPECT_GE(alarms[0].due_ms, before + kHourMs);
  EXPECT_LE(alarms[0].due_ms, embedded::now_ms() + kHourMs);
  EXPECT_EQ(embedded::next_due(device()), alarms[0].due_ms);
}

TEST_F(Alarms, ArriveOnceWhileSomebodyListens) {
  const int id = add(kHour);
  listen();
  ASSERT_TRUE(embedded::fire_alarm(device(), id, embedded::now_ms()));
  EXPECT_TRUE(run_until([this] { return !fired_.empty(); }));
  drain();
  EXPECT_EQ(fired_, std::vector<int>{id});
  EXPECT_TRUE(pending().empty());
  EXPECT_FALSE(embedded::has_fired_alarms(device(), kOwner));
}

TEST_F(Alarms, ThatFellDueWhileNobodyListenedFollowInTheirOrder) {
  const int first = add(kHour);
  const int second = add(kHour);
  ASSERT_TRUE(embedded::fire_alarm(device(), second, embedded::now_ms()));
  ASSERT_TRUE(embedded::fire_alarm(device(), first, embedded::now_ms()));
  EXPECT_TRUE(embedded::has_fired_alarms(device(), kOwner));
  listen();
  // Not from inside the call.
  EXPECT_TRUE(fired_.empty());
  EXPECT_TRUE(run_until([this] { return fired_.size() == 2; }));
  EXPECT_EQ(fired_, (std::vector<int>{second, first}));
}

TEST_F(Alarms, OfAnotherOwnerAreLeftToIt) {
  const int id = add(kHour, 0, "other");
  EXPECT_EQ(alarmmgr_remove_alarm(id), ERR_ALARM_INVALID_ID);
  ASSERT_TRUE(embedded::fire_alarm(device(), id, embedded::now_ms()));
  listen();
  drain();
  EXPECT_TRUE(fired_.empty());
  EXPECT_FALSE(embedded::has_fired_alarms(device(), kOwner));
  EXPECT_TRUE(embedded::has_fired_alarms(device(), "other"));
}

TEST_F(Alarms, ThatWereRemovedDoNotArrive) {
  const int id = add(kHour);
  ASSERT_TRUE(embedded::fire_alarm(device(), id, embedded::now_ms()));
  EXPECT_EQ(alarmmgr_remove_alarm(id), ALARMMGR_RESULT_SUCCESS);
  EXPECT_EQ(alarmmgr_remove_alarm(id), ERR_ALARM_INVALID_ID);
  listen();
  drain();
  EXPECT_TRUE(fired_.empty());
}

TEST_F(Alarms, FireWhenTheyAreDue) {
  const int now = add(0);
  const int later = add(kHour);
  EXPECT_EQ(embedded::fire_due_alarms(device(), embedded::now_ms()), 1);
  EXPECT_EQ(embedded::fire_due_alarms(device(), embedded::now_ms()), 0);
  EXPECT_EQ(pending().front().id, later);
  listen();
  EXPECT_TRUE(run_until([this] { return !fired_.empty(); }));
  EXPECT_EQ(fired_, std::vector<int>{now});
}

TEST_F(Alarms, WithAnIntervalComeAgain) {
  const int id = add(0, kHour);
  const std::int64_t due = pending().front().due_ms;
  EXPECT_EQ(embedded::fire_due_alarms(device(), due), 1);
  ASSERT_EQ(pending().size(), 1U);
  EXPECT_EQ(pending().front().id, id);
  EXPECT_EQ(pending().front().due_ms, due + kHourMs);
  // Periods that were slept through are one firing.
  EXPECT_EQ(embedded::fire_due_alarms(device(), due + 5 * kHourMs + 1), 1);
  EXPECT_EQ(pending().front().due_ms, due + 6 * kHourMs);
  EXPECT_EQ(embedded::take_fired_alarms(device(), kOwner), (std::vector<int>{id, id}));
}

TEST_F(Alarms, DoNotArriveAfterTheEndOfTheRegistration) {
  const int id = add(kHour);
  ASSERT_TRUE(embedded::fire_alarm(device(), id, embedded::now_ms()));
  listen();
  alarmmgr_fini();
  drain();
  EXPECT_TRUE(fired_.empty());
  EXPECT_TRUE(embedded::has_fired_alarms(device(), kOwner));
}

TEST_F(Alarms, AreInTheirFileWhenTheRegistrationEnds) {
  const int id = add(kHour);
  alarmmgr_fini();
  const embedded::KeyFilePtr file = embedded::read_state(device(), embedded::kAlarmsFile);
  ASSERT_NE(file, nullptr);
  EXPECT_EQ(embedded::text_of(file.get(), ("alarm " + std::to_string(id)).c_str(), "owner"),
            kOwner);
}

TEST_F(Alarms, NeedARegistration) {
  alarmmgr_fini();
  alarm_id_t id = 0;
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, 0, kOwner, &id), ERR_ALARM_NOT_INITIALIZED);
  EXPECT_EQ(alarmmgr_remove_alarm(1), ERR_ALARM_NOT_INITIALIZED);
  EXPECT_EQ(alarmmgr_set_cb(on_alarm, nullptr), ERR_ALARM_NOT_INITIALIZED);
}

TEST_F(Alarms, RefuseBadParameters) {
  alarm_id_t id = 0;
  EXPECT_EQ(alarmmgr_init(nullptr), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_init(""), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_set_cb(nullptr, nullptr), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(1, 1, 0, kOwner, &id), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, -1, 0, kOwner, &id), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, -1, kOwner, &id), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, 0, nullptr, &id), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, 0, "", &id), ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, 0, kOwner, nullptr), ERR_ALARM_INVALID_PARAM);
  const auto endless = static_cast<time_t>(1) << 40U;
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, endless, 0, kOwner, &id),
            ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, endless, kOwner, &id),
            ERR_ALARM_INVALID_PARAM);
  EXPECT_EQ(id, 0);
}

TEST_F(Alarms, FailWithoutADeviceOrItsState) {
  alarm_id_t id = 0;
  break_state();
  EXPECT_EQ(alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, 1, 0, kOwner, &id), ERR_ALARM_SYSTEM_FAIL);
  leave_device();
  EXPECT_EQ(alarmmgr_init(kOwner), ERR_ALARM_SYSTEM_FAIL);
  EXPECT_EQ(alarmmgr_set_cb(on_alarm, &fired_), ERR_ALARM_SYSTEM_FAIL);
}

TEST_F(Alarms, OfASpoiltFileAreNotListed) {
  spoil(embedded::kAlarmsFile);
  std::vector<embedded::Alarm> alarms;
  EXPECT_FALSE(embedded::list_alarms(device(), &alarms));
  EXPECT_EQ(embedded::next_due(device()), std::nullopt);
  EXPECT_FALSE(embedded::fire_alarm(device(), 1, 0));
  EXPECT_EQ(embedded::fire_due_alarms(device(), 0), 0);
  EXPECT_TRUE(embedded::take_fired_alarms(device(), kOwner).empty());
  EXPECT_FALSE(embedded::has_fired_alarms(device(), kOwner));
}

TEST_F(Alarms, StartAgainAtOneAfterTheLastNumber) {
  ASSERT_TRUE(embedded::edit_state(device(), embedded::kAlarmsFile, [](GKeyFile *file) {
    g_key_file_set_integer(file, "counters", "next_id", std::numeric_limits<int>::max());
    return true;
  }));
  EXPECT_EQ(add(kHour), std::numeric_limits<int>::max());
  EXPECT_EQ(add(kHour), 1);
  EXPECT_EQ(add(kHour), 2);
}

}  // namespace
