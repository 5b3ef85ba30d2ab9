#include <glib.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "backup_transport.h"
#include "log_capture.h"
#include "platform_settings.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/power.h"
#include "setting_fixture.h"

namespace {

using ::testing::_;
using ::testing::InSequence;
using ::testing::IsNull;
using ::testing::NotNull;
using ::testing::Return;
using ::testing::StrEq;

constexpr std::uint64_t kHourMs = 3600000;
constexpr std::uint64_t kDayMs = 24 * kHourMs;
constexpr time_t kTwelveHours = 43200;
constexpr int kServiceError = -5;

using Texts = std::vector<std::string>;

/* ---- start and end ---- */

TEST_F(SettingTest, TheStartTakesConnectionAndAlarmServiceAndArmsTwelveHours) {
  const InSequence order;
  EXPECT_CALL(platform, connection_create(&g_connection)).Times(1);
  EXPECT_CALL(platform, alarmmgr_init(StrEq("quarn"))).Times(1);
  EXPECT_CALL(platform, alarmmgr_set_cb(NotNull(), IsNull())).Times(1);
  EXPECT_CALL(platform, alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, kTwelveHours, 0, StrEq("quarn"), _))
      .Times(1);
  init_backup_resource();
  EXPECT_EQ(captured_texts(), Texts{"init backup resource"});
  EXPECT_EQ(_alarm_id, 0);
}

TEST_F(SettingTest, TheStartGoesOnAfterEveryFailure) {
  EXPECT_CALL(platform, connection_create).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, alarmmgr_init).WillOnce(Return(ERR_ALARM_SYSTEM_FAIL));
  EXPECT_CALL(platform, alarmmgr_set_cb).WillOnce(Return(ERR_ALARM_NOT_INITIALIZED));
  EXPECT_CALL(platform, alarmmgr_add_alarm).WillOnce(Return(ERR_ALARM_NOT_INITIALIZED));
  init_backup_resource();
  EXPECT_EQ(captured_texts(),
            (Texts{"init backup resource", "connection_create failed", "alarmmgr_init failed",
                   "alarmmgr_set_cb failed", "alarmmgr_add_alarm failed[-6]"}));
  EXPECT_EQ(count_logged(DLOG_ERROR, "connection_create failed"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "alarmmgr_init failed"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "alarmmgr_set_cb failed"), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "alarmmgr_add_alarm failed[-6]"), 1);
}

TEST_F(SettingTest, TheEndGivesEverythingBackInOrder) {
  init_backup_resource();
  start_wifi_monitor();
  start_screen_monitor();
  satisfy_conditions();
  ASSERT_EQ(_alarm_id, 2);
  clear_captured_log();
  {
    const InSequence order;
    EXPECT_CALL(platform, connection_destroy(g_connection)).WillOnce(Return(0));
    EXPECT_CALL(transport, backup_trans_deinit).Times(1);
    EXPECT_CALL(platform, alarmmgr_remove_alarm(2)).Times(1);
    EXPECT_CALL(platform, alarmmgr_fini).Times(1);
  }
  deinit_backup_resource();
  EXPECT_EQ(captured_texts(), (Texts{"connection destroy ~", "backup-transport deinit ~",
                                     "remove alarm ~", "alarm(id:2) was removed"}));
  EXPECT_EQ(_alarm_id, 0);
  EXPECT_EQ(alarms, (std::map<alarm_id_t, time_t>{{1, kTwelveHours}}));
}

TEST_F(SettingTest, ASecondEndFindsNothingToGiveBack) {
  init_backup_resource();
  deinit_backup_resource();
  EXPECT_CALL(platform, connection_destroy).Times(0);
  EXPECT_CALL(platform, alarmmgr_remove_alarm).Times(0);
  EXPECT_CALL(platform, alarmmgr_fini).Times(0);
  deinit_backup_resource();
  EXPECT_EQ(g_connection, nullptr);
}

