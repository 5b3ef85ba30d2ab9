#include <Ecore.h>
#include <glib.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "backup_transport.h"
#include "platform_package_manager.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/install_monitor.h"
#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/package.h"
#include "restore_fixture.h"

using ::testing::_;
using ::testing::Return;

namespace {

/** Free space that the device reports, 0 for what it really is. */
std::uint64_t free_space = 0;

/** Delays of the timers that were made, and how many of them are left. */
std::vector<double> timer_delays;
int timers_left = 0;

}  // namespace

extern "C" Ecore_Timer *ecore_timer_add(double delay, Ecore_Task_Cb, const void *) {
  static char timer[1];
  timer_delays.push_back(delay);
  ++timers_left;
  return reinterpret_cast<Ecore_Timer *>(timer);
}

extern "C" void *ecore_timer_del(Ecore_Timer *) {
  --timers_left;
  return nullptr;
}

extern "C" int fstatfs(int fd, struct statfs *status) noexcept {
  const auto result = static_cast<int>(syscall(SYS_fstatfs, fd, status));
  if (free_space != 0) {
    status->f_bfree = free_space;
    status->f_bsize = 1;
  }
  return result;
}

namespace {

char a_handle[1];
/** How often restore mode was switched off. */
int disabled() { return count_logged(DLOG_INFO, "stop install event monitor"); }
std::vector<std::pair<restore_outcome, int>> ends;

class MonitorTest : public RestoreTest {
 protected:
  MonitorTest() {
    free_space = 0;
    timer_delays.clear();
    ends.clear();
    for (const std::string &package : owed_packages(kSerial)) {
      forget_owed_archive(kSerial, package, "");
    }
    set_restore_progress_sink([](const restore_progress &step) {
      if (step.stage == restore_stage::finished) ends.emplace_back(step.outcome, step.result);
    });
    init_install_complete_pkgs_list();
    ON_CALL(platform, connection_get_type).WillByDefault([this](auto, auto *type) {
      *type = network;
      return 0;
    });
    ON_CALL(platform, package_manager_create).WillByDefault([](auto *handle) {
      *handle = reinterpret_cast<package_manager_h>(a_handle);
      return 0;
    });
    ON_CALL(platform, package_manager_set_event_cb)
        .WillByDefault([this](auto, auto callback, auto) {
          event = callback;
          return 0;
        });
    ON_CALL(platform, package_manager_get_package_info).WillByDefault([](auto, auto *info) {
      *info = reinterpret_cast<package_info_h>(a_handle);
      return 0;
    });
    ON_CALL(platform, package_info_get_root_path).WillByDefault([this](auto, char **path) {
      *path = strdup(root.c_str());
      return 0;
    });
    ON_CALL(platform, package_info_get_version).WillByDefault([](auto, char **text) {
      *text = strdup(kVersion);
      return 0;
    });
    ON_CALL(platform, package_info_is_preload_package).WillByDefault([](auto, bool *preload) {
      *preload = false;
      return 0;
    });
    ON_CALL(platform, package_info_foreach_app_from_package)
        .WillByDefault([this](auto, auto type, auto callback, void *data) {
          for (const auto &app : apps) EXPECT_TRUE(callback(type, app.c_str(), data));
          return 0;
        });
    ON_CALL(platform, pkgmgrinfo_appinfo_get_appinfo).WillByDefault([](auto, auto *handle) {
      *handle = a_handle;
      return 0;
    });
    ON_CALL(platform, pkgmgrinfo_appinfo_get_api_version).WillByDefault([](auto, char **text) {
      static char version[] = "4.0";
      *text = version;
      return 0;
    });
    ON_CALL(platform, pkgmgrinfo_appinfo_get_metadata_value)
        .WillByDefault([this](auto, auto, char **value) {
          static char disable[] = "disable";
          if (!opted_out) return PMINFO_R_ENOENT;
          *value = disable;
          return PMINFO_R_OK;
        });
    ON_CALL(platform, pkgmgr_client_new).WillByDefault([](auto) {
      return static_cast<pkgmgr_client *>(a_handle);
    });
    pkg_list_to_be_restored = {"org.example.first", kPkg, "org.example.last"};
    EXPECT_EQ(start_install_monitor(), 1);
    EXPECT_EQ(start_wifi_monitor(), 1);
    clear_captured_log();
  }
  ~MonitorTest() override {
    free_space = 0;
    stop_wifi_monitor();
    stop_install_monitor();
    init_icon_hide_delay_timer_list();
  }

