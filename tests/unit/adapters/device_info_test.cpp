#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <cstring>

#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"

namespace {

using ::testing::_;
using ::testing::IsNull;
using ::testing::NiceMock;
using ::testing::Return;
using ::testing::StrEq;

class DeviceInfoTest : public ::testing::Test {
 protected:
  DeviceInfoTest() { clear_captured_log(); }

  void query() {
    char *model_text = nullptr;
    char *serial_text = nullptr;
    get_device_info(&model_text, &serial_text);
    model.reset(model_text);
    serial.reset(serial_text);
  }

  NiceMock<MockPlatform> platform;
  CString model;
  CString serial;
};

TEST_F(DeviceInfoTest, GivesModelNameAndImei) {
  EXPECT_CALL(platform, system_info_get_platform_string(StrEq(SYSTEM_INFO_KEY_MODEL_NAME), _))
      .Times(1);
  EXPECT_CALL(platform, tel_init(IsNull())).Times(1);
  EXPECT_CALL(platform, tel_deinit).Times(1);
  query();
  EXPECT_STREQ(model.get(), "Model One");
  EXPECT_STREQ(serial.get(), "350000000000001");
}

TEST_F(DeviceInfoTest, ADeviceWithoutAModemHasAModelNameAndNoSerial) {
  EXPECT_CALL(platform, tel_init).WillOnce(Return(nullptr));
  EXPECT_CALL(platform, tel_get_misc_me_imei_sync).Times(0);
  EXPECT_CALL(platform, tel_deinit).Times(0);
  query();
  EXPECT_STREQ(model.get(), "Model One");
  EXPECT_EQ(serial, nullptr);
  EXPECT_EQ(count_logged(DLOG_ERROR, "Fail: to get device serial number"), 1);
}

TEST_F(DeviceInfoTest, AnUnreadableImeiIsNoSerialAndTheModemIsClosed) {
  EXPECT_CALL(platform, tel_get_misc_me_imei_sync).WillOnce(Return(nullptr));
  EXPECT_CALL(platform, tel_deinit).Times(1);
  query();
  EXPECT_EQ(serial, nullptr);
}

TEST_F(DeviceInfoTest, AnUnreadableModelNameDoesNotStopTheSerial) {
  EXPECT_CALL(platform, system_info_get_platform_string)
      .WillOnce(Return(SYSTEM_INFO_ERROR_IO_ERROR));
  query();
  EXPECT_EQ(model, nullptr);
  EXPECT_STREQ(serial.get(), "350000000000001");
  EXPECT_EQ(count_logged(DLOG_ERROR, "Failed to get system information(-5)"), 1);
}

TEST(Timestamp, IsTheWallClockInMilliseconds) {
  using std::chrono::duration_cast;
  using std::chrono::milliseconds;
  using std::chrono::system_clock;
  const auto before = duration_cast<milliseconds>(system_clock::now().time_since_epoch()).count();
  const std::int64_t now = _get_current_timestamp();
  const auto after = duration_cast<milliseconds>(system_clock::now().time_since_epoch()).count();
  EXPECT_GE(now, before);
  EXPECT_LE(now, after);
}

}  // namespace
