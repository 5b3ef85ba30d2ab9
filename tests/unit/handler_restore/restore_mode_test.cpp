#include <cstring>

#include "glib_handles.h"
#include "handler_fixture.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/power.h"

using ::testing::_;
using ::testing::Return;

namespace {

class RestoreModeTest : public HandlerTest {
 protected:
  using List = std::vector<std::string>;
  static constexpr char kList[] = R"(["org.example.notes", "org.example.chat"])";

  int on(int client, const char *serial = kSerial, const char *list = kList,
         unsigned int req_id = 1) {
    return quarnd_restore_enable(1, client, serial, list, make_record(req_id));
  }
  int off(int client = 0) { return quarnd_restore_enable(0, client, "", "", make_record(99)); }
  static Outside::Answer stop(unsigned int req_id) {
    return {"restore_enable_cb", 0, "restore_stop", req_id};
  }
  /** The settings have the mark that tells whose the backup is, and nothing else. */
  void keep_mark() {
    ON_CALL(platform, vconf_get_dbl).WillByDefault(Return(VCONF_ERROR));
    ON_CALL(platform, vconf_set_int).WillByDefault([this](auto, int value) {
      mark = value;
      return VCONF_OK;
    });
    ON_CALL(platform, vconf_get_int).WillByDefault([this](auto, int *value) {
      *value = mark;
      return VCONF_OK;
    });
  }

