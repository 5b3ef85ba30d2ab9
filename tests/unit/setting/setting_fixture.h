/**
 * @file setting_fixture.h
 * @brief A device whose charger, network, display, alarms and setting are variables.
 */
#ifndef SETTING_FIXTURE_H
#define SETTING_FIXTURE_H

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <map>
#include <vector>

#include "mock_platform.h"
#include "mock_transport.h"
#include "quarn_d_conditions/alarm.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_setting/quarn_d_setting.h"

/** What the units above and below would have done. */
struct FakeDaemon {
  std::int64_t now = 1700000000000;
  std::uint64_t last_backup = 0;
  std::vector<void *> backup_requests;
  struct Termination {
    double delay;
    bool restart;
  };
  std::vector<Termination> terminations;
};
extern FakeDaemon fake_daemon;

class SettingTest : public ::testing::Test {
 protected:
  SettingTest();
  ~SettingTest() override;

  /** The three facts, with their notifications where somebody watches. */
  void set_charger(bool connected);
  void set_network(connection_type_e type);
  void set_display(display_state_e state);
  /** Charging, on Wi-Fi, screen off. */
  void satisfy_conditions();

  ::testing::NiceMock<MockPlatform> platform;
  ::testing::NiceMock<MockTransport> transport;

  bool charger = false;
  connection_type_e network = CONNECTION_TYPE_DISCONNECTED;
  display_state_e display = DISPLAY_STATE_NORMAL;
  connection_type_changed_cb network_callback = nullptr;
  runtime_info_changed_cb charger_callback = nullptr;
  device_changed_cb display_callback = nullptr;
  alarm_cb_t alarm_callback = nullptr;
  vconf_callback_fn setting_callback = nullptr;
  /** Pending alarms: id, seconds from when it was added. */
  std::map<alarm_id_t, time_t> alarms;
  alarm_id_t last_alarm = 0;
  /** The setting's value, and whether it can be read. */
  int setting = 0;
  bool setting_readable = true;
};

#endif