  void install(const char *package = kPkg,
               package_manager_event_type_e type = PACKAGE_MANAGER_EVENT_TYPE_INSTALL,
               package_manager_event_state_e state = PACKAGE_MANAGER_EVENT_STATE_COMPLETED,
               package_manager_error_e error = PACKAGE_MANAGER_ERROR_NONE) {
    event("tpk", package, type, state, 100, error, nullptr);
  }
  std::string icon_note() const { return root + "/shared/data/quarn_tmp_rst_dir.icon"; }
  bool is_candidate() const {
    for (const auto &one : pkg_list_to_be_restored) {
      if (one == kPkg) return true;
    }
    return false;
  }

  connection_type_e network = CONNECTION_TYPE_WIFI;
  package_manager_event_cb event = nullptr;
  std::vector<std::string> apps = {"org.example.notes"};
  bool opted_out = false;
};

TEST_F(MonitorTest, ACandidateIsRestoredWhenItsInstallationCompletes) {
  install();
  expect_info("new package install detected : org.example.notes");
  expect_info("backup enabled for (org.example.notes)");
  ASSERT_EQ(downloads.size(), 1U);
  EXPECT_EQ(downloads[0].remote, "/350000000000001/org.example.notes/1.2.0/org.example.notes.zip");
  EXPECT_EQ(pkg_list_to_be_restored,
            (std::vector<std::string>{"org.example.first", "org.example.last"}));
}

TEST_F(MonitorTest, NoBackupTouchesTheArchiveFromTheEventToTheRestoresEnd) {
  await_archives(kSerial, {kPkg, "org.example.last"}, {});
  serial_num_user_select = kSerial;
  install();
  EXPECT_EQ(claimed_packages(kSerial), (std::vector<std::string>{"org.example.last", kPkg}));
  await_no_archives();
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::whole) << "the mode may end before it";
  answer(BACKUP_TRANS_ERROR_NETWORK);
  forget_owed_archive(kSerial, kPkg, root);
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::none);
}

TEST_F(MonitorTest, WhatARestoreOnInstallationDidNotBringIsOwed) {
  serial_num_user_select = kSerial;
  const auto owed = [this] { return look_for_owed_archive(kSerial, kPkg, root); };
  install();
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::whole);
  EXPECT_TRUE(exists(root + "/shared/data/quarn_tmp_rst_dir.owed")) << "for the next daemon";
  EXPECT_EQ(claimed_packages(kSerial), std::vector<std::string>{kPkg});
  forget_owed_archive(kSerial, kPkg, root);
  EXPECT_FALSE(exists(root + "/shared/data/quarn_tmp_rst_dir.owed"));
  EXPECT_EQ(owed(), archive_claim::none);
}

TEST_F(MonitorTest, ARestoreOnInstallationThatSucceedsLeavesNothingOwed) {
  serial_num_user_select = kSerial;
  install();
  ASSERT_TRUE(exists(root + "/shared/data/quarn_tmp_rst_dir.owed"));
  make_archive(download(), {{"data/a", "brought back"}});
  answer();
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::restored, 0}));
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::none);
  EXPECT_FALSE(exists(root + "/shared/data/quarn_tmp_rst_dir.owed"));
}

TEST_F(MonitorTest, WhereTheCloudHasNoArchiveOfTheVersionOnlyTheOthersAreOwed) {
  serial_num_user_select = kSerial;
  install();
  answer(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::versions);
}

TEST_F(MonitorTest, AnInstallThatIsNotRestoredClaimsNothingAnyMore) {
  await_archives(kSerial, {kPkg}, {});
  serial_num_user_select = kSerial;
  opted_out = true;
  install();
  EXPECT_TRUE(claimed_packages(kSerial).empty());
}