TEST_F(SettingTest, TheEndLogsItsFailures) {
  init_backup_resource();
  _alarm_id = 7;
  EXPECT_CALL(platform, connection_destroy).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, alarmmgr_remove_alarm(7)).WillOnce(Return(ERR_ALARM_INVALID_ID));
  deinit_backup_resource();
  EXPECT_EQ(count_logged(DLOG_ERROR, "connection_destroy failed"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail : alarmmgr_remove_alarm(id:7), err=-2"), 1);
  EXPECT_EQ(_alarm_id, 0);
}

/* ---- the alarm falls due ---- */

class ExpiryTest : public SettingTest {
 protected:
  ExpiryTest() {
    init_backup_resource();
    start_wifi_monitor();
    start_screen_monitor();
    alarms.clear();
    clear_captured_log();
  }

  void last_backup_was(std::uint64_t ms_ago) {
    fake_daemon.last_backup = static_cast<std::uint64_t>(fake_daemon.now) - ms_ago;
  }

  void expire(alarm_id_t id = 5) {
    clear_captured_log();
    EXPECT_EQ(alarm_callback(id, nullptr), 0);
  }

  static void expect_terminated_once() {
    ASSERT_EQ(fake_daemon.terminations.size(), 1U);
    EXPECT_EQ(fake_daemon.terminations[0].delay, 0.0);
    EXPECT_FALSE(fake_daemon.terminations[0].restart);
  }
};

TEST_F(ExpiryTest, TwentyThreeHoursAfterTheLastBackupNothingIsDueAndTheIdleDaemonEnds) {
  last_backup_was(23 * kHourMs);
  expire();
  EXPECT_EQ(captured_texts(), (Texts{"alarm(id:5) was expired. backup time term in second = 82800",
                                     "auto backup period wasn't expired yet", "terminate quarn"}));
  expect_terminated_once();
  EXPECT_TRUE(fake_daemon.backup_requests.empty());
}

TEST_F(ExpiryTest, ADayIsNotOverBeforeItsLastMillisecond) {
  last_backup_was(kDayMs);
  expire();
  EXPECT_EQ(count_logged(DLOG_INFO, "auto backup period wasn't expired yet"), 1);
  last_backup_was(kDayMs + 1);
  expire();
  EXPECT_EQ(count_logged(DLOG_INFO, "request for auto backup"), 1);
}

TEST_F(ExpiryTest, TwentyFiveHoursLaterWithAutoBackupOffNothingIsRequested) {
  satisfy_conditions();
  last_backup_was(25 * kHourMs);
  expire();
  EXPECT_EQ(captured_texts(),
            (Texts{"alarm(id:5) was expired. backup time term in second = 90000",
                   "request for auto backup", "satisfied for auto backup condition",
                   "auto backup condition is invalid", "terminate quarn"}));
  EXPECT_TRUE(fake_daemon.backup_requests.empty());
  expect_terminated_once();
}

TEST_F(ExpiryTest, WithAConditionBrokenNothingIsRequested) {
  set_auto_backup(1);
  satisfy_conditions();
  set_charger(false);
  last_backup_was(25 * kHourMs);
  expire();
  EXPECT_EQ(count_logged(DLOG_INFO, "auto backup condition is invalid"), 1);
  EXPECT_TRUE(fake_daemon.backup_requests.empty());
}

TEST_F(ExpiryTest, ADueBackupIsRequestedForNobodyAndKeepsTheDaemon) {
  set_auto_backup(1);
  satisfy_conditions();
  alarms.clear();
  last_backup_was(25 * kHourMs);
  EXPECT_CALL(platform, alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, kTwelveHours, 0, StrEq("quarn"), _))
      .Times(1);
  expire();
  EXPECT_EQ(fake_daemon.backup_requests, std::vector<void *>{nullptr});
  EXPECT_TRUE(fake_daemon.terminations.empty());
  EXPECT_EQ(captured_texts(),
            (Texts{"alarm(id:5) was expired. backup time term in second = 90000",
                   "request for auto backup", "satisfied for auto backup condition",
                   "add alarm for 5 min"}));
  EXPECT_EQ(_alarm_id, 0);
}

TEST_F(ExpiryTest, AnIdleProcessWithoutAnotherAlarmLeavesOneForTheNextDay) {
  set_auto_backup(1);
  last_backup_was(kHourMs);
  for (alarm_id_t id = 1; id <= last_alarm; ++id) forget_alarm(id);
  expire();
  ASSERT_EQ(alarms.size(), 1U);
  EXPECT_EQ(alarms.begin()->second, kTwelveHours);
  expect_terminated_once();
}

TEST_F(ExpiryTest, AnIdleProcessWithAnAlarmPendingAddsNone) {
  set_auto_backup(1);
  last_backup_was(kHourMs);
  alarm_id_t pending = 0;
  EXPECT_EQ(add_backup_alarm(kTwelveHours, &pending), ALARMMGR_RESULT_SUCCESS);
  EXPECT_CALL(platform, alarmmgr_add_alarm).Times(0);
  expire();
  expect_terminated_once();
}

TEST_F(ExpiryTest, WithAutoBackupOffNoAlarmFollows) {
  last_backup_was(kHourMs);
  EXPECT_CALL(platform, alarmmgr_add_alarm).Times(0);
  expire();
  expect_terminated_once();
}

