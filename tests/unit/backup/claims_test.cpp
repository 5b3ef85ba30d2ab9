// What a backup leaves in the cloud because a restore is still to have it.
#include <filesystem>
#include <memory>

#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_backup/own_backup.h"
#include "run_fixture.h"

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::Return;
using ::testing::StartsWith;
using ::testing::UnorderedElementsAre;

namespace {

/** org.kept is in the cloud and not installed; org.here is both. */
class Claims : public Runs {
 protected:
  Claims() {
    install("org.here");
    kept_ = install("org.kept", "1.5").object();
    manual();
    entry_ = cloud_list().packages(0)[1];
    EXPECT_THAT(entry_, StartsWith("org.kept 1.5 "));
    remove("org.kept");
    content_ = cloud_.objects[kept_];
    clear_captured_log();
    steps().clear();
    clear_sent_statuses();
  }

  void wait_for_kept() { await_archives(kSerial, {"org.kept"}, {"org.here"}); }
  void expect_kept() {
    EXPECT_EQ(cloud_.objects[kept_], content_);
    EXPECT_THAT(cloud_list().packages(0), Contains(entry_));
  }
  void expect_gone() {
    EXPECT_FALSE(in_cloud(kept_));
    EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.here"));
  }

  std::string kept_;
  std::string entry_;
  std::string content_;
};

TEST_F(Claims, AManualRunRemovesWhatIsNotInstalledAndNotWaitedFor) {
  manual();
  expect_gone();
}

TEST_F(Claims, WhatRestoreModeWaitsForStaysWithItsEntryInEveryKindOfRun) {
  wait_for_kept();
  manual();
  expect_kept();
  automatic();
  expect_kept();
  EXPECT_EQ(info("(org.kept) stays in cloud : a restore is to have it"), 0) << "it is listed";
  await_no_archives();
  manual();
  expect_gone();
}

TEST_F(Claims, TheModeOfAnotherDevicesBackupClaimsNothingOfThisOne) {
  await_archives("350000000000002", {"org.kept"}, {});
  manual();
  expect_gone();
}

TEST_F(Claims, WhatBeginsToBeWaitedForAtAnyRequestOfARunStays) {
  const std::string list_upload = kAppListInCloud;
  const std::string folder = std::string("/") + kSerial + "/";
  const std::vector<std::pair<Op, std::string>> moments = {
      {Op::download, kAppListInCloud}, {Op::upload, folder}, {Op::upload, list_upload}};
  for (const auto &[op, path] : moments) {
    write_text(package("org.here").root + "/data/file.txt", path + std::to_string(int(op)));
    await_no_archives();
    at(op, path, [this] { wait_for_kept(); });
    manual();
    cloud_.refuse = nullptr;
    EXPECT_EQ(sent_statuses().back().err, 0) << path;
    expect_kept();
  }
}

TEST_F(Claims, WhatBeginsToBeWaitedForWhileTheSerialFolderIsListedKeepsItsArchive) {
  at(Op::list, "", [this] { wait_for_kept(); });
  manual();
  EXPECT_EQ(cloud_.objects[kept_], content_);
  EXPECT_EQ(info("(org.kept) stays in cloud : a restore is to have it"), 1);
}

TEST_F(Claims, AModeThatEndsDuringTheRunLeavesWhatTheRunHasListed) {
  for (const auto &[op, path] :
       std::vector<std::pair<Op, std::string>>{{Op::upload, kAppListInCloud}, {Op::list, ""}}) {
    wait_for_kept();
    at(op, path, [] { await_no_archives(); });
    manual();
    cloud_.refuse = nullptr;
    expect_kept();
  }
}

TEST_F(Claims, APackageThatHasJustBeenInstalledIsNotBackedUpOverTheArchiveItWaitsFor) {
  wait_for_kept();
  const FakePackage &fresh = install("org.kept", "1.5", "as it comes from the shop");
  manual();
  expect_kept();
  EXPECT_EQ(cloud_.count_requests("upload " + fresh.object()), 1) << "the first one's";
  EXPECT_EQ(step_of("org.kept").outcome, backup_outcome::restoring);
  EXPECT_FALSE(exists(fresh.staged()));
  {
    const archive_hold restore(kSerial, "org.kept");
    stop_awaiting_archive("org.kept");
    automatic();
    expect_kept();
  }
  automatic();
  EXPECT_EQ(cloud_.count_requests("upload " + fresh.object()), 2) << "now it is a package as any";
}

TEST_F(Claims, APackageWhoseRestoreFailedIsNotBackedUpOverItsArchive) {
  const FakePackage &fresh = install("org.kept", "1.5", "as it comes from the shop");
  note_owed_archive(kSerial, "org.kept", fresh.root);
  for (int run = 0; run < 2; ++run) {
    manual();
    expect_kept();
    automatic();
    expect_kept();
  }
  EXPECT_EQ(step_of("org.kept").outcome, backup_outcome::restoring);
  forget_owed_archive(kSerial, "org.kept", fresh.root);
  automatic();
  EXPECT_NE(cloud_.objects[kept_], content_) << "now it is a package as any";
}

TEST_F(Claims, WhatIsOwedIsKnownToTheNextDaemonAndGoesWithThePackage) {
  const FakePackage &fresh = install("org.kept", "1.5", "as it comes from the shop");
  const std::string note = fresh.root + "/shared/data/quarn_tmp_rst_dir.owed";
  for (const std::string text : {"", "w350000000000001"}) {
    write_text(note, text);
    manual();
    expect_kept();
  }
  remove("org.kept");
  manual();
  expect_gone();
}

TEST_F(Claims, WhatIsOwedToAnotherDevicesBackupIsNothingToThisOne) {
  const FakePackage &fresh = install("org.kept", "1.5", "as it comes from the shop");
  note_owed_archive("350000000000002", "org.kept", fresh.root);
  manual();
  EXPECT_NE(cloud_.objects[kept_], content_);
}

TEST_F(Claims, WhereAnotherVersionCameTheOneThatIsOwedStaysBesideIt) {
  const FakePackage &fresh = install("org.kept", "2.0", "newer");
  note_owed_archive(kSerial, "org.kept", fresh.root);
  for (const char *content : {"newer", "newer still"}) {
    write_text(fresh.root + "/data/file.txt", content);
    manual();
    EXPECT_EQ(step_of("org.kept").outcome, backup_outcome::uploaded);
    expect_kept();
  }
  forget_owed_archive(kSerial, "org.kept", fresh.root);
  write_text(fresh.root + "/data/file.txt", "the newest");
  manual();
  EXPECT_FALSE(in_cloud(kept_));
}

TEST_F(Claims, NothingIsOwedOfWhatTheCloudDoesNotList) {
  const FakePackage &fresh = install("org.fresh");
  note_owed_archive(kSerial, "org.fresh", fresh.root);
  automatic();
  EXPECT_TRUE(in_cloud(fresh.object()));
  write_text(fresh.root + "/data/file.txt", "later");
  steps().clear();
  automatic();
  EXPECT_EQ(step_of("org.fresh").outcome, backup_outcome::uploaded);
}

TEST_F(Claims, TheVersionThatIsWaitedForSurvivesTheUploadOfAnother) {
  install("org.kept", "2.0", "newer");
  await_archives(kSerial, {"org.kept"}, {"org.kept"});
  manual();
  EXPECT_EQ(cloud_.objects[kept_], content_);
  EXPECT_TRUE(in_cloud(package("org.kept").object()));
  EXPECT_THAT(cloud_list().packages(0), Contains(entry_));
  EXPECT_THAT(cloud_list().packages(0), Contains(StartsWith("org.kept 2.0 ")));
  await_no_archives();
  write_text(package("org.kept").root + "/data/file.txt", "newer still");
  manual();
  EXPECT_FALSE(in_cloud(kept_)) << "the versions are cleaned up as ever";
}

TEST_F(Claims, AnInstalledPackageThatIsWaitedForIsBackedUpUntilItIsRemoved) {
  install("org.kept", "1.5", "here already");
  await_archives(kSerial, {"org.kept"}, {"org.kept"});
  manual();
  EXPECT_EQ(step_of("org.kept").outcome, backup_outcome::uploaded);
  content_ = cloud_.objects[kept_];
  entry_ = cloud_list().packages(0)[1];
  remove("org.kept");
  note_awaited_package_removed("org.kept");
  install("org.kept", "1.5", "new again");
  manual();
  expect_kept();
}

/** Restore mode was on when the daemon was killed: its list is gone, the knowledge is not. */
TEST_F(Claims, AModeThatTheDaemonDidNotOutliveKeepsTheBackupFromNightlyRuns) {
  note_restore_mode_waits(kSerial);
  EXPECT_EQ(settings_[kOwnBackupKey], -2);
  EXPECT_TRUE(knows_own_backup(kSerial)) << "this process knows what it waits for";
  wait_for_kept();
  automatic();
  manual();
  expect_kept();
  EXPECT_EQ(settings_[kOwnBackupKey], -2);
  // the next process: nothing is waited for here
  note_restore_mode_used();
  settings_[kOwnBackupKey] = -2;
  await_no_archives();
  EXPECT_FALSE(knows_own_backup(kSerial));
  automatic();
  automatic();
  expect_kept();
  manual();
  expect_gone();
  EXPECT_TRUE(knows_own_backup(kSerial));
}

TEST_F(Claims, AModeForAnotherDevicesBackupLeavesTheKnowledgeOfOnesOwn) {
  const double before = settings_[kOwnBackupKey];
  note_restore_mode_waits("350000000000002");
  EXPECT_EQ(settings_[kOwnBackupKey], before);
}

TEST_F(Claims, AHoldKeepsThePackageUntilTheLastOneGoes) {
  auto first = std::make_unique<archive_hold>(kSerial, "org.kept");
  archive_hold second(kSerial, "org.kept");
  archive_hold moved(std::move(second));
  EXPECT_EQ(claim_on_archive(kSerial, "org.kept"), archive_claim::whole);
  first.reset();
  EXPECT_THAT(claimed_packages(kSerial), ElementsAre("org.kept"));
  moved = archive_hold();
  EXPECT_EQ(claim_on_archive(kSerial, "org.kept"), archive_claim::none);
  EXPECT_THAT(claimed_packages(kSerial), IsEmpty());
}

TEST_F(Claims, WhatABackupKeepsIsWhatIsInstalledOrWaitedFor) {
  install("org.preloaded").preload = true;
  wait_for_kept();
  std::set<std::string> kept;
  EXPECT_TRUE(packages_kept_by_backup(&kept));
  EXPECT_THAT(kept, UnorderedElementsAre("org.here", "org.kept"));
  std::set<std::string> installed;
  EXPECT_TRUE(list_installed_packages(&installed));
  EXPECT_THAT(installed, UnorderedElementsAre("org.here", "org.preloaded"));
  package_walk_result_ = PACKAGE_MANAGER_ERROR_IO_ERROR;
  EXPECT_FALSE(packages_kept_by_backup(&kept));
}

/* ---- a device that was reset ---- */

class ResetDevice : public Claims {
 protected:
  ResetDevice() { settings_.clear(); }
};

TEST_F(ResetDevice, ANightlyRunKeepsWhatItFindsNightAfterNight) {
  write_text(package("org.here").root + "/data/file.txt", "changed");
  for (int night = 0; night < 3; ++night) {
    automatic();
    expect_kept();
    EXPECT_EQ(info("auto backup successful!"), night + 1);
  }
  EXPECT_EQ(step_of("org.here").outcome, backup_outcome::uploaded);
}

TEST_F(ResetDevice, ItsOldVersionsStayToo) {
  package("org.here").version = "2.0";
  automatic();
  EXPECT_TRUE(in_cloud(std::string("/") + kSerial + "/org.here/1.0.0/org.here.zip"));
  EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.here", "org.here", "org.kept"));
}

TEST_F(ResetDevice, AManualRunCleansUpAndNightlyRunsFollowIt) {
  automatic();
  manual();
  expect_gone();
  install("org.later");
  automatic();
  remove("org.later");
  automatic();
  EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.here"));
}

TEST_F(ResetDevice, AManualRunThatFailsDecidesNothing) {
  cloud_.fail = [](Op op, const std::string &) {
    return op == Op::upload ? int(BACKUP_TRANS_ERROR_NETWORK) : 0;
  };
  manual();
  cloud_.fail = nullptr;
  automatic();
  expect_kept();
}

TEST_F(ResetDevice, RestoreModeThatWasUsedDecides) {
  note_restore_mode_used();
  automatic();
  expect_gone();
}

TEST_F(ResetDevice, ForgettingTheLastTimeForgetsNoRunOfItsOwn) {
  manual();
  init_last_backup_time();
  install("org.kept", "1.5");
  automatic();
  remove("org.kept");
  automatic();
  expect_gone();
}

TEST_F(ResetDevice, ABackupTimeOfAnEarlierReleaseIsKnowledgeAndSurvivesItsForgetting) {
  settings_[kLastTimeKey] = 1.7e12;
  EXPECT_TRUE(knows_own_backup(kSerial));
  init_last_backup_time();
  EXPECT_EQ(settings_[kLastTimeKey], 0);
  EXPECT_TRUE(knows_own_backup(kSerial));
}

TEST_F(ResetDevice, AnotherSerialIsAnotherDevice) {
  note_own_backup("350000000000002");
  settings_[kLastTimeKey] = 1.7e12;
  automatic();
  expect_kept();
}

TEST_F(ResetDevice, SettingsThatCannotBeWrittenKeepEverything) {
  settings_work_ = false;
  automatic();
  automatic();
  expect_kept();
}

TEST_F(Runs, ANewDevicesFirstNightlyRunIsItsOwn) {
  install("org.here");
  const std::string gone = install("org.gone").object();
  automatic();
  remove("org.gone");
  automatic();
  EXPECT_FALSE(in_cloud(gone));
}

/* ---- package managers that do not tell everything ---- */

class BadPackageManager : public Claims {};

TEST_F(BadPackageManager, APackageThatTheWalkMissesButTheManagerKnowsStays) {
  FakePackage hidden;
  ON_CALL(platform_, package_manager_get_package_info)
      .WillByDefault([&](const char *id, package_info_h *info) {
        if (std::string(id) != "org.kept") return int(PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE);
        *info = reinterpret_cast<package_info_h>(&hidden);
        return 0;
      });
  manual();
  expect_kept();
}

TEST_F(BadPackageManager, APackageThatBecamePreloadedIsNoLongerListed) {
  install("org.kept", "1.5").preload = true;
  manual();
  expect_gone();
}

TEST_F(BadPackageManager, AnAnswerThatIsAnErrorIsNoAnswer) {
  unknown_package_result_ = PACKAGE_MANAGER_ERROR_IO_ERROR;
  manual();
  expect_kept();
}

TEST_F(BadPackageManager, AFailedWalkRemovesAndForgetsNothing) {
  remove("org.here");
  package_walk_result_ = PACKAGE_MANAGER_ERROR_IO_ERROR;
  manual();
  expect_kept();
  EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.here", "org.kept"));
}

TEST_F(BadPackageManager, AnEmptyWalkOverFoldersThatAreThereRemovesNothing) {
  const std::string folder = std::string(kAppsDir) + "org.quarn-test-kept";
  std::error_code none;
  if (!std::filesystem::create_directories(folder, none)) return;
  install("org.quarn-test-kept");
  manual();
  packages_.clear();
  automatic();
  std::filesystem::remove(folder);
  EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.quarn-test-kept"));
  EXPECT_TRUE(
      in_cloud(std::string("/") + kSerial + "/org.quarn-test-kept/1.0.0/org.quarn-test-kept.zip"));
}

TEST_F(Claims, ARunThatIsCancelledBetweenListAndCleanUpLosesNothingAndTheNextEndsIt) {
  at(Op::list, "", [] {
    manual_backup_canceled = true;
    set_poll_hook([](int) {});
  });
  manual();
  set_poll_hook([this](int) { cloud_.answer_next(); });
  EXPECT_EQ(sent_statuses().back().err, 17);
  cloud_.answer_all();
  EXPECT_EQ(cloud_.objects[kept_], content_) << "what came late deleted nothing";
  manual_backup_canceled = false;
  wait_for_kept();
  manual();
  EXPECT_EQ(cloud_.objects[kept_], content_);
  await_no_archives();
  manual();
  expect_gone();
}

}  // namespace
