#include <Ecore.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <vector>

#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/package.h"

namespace {

struct FakeTimer {
  double delay;
  Ecore_Task_Cb callback;
  const void *data;
};

/** Ecore's timers, run by hand: the first key is the timer made first. */
std::map<int, FakeTimer> timers;
int last_timer = 0;
bool timers_fail = false;

}  // namespace

extern "C" Ecore_Timer *ecore_timer_add(double delay, Ecore_Task_Cb callback, const void *data) {
  if (timers_fail) return nullptr;
  const auto made = timers.emplace(++last_timer, FakeTimer{delay, callback, data});
  return reinterpret_cast<Ecore_Timer *>(&made.first->second);
}

extern "C" void *ecore_timer_del(Ecore_Timer *timer) {
  for (auto it = timers.begin(); it != timers.end(); ++it) {
    if (reinterpret_cast<Ecore_Timer *>(&it->second) == timer) {
      timers.erase(it);
      return nullptr;
    }
  }
  ADD_FAILURE() << "a timer that does not exist was deleted";
  return nullptr;
}

namespace {

using ::testing::_;
using ::testing::InSequence;
using ::testing::IsNull;
using ::testing::NiceMock;
using ::testing::Return;
using ::testing::StrEq;

int client_object = 0;
pkgmgr_client *const client = &client_object;
constexpr double kDelay = 0.5;
constexpr char kNotes[] = "org.example.notes";
constexpr char kChess[] = "org.example.chess";

class IconTest : public ::testing::Test {
 protected:
  IconTest() {
    init_install_complete_pkgs_list();
    clear_captured_log();
    timers_fail = false;
    ON_CALL(platform, pkgmgr_client_new).WillByDefault([this](pkgmgr_client_type) {
      ++clients;
      return client;
    });
    ON_CALL(platform, pkgmgr_client_free(client)).WillByDefault([this](pkgmgr_client *) {
      --clients;
      return PKGMGR_R_OK;
    });
  }
  ~IconTest() override {
    init_icon_hide_delay_timer_list();
    EXPECT_TRUE(timers.empty());
    EXPECT_EQ(clients, 0);
  }

  /** Let one timer run out, as Ecore does it. */
  static void run_out(int key) {
    const FakeTimer timer = timers.at(key);
    EXPECT_EQ(timer.callback(const_cast<void *>(timer.data)), ECORE_CALLBACK_CANCEL);
    timers.erase(key);
  }

  NiceMock<MockPlatform> platform;
  int clients = 0;
};

TEST_F(IconTest, ShowingActivatesAndRemembersThePackage) {
  EXPECT_CALL(platform, pkgmgr_client_new(PC_REQUEST)).Times(1);
  EXPECT_CALL(platform, pkgmgr_client_activate(client, IsNull(), StrEq(kNotes)))
      .WillOnce(Return(PKGMGR_R_OK));
  appear_app_icon(kNotes, true, 0.0);
  EXPECT_TRUE(already_installed_package(kNotes));
  EXPECT_EQ(count_logged(DLOG_INFO, "success to appear icon of (org.example.notes)!"), 1);
}

TEST_F(IconTest, AFailedShowIsLogged) {
  EXPECT_CALL(platform, pkgmgr_client_activate).WillOnce(Return(PKGMGR_R_EINVAL));
  appear_app_icon(kNotes, true, 0.0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to appear icon of (org.example.notes)... err:-2"), 1);
}

TEST_F(IconTest, HidingWithoutDelayDeactivatesAtOnce) {
  EXPECT_CALL(platform, pkgmgr_client_deactivate(client, IsNull(), StrEq(kNotes)))
      .WillOnce(Return(PKGMGR_R_OK));
  appear_app_icon(kNotes, false, 0.0);
  EXPECT_FALSE(already_installed_package(kNotes));
  EXPECT_EQ(count_logged(DLOG_INFO, "success to hide icon of (org.example.notes)!"), 1);
}

TEST_F(IconTest, AFailedHideIsLogged) {
  EXPECT_CALL(platform, pkgmgr_client_deactivate).WillOnce(Return(PKGMGR_R_ERROR));
  appear_app_icon(kNotes, false, 0.0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to hide icon of (org.example.notes)... err:-1"), 1);
}

TEST_F(IconTest, WithoutAClientNothingIsAskedOfThePlatform) {
  EXPECT_CALL(platform, pkgmgr_client_new).Times(2).WillRepeatedly(Return(nullptr));
  EXPECT_CALL(platform, pkgmgr_client_activate).Times(0);
  EXPECT_CALL(platform, pkgmgr_client_deactivate).Times(0);
  EXPECT_CALL(platform, pkgmgr_client_free).Times(0);
  appear_app_icon(kNotes, true, 0.0);
  appear_app_icon(kNotes, false, 0.0);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to appear icon of (org.example.notes)... err:-1"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to hide icon of (org.example.notes)... err:-1"), 1);
}

TEST_F(IconTest, ADelayedHideWaitsForItsTimerAndFiresOnce) {
  EXPECT_CALL(platform, pkgmgr_client_deactivate).Times(0);
  appear_app_icon(kNotes, false, kDelay);
  ASSERT_EQ(timers.size(), 1U);
  EXPECT_EQ(timers.begin()->second.delay, kDelay);
  EXPECT_TRUE(::testing::Mock::VerifyAndClearExpectations(&platform));

  EXPECT_CALL(platform, pkgmgr_client_new(PC_REQUEST)).WillOnce(Return(client));
  EXPECT_CALL(platform, pkgmgr_client_deactivate(client, IsNull(), StrEq(kNotes)))
      .WillOnce(Return(PKGMGR_R_OK));
  EXPECT_CALL(platform, pkgmgr_client_free(client)).WillOnce(Return(PKGMGR_R_OK));
  run_out(last_timer);
  EXPECT_EQ(count_logged(DLOG_INFO, "success to hide icon of (org.example.notes) by delay!"), 1);
}

TEST_F(IconTest, AFailedDelayedHideIsLogged) {
  appear_app_icon(kNotes, false, kDelay);
  EXPECT_CALL(platform, pkgmgr_client_deactivate).WillOnce(Return(PKGMGR_R_ERROR));
  run_out(last_timer);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to hide icon of (org.example.notes) by delay... err:-1"),
            1);
}

