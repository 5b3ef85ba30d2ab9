#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "log_capture.h"
#include "setting_fixture.h"

namespace {

using ::testing::_;
using ::testing::IsNull;
using ::testing::Return;
using ::testing::StrEq;

constexpr time_t kHour = 3600;
constexpr int kServiceError = -5;

class ConditionsTest : public SettingTest {
 protected:
  ConditionsTest() {
    start_wifi_monitor();
    start_screen_monitor();
    clear_captured_log();
  }
};

/* ---- the combined test ---- */

TEST_F(ConditionsTest, ChargingOnWifiWithTheScreenOffPasses) {
  satisfy_conditions();
  clear_captured_log();
  EXPECT_EQ(backup_condition_pass(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "satisfied for auto backup condition"), 1);
}

TEST_F(ConditionsTest, EachConditionAloneIsNotEnough) {
  satisfy_conditions();
  set_charger(false);
  clear_captured_log();
  EXPECT_EQ(backup_condition_pass(), 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "Charger_Conn=>0, Wifi_Conn=>1, Lcd_Off=>1"), 1);

  satisfy_conditions();
  set_network(CONNECTION_TYPE_DISCONNECTED);
  clear_captured_log();
  EXPECT_EQ(backup_condition_pass(), 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "Charger_Conn=>1, Wifi_Conn=>0, Lcd_Off=>1"), 1);

  satisfy_conditions();
  set_display(DISPLAY_STATE_SCREEN_DIM);
  clear_captured_log();
  EXPECT_EQ(backup_condition_pass(), 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "Charger_Conn=>1, Wifi_Conn=>1, Lcd_Off=>0"), 1);
}

TEST_F(ConditionsTest, MobileDataInsteadOfWifiFails) {
  satisfy_conditions();
  set_network(CONNECTION_TYPE_CELLULAR);
  EXPECT_EQ(wifi_connected(), 0);
  EXPECT_EQ(backup_condition_pass(), 0);
}

TEST_F(ConditionsTest, AnUnreadableChargerCountsAsNotConnected) {
  satisfy_conditions();
  EXPECT_CALL(platform, runtime_info_get_value_bool).WillRepeatedly(Return(kServiceError));
  EXPECT_EQ(charger_connected(), 0);
  EXPECT_EQ(backup_condition_pass(), 0);
}

TEST_F(ConditionsTest, TheChargerIsReadAnewAtEveryCall) {
  EXPECT_EQ(charger_connected(), 0);
  charger = true;
  EXPECT_EQ(charger_connected(), 1);
}

/* ---- arming and disarming ---- */

TEST_F(ConditionsTest, TheScreenTurningOffArmsAnAlarmOneHourAheadAndTurningOnRemovesIt) {
  set_charger(true);
  set_network(CONNECTION_TYPE_WIFI);
  EXPECT_CALL(platform, alarmmgr_add_alarm(ALARM_TYPE_DEFAULT, kHour, 0, StrEq("quarn"), _))
      .Times(1);
  set_display(DISPLAY_STATE_SCREEN_OFF);
  EXPECT_EQ(alarms, (std::map<alarm_id_t, time_t>{{1, kHour}}));
  EXPECT_EQ(_alarm_id, 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "alarm registered for auto backup. id:1"), 1);

  set_display(DISPLAY_STATE_NORMAL);
  EXPECT_TRUE(alarms.empty());
  EXPECT_EQ(_alarm_id, 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "auto backup`s condition was broken"), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "alarm(id:1) was removed"), 1);
}

TEST_F(ConditionsTest, ASecondSatisfiedNotificationRestartsTheHour) {
  satisfy_conditions();
  ASSERT_EQ(_alarm_id, 1);
  clear_captured_log();
  check_backup_condition();
  EXPECT_EQ(alarms, (std::map<alarm_id_t, time_t>{{2, kHour}}));
  EXPECT_EQ(captured_texts(), (std::vector<std::string>{"satisfied for auto backup condition",
                                                        "alarm(id:1) was removed",
                                                        "alarm registered for auto backup. id:2"}));
}

