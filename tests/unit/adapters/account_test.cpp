#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>

#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_d_utils/cloud_session.h"

namespace {

using ::testing::_;
using ::testing::InSequence;
using ::testing::NiceMock;
using ::testing::Return;
using ::testing::StrEq;

char account_record[1];
const auto account = reinterpret_cast<account_h>(account_record);

class AccountTest : public ::testing::Test {
 protected:
  AccountTest() {
    clear_captured_log();
    ON_CALL(platform, account_get_user_name).WillByDefault([](account_h, char **name) {
      *name = strdup("somebody");
      return ACCOUNT_ERROR_NONE;
    });
  }

  /** The query finds @p found; the callback's answer is kept. */
  void query_finds(account_h found) {
    EXPECT_CALL(platform,
                account_query_account_by_package_name(_, StrEq("com.velmor.velmoraccount"), _))
        .WillOnce([this, found](account_cb callback, const char *, void *user_data) {
          callback_result = callback(found, user_data);
          return ACCOUNT_ERROR_NONE;
        });
  }

  NiceMock<MockPlatform> platform;
  bool callback_result = false;
};

TEST_F(AccountTest, ASignedInUserIsFound) {
  const InSequence order;
  EXPECT_CALL(platform, account_connect).WillOnce(Return(ACCOUNT_ERROR_NONE));
  query_finds(account);
  EXPECT_CALL(platform, account_disconnect).WillOnce(Return(ACCOUNT_ERROR_NONE));
  EXPECT_TRUE(server_util_is_account_exist());
  EXPECT_TRUE(callback_result);
  EXPECT_EQ(count_logged(DLOG_INFO, "account exist!"), 1);
}

TEST_F(AccountTest, ADeviceWithoutAnAccountIsNotSignedIn) {
  EXPECT_CALL(platform, account_query_account_by_package_name)
      .WillOnce(Return(ACCOUNT_ERROR_RECORD_NOT_FOUND));
  EXPECT_CALL(platform, account_disconnect).Times(1);
  EXPECT_FALSE(server_util_is_account_exist());
  EXPECT_EQ(count_logged(DLOG_ERROR, "account_query_account_by_package_name fail -3"), 1);
}

TEST_F(AccountTest, WithoutTheServiceNobodyIsSignedIn) {
  EXPECT_CALL(platform, account_connect).WillOnce(Return(ACCOUNT_ERROR_DB_FAILED));
  EXPECT_CALL(platform, account_query_account_by_package_name).Times(0);
  EXPECT_CALL(platform, account_disconnect).Times(0);
  EXPECT_FALSE(server_util_is_account_exist());
  EXPECT_EQ(count_logged(DLOG_ERROR, "account_connect fail"), 1);
}

TEST_F(AccountTest, ANullAccountIsNone) {
  query_finds(nullptr);
  EXPECT_FALSE(server_util_is_account_exist());
  EXPECT_FALSE(callback_result);
  EXPECT_EQ(count_logged(DLOG_ERROR, "account is NULL"), 1);
}

TEST_F(AccountTest, AnAccountWithoutAReadableNameIsNone) {
  EXPECT_CALL(platform, account_get_user_name).WillOnce(Return(ACCOUNT_ERROR_DB_FAILED));
  query_finds(account);
  EXPECT_FALSE(server_util_is_account_exist());
  EXPECT_FALSE(callback_result);
  EXPECT_EQ(count_logged(DLOG_ERROR, "account_get_user_name failed"), 1);
}

TEST_F(AccountTest, AFailedDisconnectIsLoggedOnly) {
  query_finds(account);
  EXPECT_CALL(platform, account_disconnect).WillOnce(Return(ACCOUNT_ERROR_DB_FAILED));
  EXPECT_TRUE(server_util_is_account_exist());
  EXPECT_EQ(count_logged(DLOG_ERROR, "account_disconnect fail"), 1);
}

}  // namespace