  int mark = 0;
};

class RestoreModeTestWithMark : public RestoreModeTest {
 protected:
  static constexpr int kWaitedFor = -2;
  RestoreModeTestWithMark() {
    keep_mark();
    note_own_backup(kSerial);
  }
  /** Nobody waits any more, and what was waited for is not known to be superfluous. */
  void expect_unused() const {
    EXPECT_TRUE(claimed_packages(kSerial).empty());
    EXPECT_EQ(mark, kWaitedFor);
    EXPECT_FALSE(knows_own_backup(kSerial));
  }
};

/* ---- the list ---- */

TEST_F(RestoreModeTest, TheListKeepsItsOrderAndReplacesTheEarlierOne) {
  pkg_list_to_be_restored = {"old"};
  EXPECT_EQ(init_package_list_to_be_restored(R"(["b", "a", "c"])"), 3);
  EXPECT_EQ(pkg_list_to_be_restored, (List{"b", "a", "c"}));
  expect_info(R"(pkg_list_json : ["b", "a", "c"])");
}

TEST_F(RestoreModeTest, WhatIsNoArrayOfTextsIsAnEmptyList) {
  for (const char *text : {"", "not json", "{}", "7", "\"a\"", "null", "[1]", "[\"a\", null]",
                           "[\"a\", [\"b\"]]", "[]"}) {
    pkg_list_to_be_restored = {"old"};
    EXPECT_EQ(init_package_list_to_be_restored(text), 0) << text;
    EXPECT_TRUE(pkg_list_to_be_restored.empty()) << text;
  }
}

TEST_F(RestoreModeTest, ImpossiblePackageIdsAreLeftOut) {
  EXPECT_EQ(
      init_package_list_to_be_restored(R"(["../x", "a", "", ".", "..", "x/y", "n\u0000ul", "b"])"),
      2);
  EXPECT_EQ(pkg_list_to_be_restored, (List{"a", "b"}));
  expect_error("refused : not a package id (../x)");
  expect_error("refused : not a package id ()");
  expect_error("refused : not a package id (x/y)");
}

/* ---- on ---- */

TEST_F(RestoreModeTest, TheCloudClientSwitchesOn) {
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(pkg_list_to_be_restored, (List{"org.example.notes", "org.example.chat"}));
  EXPECT_EQ(current_restore_client, 0);
  EXPECT_EQ(serial_num_user_select, kSerial);
  EXPECT_EQ(subscriptions.size(), 1U);
  EXPECT_EQ(cloud_restore_running(), 1);
  EXPECT_EQ(pellix_restore_running(), 0);
  EXPECT_NE(g_restore_cb_data, nullptr);
  EXPECT_TRUE(is_idle_status());
  expect_info("start install event monitoring. client:0, serial_num:350000000000001");
}

TEST_F(RestoreModeTest, TheCloudsModeClaimsWhatItWaitsForUntilItEnds) {
  EXPECT_EQ(on(0), 0);
  const List both = {"org.example.chat", "org.example.notes"};
  EXPECT_EQ(claimed_packages(kSerial), both);
  EXPECT_EQ(on(0, kSerial, R"(["org.example.chat"])"), 0);
  EXPECT_EQ(claimed_packages(kSerial), List{"org.example.chat"});
  EXPECT_EQ(package_to_be_restored("org.example.chat"), 1);
  EXPECT_TRUE(claimed_packages(kSerial).empty());
  EXPECT_EQ(on(0), 0);
  off();
  EXPECT_TRUE(claimed_packages(kSerial).empty());
}

TEST_F(RestoreModeTest, ItClaimsBeforeTheSessionIsThere) {
  List claimed;
  session.meanwhile = [&] { claimed = claimed_packages(kSerial); };
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(claimed.size(), 2U);
  off();
}

TEST_F(RestoreModeTest, AnEmptyListAndTheCompanionsModeClaimNothing) {
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(on(0, kSerial, "[]"), 0);
  EXPECT_TRUE(claimed_packages(kSerial).empty());
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(on(1), 0);
  EXPECT_TRUE(claimed_packages(kSerial).empty());
}

TEST_F(RestoreModeTest, AModeThatWasUsedIsADecisionOnTheBackup) {
  keep_mark();
  off();
  EXPECT_EQ(mark, 0) << "there was none";
  EXPECT_EQ(on(1), 0);
  off();
  EXPECT_EQ(mark, 0) << "the companion's has nothing to do with the cloud";
  EXPECT_EQ(on(0), 0);
  EXPECT_FALSE(knows_own_backup(kSerial));
  off();
  EXPECT_TRUE(knows_own_backup(kSerial));
}

TEST_F(RestoreModeTest, TheCompanionSwitchesOnWithoutTheCloud) {
  session.ready = false;
  EXPECT_CALL(platform, device_power_request_lock).Times(0);
  EXPECT_EQ(on(1, ""), 0);
  EXPECT_EQ(session.asked, 0);
  EXPECT_EQ(current_restore_client, 1);
  EXPECT_EQ(subscriptions.size(), 1U);
  EXPECT_EQ(pellix_restore_running(), 1);
  EXPECT_EQ(cloud_restore_running(), 0);
  expect_info("start install event monitoring. client:1, serial_num:");
}

TEST_F(RestoreModeTest, AnyOtherClientReturnsOneAndChangesNothing) {
  pkg_list_to_be_restored = {"old"};
  for (const int client : {2, -1, 100}) {
    EXPECT_EQ(on(client), 1);
    EXPECT_EQ(off(client), 1);
  }
  EXPECT_EQ(pkg_list_to_be_restored, List{"old"});
  EXPECT_TRUE(subscriptions.empty());
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(RestoreModeTest, TheCloudClientMayNotEnterWhileTheCompanionsModeRuns) {
  EXPECT_EQ(on(1), 0);
  EXPECT_EQ(on(0, "other", R"(["x"])"), 36);
  expect_error("restore mode by pellix is already running");
  EXPECT_EQ(current_restore_client, 1);
  EXPECT_EQ(serial_num_user_select, kSerial);
  EXPECT_EQ(on(1, kSerial, R"(["new"])"), 0) << "the companion itself may";
  EXPECT_EQ(pkg_list_to_be_restored, List{"new"});
}

TEST_F(RestoreModeTest, TheCompanionMayEnterWhileTheCloudClientsModeRuns) {
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(on(1), 0);
  EXPECT_EQ(current_restore_client, 1);
  EXPECT_EQ(pellix_restore_running(), 1);
  EXPECT_EQ(cloud_restore_running(), 0);
  expect_info("start_install_monitor : already initialized");
}

TEST_F(RestoreModeTest, AnEmptyArrayReturnsZeroWithoutTheMonitor) {
  pkg_list_to_be_restored = {"old"};
  serial_num_user_select = "before";
  EXPECT_EQ(on(0, "", "[]"), 0);
  expect_info("there is no package should be restored");
  EXPECT_TRUE(pkg_list_to_be_restored.empty());
  EXPECT_EQ(serial_num_user_select, "before");
  EXPECT_EQ(cloud_restore_running(), 0);
  EXPECT_TRUE(subscriptions.empty());
  EXPECT_EQ(g_restore_cb_data, nullptr);
}

TEST_F(RestoreModeTest, MissingTextsAreEmptyOnes) {
  EXPECT_EQ(quarnd_restore_enable(1, 0, nullptr, nullptr, make_record(1)), 0);
  expect_info("there is no package should be restored");
}

TEST_F(RestoreModeTest, ASerialThatIsNoPathComponentIsRefusedBeforeAnythingChanges) {
  pkg_list_to_be_restored = {"old"};
  serial_num_user_select = "before";
  for (const char *serial : {"", "..", ".", "a/b", "/"}) {
    EXPECT_EQ(on(0, serial), 36) << serial;
    expect_error("refused : not a serial number (" + std::string(serial) + ")");
  }
  EXPECT_EQ(pkg_list_to_be_restored, List{"old"});
  EXPECT_EQ(serial_num_user_select, "before");
  EXPECT_EQ(session.asked, 0);
}

TEST_F(RestoreModeTest, WithoutASessionNothingIsStartedAndTheRecordIsNotKept) {
  session.ready = false;
  EXPECT_EQ(on(0), 0);
  EXPECT_TRUE(subscriptions.empty());
  EXPECT_EQ(g_restore_cb_data, nullptr);
  EXPECT_EQ(cloud_restore_running(), 1);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(RestoreModeTest, AMonitorThatDoesNotStartIsLoggedAndTheRecordIsNotKept) {
  ON_CALL(platform, package_manager_create).WillByDefault(Return(-12));
  for (const int client : {0, 1}) EXPECT_EQ(on(client), client == 0 ? 0 : 0);
  expect_error("fail to start install event monitor", 2);
  EXPECT_EQ(g_restore_cb_data, nullptr);
}

TEST_F(RestoreModeTest, TheListsOfTheEarlierModeAreForgotten) {
  install_complete_pkgs = {kPkg};
  EXPECT_EQ(on(0), 0);
  EXPECT_TRUE(install_complete_pkgs.empty());
  expect_info("init_install_complete_pkgs_list");
  expect_info("init_icon_hide_delay_timer_list");
}

TEST_F(RestoreModeTest, TheDeviceStaysAwakeWhileTheSessionStarts) {
  bool idle = true;
  session.meanwhile = [&] { idle = is_idle_status(); };
  EXPECT_EQ(on(0), 0);
  EXPECT_FALSE(idle);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(RestoreModeTest, WhatWasAskedWhileTheSessionStartedCounts) {
  session.meanwhile = [&] { EXPECT_EQ(on(1, "", R"(["mine"])", 2), 0); };
  EXPECT_EQ(on(0), 36) << "the companion's mode runs by now";
  EXPECT_EQ(current_restore_client, 1);
  EXPECT_EQ(pellix_restore_running(), 1);
  EXPECT_EQ(cloud_restore_running(), 0);
  EXPECT_EQ(pkg_list_to_be_restored, List{"mine"});

  EXPECT_EQ(off(), 0);
  session.meanwhile = [&] { EXPECT_EQ(off(), 0); };
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(cloud_restore_running(), 0) << "it was switched off meanwhile";
  EXPECT_EQ(g_restore_cb_data, nullptr);
}

TEST_F(RestoreModeTest, WhatADeadDaemonLeftIsPutBack) {
  make_old_data();
  const Tree before = tree_of(root);
  ON_CALL(platform, package_manager_foreach_package_info)
      .WillByDefault([](package_manager_package_info_cb callback, void *data) {
        callback(nullptr, data);
        return 0;
      });
  ON_CALL(platform, package_info_get_package).WillByDefault([](auto, char **id) {
    *id = strdup(kPkg);
    return 0;
  });
  for (const int client : {0, 1}) {
    ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
    unpacked_file("data/settings.ini", "half of a restore");
    EXPECT_EQ(on(client), 0);
    EXPECT_EQ(tree_of(root), before);
  }
}

/* ---- off, and the client's end ---- */

TEST_F(RestoreModeTest, SwitchingOffAlwaysReturnsZeroAndClearsBothFlags) {
  EXPECT_EQ(off(), 0) << "nothing ran";
  expect_info("stop_install_monitor : not initialized");
  expect_info("stop install event monitor");
  for (const int client : {0, 1}) {
    EXPECT_EQ(on(client), 0);
    EXPECT_EQ(off(1 - client), 0) << "anybody may";
    EXPECT_EQ(current_restore_client, 0);
    EXPECT_EQ(cloud_restore_running(), 0);
    EXPECT_EQ(pellix_restore_running(), 0);
  }
}

TEST_F(RestoreModeTest, TheKeptClientIsToldThatTheModeIsOver) {
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(off(), 0);
  EXPECT_TRUE(outside.answers.empty()) << "not before the reply to the one who switches off";
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(1)});
  EXPECT_EQ(g_restore_cb_data, nullptr);
}

TEST_F(RestoreModeTest, SwitchingOnAgainEndsTheEarlierClientsMessages) {
  EXPECT_EQ(on(0, kSerial, kList, 1), 0);
  EXPECT_EQ(on(0, kSerial, kList, 2), 0);
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(1)});
  EXPECT_EQ(off(), 0);
  run_pending();
  EXPECT_EQ(outside.answers, (Answers{stop(1), stop(2)}));
}