TEST_F(ConditionsTest, AnAlarmThatCannotBeRemovedIsForgotten) {
  satisfy_conditions();
  EXPECT_CALL(platform, alarmmgr_remove_alarm(1)).WillOnce(Return(ERR_ALARM_INVALID_ID));
  set_display(DISPLAY_STATE_NORMAL);
  EXPECT_EQ(_alarm_id, 0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail : alarmmgr_remove_alarm(id:1), err=-2"), 1);
}

TEST_F(ConditionsTest, AnAlarmThatCannotBeAddedIsLogged) {
  EXPECT_CALL(platform, alarmmgr_add_alarm)
      .WillOnce([](int, time_t, time_t, const char *, alarm_id_t *id) {
        *id = 99;
        return ERR_ALARM_SYSTEM_FAIL;
      });
  satisfy_conditions();
  EXPECT_EQ(_alarm_id, 0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail : alarmmgr_add_alarm, err=-4"), 1);
}

TEST_F(ConditionsTest, UnsatisfiedConditionsWithoutAnAlarmChangeNothing) {
  EXPECT_CALL(platform, alarmmgr_add_alarm).Times(0);
  EXPECT_CALL(platform, alarmmgr_remove_alarm).Times(0);
  check_backup_condition();
  EXPECT_EQ(captured_texts(),
            std::vector<std::string>{"Charger_Conn=>0, Wifi_Conn=>0, Lcd_Off=>0"});
}

/* ---- Wi-Fi ---- */

TEST_F(SettingTest, WithoutItsMonitorThereIsNoWifi) {
  network = CONNECTION_TYPE_WIFI;
  EXPECT_EQ(wifi_connected(), 0);
  EXPECT_EQ(start_wifi_monitor(), 1);
  EXPECT_EQ(wifi_connected(), 1);
  EXPECT_EQ(stop_wifi_monitor(), 1);
  EXPECT_EQ(wifi_connected(), 0);
}

TEST_F(SettingTest, TheWifiMonitorUsesTheConnection) {
  init_backup_resource();
  ASSERT_NE(g_connection, nullptr);
  EXPECT_CALL(platform, connection_get_type(g_connection, _)).Times(2);
  EXPECT_CALL(platform, connection_set_type_changed_cb(g_connection, _, IsNull())).Times(1);
  EXPECT_EQ(start_wifi_monitor(), 1);
  EXPECT_CALL(platform, connection_unset_type_changed_cb(g_connection)).Times(1);
  EXPECT_EQ(stop_wifi_monitor(), 1);
}

TEST_F(SettingTest, WifiThatIsLostWhileItsMonitorStartsIsNoticed) {
  network = CONNECTION_TYPE_WIFI;
  EXPECT_CALL(platform, connection_set_type_changed_cb).WillOnce([this](auto &&...) {
    network = CONNECTION_TYPE_CELLULAR;
    return CONNECTION_ERROR_NONE;
  });
  EXPECT_EQ(start_wifi_monitor(), 1);
  EXPECT_EQ(wifi_connected(), 0);
}

TEST_F(SettingTest, AStartedWifiMonitorIsNotStartedAgain) {
  EXPECT_EQ(start_wifi_monitor(), 1);
  EXPECT_CALL(platform, connection_get_type).Times(0);
  EXPECT_EQ(start_wifi_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "start_wifi_monitor : already initialized"), 1);
}

TEST_F(SettingTest, AnUnreadableNetworkLeavesTheWifiMonitorStopped) {
  EXPECT_CALL(platform, connection_get_type).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, connection_set_type_changed_cb).Times(0);
  EXPECT_EQ(start_wifi_monitor(), 0);
  EXPECT_EQ(wifi_connected(), 0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "connection_get_type failed"), 1);
}

