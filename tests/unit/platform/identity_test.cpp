#include <cstdlib>
#include <memory>

#include "device_fixture.h"
#include "platform_account.h"
#include "platform_system_info.h"
#include "platform_telephony.h"

namespace {

constexpr char kPackage[] = "com.velmor.velmoraccount";

struct Free {
  void operator()(char *text) const { std::free(text); }
};
using Text = std::unique_ptr<char, Free>;

using Model = DeviceTest;

TEST_F(Model, IsTheOneThatWasSet) {
  set_fact(embedded::kModel, "Orvane One");
  char *model = nullptr;
  ASSERT_EQ(system_info_get_platform_string(SYSTEM_INFO_KEY_MODEL_NAME, &model),
            SYSTEM_INFO_ERROR_NONE);
  EXPECT_STREQ(Text(model).get(), "Orvane One");
}

TEST_F(Model, IsAnErrorWithoutOneAndUnderAnotherKey) {
  char *model = nullptr;
  EXPECT_EQ(system_info_get_platform_string(SYSTEM_INFO_KEY_MODEL_NAME, &model),
            SYSTEM_INFO_ERROR_IO_ERROR);
  EXPECT_EQ(system_info_get_platform_string("http://orvane.org/other", &model),
            SYSTEM_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(system_info_get_platform_string(nullptr, &model), SYSTEM_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(system_info_get_platform_string(SYSTEM_INFO_KEY_MODEL_NAME, nullptr),
            SYSTEM_INFO_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(model, nullptr);
}

using Modem = DeviceTest;

TEST_F(Modem, HasTheSerialNumberOfTheDevice) {
  set_fact(embedded::kModem, "on");
  set_fact(embedded::kSerial, "356938035643809");
  TapiHandle *handle = tel_init(nullptr);
  ASSERT_NE(handle, nullptr);
  EXPECT_STREQ(Text(tel_get_misc_me_imei_sync(handle)).get(), "356938035643809");
  EXPECT_EQ(tel_deinit(handle), TAPI_API_SUCCESS);
}

TEST_F(Modem, IsNotThereWhenItIsOff) {
  set_fact(embedded::kModem, "off");
  EXPECT_EQ(tel_init(nullptr), nullptr);
  leave_device();
  EXPECT_EQ(tel_init(nullptr), nullptr);
}

TEST_F(Modem, HasNoSerialNumberWhenTheDeviceHasNone) {
  set_fact(embedded::kModem, "on");
  TapiHandle *handle = tel_init(nullptr);
  ASSERT_NE(handle, nullptr);
  EXPECT_EQ(tel_get_misc_me_imei_sync(handle), nullptr);
  EXPECT_EQ(tel_get_misc_me_imei_sync(nullptr), nullptr);
  EXPECT_EQ(tel_deinit(handle), TAPI_API_SUCCESS);
}

class Account : public DeviceTest {
 protected:
  static bool collect(account_h account, void *names) {
    char *name = nullptr;
    EXPECT_EQ(account_get_user_name(account, nullptr), ACCOUNT_ERROR_INVALID_PARAMETER);
    EXPECT_EQ(account_get_user_name(account, &name), ACCOUNT_ERROR_NONE);
    static_cast<std::vector<std::string> *>(names)->emplace_back(Text(name).get());
    return true;
  }
  std::vector<std::string> names_;
};

TEST_F(Account, HasTheNameOfWhoSignedIn) {
  set_fact(embedded::kAccount, "ada");
  EXPECT_EQ(account_connect(), ACCOUNT_ERROR_NONE);
  EXPECT_EQ(account_query_account_by_package_name(collect, kPackage, &names_), ACCOUNT_ERROR_NONE);
  EXPECT_EQ(account_disconnect(), ACCOUNT_ERROR_NONE);
  EXPECT_EQ(names_, std::vector<std::string>{"ada"});
}

TEST_F(Account, IsNotFoundWhenNobodySignedInOrForAnotherPackage) {
  EXPECT_EQ(account_query_account_by_package_name(collect, kPackage, &names_),
            ACCOUNT_ERROR_RECORD_NOT_FOUND);
  set_fact(embedded::kAccount, "ada");
  EXPECT_EQ(account_query_account_by_package_name(collect, "org.example.other", &names_),
            ACCOUNT_ERROR_RECORD_NOT_FOUND);
  EXPECT_TRUE(names_.empty());
}

TEST_F(Account, RefusesNullsAndAMissingDevice) {
  char *name = nullptr;
  EXPECT_EQ(account_query_account_by_package_name(nullptr, kPackage, nullptr),
            ACCOUNT_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(account_query_account_by_package_name(collect, nullptr, nullptr),
            ACCOUNT_ERROR_INVALID_PARAMETER);
  EXPECT_EQ(account_get_user_name(nullptr, &name), ACCOUNT_ERROR_INVALID_PARAMETER);
  leave_device();
  EXPECT_EQ(account_connect(), ACCOUNT_ERROR_DB_FAILED);
}

}  // namespace