TEST_F(SettingTest, KnowsWhenItsAlarmsAreDue) {
  EXPECT_EQ(next_alarm_due(), 0);
  const std::int64_t before = _get_current_timestamp();
  alarm_id_t id = 0;
  EXPECT_EQ(add_backup_alarm(kTwelveHours, &id), ALARMMGR_RESULT_SUCCESS);
  EXPECT_GE(next_alarm_due(), before + kTwelveHours * 1000LL);
  EXPECT_EQ(condition_alarm_due(), 0);
  EXPECT_EQ(add_backup_alarm(60, &_alarm_id), ALARMMGR_RESULT_SUCCESS);
  EXPECT_GE(condition_alarm_due(), before + 60000);
  EXPECT_EQ(next_alarm_due(), condition_alarm_due());
  remove_condition_alarm();
  EXPECT_EQ(condition_alarm_due(), 0);
}

TEST_F(ExpiryTest, WhileABackupRunsNoneIsRequestedAndATwelveHourAlarmIsAdded) {
  set_auto_backup(1);
  satisfy_conditions();
  alarms.clear();
  g_is_backing_up = true;
  request_power_lock(true);
  last_backup_was(25 * kHourMs);
  expire();
  request_power_lock(false);
  EXPECT_EQ(count_logged(DLOG_INFO, "cannot request back up.(now backing up)"), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "add alarm for 5 min"), 1);
  ASSERT_EQ(alarms.size(), 1U);
  EXPECT_EQ(alarms.begin()->second, kTwelveHours);
  EXPECT_TRUE(fake_daemon.backup_requests.empty());
  EXPECT_TRUE(fake_daemon.terminations.empty());
}

TEST_F(ExpiryTest, ATwelveHourAlarmThatCannotBeAddedIsLogged) {
  request_power_lock(true);
  last_backup_was(kHourMs);
  EXPECT_CALL(platform, alarmmgr_add_alarm).WillOnce(Return(ERR_ALARM_SYSTEM_FAIL));
  expire();
  request_power_lock(false);
  EXPECT_EQ(count_logged(DLOG_INFO, "alarmmgr_add_alarm failed[-4]"), 1);
}

TEST_F(ExpiryTest, ALastBackupInTheFutureIsDue) {
  fake_daemon.last_backup = static_cast<std::uint64_t>(fake_daemon.now) + kHourMs;
  expire();
  EXPECT_EQ(count_logged(DLOG_INFO, "request for auto backup"), 1);
  EXPECT_EQ(count_logged(DLOG_INFO,
                         "alarm(id:5) was expired. backup time term in second = 18446744073705951"),
            1);
}

TEST_F(ExpiryTest, AnUnreadableLastBackupIsDue) {
  fake_daemon.last_backup = ~std::uint64_t{0};
  expire();
  EXPECT_EQ(count_logged(DLOG_INFO, "request for auto backup"), 1);
}

TEST_F(ExpiryTest, WhicheverAlarmFiresThePendingOneIsSpent) {
  satisfy_conditions();
  ASSERT_NE(_alarm_id, 0);
  last_backup_was(kHourMs);
  expire(_alarm_id + 1);
  EXPECT_EQ(_alarm_id, 0);
}

/* ---- the setting ---- */

class AutoBackupTest : public SettingTest {
 protected:
  AutoBackupTest() {
    start_wifi_monitor();
    clear_captured_log();
  }
};

TEST_F(AutoBackupTest, SwitchingOnTwiceChangesNothingTheSecondTime) {
  set_auto_backup(1);
  EXPECT_EQ(auto_backup_enabled, 1);
  EXPECT_EQ(captured_texts(),
            (Texts{"Charger_Conn=>0, Wifi_Conn=>0, Lcd_Off=>0", "now auto backup state is 1"}));
  clear_captured_log();
  EXPECT_CALL(platform, device_add_callback).Times(0);
  set_auto_backup(1);
  EXPECT_EQ(captured_texts(), Texts{"backup state is aleady 1"});
  EXPECT_EQ(auto_backup_enabled, 1);
}

TEST_F(AutoBackupTest, SwitchingOffWhatIsOffChangesNothing) {
  EXPECT_CALL(platform, device_remove_callback).Times(0);
  set_auto_backup(0);
  EXPECT_EQ(captured_texts(), Texts{"backup state is aleady 0"});
}

TEST_F(AutoBackupTest, AnyOtherValueThanZeroIsOn) {
  set_auto_backup(2);
  EXPECT_EQ(auto_backup_enabled, 1);
  clear_captured_log();
  set_auto_backup(3);
  EXPECT_EQ(captured_texts(), Texts{"backup state is aleady 3"});
}

