// Network, charger, display and power: what automatic backup depends on.
#include <unistd.h>

#include "device_fixture.h"
#include "platform_connection.h"
#include "platform_device.h"
#include "platform_runtime_info.h"
#include "state/power.h"

namespace {

class Network : public DeviceTest {
 protected:
  void SetUp() override {
    set_fact(embedded::kNetwork, "wifi");
    ASSERT_EQ(connection_create(&connection_), CONNECTION_ERROR_NONE);
  }
  void TearDown() override { EXPECT_EQ(connection_destroy(connection_), CONNECTION_ERROR_NONE); }

  static void on_change(connection_type_e type, void *self) {
    static_cast<Network *>(self)->seen_.push_back(type);
  }
  static void unset_on_change(connection_type_e type, void *self) {
    on_change(type, self);
    connection_unset_type_changed_cb(static_cast<Network *>(self)->connection_);
  }

  connection_h connection_ = nullptr;
  std::vector<connection_type_e> seen_;
};

TEST_F(Network, HasTheTypeThatWasSet) {
  const std::pair<const char *, connection_type_e> types[] = {
      {"wifi", CONNECTION_TYPE_WIFI},
      {"cellular", CONNECTION_TYPE_CELLULAR},
      {"none", CONNECTION_TYPE_DISCONNECTED}};
  for (const auto &[network, expected] : types) {
    set_fact(embedded::kNetwork, network);
    connection_type_e type{};
    EXPECT_EQ(connection_get_type(connection_, &type), CONNECTION_ERROR_NONE);
    EXPECT_EQ(type, expected) << network;
  }
}

TEST_F(Network, TellsOfAChange) {
  ASSERT_EQ(connection_set_type_changed_cb(connection_, on_change, this), CONNECTION_ERROR_NONE);
  set_fact(embedded::kNetwork, "cellular");
  EXPECT_TRUE(run_until([this] { return !seen_.empty(); }));
  EXPECT_EQ(seen_, std::vector<connection_type_e>{CONNECTION_TYPE_CELLULAR});
}

TEST_F(Network, TellsOfAChangeThatWasTakenBackAtOnce) {
  ASSERT_EQ(connection_set_type_changed_cb(connection_, on_change, this), CONNECTION_ERROR_NONE);
  set_fact(embedded::kNetwork, "none");
  set_fact(embedded::kNetwork, "wifi");
  EXPECT_TRUE(run_until([this] { return !seen_.empty(); }));
  EXPECT_EQ(seen_.back(), CONNECTION_TYPE_WIFI);
}

TEST_F(Network, IsSilentAboutOtherFactsAndTheSameValue) {
  ASSERT_EQ(connection_set_type_changed_cb(connection_, on_change, this), CONNECTION_ERROR_NONE);
  set_fact(embedded::kCharger, "on");
  set_fact(embedded::kNetwork, "wifi");
  drain();
  EXPECT_TRUE(seen_.empty());
}

TEST_F(Network, IsSilentOnceUnset) {
  ASSERT_EQ(connection_set_type_changed_cb(connection_, on_change, this), CONNECTION_ERROR_NONE);
  ASSERT_EQ(connection_unset_type_changed_cb(connection_), CONNECTION_ERROR_NONE);
  EXPECT_EQ(connection_unset_type_changed_cb(connection_), CONNECTION_ERROR_INVALID_PARAMETER);
  set_fact(embedded::kNetwork, "none");
  drain();
  EXPECT_TRUE(seen_.empty());
}

TEST_F(Network, MayBeUnsetByItsOwnCallback) {
  ASSERT_EQ(connection_set_type_changed_cb(connection_, unset_on_change, this),
            CONNECTION_ERROR_NONE);
  set_fact(embedded::kNetwork, "none");
  EXPECT_TRUE(run_until([this] { return !seen_.empty(); }));
  set_fact(embedded::kNetwork, "wifi");
  drain();
  EXPECT_EQ(seen_.size(), 1U);
}

TEST_F(Network, RefusesNullsAndAMissingDevice) {
  connection_type_e type{};
  EXPECT_EQ(connection_create(nullptr), CONNECTION_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(connection_destroy(nullptr), CONNECTION_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(connection_get_type(nullptr, &type), CONNECTION_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(connection_get_type(connection_, nullptr), CONNECTION_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(connection_set_type_changed_cb(connection_, nullptr, nullptr),
            CONNECTION_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(connection_unset_type_changed_cb(nullptr), CONNECTION_ERROR_INVALID_PARAMETER);
  leave_device();
  connection_h none = nullptr;
  EXPECT_EQ(connection_create(&none), CONNECTION_ERROR_OPERATION_FAILED);
  EXPECT_EQ(connection_get_type(connection_, &type), CONNECTION_ERROR_OPERATION_FAILED);
  EXPECT_EQ(connection_set_type_changed_cb(connection_, on_change, this),
            CONNECTION_ERROR_OPERATION_FAILED);
}

class Charger : public DeviceTest {
 protected:
  static void on_change(runtime_info_key_e key, void *keys) {
    static_cast<std::vector<int> *>(keys)->push_back(key);
  }
  std::vector<int> keys_;
};

TEST_F(Charger, IsConnectedWhenItIsOn) {
  bool connected = false;
  set_fact(embedded::kCharger, "on");
  EXPECT_EQ(runtime_info_get_value_bool(RUNTIME_INFO_KEY_CHARGER_CONNECTED, &connected),
            RUNTIME_INFO_ERROR_NONE);
  EXPECT_TRUE(connected);
  set_fact(embedded::kCharger, "off");
  EXPECT_EQ(runtime_info_get_value_bool(RUNTIME_INFO_KEY_CHARGER_CONNECTED, &connected),
            RUNTIME_INFO_ERROR_NONE);
  EXPECT_FALSE(connected);
}

TEST_F(Charger, TellsOfAChangeUntilUnset) {
  ASSERT_EQ(runtime_info_set_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED, on_change, &keys_),
            RUNTIME_INFO_ERROR_NONE);
  set_fact(embedded::kCharger, "on");
  EXPECT_TRUE(run_until([this] { return !keys_.empty(); }));
  EXPECT_EQ(keys_, std::vector<int>{RUNTIME_INFO_KEY_CHARGER_CONNECTED});
  EXPECT_EQ(runtime_info_unset_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED),
            RUNTIME_INFO_ERROR_NONE);
  EXPECT_EQ(runtime_info_unset_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED),
            RUNTIME_INFO_ERROR_INVALID_PARAMETER);
  set_fact(embedded::kCharger, "off");
  drain();
  EXPECT_EQ(keys_.size(), 1U);
}

TEST_F(Charger, RefusesOtherKeysNullsAndAMissingDevice) {
  const auto other = static_cast<runtime_info_key_e>(1);
  bool connected = false;
  EXPECT_EQ(runtime_info_get_value_bool(other, &connected), RUNTIME_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(runtime_info_get_value_bool(RUNTIME_INFO_KEY_CHARGER_CONNECTED, nullptr),
            RUNTIME_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(runtime_info_set_changed_cb(other, on_change, &keys_),
            RUNTIME_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(runtime_info_set_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED, nullptr, nullptr),
            RUNTIME_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(runtime_info_unset_changed_cb(other), RUNTIME_INFO_ERROR_INVALID_PARAMETER);
  leave_device();
  EXPECT_EQ(runtime_info_get_value_bool(RUNTIME_INFO_KEY_CHARGER_CONNECTED, &connected),
            RUNTIME_INFO_ERROR_IO_ERROR);
  EXPECT_EQ(runtime_info_set_changed_cb(RUNTIME_INFO_KEY_CHARGER_CONNECTED, on_change, &keys_),
            RUNTIME_INFO_ERROR_IO_ERROR);
}

class Display : public DeviceTest {
 protected:
  static void on_change(device_callback_e type, void *value, void *values) {
    EXPECT_EQ(type, DEVICE_CALLBACK_DISPLAY_STATE);
    static_cast<std::vector<intptr_t> *>(values)->push_back(reinterpret_cast<intptr_t>(value));
  }
  std::vector<intptr_t> values_;
};

TEST_F(Display, HasTheStateThatWasSet) {
  const std::pair<const char *, display_state_e> states[] = {{"on", DISPLAY_STATE_NORMAL},
                                                             {"dim", DISPLAY_STATE_SCREEN_DIM},
                                                             {"off", DISPLAY_STATE_SCREEN_OFF}};
  for (const auto &[display, expected] : states) {
    set_fact(embedded::kDisplay, display);
    display_state_e state{};
    EXPECT_EQ(device_display_get_state(&state), DEVICE_ERROR_NONE);
    EXPECT_EQ(state, expected) << display;
  }
}

TEST_F(Display, TellsOfAChangeUntilRemoved) {
  ASSERT_EQ(device_add_callback(DEVICE_CALLBACK_DISPLAY_STATE, on_change, &values_),
            DEVICE_ERROR_NONE);
  set_fact(embedded::kDisplay, "off");
  EXPECT_TRUE(run_until([this] { return !values_.empty(); }));
  EXPECT_EQ(values_, std::vector<intptr_t>{DISPLAY_STATE_SCREEN_OFF});
  EXPECT_EQ(device_remove_callback(DEVICE_CALLBACK_DISPLAY_STATE, on_change), DEVICE_ERROR_NONE);
  EXPECT_EQ(device_remove_callback(DEVICE_CALLBACK_DISPLAY_STATE, on_change),
            DEVICE_ERROR_INVALID_PARAMETER);
  set_fact(embedded::kDisplay, "on");
  drain();
  EXPECT_EQ(values_.size(), 1U);
}

TEST_F(Display, RefusesOtherTypesNullsAndAMissingDevice) {
  display_state_e state{};
  EXPECT_EQ(device_display_get_state(nullptr), DEVICE_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(device_add_callback(DEVICE_CALLBACK_BATTERY_LEVEL, on_change, &values_),
            DEVICE_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(device_add_callback(DEVICE_CALLBACK_DISPLAY_STATE, nullptr, nullptr),
            DEVICE_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(device_remove_callback(DEVICE_CALLBACK_BATTERY_LEVEL, on_change),
            DEVICE_ERROR_INVALID_PARAMETER);
  leave_device();
  EXPECT_EQ(device_display_get_state(&state), DEVICE_ERROR_OPERATION_FAILED);
  EXPECT_EQ(device_add_callback(DEVICE_CALLBACK_DISPLAY_STATE, on_change, &values_),
            DEVICE_ERROR_OPERATION_FAILED);
}

using PowerLock = DeviceTest;

TEST_F(PowerLock, IsHeldFromRequestToRelease) {
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kCpuLock), 0);
  EXPECT_EQ(device_power_request_lock(POWER_LOCK_CPU, 0), DEVICE_ERROR_NONE);
  EXPECT_EQ(device_power_request_lock(POWER_LOCK_CPU, 0), DEVICE_ERROR_NONE);
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kCpuLock), getpid());
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kDisplayLock), 0);
  // Locks do not count.
  EXPECT_EQ(device_power_release_lock(POWER_LOCK_CPU), DEVICE_ERROR_NONE);
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kCpuLock), 0);
}

TEST_F(PowerLock, EndsWithItsTime) {
  constexpr int kHour = 3600000;
  EXPECT_EQ(device_power_request_lock(POWER_LOCK_DISPLAY, kHour), DEVICE_ERROR_NONE);
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kDisplayLock), getpid());
  ASSERT_TRUE(embedded::edit_state(device(), embedded::kPowerFile, [](GKeyFile *file) {
    g_key_file_set_int64(file, embedded::kDisplayLock, "until_ms", embedded::now_ms() - 1);
    return true;
  }));
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kDisplayLock), 0);
}

TEST_F(PowerLock, IsDroppedWithTheProcessThatHeldIt) {
  EXPECT_EQ(device_power_request_lock(POWER_LOCK_CPU, 0), DEVICE_ERROR_NONE);
  embedded::drop_power_locks(device(), getpid() + 1);
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kCpuLock), getpid());
  embedded::drop_power_locks(device(), getpid());
  EXPECT_EQ(embedded::power_lock_holder(device(), embedded::kCpuLock), 0);
}

TEST_F(PowerLock, RefusesUnknownLocksAndAMissingDevice) {
  const auto unknown = static_cast<power_lock_e>(9);
  EXPECT_EQ(device_power_request_lock(unknown, 0), DEVICE_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(device_power_request_lock(POWER_LOCK_CPU, -1), DEVICE_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(device_power_release_lock(unknown), DEVICE_ERROR_INVALID_PARAMETER);
  leave_device();
  EXPECT_EQ(device_power_request_lock(POWER_LOCK_CPU, 0), DEVICE_ERROR_OPERATION_FAILED);
  EXPECT_EQ(device_power_release_lock(POWER_LOCK_CPU), DEVICE_ERROR_OPERATION_FAILED);
}

}  // namespace
