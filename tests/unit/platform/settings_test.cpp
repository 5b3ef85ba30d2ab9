#include "platform_settings.h"

#include <cmath>
#include <limits>

#include "device_fixture.h"
#include "state/values.h"

namespace {

constexpr char kKey[] = "db/private/quarn/some_key";

class Settings : public DeviceTest {
 protected:
  static void count(keynode_t *node, void *counter) {
    EXPECT_NE(node, nullptr);
    ++*static_cast<int *>(counter);
  }
  void set_text(const std::string &value) const {
    ASSERT_TRUE(embedded::set_value(device(), kKey, value));
  }
};

TEST_F(Settings, KeepAnInteger) {
  for (const int number :
       {0, 1, -1, std::numeric_limits<int>::max(), std::numeric_limits<int>::min()}) {
    int value = 5;
    EXPECT_EQ(vconf_set_int(kKey, number), VCONF_OK);
    EXPECT_EQ(vconf_get_int(kKey, &value), VCONF_OK);
    EXPECT_EQ(value, number);
  }
}

TEST_F(Settings, KeepADoubleToItsLastBit) {
  for (const double number : {0.0, 1763695200123.0, -0.1, 1e300}) {
    double value = 5;
    EXPECT_EQ(vconf_set_dbl(kKey, number), VCONF_OK);
    EXPECT_EQ(vconf_get_dbl(kKey, &value), VCONF_OK);
    EXPECT_EQ(value, number);
  }
  std::string text;
  EXPECT_EQ(vconf_set_dbl(kKey, 1763695200123.0), VCONF_OK);
  EXPECT_TRUE(embedded::get_value(device(), kKey, &text));
  EXPECT_EQ(text, "1763695200123");
}

TEST_F(Settings, AreMissingUntilWritten) {
  int number = 5;
  double real = 5;
  EXPECT_EQ(vconf_get_int(kKey, &number), VCONF_ERROR);
  EXPECT_EQ(vconf_get_dbl(kKey, &real), VCONF_ERROR);
  EXPECT_EQ(number, 5);
  EXPECT_EQ(real, 5);
}

TEST_F(Settings, OfAnotherTypeAreAnErrorAndLeaveTheValue) {
  for (const char *text : {"", "x", "1.5", "1 ", "99999999999"}) {
    int value = 5;
    set_text(text);
    EXPECT_EQ(vconf_get_int(kKey, &value), VCONF_ERROR) << text;
    EXPECT_EQ(value, 5);
  }
  for (const char *text : {"", "x", "1.5x", "inf", "nan"}) {
    double value = 5;
    set_text(text);
    EXPECT_EQ(vconf_get_dbl(kKey, &value), VCONF_ERROR) << text;
    EXPECT_EQ(value, 5);
  }
}

TEST_F(Settings, RefuseNullsBadKeysAndWhatIsNoNumber) {
  int number = 0;
  double real = 0;
  EXPECT_EQ(vconf_get_int(nullptr, &number), VCONF_ERROR);
  EXPECT_EQ(vconf_get_int(kKey, nullptr), VCONF_ERROR);
  EXPECT_EQ(vconf_get_dbl(nullptr, &real), VCONF_ERROR);
  EXPECT_EQ(vconf_get_dbl(kKey, nullptr), VCONF_ERROR);
  EXPECT_EQ(vconf_set_int(nullptr, 1), VCONF_ERROR);
  EXPECT_EQ(vconf_set_int("a=b", 1), VCONF_ERROR);
  EXPECT_EQ(vconf_set_dbl(nullptr, 1), VCONF_ERROR);
  EXPECT_EQ(vconf_set_dbl(kKey, std::nan("")), VCONF_ERROR);
  EXPECT_EQ(vconf_notify_key_changed(nullptr, count, nullptr), VCONF_ERROR);
  EXPECT_EQ(vconf_notify_key_changed(kKey, nullptr, nullptr), VCONF_ERROR);
  EXPECT_EQ(vconf_notify_key_changed("a=b", count, nullptr), VCONF_ERROR);
}

TEST_F(Settings, FailWithoutADevice) {
  leave_device();
  int value = 0;
  EXPECT_EQ(vconf_set_int(kKey, 1), VCONF_ERROR);
  EXPECT_EQ(vconf_get_int(kKey, &value), VCONF_ERROR);
  EXPECT_EQ(vconf_notify_key_changed(kKey, count, nullptr), VCONF_ERROR);
}

TEST_F(Settings, TellOfEveryWriteOfTheKeyTheOwnOnesToo) {
  // A watch has no end, so its counter outlives the test.
  static int changes;
  changes = 0;
  EXPECT_EQ(vconf_set_int(kKey, 1), VCONF_OK);
  ASSERT_EQ(vconf_notify_key_changed(kKey, count, &changes), VCONF_OK);
  EXPECT_EQ(vconf_set_int(kKey, 0), VCONF_OK);
  EXPECT_TRUE(run_until([] { return changes == 1; }));
  // The same value again is a write as well.
  EXPECT_EQ(vconf_set_int(kKey, 0), VCONF_OK);
  EXPECT_TRUE(run_until([] { return changes == 2; }));
  EXPECT_EQ(vconf_set_int("db/private/quarn/other", 1), VCONF_OK);
  drain();
  EXPECT_EQ(changes, 2);
}

}  // namespace