TEST_F(AutoBackupTest, SwitchingOnWithTheConditionsSatisfiedArmsTheAlarm) {
  satisfy_conditions();
  set_auto_backup(1);
  EXPECT_NE(_alarm_id, 0);
  EXPECT_EQ(alarms.size(), 1U);
}

TEST_F(AutoBackupTest, SwitchingOffRemovesAPendingAlarm) {
  satisfy_conditions();
  set_auto_backup(1);
  ASSERT_EQ(_alarm_id, 1);
  clear_captured_log();
  set_auto_backup(0);
  EXPECT_EQ(captured_texts(), (Texts{"auto backup`s condition is broken", "alarm(id:1) was removed",
                                     "now auto backup state is 0"}));
  EXPECT_TRUE(alarms.empty());
  EXPECT_EQ(_alarm_id, 0);
  EXPECT_EQ(auto_backup_enabled, 0);
  EXPECT_EQ(display_callback, nullptr);
}

TEST_F(AutoBackupTest, SwitchingOffForgetsAnAlarmThatCannotBeRemoved) {
  satisfy_conditions();
  set_auto_backup(1);
  EXPECT_CALL(platform, alarmmgr_remove_alarm(1)).WillOnce(Return(ERR_ALARM_INVALID_ID));
  set_auto_backup(0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail : alarmmgr_remove_alarm(id:1), err=-2"), 1);
  EXPECT_EQ(_alarm_id, 0);
}

TEST_F(AutoBackupTest, SwitchingOffWithoutAnAlarmRemovesNone) {
  set_auto_backup(1);
  clear_captured_log();
  EXPECT_CALL(platform, alarmmgr_remove_alarm).Times(0);
  set_auto_backup(0);
  EXPECT_EQ(captured_texts(), Texts{"now auto backup state is 0"});
}

TEST_F(AutoBackupTest, TheSettingIsAppliedAndFollowed) {
  EXPECT_CALL(platform, vconf_notify_key_changed(StrEq("db/private/quarn/backup_status"), NotNull(),
                                                 IsNull()))
      .Times(1);
  setting = 1;
  monitor_auto_backup_status();
  EXPECT_EQ(auto_backup_enabled, 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "try to backup setting on"), 1);

  setting = 0;
  setting_callback(nullptr, nullptr);
  EXPECT_EQ(auto_backup_enabled, 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "try to backup setting off"), 1);

  setting = 1;
  setting_callback(nullptr, nullptr);
  EXPECT_EQ(auto_backup_enabled, 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "try to backup setting on"), 2);
}

TEST_F(AutoBackupTest, ASettingThatIsOffStaysOffAtTheStart) {
  monitor_auto_backup_status();
  EXPECT_EQ(captured_texts(), Texts{"backup off"});
  EXPECT_EQ(auto_backup_enabled, 0);
}

TEST_F(AutoBackupTest, ASettingOfAnotherValueIsIgnoredWhenItChanges) {
  setting = 1;
  monitor_auto_backup_status();
  clear_captured_log();
  setting = 2;
  setting_callback(nullptr, nullptr);
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_EQ(auto_backup_enabled, 1);
}

TEST_F(AutoBackupTest, ASettingOfAnotherValueIsOffAtTheStart) {
  setting = 2;
  monitor_auto_backup_status();
  EXPECT_EQ(captured_texts(), Texts{"backup off"});
}

TEST_F(AutoBackupTest, AnUnreadableSettingChangesNothing) {
  setting = 1;
  monitor_auto_backup_status();
  clear_captured_log();
  setting_readable = false;
  setting_callback(nullptr, nullptr);
  EXPECT_EQ(captured_texts(), Texts{"cannot read backup status value from vconf"});
  EXPECT_EQ(captured_log().front().level, DLOG_ERROR);
  EXPECT_EQ(auto_backup_enabled, 1);
}

TEST_F(AutoBackupTest, AnUnwatchableSettingIsStillApplied) {
  EXPECT_CALL(platform, vconf_notify_key_changed).WillOnce(Return(VCONF_ERROR));
  setting = 1;
  monitor_auto_backup_status();
  EXPECT_EQ(count_logged(DLOG_ERROR, "vconf_notify_key_changed() failed"), 1);
  EXPECT_EQ(auto_backup_enabled, 1);
}

TEST_F(AutoBackupTest, AnUnreadableSettingAtTheStartIsOff) {
  setting_readable = false;
  monitor_auto_backup_status();
  EXPECT_EQ(captured_texts(), Texts{"cannot read backup status value from vconf"});
  EXPECT_EQ(auto_backup_enabled, 0);
}

}  // namespace