TEST_F(SettingTest, AnUnwatchableNetworkLeavesTheWifiMonitorStopped) {
  network = CONNECTION_TYPE_WIFI;
  EXPECT_CALL(platform, connection_set_type_changed_cb).WillOnce(Return(kServiceError));
  EXPECT_EQ(start_wifi_monitor(), 0);
  EXPECT_EQ(wifi_connected(), 0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "connection_set_type_changed_cb failed -5"), 1);
}

TEST_F(SettingTest, AStoppedWifiMonitorIsNotStoppedAgain) {
  EXPECT_CALL(platform, connection_unset_type_changed_cb).Times(0);
  EXPECT_EQ(stop_wifi_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "stop_wifi_monitor : not initialized"), 1);
}

TEST_F(SettingTest, AWifiMonitorThatCannotBeStoppedRunsOn) {
  network = CONNECTION_TYPE_WIFI;
  start_wifi_monitor();
  EXPECT_CALL(platform, connection_unset_type_changed_cb).WillOnce(Return(kServiceError));
  EXPECT_EQ(stop_wifi_monitor(), 0);
  EXPECT_EQ(wifi_connected(), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "connection_unset_type_changed_cb failed -5"), 1);
}

TEST_F(SettingTest, AnotherThreadMayAskForWifiWhileItChanges) {
  start_wifi_monitor();
  std::atomic<bool> seen{false};
  std::thread worker([&seen] {
    while (wifi_connected() == 0) std::this_thread::yield();
    seen = true;
  });
  while (!seen) {
    set_network(CONNECTION_TYPE_CELLULAR);
    set_network(CONNECTION_TYPE_WIFI);
    std::this_thread::yield();
  }
  worker.join();
  EXPECT_EQ(wifi_connected(), 1);
}

TEST_F(ConditionsTest, ANetworkChangeIsOnlyCheckedWhileAutoBackupIsOn) {
  set_charger(true);
  set_display(DISPLAY_STATE_SCREEN_OFF);
  set_network(CONNECTION_TYPE_WIFI);
  EXPECT_TRUE(alarms.empty());
  EXPECT_EQ(wifi_connected(), 1);

  set_network(CONNECTION_TYPE_DISCONNECTED);
  set_auto_backup(1);
  EXPECT_TRUE(alarms.empty());
  set_network(CONNECTION_TYPE_WIFI);
  EXPECT_EQ(alarms.size(), 1U);
  set_network(CONNECTION_TYPE_CELLULAR);
  EXPECT_TRUE(alarms.empty());
}

/* ---- charger ---- */

class ChargerTest : public ConditionsTest {
 protected:
  ChargerTest() {
    set_network(CONNECTION_TYPE_WIFI);
    set_display(DISPLAY_STATE_SCREEN_OFF);
    clear_captured_log();
  }
};

TEST_F(ChargerTest, AChargerChangeIsChecked) {
  EXPECT_EQ(start_charger_monitor(), 1);
  set_charger(true);
  EXPECT_EQ(count_logged(DLOG_INFO, "_charger_changed_cb"), 1);
  EXPECT_EQ(alarms.size(), 1U);
  set_charger(false);
  EXPECT_TRUE(alarms.empty());
}

TEST_F(ChargerTest, ANotificationForAnotherKeyIsRejected) {
  start_charger_monitor();
  charger = true;
  charger_callback(static_cast<runtime_info_key_e>(7), nullptr);
  EXPECT_EQ(captured_texts(),
            (std::vector<std::string>{"_charger_changed_cb", "Runtime info key mismatch 7"}));
  EXPECT_EQ(count_logged(DLOG_ERROR, "Runtime info key mismatch 7"), 1);
}

TEST_F(ChargerTest, AnUnreadableChargerIsNotChecked) {
  start_charger_monitor();
  EXPECT_CALL(platform, runtime_info_get_value_bool).WillOnce(Return(kServiceError));
  set_charger(true);
  EXPECT_TRUE(alarms.empty());
  EXPECT_EQ(count_logged(DLOG_ERROR, "Getting runtime info failed -5"), 1);
}