TEST_F(MonitorTest, APackageThatIsRemovedIsWaitedForAsOneThatIsToCome) {
  await_archives(kSerial, {kPkg}, {kPkg});
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::versions);
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_UNINSTALL);
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::whole);
  expect_error("this is not new install event");
  await_no_archives();
}

TEST_F(MonitorTest, TheIconIsHiddenUntilTheRestoreHasEnded) {
  EXPECT_CALL(platform, pkgmgr_client_deactivate).Times(0);
  EXPECT_CALL(platform, pkgmgr_client_activate).Times(0);
  install();
  EXPECT_EQ(timer_delays, std::vector<double>{0.5});
  EXPECT_EQ(timers_left, 1);
  EXPECT_TRUE(exists(icon_note())) << "for the next daemon";
  ::testing::Mock::VerifyAndClearExpectations(&platform);
  EXPECT_CALL(platform, pkgmgr_client_activate(_, nullptr, ::testing::StrEq(kPkg))).Times(1);
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(timers_left, 0);
  EXPECT_FALSE(exists(icon_note()));
}

TEST_F(MonitorTest, AnIconThatTheNextDaemonWouldNotShowIsNotHidden) {
  std::filesystem::create_directories(icon_note() + "/in/the/way");
  install();
  expect_error("icon of (org.example.notes) stays: that it is hidden cannot be noted");
  EXPECT_EQ(timers_left, 0);
  answer(BACKUP_TRANS_ERROR_NETWORK);
}

TEST_F(MonitorTest, AnInstallOfNoCandidateLeavesTheListUnchanged) {
  install("org.example.stranger");
  EXPECT_EQ(pkg_list_to_be_restored.size(), 3U);
  EXPECT_TRUE(downloads.empty());
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(MonitorTest, AnEventOnAnEmptyListSchedulesTheEnd) {
  pkg_list_to_be_restored.clear();
  install();
  EXPECT_EQ(disabled(), 0);
  run_pending();
  EXPECT_EQ(disabled(), 1);
  expect_info("installation of all restore candidate package was completed!");
}

TEST_F(MonitorTest, TheLastCandidateSchedulesTheEnd) {
  pkg_list_to_be_restored = {kPkg};
  EXPECT_EQ(package_to_be_restored(kPkg), 1);
  run_pending();
  EXPECT_EQ(disabled(), 1);
}

TEST_F(MonitorTest, AListThatWasGivenMeanwhileIsNotEnded) {
  pkg_list_to_be_restored = {kPkg};
  EXPECT_EQ(package_to_be_restored(kPkg), 1);
  pkg_list_to_be_restored = {"org.example.next"};
  run_pending();
  EXPECT_EQ(disabled(), 0);
}

TEST_F(MonitorTest, AnEndOfAModeThatIsOffIsHarmless) {
  pkg_list_to_be_restored.clear();
  EXPECT_EQ(package_to_be_restored(kPkg), 0);
  run_pending();
  expect_info("installation of all restore candidate package was completed!");
}

TEST_F(MonitorTest, APackageOfThreeComponentsStartsOneRestore) {
  apps = {"one", "two", "three"};
  install();
  EXPECT_EQ(downloads.size(), 1U);
}

TEST_F(MonitorTest, AComponentThatOptedOutConsumesTheCandidateWithoutARestore) {
  opted_out = true;
  install();
  expect_info("backup disabled for (org.example.notes)");
  EXPECT_TRUE(downloads.empty());
  EXPECT_FALSE(is_candidate());
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::skipped, 41}));
}

TEST_F(MonitorTest, OnlyCompletedInstallsCount) {
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_UNINSTALL);
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_UPDATE);
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_INSTALL, PACKAGE_MANAGER_EVENT_STATE_STARTED);
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_INSTALL, PACKAGE_MANAGER_EVENT_STATE_PROCESSING);
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_INSTALL, PACKAGE_MANAGER_EVENT_STATE_FAILED);
  expect_error("this is not new install event", 5);
  EXPECT_TRUE(is_candidate());
}

TEST_F(MonitorTest, AnErrorOfThePackageManagerIsLogged) {
  install(kPkg, PACKAGE_MANAGER_EVENT_TYPE_INSTALL, PACKAGE_MANAGER_EVENT_STATE_COMPLETED,
          PACKAGE_MANAGER_ERROR_IO_ERROR);
  expect_error("package_manager error: -5");
  EXPECT_TRUE(is_candidate());
}

