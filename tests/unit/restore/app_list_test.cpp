#include <linux/capability.h>
#include <sys/stat.h>
#include <unistd.h>

#include <csignal>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "backup_transport.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_backup/list_bound.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/power.h"
#include "quarn_d_utils/request_cause.h"
#include "restore_fixture.h"

using ::testing::Return;

namespace {

class AppListTest : public RestoreTest {
 protected:
  using Answers = std::vector<Outside::Answer>;
  int ask(int client) {
    return get_app_list(static_cast<quarn_client_kind>(client), owned_record(9));
  }
  ~AppListTest() override { stop_wifi_monitor(); }
  void connect_to_wifi() {
    ON_CALL(platform, connection_get_type).WillByDefault([](auto, auto *type) {
      *type = CONNECTION_TYPE_WIFI;
      return 0;
    });
    EXPECT_EQ(start_wifi_monitor(), 1);
  }
  static Answers answered(int err, const std::string &text) {
    return {{"get_app_list_cb", err, text, 9}};
  }
};

TEST_F(AppListTest, PassesTheCloudsListAsItIs) {
  ASSERT_EQ(ask(0), 0);
  ASSERT_EQ(downloads.size(), 1U);
  EXPECT_EQ(downloads[0].remote, "/app_list/app_list.txt");
  EXPECT_TRUE(outside.answers.empty());
  EXPECT_FALSE(is_idle_status());
  const std::string local = downloads[0].local;
  write_text(local, "{\"any\": \"text\"}");
  answer();
  EXPECT_EQ(outside.answers, answered(0, "{\"any\": \"text\"}"));
  expect_info("backup trans success : app list download");
  expect_info("app list : {\"any\": \"text\"}");
  EXPECT_FALSE(exists(local));
  EXPECT_TRUE(is_idle_status());
}

TEST_F(AppListTest, StagesBesideTheListOfABackupRun) {
  ASSERT_EQ(ask(0), 0);
  ASSERT_EQ(ask(0), 0);
  EXPECT_NE(downloads[0].local, kLocalAppListPath);
  EXPECT_NE(downloads[0].local, downloads[1].local);
  EXPECT_EQ(downloads[0].local.rfind("/tmp/quarn/", 0), 0U);
}

TEST_F(AppListTest, ADownloadErrorIsAnsweredWithOneAndNone) {
  ASSERT_EQ(ask(0), 0);
  answer(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(outside.answers, answered(1, "none"));
  expect_error("__get_app_list_resp_cb failed...err_code[12]");
}

TEST_F(AppListTest, ADownloadThatWasAbortedWithOthersIsBegunAgain) {
  connect_to_wifi();
  ASSERT_EQ(ask(0), 0);
  answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_TRUE(outside.answers.empty());
  EXPECT_FALSE(is_idle_status());
  ASSERT_EQ(downloads.size(), 1U);
  write_text(downloads[0].local, "[]");
  answer();
  EXPECT_EQ(outside.answers, answered(0, "[]"));
  EXPECT_TRUE(is_idle_status());
}

TEST_F(AppListTest, ADownloadThatIsAbortedWithoutEndIsGivenUp) {
  connect_to_wifi();
  ASSERT_EQ(ask(0), 0);
  for (int times = 0; times < 9; ++times) {
    EXPECT_TRUE(outside.answers.empty());
    ASSERT_EQ(downloads.size(), 1U);
    answer(BACKUP_TRANS_ERROR_CANCELLED);
  }
  EXPECT_EQ(outside.answers, answered(1, "none"));
  EXPECT_TRUE(downloads.empty());
  EXPECT_TRUE(is_idle_status());
}

TEST_F(AppListTest, ADownloadThatWasAbortedForWantOfWifiIsNot) {
  ASSERT_EQ(ask(0), 0);
  answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(outside.answers, answered(1, "none"));
  EXPECT_TRUE(downloads.empty());
}

TEST_F(AppListTest, AListThatItsClientWithdrawsIsEndedAndNotBegunAgain) {
  connect_to_wifi();
  ASSERT_EQ(ask(0), 0);
  EXPECT_CALL(transport, backup_trans_abort_request).Times(1);
  EXPECT_EQ(withdraw_app_lists(":1.99"), 0U);
  EXPECT_EQ(withdraw_app_lists(":1.7"), 1U);
  EXPECT_EQ(withdraw_app_lists(":1.7"), 0U) << "it is on its way to its end";
  EXPECT_TRUE(outside.answers.empty());
  answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_TRUE(downloads.empty());
  EXPECT_EQ(outside.answers, answered(17, "failed"));
  EXPECT_TRUE(is_idle_status());
  EXPECT_EQ(withdraw_app_lists(":1.7"), 0U);
}

TEST_F(AppListTest, ADownloadIsLimitedToWhatCanBeRead) {
  ASSERT_EQ(ask(0), 0);
  EXPECT_EQ(transport.last_max_size, kMaxAppListSize);
}

TEST_F(AppListTest, WhatIsNoTextIsNoList) {
  ASSERT_EQ(ask(0), 0);
  write_text(downloads[0].local, "{\"a\": \"\xff\"}");
  answer();
  EXPECT_EQ(outside.answers, answered(1, "none"));
  expect_error("couldn't read app list...");
}

TEST_F(AppListTest, TheLogHasTheBeginningOfAList) {
  ASSERT_EQ(ask(0), 0);
  const std::string list = "{\n" + std::string(1U << 20, 'x');
  write_text(downloads[0].local, list);
  answer();
  EXPECT_EQ(outside.answers, answered(0, list));
  expect_info("app list : {\\n" + std::string(254, 'x') + "...");
}

TEST_F(AppListTest, AMissingFileIsAnsweredWithOneAndNone) {
  ASSERT_EQ(ask(0), 0);
  answer();
  EXPECT_EQ(outside.answers, answered(1, "none"));
  expect_error("there isn't app list file...");
}

TEST_F(AppListTest, AnUnreadableFileIsAnsweredWithOneAndNone) {
  ASSERT_EQ(ask(0), 0);
  write_text(downloads[0].local, "text");
  ASSERT_EQ(chmod(downloads[0].local.c_str(), 0), 0);
  ASSERT_EQ(chown(downloads[0].local.c_str(), 5000, 5000), 0);
  {
    const WithoutCapabilities none({CAP_DAC_OVERRIDE, CAP_DAC_READ_SEARCH});
    answer();
  }
  EXPECT_EQ(outside.answers, answered(1, "none"));
  expect_error("couldn't read app list...");
}

TEST_F(AppListTest, TakesWhatARunWritesAndNothingLarger) {
  for (const std::uint64_t more : {0, 1}) {
    outside.answers.clear();
    ASSERT_EQ(ask(0), 0);
    const std::string text(kMaxAppListSize + more, 'x');
    write_text(downloads[0].local, text);
    answer();
    EXPECT_EQ(outside.answers, more == 0 ? answered(0, text) : answered(1, "none"));
    EXPECT_EQ(last_request_cause(),
              more == 0 ? request_cause::none : request_cause::list_too_large);
  }
}

TEST_F(AppListTest, ACauseIsToldUntilTheNextRequestIsServed) {
  ASSERT_EQ(ask(0), 0);
  answer(BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_EQ(last_request_cause(), request_cause::device_file);
  ASSERT_EQ(ask(0), 0);
  answer(BACKUP_TRANS_ERROR_QUOTA);
  EXPECT_EQ(last_request_cause(), request_cause::space);
  ASSERT_EQ(ask(0), 0);
  answer(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(last_request_cause(), request_cause::none) << "an empty cloud is none";
  transport_result = BACKUP_TRANS_ERROR_LOCAL_FILE;
  EXPECT_EQ(ask(0), 42);
  EXPECT_EQ(last_request_cause(), request_cause::device_file);
}

TEST_F(AppListTest, ARefusedRequestIsAnsweredWithTwelveAndNone) {
  transport_result = 2;
  EXPECT_EQ(ask(0), 42);
  EXPECT_EQ(outside.answers, answered(12, "none"));
  expect_error("backup_trans_download_file_ors_async failed... 2");
  EXPECT_TRUE(is_idle_status());
}

TEST_F(AppListTest, TheCompanionGetsThisDevicesList) {
  std::filesystem::create_directories(kCompanionDir);
  EXPECT_EQ(ask(1), 0);
  ASSERT_EQ(outside.answers.size(), 1U);
  EXPECT_EQ(outside.answers[0].err, 0);
  EXPECT_NE(outside.answers[0].msg.find("app_data_path"), std::string::npos);
  EXPECT_TRUE(downloads.empty());
}

TEST_F(AppListTest, ACompanionsListThatCannotBeMadeIsAnsweredWithFortyTwo) {
  ON_CALL(platform, package_manager_foreach_package_info).WillByDefault(Return(-5));
  EXPECT_EQ(ask(1), 42);
  EXPECT_EQ(outside.answers, answered(42, "failed"));
}

TEST_F(AppListTest, ACallbackWithoutItsRequestEndsTheProcess) {
  ASSERT_EQ(ask(0), 0);
  const auto callback = downloads[0].callback;
  EXPECT_EXIT(callback(BACKUP_TRANS_ERROR_NONE, nullptr, nullptr),
              ::testing::KilledBySignal(SIGABRT), "user_data != ");
}

}  // namespace