TEST_F(ChargerTest, AStartedChargerMonitorIsNotStartedAgain) {
  EXPECT_CALL(platform,
              runtime_info_set_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED, _, IsNull()))
      .Times(1);
  EXPECT_EQ(start_charger_monitor(), 1);
  EXPECT_EQ(start_charger_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "start_charger_monitor : already initialized"), 1);
}

TEST_F(ChargerTest, AnUnreadableChargerLeavesTheMonitorStopped) {
  EXPECT_CALL(platform, runtime_info_get_value_bool).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, runtime_info_set_changed_cb).Times(0);
  EXPECT_EQ(start_charger_monitor(), 0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "Getting runtime info failed -5"), 1);
}

TEST_F(ChargerTest, AnUnwatchableChargerLeavesTheMonitorStopped) {
  EXPECT_CALL(platform, runtime_info_set_changed_cb).WillOnce(Return(kServiceError));
  EXPECT_EQ(start_charger_monitor(), 0);
  EXPECT_EQ(
      count_logged(DLOG_ERROR, "Failed to set changed cb : RUNTIME_INFO_KEY_CHANGER_CONNECTED(-5)"),
      1);
  EXPECT_EQ(stop_charger_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "stop_charger_monitor : not initialized"), 1);
}

TEST_F(ChargerTest, AChargerMonitorThatCannotBeStoppedRunsOn) {
  start_charger_monitor();
  EXPECT_CALL(platform, runtime_info_unset_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED))
      .WillOnce(Return(kServiceError));
  EXPECT_EQ(stop_charger_monitor(), 0);
  EXPECT_EQ(count_logged(DLOG_ERROR,
                         "Failed to unset changed cb : RUNTIME_INFO_KEY_CHANGER_CONNECTED(-5)"),
            1);
  EXPECT_EQ(start_charger_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "start_charger_monitor : already initialized"), 1);
}

/* ---- screen ---- */

TEST_F(SettingTest, TheFirstScreenNotificationAlwaysRunsTheCheck) {
  display = DISPLAY_STATE_NORMAL;
  start_screen_monitor();
  set_display(DISPLAY_STATE_NORMAL);
  EXPECT_EQ(count_logged(DLOG_INFO, "Charger_Conn=>0, Wifi_Conn=>0, Lcd_Off=>0"), 1);
}

TEST_F(ConditionsTest, AnUnchangedScreenIsNotCheckedAgain) {
  satisfy_conditions();
  ASSERT_EQ(_alarm_id, 1);
  set_display(DISPLAY_STATE_SCREEN_OFF);
  EXPECT_EQ(_alarm_id, 1);
  set_display(DISPLAY_STATE_SCREEN_DIM);
  EXPECT_EQ(_alarm_id, 0);
}

TEST_F(ConditionsTest, ARestartedScreenMonitorTakesItsFirstNotificationAsAChange) {
  set_charger(true);
  set_network(CONNECTION_TYPE_WIFI);
  set_display(DISPLAY_STATE_NORMAL);
  ASSERT_EQ(stop_screen_monitor(), 1);
  set_display(DISPLAY_STATE_SCREEN_OFF);
  ASSERT_EQ(start_screen_monitor(), 1);
  check_backup_condition();
  ASSERT_EQ(alarms.size(), 1U);
  set_display(DISPLAY_STATE_NORMAL);
  EXPECT_TRUE(alarms.empty());
}

TEST_F(ConditionsTest, AScreenNotificationOfAnotherKindIsRejected) {
  EXPECT_CALL(platform, device_display_get_state).Times(0);
  display_callback(DEVICE_CALLBACK_BATTERY_LEVEL, nullptr, nullptr);
  EXPECT_EQ(captured_texts(), std::vector<std::string>{"unexpected callback : 1"});
  EXPECT_EQ(captured_log().front().level, DLOG_ERROR);
}

