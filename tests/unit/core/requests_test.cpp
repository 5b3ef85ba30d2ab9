#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_client.h"

using ::testing::NiceMock;
using ::testing::Return;
using ::testing::StrEq;

namespace {

using Texts = std::vector<std::string>;

/** What the handlers did, in order. */
Texts steps;
bool cloud_ready = true;
int list_result = 0;
int callback_result = 0;
std::int64_t present_time = 0;
client_cb_data marker{7, ":1.1"};
void *const record = &marker;

std::string number(long long value) { return std::to_string(value); }

/** Every step is on behalf of the one record. */
void note(const std::string &step, const void *of) {
  EXPECT_EQ(of, record);
  steps.push_back(step);
}

}  // namespace

std::atomic<bool> manual_backup_canceled{false};

void request_backup(void *client) {
  note(std::string("request_backup cancelled=") + (manual_backup_canceled ? "1" : "0"), client);
}
void cancel_backup(void *client) {
  note(std::string("cancel_backup cancelled=") + (manual_backup_canceled ? "1" : "0"), client);
}
int get_app_list(quarn_client_kind client, std::unique_ptr<client_cb_data> data) {
  note("get_app_list " + number(client), data.release());
  return list_result;
}
void request_power_lock(bool lock) { steps.emplace_back(lock ? "lock" : "unlock"); }
bool cloud_initialized() {
  steps.emplace_back("cloud");
  return cloud_ready;
}
std::int64_t _get_current_timestamp() { return present_time; }
int quarn_dbus_get_app_list_cb(int err, const char *msg, void *data) {
  note("get_app_list_cb " + number(err) + " " + msg, data);
  return callback_result;
}
/** Done while the client is told that its backup is taken: others are served meanwhile. */
std::function<void()> while_told;
int quarn_dbus_manual_backup_status(int err, int status, void *data) {
  if (status == QUARN_BACKUP_RUNNING && while_told) std::exchange(while_told, nullptr)();
  note("status " + number(err) + " " + number(status) +
           " cancelled=" + (manual_backup_canceled ? "1" : "0"),
       data);
  return callback_result;
}
int quarn_dbus_manual_backup_cancel_result(int err, void *data) {
  note("cancel_result " + number(err), data);
  return callback_result;
}

namespace {

class Requests : public ::testing::Test {
 protected:
  void SetUp() override {
    steps.clear();
    clear_captured_log();
    cloud_ready = true;
    list_result = 0;
    callback_result = 0;
    manual_backup_canceled = false;
  }
  NiceMock<MockPlatform> platform_;
};

TEST_F(Requests, BackupEnableWritesOneForAnythingButZero) {
  EXPECT_CALL(platform_, vconf_set_int(StrEq("db/private/quarn/backup_status"), 1)).Times(3);
  for (const int on : {1, 7, -1}) EXPECT_EQ(quarnd_backup_enable(on), 0);
}

TEST_F(Requests, BackupEnableWritesZeroForZero) {
  EXPECT_CALL(platform_, vconf_set_int(StrEq("db/private/quarn/backup_status"), 0));
  EXPECT_EQ(quarnd_backup_enable(0), 0);
}

TEST_F(Requests, BackupEnableAnswersZeroWhenTheWriteFails) {
  EXPECT_CALL(platform_, vconf_set_int).WillOnce(Return(-1));
  EXPECT_EQ(quarnd_backup_enable(1), 0);
}

TEST_F(Requests, LastBackedUpTimeIsThePresentTimeEveryTime) {
  unsigned long long time = 0;
  for (const std::int64_t now : {1500000000123, 1500000000456}) {
    present_time = now;
    EXPECT_EQ(quarnd_get_last_backed_up_time(&time), 0);
    EXPECT_EQ(time, static_cast<unsigned long long>(now));
  }
  EXPECT_EQ(count_logged(DLOG_INFO, "quarnd_get_last_backed_up_time"), 2);
}

TEST_F(Requests, GetAppListOfAnUnknownClientFailsAndNeverTakesTheLock) {
  for (const int client : {-1, 2, 100}) {
    steps.clear();
    EXPECT_EQ(quarnd_get_app_list(client, record), 1);
    EXPECT_EQ(steps, Texts{"get_app_list_cb 1 failed"}) << client;
  }
}

TEST_F(Requests, GetAppListFromTheCloudNeedsASession) {
  cloud_ready = false;
  EXPECT_EQ(quarnd_get_app_list(0, record), 33);
  EXPECT_EQ(steps, (Texts{"lock", "cloud", "get_app_list_cb 33 failed", "unlock"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "quarnd_get_app_list"), 0);
}

TEST_F(Requests, GetAppListFromTheCloudHoldsTheLockMeanwhile) {
  list_result = 42;
  EXPECT_EQ(quarnd_get_app_list(0, record), 42);
  EXPECT_EQ(steps, (Texts{"lock", "cloud", "get_app_list 0", "unlock"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "quarnd_get_app_list"), 1);
}

TEST_F(Requests, GetAppListForTheCompanionAsksForNoSession) {
  cloud_ready = false;
  EXPECT_EQ(quarnd_get_app_list(1, record), 0);
  EXPECT_EQ(steps, (Texts{"lock", "get_app_list 1", "unlock"}));
}

TEST_F(Requests, ManualBackupTellsStatusTwoBeforeItIsQueued) {
  manual_backup_canceled = true;
  EXPECT_EQ(quarnd_manual_backup(record), 0);
  EXPECT_EQ(steps, (Texts{"status 0 2 cancelled=0", "request_backup cancelled=0"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "request for manual backup"), 1);
}

TEST_F(Requests, ManualBackupIsQueuedForAClientThatCannotBeReached) {
  callback_result = 42;
  EXPECT_EQ(quarnd_manual_backup(record), 0);
  EXPECT_EQ(steps.back(), "request_backup cancelled=0");
}

TEST_F(Requests, ManualBackupThatIsCancelledWhileItsClientIsToldIsNeverQueued) {
  while_told = [] { EXPECT_EQ(quarnd_manual_backup_cancel(record), 0); };
  EXPECT_EQ(quarnd_manual_backup(record), 0);
  EXPECT_EQ(steps, (Texts{"cancel_backup cancelled=1", "cancel_result 0", "status 0 2 cancelled=1",
                          "status 17 6 cancelled=1"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "reservation for manual backup is canceled"), 1);
}

TEST_F(Requests, ManualBackupIsWithdrawnWhileItsClientIsToldByThatClientAlone) {
  const std::string own = ":1.1";
  const std::string other = ":1.2";
  while_told = [&] {
    EXPECT_EQ(quarnd_cancel_starting_backups(&other), 0U);
    EXPECT_EQ(quarnd_cancel_starting_backups(&own), 1U);
    EXPECT_EQ(quarnd_cancel_starting_backups(&own), 0U) << "once";
  };
  EXPECT_EQ(quarnd_manual_backup(record), 0);
  EXPECT_EQ(steps.back(), "status 17 6 cancelled=0");
  EXPECT_EQ(quarnd_cancel_starting_backups(nullptr), 0U);
}

TEST_F(Requests, ManualBackupCancelIsAcknowledgedAtOnceEvenWhenNothingRuns) {
  EXPECT_EQ(quarnd_manual_backup_cancel(record), 0);
  EXPECT_EQ(steps, (Texts{"cancel_backup cancelled=1", "cancel_result 0"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "quarnd_manual_backup_cancel"), 1);
}

}  // namespace