TEST_F(RestoreModeTest, TheCompanionsModeEndsTheCloudClientsMessages) {
  EXPECT_EQ(on(0, kSerial, kList, 1), 0);
  EXPECT_EQ(on(1, "", kList, 2), 0);
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(1)});
}

TEST_F(RestoreModeTest, ARequestThatIsReplacedWhileItWaitsHasItsEndAsWell) {
  session.meanwhile = [&] { EXPECT_EQ(off(), 0); };
  EXPECT_EQ(on(0, kSerial, kList, 1), 0);
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(1)});
}

TEST_F(RestoreModeTest, ItsClientMayWithdrawTheModeAndNobodyElse) {
  EXPECT_EQ(on(0, kSerial, kList, 1), 0);
  EXPECT_EQ(quarnd_cancel_own(":1.8"), 0U);
  EXPECT_EQ(cloud_restore_running(), 1);
  EXPECT_EQ(quarnd_cancel_own(":1.7"), 1U);
  EXPECT_EQ(cloud_restore_running(), 0);
  EXPECT_EQ(quarnd_cancel_own(":1.7"), 0U);
  run_pending();
  EXPECT_EQ(outside.answers, (Answers{{"restore_enable_cb", 17, "restore_stop", 1}}));
}

TEST_F(RestoreModeTest, AWithdrawnRequestDoesNotSwitchTheModeOn) {
  session.ready = false;
  int reply = -1;
  run_on_fiber([&] {
    const std::uint64_t own = fiber_id(current_fiber());
    session.meanwhile = [this, own] {
      const GMainLoopPtr answer(new_wait_loop());
      later([own] { EXPECT_TRUE(withdraw_waits(own)); });
      run_nested_loop(answer.get());
    };
    reply = on(0, kSerial, kList, 1);
  });
  run_pending();
  EXPECT_EQ(reply, 17);
  EXPECT_EQ(cloud_restore_running(), 0);
  EXPECT_TRUE(pkg_list_to_be_restored.empty());
  EXPECT_TRUE(claimed_packages(kSerial).empty()) << "what is waited for no longer is not kept";
  EXPECT_EQ(outside.answers, (Answers{{"restore_enable_cb", 17, "restore_stop", 1}}));
  EXPECT_TRUE(is_idle_status());
}