TEST_F(ConditionsTest, AnUnreadableDisplayIsNotChecked) {
  EXPECT_CALL(platform, device_display_get_state).WillOnce(Return(kServiceError));
  set_display(DISPLAY_STATE_SCREEN_OFF);
  EXPECT_EQ(captured_texts(), std::vector<std::string>{"Cannot get display state"});
  EXPECT_EQ(captured_log().front().level, DLOG_ERROR);
}

TEST_F(SettingTest, TheScreenMonitorSeesADisplayThatIsOffAlready) {
  charger = true;
  network = CONNECTION_TYPE_WIFI;
  display = DISPLAY_STATE_SCREEN_OFF;
  start_wifi_monitor();
  EXPECT_CALL(platform, device_add_callback(DEVICE_CALLBACK_DISPLAY_STATE, _, IsNull())).Times(1);
  EXPECT_EQ(start_screen_monitor(), 1);
  EXPECT_EQ(backup_condition_pass(), 1);
}

TEST_F(SettingTest, ADisplayThatGoesOffWhileItsMonitorStartsIsNoticed) {
  charger = true;
  network = CONNECTION_TYPE_WIFI;
  start_wifi_monitor();
  EXPECT_CALL(platform, device_add_callback).WillOnce([this](auto &&...) {
    display = DISPLAY_STATE_SCREEN_OFF;
    return DEVICE_ERROR_NONE;
  });
  EXPECT_EQ(start_screen_monitor(), 1);
  EXPECT_EQ(backup_condition_pass(), 1);
}

TEST_F(ConditionsTest, AStartedScreenMonitorIsNotStartedAgain) {
  EXPECT_CALL(platform, device_add_callback).Times(0);
  EXPECT_EQ(start_screen_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "start_screen_monitor : already initialized"), 1);
}

TEST_F(SettingTest, AnUnreadableDisplayLeavesTheScreenMonitorStopped) {
  EXPECT_CALL(platform, device_display_get_state).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, device_add_callback).Times(0);
  start_backup_condition_monitor();
  EXPECT_EQ(captured_texts(), (std::vector<std::string>{"fail : device_display_get_state",
                                                        "fail to start screen monitor"}));
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to start screen monitor"), 1);
}

TEST_F(SettingTest, AnUnwatchableDisplayLeavesTheScreenMonitorStopped) {
  EXPECT_CALL(platform, device_add_callback).WillOnce(Return(kServiceError));
  EXPECT_EQ(start_screen_monitor(), 0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "Failed to set changed cb for screen : -5"), 1);
  EXPECT_EQ(stop_screen_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "stop_screen_monitor : not initialized"), 1);
}

TEST_F(ConditionsTest, AScreenMonitorThatCannotBeStoppedRunsOn) {
  EXPECT_CALL(platform, device_remove_callback(DEVICE_CALLBACK_DISPLAY_STATE, display_callback))
      .WillOnce(Return(kServiceError));
  stop_backup_condition_monitor();
  EXPECT_EQ(captured_texts(),
            (std::vector<std::string>{"Failed to unset changed cb for screen : -5",
                                      "fail to stop screen monitor"}));
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to stop screen monitor"), 1);
  EXPECT_EQ(start_screen_monitor(), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "start_screen_monitor : already initialized"), 1);
}

TEST_F(SettingTest, TheConditionMonitorIsTheScreenMonitorOnly) {
  EXPECT_CALL(platform, connection_set_type_changed_cb).Times(0);
  EXPECT_CALL(platform, runtime_info_set_changed_cb).Times(0);
  EXPECT_CALL(platform, device_add_callback).Times(1);
  start_backup_condition_monitor();
  EXPECT_CALL(platform, device_remove_callback).Times(1);
  stop_backup_condition_monitor();
}

}  // namespace