TEST_F(MonitorTest, APackageThatWasHandledIsNotRestoredAgain) {
  install_complete_pkgs.emplace_back(kPkg);
  install();
  EXPECT_TRUE(downloads.empty());
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_FALSE(is_candidate());
}

TEST_F(MonitorTest, AnUnknownPackageIsDropped) {
  ON_CALL(platform, package_manager_get_package_info).WillByDefault(Return(-71));
  EXPECT_CALL(platform, package_info_destroy).Times(0);
  serial_num_user_select = kSerial;
  install();
  expect_error("package_manager_get_package_info() failed");
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::skipped, 1}));
  EXPECT_EQ(claim_on_archive(kSerial, kPkg), archive_claim::whole) << "its archive is kept";
}

TEST_F(MonitorTest, WithoutARootPathThePackageIsDropped) {
  EXPECT_CALL(platform, package_info_destroy).Times(2);
  ON_CALL(platform, package_info_get_root_path).WillByDefault(Return(-5));
  install();
  expect_error("package_info_get_root_path() was failed, ret = [-5]");
  pkg_list_to_be_restored = {kPkg, "x"};
  ON_CALL(platform, package_info_get_root_path).WillByDefault([](auto, char **path) {
    *path = nullptr;
    return 0;
  });
  install();
  expect_error("pkg_root_path is NULL");
  EXPECT_TRUE(downloads.empty());
}

TEST_F(MonitorTest, FreeSpaceOfExactlyTheLargestBackupIsEnough) {
  free_space = 26214400;
  install();
  EXPECT_EQ(downloads.size(), 1U);
}

TEST_F(MonitorTest, OneByteLessOfFreeSpaceIsNot) {
  free_space = 26214399;
  install();
  expect_error("fail : available space is too small");
  EXPECT_TRUE(downloads.empty());
  EXPECT_FALSE(is_candidate());
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::skipped, 34}));
}

TEST_F(MonitorTest, APreloadedPackageIsDroppedSilently) {
  ON_CALL(platform, package_info_is_preload_package).WillByDefault([](auto, bool *preload) {
    *preload = true;
    return 0;
  });
  install();
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_TRUE(downloads.empty());
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::skipped, 27}));
}

TEST_F(MonitorTest, APackageOfUnknownOriginIsDropped) {
  ON_CALL(platform, package_info_is_preload_package).WillByDefault(Return(-5));
  install();
  expect_error("package_info_is_preload_package fail, err = [-5]");
  EXPECT_TRUE(downloads.empty());
}

TEST_F(MonitorTest, WithoutWifiNothingIsRequested) {
  stop_wifi_monitor();
  install();
  expect_error("WIFI disconnected");
  EXPECT_TRUE(downloads.empty());
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::skipped, 33}));
}

TEST_F(MonitorTest, ARefusedDownloadIsReportedAndTheIconStays) {
  EXPECT_CALL(platform, pkgmgr_client_new).Times(0);
  transport_result = 2;
  install();
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::failed, 13}));
}

TEST_F(MonitorTest, AFailedFirstVisitIsLoggedAndTheRestoreGoesOn) {
  int visit = 0;
  ON_CALL(platform, package_info_foreach_app_from_package)
      .WillByDefault([&](auto, auto type, auto callback, void *data) {
        if (++visit == 1) return -5;
        callback(type, "app", data);
        return 0;
      });
  install();
  expect_error("package_info_foreach_app_from_package() fail, err = [-5]");
  EXPECT_EQ(downloads.size(), 1U);
}

TEST_F(MonitorTest, AFailedSecondVisitIsLoggedAndTheIconStays) {
  EXPECT_CALL(platform, pkgmgr_client_new).Times(0);
  int visit = 0;
  ON_CALL(platform, package_info_foreach_app_from_package)
      .WillByDefault([&](auto, auto, auto, void *) { return ++visit == 2 ? -5 : 0; });
  install();
  expect_error("package_info_foreach_app_from_package() failed");
  EXPECT_TRUE(downloads.empty());
}