TEST_F(RestoreModeTestWithMark, AModeThatWasWithdrawnIsNoDecisionOnTheBackup) {
  EXPECT_EQ(on(0), 0);
  EXPECT_TRUE(knows_own_backup(kSerial));
  EXPECT_EQ(quarnd_cancel_own(":1.7"), 1U);
  expect_unused();
}

TEST_F(RestoreModeTestWithMark, NorIsOneThatWasWithdrawnWhileTheSessionStarted) {
  session.ready = false;
  run_on_fiber([&] {
    const std::uint64_t own = fiber_id(current_fiber());
    session.meanwhile = [this, own] {
      const GMainLoopPtr answer(new_wait_loop());
      later([own] { EXPECT_TRUE(withdraw_waits(own)); });
      run_nested_loop(answer.get());
    };
    EXPECT_EQ(on(0), 17);
  });
  run_pending();
  expect_unused();
}

TEST_F(RestoreModeTestWithMark, NorIsOneInWhosePlaceAnotherCame) {
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(on(1), 0);
  off();
  expect_unused();
  mark = 0;
  note_own_backup(kSerial);
  EXPECT_EQ(on(0), 0);
  EXPECT_EQ(on(0, "350000000000002"), 0);
  expect_unused();
  off();
  run_pending();
}

TEST_F(RestoreModeTest, AListThatRunsEmptyEndsTheMode) {
  EXPECT_EQ(on(0, kSerial, R"(["org.example.notes"])"), 0);
  EXPECT_EQ(package_to_be_restored(kPkg), 1);
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(1)});
  EXPECT_EQ(cloud_restore_running(), 0);
}

}  // namespace