TEST_F(IconTest, ADelayedHideWithoutATimerIsLogged) {
  timers_fail = true;
  appear_app_icon(kNotes, false, kDelay);
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to hide icon of (org.example.notes) by delay... err:-1"),
            1);
}

TEST_F(IconTest, ShowingCancelsAPendingHideOfTheSamePackage) {
  appear_app_icon(kNotes, false, kDelay);
  appear_app_icon(kChess, false, kDelay);
  const int chess = last_timer;
  appear_app_icon(kNotes, true, 0.0);
  ASSERT_EQ(timers.size(), 1U);
  EXPECT_EQ(timers.begin()->first, chess);
}

TEST_F(IconTest, OneShowCancelsOnlyTheFirstOfTwoHidesOfAPackage) {
  appear_app_icon(kNotes, false, kDelay);
  appear_app_icon(kNotes, false, kDelay);
  const int second = last_timer;
  ASSERT_EQ(timers.size(), 2U);
  appear_app_icon(kNotes, true, 0.0);
  ASSERT_EQ(timers.size(), 1U);
  EXPECT_EQ(timers.begin()->first, second);
  EXPECT_CALL(platform, pkgmgr_client_deactivate(client, IsNull(), StrEq(kNotes))).Times(1);
  run_out(second);
}

TEST_F(IconTest, AShorterSecondHideLeavesTheFirstPending) {
  appear_app_icon(kNotes, false, 10 * kDelay);
  const int first = last_timer;
  appear_app_icon(kNotes, false, kDelay);
  run_out(last_timer);
  ASSERT_EQ(timers.size(), 1U);
  EXPECT_EQ(timers.begin()->first, first);
  run_out(first);
}

TEST_F(IconTest, EmptyingTheListEndsItsTimers) {
  appear_app_icon(kNotes, false, kDelay);
  appear_app_icon(kChess, false, kDelay);
  init_icon_hide_delay_timer_list();
  EXPECT_TRUE(timers.empty());
  EXPECT_EQ(count_logged(DLOG_INFO, "init_icon_hide_delay_timer_list"), 1);
  delete_icon_hide_delay_timer(kNotes);
}

TEST_F(IconTest, DeletingAHideThatIsNotPendingDoesNothing) {
  appear_app_icon(kChess, false, kDelay);
  delete_icon_hide_delay_timer(kNotes);
  EXPECT_EQ(timers.size(), 1U);
}

TEST_F(IconTest, TheListOfInstalledPackagesIsEmptied) {
  appear_app_icon(kNotes, true, 0.0);
  init_install_complete_pkgs_list();
  EXPECT_FALSE(already_installed_package(kNotes));
  EXPECT_EQ(count_logged(DLOG_INFO, "init_install_complete_pkgs_list"), 1);
}

}  // namespace