TEST_F(MonitorTest, ADownloadThatWasRequestedBeforeTheVisitFailedIsFinished) {
  int visit = 0;
  ON_CALL(platform, package_info_foreach_app_from_package)
      .WillByDefault([&](auto, auto type, auto callback, void *data) {
        callback(type, "app", data);
        return ++visit == 2 ? -5 : 0;
      });
  install();
  ASSERT_EQ(downloads.size(), 1U);
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::failed, 12}));
}

TEST_F(MonitorTest, ACompanionsRestoreHappensAtOnce) {
  current_restore_client = QUARN_CLIENT_COMPANION;
  serial_num_user_select = kSerial;
  install();
  EXPECT_TRUE(downloads.empty());
  EXPECT_TRUE(owed_packages(kSerial).empty()) << "it is not the cloud's";
  expect_info("restore_app_data for org.example.notes complete");
  EXPECT_EQ(timers_left, 1) << "its icon is hidden all the same";
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::failed, 31}));
}

TEST_F(MonitorTest, AVersionThatCannotBeReadIsNoPath) {
  ON_CALL(platform, package_info_get_version).WillByDefault(Return(-5));
  install();
  EXPECT_TRUE(downloads.empty());
  EXPECT_EQ(ends.back(), (std::pair{restore_outcome::failed, 13}));
}

TEST_F(MonitorTest, RestoresOfTheModeAreFinishedBeforeItsClientIsToldOfTheEnd) {
  keep_restore_record(owned_record(5));
  pkg_list_to_be_restored = {kPkg};
  install();
  run_pending();
  EXPECT_TRUE(outside.answers.empty());
  answer(BACKUP_TRANS_ERROR_NETWORK);
  run_pending();
  ASSERT_EQ(outside.answers.size(), 1U);
  EXPECT_EQ(outside.answers[0].msg, "restore_stop");
}

TEST_F(MonitorTest, TheClientIsToldOfTheEndBeforeTheDaemonEndsItself) {
  keep_restore_record(owned_record(5));
  pkg_list_to_be_restored = {kPkg};
  install();
  answer(BACKUP_TRANS_ERROR_NETWORK);  // before the main loop came to the end of the mode
  ASSERT_TRUE(run_until([&] { return !outside.terminations.empty(); }));
  ASSERT_EQ(outside.answers.size(), 1U);
  EXPECT_EQ(outside.answers[0].msg, "restore_stop");
}

/* ---- start and stop ---- */

TEST_F(MonitorTest, AMonitorThatRunsIsNotStartedAgain) {
  EXPECT_CALL(platform, package_manager_create).Times(0);
  EXPECT_EQ(start_install_monitor(), 1);
  expect_info("start_install_monitor : already initialized");
}

TEST_F(MonitorTest, StoppingReleasesTheHandleOnce) {
  EXPECT_CALL(platform, package_manager_unset_event_cb).Times(1);
  EXPECT_CALL(platform, package_manager_destroy).Times(1);
  EXPECT_EQ(stop_install_monitor(), 1);
  EXPECT_EQ(stop_install_monitor(), 1);
  expect_info("stop_install_monitor : not initialized");
}

TEST_F(MonitorTest, AStoppedMonitorCanBeStartedAgain) {
  stop_install_monitor();
  EXPECT_EQ(start_install_monitor(), 1);
  install();
  EXPECT_EQ(downloads.size(), 1U);
}

TEST_F(MonitorTest, AHandleThatCannotBeMadeFailsTheStart) {
  stop_install_monitor();
  EXPECT_CALL(platform, package_manager_create).WillOnce(Return(-12));
  EXPECT_EQ(start_install_monitor(), 0);
  expect_error("package_manager_create() failed -12");
}

TEST_F(MonitorTest, ASubscriptionThatFailsReleasesTheHandle) {
  stop_install_monitor();
  EXPECT_CALL(platform, package_manager_set_event_cb).WillOnce(Return(-22));
  EXPECT_CALL(platform, package_manager_destroy).Times(1);
  EXPECT_EQ(start_install_monitor(), 0);
  expect_error("package_manager_set_event_cb() failed -22");
}

}  // namespace
