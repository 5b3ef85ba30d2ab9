#include <sys/stat.h>

#include <filesystem>
#include <map>
#include <thread>

#include "backup_device.h"
#include "poll_hook.h"
#include "quarn_common.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/pipeline.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/bounds.h"

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::Return;
using ::testing::StartsWith;

namespace {

constexpr std::uint32_t kRequest = 41;
constexpr int kPausesPerMinute = 6000;

std::vector<backup_progress> seen_progress;
std::vector<std::string> seen_packages;
std::function<void(const backup_progress &)> on_progress;

void record_progress(const backup_progress &progress) {
  seen_progress.push_back(progress);
  seen_packages.emplace_back(progress.package);
  seen_progress.back().package = "";
  if (on_progress) on_progress(progress);
}

class Pipeline : public BackupDevice {
 protected:
  Pipeline() {
    seen_progress.clear();
    seen_packages.clear();
    on_progress = nullptr;
    answer_at_every_pause();
  }
  ~Pipeline() override {
    set_poll_hook(nullptr);
    cloud_.answer_all();
  }

  void answer_at_every_pause() {
    set_poll_hook([this](int) { cloud_.answer_next(); });
  }
  /** Once the newest request begins so and is not answered, do this in place of answering. */
  void during(const std::string &request, std::function<void()> action) {
    set_poll_hook([this, request, action](int) {
      const auto all = cloud_.requests();
      if (cloud_.waiting() > 0 && all.back().rfind(request, 0) == 0) {
        action();
      } else {
        cloud_.answer_next();
      }
    });
  }
  void during_stage(backup_stage stage, std::function<void()> action) {
    on_progress = [stage, action](const backup_progress &progress) {
      if (progress.stage == stage) action();
    };
    set_backup_progress_sink(record_progress);
  }

  void manual() { do_backup(true, std::unique_ptr<client_cb_data>(new_client(kRequest))); }
  void automatic() { do_backup(false, nullptr); }

  static SentStatus sent(int err, int status) { return {err, status, kRequest}; }
  bool last_time_set() const { return settings_.count(kLastTimeKey) != 0; }
  void expect_failed(int err, int status) {
    EXPECT_THAT(sent_statuses(), ElementsAre(sent(err, status)));
    EXPECT_EQ(error("manual backup couldn't be completed... cause=" + std::to_string(err)), 1);
    EXPECT_FALSE(last_time_set());
    expect_nothing_staged();
  }
  void expect_nothing_staged() {
    EXPECT_FALSE(exists(kLocalAppListPath));
    for (const auto &package : packages_) EXPECT_FALSE(exists(package.staged())) << package.id;
  }
  /** Nobody holds a staged file any more. */
  void expect_all_released() {
    const BackupContextPtr other(new backup_context);
    EXPECT_TRUE(acquire_staged_archive(other.get(), kStagedListLease));
    for (const auto &package : packages_) {
      EXPECT_TRUE(acquire_staged_archive(other.get(), package.id)) << package.id;
    }
  }
  AppList cloud_list() { return AppList(cloud_.objects[kAppListInCloud]); }
  int info(const std::string &text) const { return count_logged(DLOG_INFO, text); }
  int error(const std::string &text) const { return count_logged(DLOG_ERROR, text); }
};

/* ---- runs that succeed ---- */

TEST_F(Pipeline, FirstBackupLeavesArchivesAndListInTheCloud) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b", "2.1");
  manual();
  EXPECT_THAT(sent_statuses(), ElementsAre(sent(0, 4)));
  EXPECT_THAT(cloud_.paths(), ElementsAre(a.object(), b.object(), kAppListInCloud));
  const AppList list = cloud_list();
  EXPECT_EQ(list.models(), 1U);
  EXPECT_THAT(list.package_ids(0), ElementsAre("org.a", "org.b"));
  EXPECT_TRUE(last_time_set());
  expect_nothing_staged();
  expect_all_released();
}

TEST_F(Pipeline, StagesFollowEachOtherInTheLog) {
  install("org.a");
  manual();
  std::vector<std::string> stages;
  for (const auto &text : captured_texts()) {
    if (text.rfind("===", 0) == 0 || text.find("app data") != std::string::npos ||
        text.find("app list") != std::string::npos || text.find("manual backup") == 0) {
      stages.push_back(text);
    }
  }
  EXPECT_THAT(
      stages,
      ElementsAre("=== checking app list from cloud ===", "app list file is not exist in cloud",
                  "=== make backup items ===", "app list is made newly",
                  "app data of (org.a) was changed, so will be backed up",
                  "=== upload all app data ===",
                  "waiting for upload completion of app data.(remain num = 1)",
                  "=== upload app list ===", "waiting for upload completion of app list...",
                  "backup trans success : app list upload", "=== start : clean up cloud ===",
                  "=== success : clean up cloud ===", "manual backup successful!"));
}

TEST_F(Pipeline, SecondRunOfAnUnchangedDeviceUploadsTheListOnly) {
  install("org.a");
  automatic();
  const auto before = cloud_list().packages(0);
  clear_captured_log();
  const auto requests = cloud_.requests().size();
  automatic();
  EXPECT_EQ(info("no app data to upload"), 1);
  EXPECT_EQ(info("=== success : clean up cloud ==="), 1);
  EXPECT_EQ(info("auto backup successful!"), 1);
  EXPECT_EQ(cloud_list().packages(0), before);
  auto later = cloud_.requests();
  later.erase(later.begin(), later.begin() + static_cast<std::ptrdiff_t>(requests));
  EXPECT_THAT(later, ElementsAre("download /app_list/app_list.txt", "upload /app_list/app_list.txt",
                                 "list /350000000000001/ 0"));
  EXPECT_THAT(sent_statuses(), IsEmpty());
}

TEST_F(Pipeline, ChangedPackageAloneIsUploadedAgain) {
  install("org.a");
  FakePackage &b = install("org.b");
  automatic();
  write_text(b.root + "/data/file.txt", "changed");
  automatic();
  EXPECT_EQ(cloud_.count_requests("upload /350000000000001/org.a/1.0.0/org.a.zip"), 1);
  EXPECT_EQ(cloud_.count_requests("upload /350000000000001/org.b/1.0.0/org.b.zip"), 2);
}

TEST_F(Pipeline, UpdatedPackageReplacesItsOldVersion) {
  FakePackage &a = install("org.a", "A");
  automatic();
  a.version = "B";
  automatic();
  EXPECT_THAT(cloud_.paths(), ElementsAre("/350000000000001/org.a/B/org.a.zip", kAppListInCloud));
  EXPECT_THAT(cloud_list().packages(0), ElementsAre(StartsWith("org.a B ")));
}

TEST_F(Pipeline, UninstalledPackageLeavesTheCloud) {
  const FakePackage &a = install("org.a");
  install("org.b");
  automatic();
  remove("org.b");
  automatic();
  EXPECT_THAT(cloud_.paths(), ElementsAre(a.object(), kAppListInCloud));
  EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.a"));
}

TEST_F(Pipeline, PackageThatOptsOutLaterKeepsItsArchive) {
  FakePackage &a = install("org.a");
  automatic();
  a.apps[0].disabled = true;
  automatic();
  EXPECT_THAT(cloud_.paths(), ElementsAre(a.object(), kAppListInCloud));
  EXPECT_THAT(cloud_list().packages(0), ElementsAre("org.a 1.0.0 0"));
}

TEST_F(Pipeline, PackageThatCannotBePackedKeepsItsLastArchive) {
  const FakePackage &a = install("org.a");
  install("org.b");
  automatic();
  const std::string good = cloud_.objects[a.object()];
  std::filesystem::remove_all(a.root + "/shared/trusted");
  write_text(a.root + "/data/file.txt", "changed");
  automatic();
  EXPECT_EQ(info("auto backup successful!"), 2);
  EXPECT_EQ(cloud_.objects[a.object()], good);
  EXPECT_THAT(cloud_list().packages(0), Contains("org.a 1.0.0 0"));
}

TEST_F(Pipeline, TwoDevicesOfOneAccountKeepTheirEntries) {
  install("org.shared");
  automatic();
  const std::string first = cloud_.objects[kAppListInCloud];
  ON_CALL(platform_, tel_get_misc_me_imei_sync).WillByDefault([](TapiHandle *) {
    return strdup("SECOND");
  });
  install("org.second");
  automatic();
  const AppList list = cloud_list();
  ASSERT_EQ(list.models(), 2U);
  EXPECT_EQ(list.info(1, "serial_number"), "SECOND");
  EXPECT_THAT(list.package_ids(0), ElementsAre("org.shared"));
  EXPECT_THAT(list.package_ids(1), ElementsAre("org.shared", "org.second"));
  const std::string entry = first.substr(first.find("[ {") + 2);
  EXPECT_THAT(cloud_.objects[kAppListInCloud], HasSubstr(entry.substr(0, entry.rfind("} ] }"))));
  EXPECT_EQ(cloud_.objects.count("/350000000000001/org.shared/1.0.0/org.shared.zip"), 1U);
  EXPECT_EQ(cloud_.objects.count("/SECOND/org.shared/1.0.0/org.shared.zip"), 1U);
}

TEST_F(Pipeline, UploadsOfManyPackagesDoNotKeepAllTheirFilesOpen) {
  constexpr int kPackages = 300;
  for (int i = 0; i < kPackages; ++i) install("org.app" + std::to_string(i));
  std::size_t most = 0;
  set_poll_hook([&](int) {
    if (info("=== upload app list ===") == 0) most = std::max(most, cloud_.waiting());
    while (cloud_.waiting() > 250) cloud_.answer_next();
    cloud_.answer_next();
  });
  automatic();
  EXPECT_EQ(most, 256U);
  EXPECT_EQ(cloud_.objects.size(), std::size_t{kPackages} + 1);
  EXPECT_EQ(info("auto backup successful!"), 1);
}

TEST_F(Pipeline, CancelBeforeEveryUploadIsRequestedDeletesTheRest) {
  for (int i = 0; i < 300; ++i) install("org.app" + std::to_string(i));
  during("upload ", [] { manual_backup_canceled = true; });
  manual();
  EXPECT_EQ(cloud_.waiting(), 256U);
  expect_failed(17, 6);
  cloud_.answer_all();
  expect_all_released();
}

TEST_F(Pipeline, UnusableCloudListIsReplaced) {
  cloud_.objects[kAppListInCloud] = "{ broken";
  install("org.a");
  automatic();
  EXPECT_EQ(info("json token error"), 1);
  EXPECT_EQ(info("auto backup successful!"), 1);
  EXPECT_THAT(cloud_list().package_ids(0), ElementsAre("org.a"));
}

TEST_F(Pipeline, ListOfAnotherFormatStaysInTheCloud) {
  const std::string later = R"({"format_ver":2,"model_list":[{"new":"form"}]})";
  cloud_.objects[kAppListInCloud] = later;
  install("org.a");
  automatic();
  EXPECT_EQ(info("format version in json changed"), 1);
  EXPECT_EQ(cloud_.objects[kAppListInCloud], later);
  EXPECT_EQ(error("auto backup couldn't be completed... cause=12"), 1);
  EXPECT_FALSE(last_time_set());
}

TEST_F(Pipeline, LeftoverStagedListIsNotUploadedInPlaceOfNone) {
  cloud_.objects[kAppListInCloud] = R"({"format_ver":2})";
  during_stage(backup_stage::archiving, [] { write_text(kLocalAppListPath, "left over"); });
  automatic();
  EXPECT_EQ(cloud_.objects[kAppListInCloud], R"({"format_ver":2})");
}

TEST_F(Pipeline, CleanUpFailureDoesNotFailTheBackup) {
  install("org.a");
  cloud_.refuse = [](Op op, const std::string &) { return op == Op::list ? 2 : 0; };
  manual();
  EXPECT_EQ(error("=== failed : clean up cloud ==="), 1);
  EXPECT_EQ(info("=== success : clean up cloud ==="), 0);
  EXPECT_EQ(info("manual backup successful!"), 1);
  EXPECT_THAT(sent_statuses(), ElementsAre(sent(0, 4)));
  EXPECT_TRUE(last_time_set());
}

TEST_F(Pipeline, IncompleteWalkDeletesNothingAndForgetsNothing) {
  install("org.a");
  const FakePackage &b = install("org.b");
  automatic();
  const auto before = cloud_list().package_ids(0);
  const std::string object = b.object();
  remove("org.b");  // the walk ends before it
  package_walk_result_ = PACKAGE_MANAGER_ERROR_IO_ERROR;
  automatic();
  EXPECT_EQ(cloud_.objects.count(object), 1U);
  EXPECT_EQ(cloud_list().package_ids(0), before);
  EXPECT_EQ(info("auto backup successful!"), 2);
}

/* ---- runs that fail ---- */

TEST_F(Pipeline, MissingDeviceInformationEndsWith36) {
  ON_CALL(platform_, tel_init).WillByDefault(Return(nullptr));
  manual();
  EXPECT_EQ(error("cannot get device info"), 1);
  EXPECT_THAT(cloud_.requests(), IsEmpty());
  expect_failed(36, 5);
}

TEST_F(Pipeline, MissingModelEndsWith36) {
  ON_CALL(platform_, system_info_get_platform_string).WillByDefault(Return(-1));
  automatic();
  EXPECT_EQ(error("cannot get device info"), 1);
  EXPECT_EQ(error("auto backup couldn't be completed... cause=36"), 1);
}

TEST_F(Pipeline, SerialThatIsNoFolderNameEndsWith36) {
  ON_CALL(platform_, tel_get_misc_me_imei_sync).WillByDefault([](TapiHandle *) {
    return strdup("../other");
  });
  automatic();
  EXPECT_EQ(error("cannot get device info"), 1);
  EXPECT_THAT(cloud_.requests(), IsEmpty());
}

TEST_F(Pipeline, RefusedListDownloadEndsTheRun) {
  cloud_.refuse = [](Op, const std::string &) { return 2; };
  manual();
  expect_failed(13, 5);
  EXPECT_EQ(info("=== make backup items ==="), 0);
}

TEST_F(Pipeline, FailedListDownloadEndsWith13) {
  cloud_.fail = [](Op, const std::string &) { return 16; };
  manual();
  expect_failed(13, 5);
  EXPECT_EQ(info("=== make backup items ==="), 0);
}

TEST_F(Pipeline, OneFailedUploadFailsTheRunAfterTheOthersAreThrough) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b");
  install("org.c");
  cloud_.fail = [&](Op, const std::string &path) { return path == b.object() ? 16 : 0; };
  automatic();
  EXPECT_EQ(error("auto backup couldn't be completed... cause=12"), 1);
  EXPECT_FALSE(last_time_set());
  EXPECT_THAT(cloud_.paths(), ElementsAre(a.object(), package("org.c").object()));
  EXPECT_EQ(info("=== upload app list ==="), 0);
  expect_nothing_staged();
  expect_all_released();
  cloud_.fail = nullptr;
  automatic();
  EXPECT_EQ(info("auto backup successful!"), 1);
  EXPECT_EQ(cloud_.objects.count(b.object()), 1U);
}

TEST_F(Pipeline, RefusedUploadFailsTheRun) {
  const FakePackage &a = install("org.a");
  cloud_.refuse = [&](Op, const std::string &path) { return path == a.object() ? 1 : 0; };
  manual();
  EXPECT_EQ(info("no app data to upload"), 1);
  EXPECT_EQ(info("=== upload app list ==="), 0);
  expect_failed(12, 5);
  expect_all_released();
}

TEST_F(Pipeline, RefusedListUploadFailsTheRun) {
  install("org.a");
  cloud_.refuse = [](Op op, const std::string &path) {
    return op == Op::upload && path == kAppListInCloud ? 2 : 0;
  };
  manual();
  EXPECT_EQ(info("=== start : clean up cloud ==="), 0);
  expect_failed(12, 5);
}

TEST_F(Pipeline, ConflictingListUploadFailsTheRunAndTheNextStartsFromTheNewList) {
  install("org.a");
  const std::string other =
      R"({"format_ver":1,"model_list":[{"backup_info":{"serial_number":"B"},"pkg_list":[]}]})";
  cloud_.fail = [&](Op op, const std::string &path) {
    if (op != Op::upload || path != kAppListInCloud) return 0;
    cloud_.objects[kAppListInCloud] = other;
    return static_cast<int>(BACKUP_TRANS_ERROR_CONFLICT);
  };
  manual();
  EXPECT_EQ(error("__upload_app_list_resp_cb failed...err_code[14]"), 1);
  expect_failed(12, 5);
  EXPECT_EQ(cloud_.objects[kAppListInCloud], other);
  cloud_.fail = nullptr;
  automatic();
  EXPECT_EQ(cloud_list().models(), 2U);
}

/* ---- cancellation ---- */

TEST_F(Pipeline, BackupCancelledBeforeItsStartDoesNothing) {
  manual_backup_canceled = true;
  manual();
  EXPECT_EQ(error("manual backup was cancelled"), 1);
  EXPECT_THAT(sent_statuses(), ElementsAre(sent(17, 6)));
  EXPECT_THAT(cloud_.requests(), IsEmpty());
  EXPECT_EQ(error("manual backup couldn't be completed... cause=17"), 0);
}

TEST_F(Pipeline, CancelDoesNotTouchAutomaticBackups) {
  install("org.a");
  manual_backup_canceled = true;
  automatic();
  EXPECT_EQ(info("auto backup successful!"), 1);
}

class CancelDuring : public Pipeline, public ::testing::WithParamInterface<const char *> {};

TEST_P(CancelDuring, StopsWith17AndLateAnswersAreHarmless) {
  install("org.a");
  install("org.b");
  cloud_.objects["/350000000000001/org.gone/1/a.zip"] = "x";
  during(GetParam(), [] { manual_backup_canceled = true; });
  manual();
  EXPECT_EQ(info("manual backup cancelled"), 1);
  EXPECT_EQ(cloud_.cancels, 0);
  EXPECT_GT(cloud_.waiting(), 0U) << "the answers are still to come";
  expect_failed(17, 6);
  clear_captured_log();
  cloud_.answer_all();
  expect_all_released();
  manual_backup_canceled = false;
  answer_at_every_pause();
  manual();
  EXPECT_EQ(info("manual backup successful!"), 1) << "the next run is not disturbed";
}

INSTANTIATE_TEST_SUITE_P(EveryWait, CancelDuring,
                         ::testing::Values("download ", "upload /350000000000001/org.b",
                                           "upload /app_list", "list ", "delete "));

TEST_F(Pipeline, CancelWhileItemsAreMadeDeletesThemBeforeTheClientIsTold) {
  const FakePackage &a = install("org.a");
  during_stage(backup_stage::archiving, [] { manual_backup_canceled = true; });
  bool still_there = true;
  set_status_hook([&](int, int) { still_there = exists(a.staged()); });
  manual();
  EXPECT_EQ(info("manual backup cancelled"), 1);
  EXPECT_EQ(info("=== upload all app data ==="), 0);
  EXPECT_FALSE(still_there);
  expect_failed(17, 6);
  expect_all_released();
}

TEST_F(Pipeline, CancelThatComesAfterTheLastCheckStillCounts) {
  install("org.a");
  cloud_.refuse = [](Op op, const std::string &) {
    if (op == Op::list) manual_backup_canceled = true;
    return op == Op::list ? 2 : 0;
  };
  manual();
  EXPECT_EQ(info("manual backup cancelled"), 1);
  expect_failed(17, 6);
}

TEST_F(Pipeline, CancelAmongTheUploadRequestsIsTheLastOfThem) {
  constexpr int kPackages = 12;
  constexpr int kBefore = 3;
  for (int i = 0; i < kPackages; ++i) install("org.package" + std::to_string(i));
  int uploads = 0;
  cloud_.refuse = [&uploads](Op op, const std::string &) {
    if (op == Op::upload && ++uploads == kBefore) manual_backup_canceled = true;
    return 0;
  };
  manual();
  EXPECT_EQ(uploads, kBefore);
  EXPECT_EQ(info("manual backup cancelled"), 1);
  expect_failed(17, 6);
  cloud_.answer_all();
  expect_all_released();
}

TEST_F(Pipeline, WifiLossAmongTheUploadRequestsIsTheLastOfThem) {
  constexpr int kPackages = 12;
  constexpr int kBefore = 3;
  for (int i = 0; i < kPackages; ++i) install("org.package" + std::to_string(i));
  int uploads = 0;
  cloud_.refuse = [&uploads](Op op, const std::string &) {
    if (op == Op::upload && ++uploads == kBefore) fake_wifi = 0;
    return 0;
  };
  manual();
  EXPECT_EQ(uploads, kBefore);
  EXPECT_EQ(cloud_.cancels, 1);
  expect_failed(12, 5);
  cloud_.answer_all();
  expect_all_released();
}

/** The transport's answers to a cancel are all there before the run looks again. */
class AbortDuring : public Pipeline, public ::testing::WithParamInterface<const char *> {};

TEST_P(AbortDuring, TheCancelledRunHasItsLineAndItsResult) {
  install("org.a");
  install("org.b");
  cloud_.objects["/350000000000001/org.gone/1/a.zip"] = "x";
  cloud_.aborts = true;
  during(GetParam(), [this] {
    manual_backup_canceled = true;
    backup_trans_cancel_request(nullptr);
    cloud_.answer_all();
  });
  manual();
  EXPECT_EQ(info("manual backup cancelled"), 1);
  EXPECT_EQ(cloud_.waiting(), 0U);
  expect_failed(17, 6);
  expect_all_released();
}

INSTANTIATE_TEST_SUITE_P(EveryWait, AbortDuring,
                         ::testing::Values("download ", "upload /350000000000001/org.b",
                                           "upload /app_list", "list ", "delete "));

/* ---- Wi-Fi loss ---- */

TEST_F(Pipeline, NoWifiAtTheStartEndsWith12) {
  fake_wifi = 0;
  manual();
  EXPECT_EQ(error("WIFI disconnected"), 1);
  EXPECT_THAT(cloud_.requests(), IsEmpty());
  expect_failed(12, 5);
}

class WifiLossDuring : public Pipeline, public ::testing::WithParamInterface<const char *> {};

TEST_P(WifiLossDuring, CancelsTheTransfersAndEndsWith12) {
  install("org.a");
  install("org.b");
  cloud_.objects["/350000000000001/org.gone/1/a.zip"] = "x";
  during(GetParam(), [] { fake_wifi = 0; });
  manual();
  EXPECT_EQ(error("WIFI disconnected"), 1);
  EXPECT_EQ(cloud_.cancels, 1);
  EXPECT_GT(cloud_.waiting(), 0U);
  expect_failed(12, 5);
  cloud_.fail = [](Op, const std::string &) {
    return static_cast<int>(BACKUP_TRANS_ERROR_CANCELLED);
  };
  cloud_.answer_all();
  expect_all_released();
}

INSTANTIATE_TEST_SUITE_P(EveryWait, WifiLossDuring,
                         ::testing::Values("download ", "upload /350000000000001/org.b",
                                           "upload /app_list", "list ", "delete "));

TEST_F(Pipeline, WifiLossWhileItemsAreMadeEndsWithoutACancelRequest) {
  install("org.a");
  during_stage(backup_stage::archiving, [] { fake_wifi = 0; });
  manual();
  EXPECT_EQ(error("WIFI disconnected"), 1);
  EXPECT_EQ(cloud_.cancels, 0);
  expect_failed(12, 5);
  expect_all_released();
}

TEST_F(Pipeline, CancellationIsSeenBeforeWifiLoss) {
  install("org.a");
  during("download ", [] {
    manual_backup_canceled = true;
    fake_wifi = 0;
  });
  manual();
  EXPECT_EQ(error("WIFI disconnected"), 0);
  expect_failed(17, 6);
}

/* ---- waiting ---- */

class LongWait : public Pipeline,
                 public ::testing::WithParamInterface<std::pair<const char *, const char *>> {};

TEST_P(LongWait, LogsEveryMinuteAndNeverGivesUp) {
  install("org.a");
  const int minutes = 3;
  int waited = 0;
  during(GetParam().first, [&] {
    if (++waited > minutes * kPausesPerMinute) cloud_.answer_next();
  });
  manual();
  for (int minute = 1; minute <= minutes; ++minute) {
    EXPECT_EQ(info("[" + std::to_string(minute) + " min] " + GetParam().second), 1) << minute;
  }
  EXPECT_EQ(info("[" + std::to_string(minutes + 1) + " min] " + GetParam().second), 0);
  EXPECT_THAT(sent_statuses(), ElementsAre(sent(0, 4)));
  EXPECT_GT(polls(), minutes * kPausesPerMinute) << "and each pause is ten milliseconds";
}

INSTANTIATE_TEST_SUITE_P(
    EveryWait, LongWait,
    ::testing::Values(std::make_pair("download ", "waiting for app list download completion..."),
                      std::make_pair("upload /350000000000001/",
                                     "waiting for upload completion of app data.(remain num = 1)"),
                      std::make_pair("upload /app_list",
                                     "waiting for upload completion of app list..."),
                      std::make_pair("list ", "waiting for clean up cloud completion...")));

TEST_F(Pipeline, NextRunWaitsForTheLastAnswerOfAnAbandonedOne) {
  install("org.a");
  during("list ", [] { manual_backup_canceled = true; });
  manual();
  const std::size_t late = cloud_.waiting();
  ASSERT_GT(late, 0U);
  manual_backup_canceled = false;
  set_poll_hook([this](int) { cloud_.answer_next(); });
  std::thread worker([] { do_backup(false, nullptr); });
  for (std::size_t i = 0; i < late; ++i) {
    EXPECT_EQ(cloud_.count_requests("download /app_list/app_list.txt"), 1);
    cloud_.answer_next();
  }
  worker.join();
  EXPECT_EQ(cloud_.count_requests("download /app_list/app_list.txt"), 2);
  EXPECT_EQ(info("auto backup successful!"), 1);
}

/* ---- what belongs to others ---- */

TEST_F(Pipeline, FinishDeletesOnlyWhatTheRunHolds) {
  const FakePackage &a = install("org.a");
  write_text(a.staged(), "of another");
  std::filesystem::create_directories("/tmp/quarn");
  write_text(kLocalAppListPath, "of another");
  const BackupContextPtr ctx(new backup_context);
  ctx->upload_list.push_back({kSerial, a.id, a.version, a.root, 0});
  ctx->uploads_requested = 1;
  delete_backup_items(ctx.get());
  EXPECT_TRUE(exists(a.staged()));
  EXPECT_TRUE(exists(kLocalAppListPath));
  ASSERT_TRUE(acquire_staged_archive(ctx.get(), a.id));
  ASSERT_TRUE(acquire_staged_archive(ctx.get(), kStagedListLease));
  finish_backup(ctx.get());
  EXPECT_FALSE(exists(a.staged()));
  EXPECT_FALSE(exists(kLocalAppListPath));
  EXPECT_TRUE(holds_staged_archive(ctx.get(), a.id)) << "its upload is still to be answered";
  EXPECT_TRUE(ctx->finished);
}

TEST_F(Pipeline, FailureToStoreTheTimeDoesNotFailTheBackup) {
  install("org.a");
  settings_work_ = false;
  manual();
  EXPECT_EQ(error("cannot set last backup time to vconf"), 1);
  EXPECT_THAT(sent_statuses(), ElementsAre(sent(0, 4)));
}

/* ---- progress ---- */

class Progress : public Pipeline {
 protected:
  Progress() { set_backup_progress_sink(record_progress); }

  struct Step {
    backup_stage stage;
    std::string package;
    backup_outcome outcome;
    bool operator==(const Step &other) const {
      return stage == other.stage && package == other.package && outcome == other.outcome;
    }
  };
  std::vector<Step> steps() const {
    std::vector<Step> all;
    for (std::size_t i = 0; i < seen_progress.size(); ++i) {
      all.push_back({seen_progress[i].stage, seen_packages[i], seen_progress[i].outcome});
    }
    return all;
  }
  backup_progress of(const std::string &package) const {
    for (std::size_t i = 0; i < seen_progress.size(); ++i) {
      if (seen_packages[i] == package) return seen_progress[i];
    }
    ADD_FAILURE() << "no progress of " << package;
    return {};
  }
};

TEST_F(Progress, TellsStagesAndPackagesInOrder) {
  const FakePackage &a = install("org.a");
  automatic();
  using Stage = backup_stage;
  using Outcome = backup_outcome;
  EXPECT_THAT(steps(), ElementsAre(Step{Stage::checking, "", Outcome::none},
                                   Step{Stage::archiving, "", Outcome::none},
                                   Step{Stage::archiving, "org.a", Outcome::none},
                                   Step{Stage::uploading, "", Outcome::none},
                                   Step{Stage::uploading, "org.a", Outcome::uploaded},
                                   Step{Stage::listing, "", Outcome::none},
                                   Step{Stage::cleaning, "", Outcome::none},
                                   Step{Stage::finished, "", Outcome::none}));
  const backup_progress &upload = seen_progress[4];
  EXPECT_EQ(upload.index, 1);
  EXPECT_EQ(upload.count, 1);
  EXPECT_EQ(upload.bytes_total, cloud_.objects[a.object()].size());
  EXPECT_EQ(upload.bytes_done, upload.bytes_total);
  EXPECT_EQ(upload.size, upload.bytes_total);
  EXPECT_EQ(seen_progress[2].index, 1);
  for (const auto &progress : seen_progress) EXPECT_EQ(progress.run, seen_progress[0].run);
  EXPECT_EQ(seen_progress.back().result, 0);
}

TEST_F(Progress, TellsRunsApart) {
  automatic();
  const auto first = seen_progress.front().run;
  seen_progress.clear();
  automatic();
  EXPECT_NE(seen_progress.front().run, first);
}

TEST_F(Progress, TellsWhyAPackageWasNotUploaded) {
  install("org.external").external = true;
  install("org.disabled").apps[0].disabled = true;
  const FakePackage &large = install("org.large", "1", "");
  write_sparse(large.root + "/data/big", kMaxBackupSize + 5);
  const FakePackage &unreadable = install("org.unreadable");
  std::filesystem::remove_all(unreadable.root + "/data");
  const FakePackage &refused = install("org.refused");
  const FakePackage &same = install("org.same");
  cloud_.refuse = [&](Op, const std::string &path) { return path == refused.object() ? 1 : 0; };
  automatic();
  EXPECT_EQ(of("org.external").outcome, backup_outcome::external);
  EXPECT_EQ(of("org.disabled").outcome, backup_outcome::disabled);
  EXPECT_EQ(of("org.large").outcome, backup_outcome::too_large);
  EXPECT_EQ(of("org.large").size, kMaxBackupSize + 5);
  EXPECT_EQ(of("org.large").limit, kMaxBackupSize);
  EXPECT_EQ(of("org.unreadable").outcome, backup_outcome::unreadable);
  EXPECT_THAT(steps(), Contains(Step{backup_stage::uploading, "org.refused",
                                     backup_outcome::upload_failed}));
  EXPECT_EQ(seen_progress.back().result, 12);

  cloud_.refuse = nullptr;
  automatic();
  seen_progress.clear();
  seen_packages.clear();
  automatic();
  EXPECT_EQ(of("org.same").outcome, backup_outcome::unchanged);
  EXPECT_EQ(of("org.same").size, cloud_.objects[same.object()].size());
}

TEST_F(Pipeline, AnApplicationsFilesWithTheNamesOfWorkingFilesAreLeftAlone) {
  const FakePackage &app = install("org.app");
  const std::string shared = app.root + "/shared/data/";
  const std::vector<std::string> own = {"org.app_upload.zip", "org.app_download.zip",
                                        "org.app.perm", "quarn_tmp_rst_dir"};
  std::map<std::string, ino_t> inodes;
  for (const std::string &name : own) {
    write_text(shared + name, "own " + name);
    ASSERT_EQ(chown((shared + name).c_str(), kAppUid, kAppGid), 0);
    struct stat status = {};
    ASSERT_EQ(lstat((shared + name).c_str(), &status), 0);
    inodes[name] = status.st_ino;
  }
  for (int run = 0; run < 2; ++run) {
    automatic();
    EXPECT_EQ(cloud_.objects.count(app.object()), 1U);
    EXPECT_EQ(cloud_.objects[app.object()].find("shared/data/org.app_upload.zip"),
              std::string::npos);
    std::size_t files = 0;
    for (const auto &entry : std::filesystem::directory_iterator(shared)) {
      ++files;
      const std::string name = entry.path().filename();
      EXPECT_EQ(read_text(entry.path()), "own " + name);
      struct stat status = {};
      ASSERT_EQ(lstat(entry.path().c_str(), &status), 0);
      EXPECT_EQ(status.st_ino, inodes[name]) << name;
      EXPECT_EQ(status.st_uid, kAppUid) << name;
    }
    EXPECT_EQ(files, own.size());
    write_text(app.root + "/data/more", "changed");
  }
}

TEST_F(Pipeline, WhereTheApplicationHasBothNamesOfAnArchiveNothingIsDeleted) {
  const FakePackage &app = install("org.app");
  const std::string shared = app.root + "/shared/data/";
  const std::vector<std::string> own = {"org.app_upload.zip",
                                        "quarn_tmp_rst_dir.org.app_upload.zip"};
  for (const std::string &name : own) {
    write_text(shared + name, "own " + name);
    ASSERT_EQ(chown((shared + name).c_str(), kAppUid, kAppGid), 0);
  }
  automatic();
  for (const std::string &name : own) EXPECT_EQ(read_text(shared + name), "own " + name);
  EXPECT_EQ(cloud_.objects.count(app.object()), 0U);
}

TEST_F(Progress, TellsWhichBoundAPackageGoesBeyond) {
  const FakePackage &many = install("org.many", "1", "");
  for (std::uint64_t i = 0; i <= kBackupBounds.members; ++i) {
    ASSERT_EQ(mknod((many.root + "/shared/data/" + std::to_string(i)).c_str(), S_IFREG | 0600, 0),
              0);
  }
  const FakePackage &names = install("org.names", "1", "");
  std::string below = names.root + "/data";
  for (int i = 0; i < 17; ++i) below += "/" + std::string(200, 'p');
  std::filesystem::create_directories(below);
  for (int i = 0; i < 5200; ++i) {
    ASSERT_EQ(mknod((below + "/" + std::to_string(i)).c_str(), S_IFREG | 0600, 0), 0);
  }
  automatic();
  EXPECT_EQ(of("org.many").outcome, backup_outcome::too_many_files);
  EXPECT_EQ(of("org.many").size, kBackupBounds.members + 1);
  EXPECT_EQ(of("org.many").limit, kBackupBounds.members);
  EXPECT_EQ(of("org.names").outcome, backup_outcome::table_too_large);
  EXPECT_EQ(of("org.names").limit, kBackupBounds.table);
  for (const FakePackage *package : {&many, &names}) {
    EXPECT_EQ(cloud_.objects.count(package->object()), 0U);
    EXPECT_FALSE(exists(package->staged()));
    EXPECT_EQ(count_logged(DLOG_ERROR, "fail to make zip data for " + package->id), 1);
  }
  EXPECT_EQ(seen_progress.back().result, 0) << "of the others";
}

TEST_F(Progress, TellsThatARulesFileCannotBeUsed) {
  const FakePackage &app = install("org.app");
  std::filesystem::create_directories(app.root + "/res");
  write_text(app.root + "/res/backup.path.xml", "<!DOCTYPE backup [<!ENTITY d \"x\">]><backup/>");
  automatic();
  EXPECT_EQ(of("org.app").outcome, backup_outcome::unusable_rules);
  EXPECT_THAT(cloud_.requests(), Not(Contains("upload " + app.object())));
}

TEST_F(Progress, TellsSizeAndFreeSpaceOfAPackageThatDoesNotFit) {
  const FakePackage &app = install("org.app", "1", "");
  const std::uint64_t size = std::uint64_t{1} << 43;
  write_sparse(app.root + "/data/huge", size);
  automatic();
  EXPECT_EQ(of("org.app").outcome, backup_outcome::no_space);
  EXPECT_EQ(of("org.app").size, size);
  EXPECT_GT(of("org.app").limit, 0U);
}

TEST_F(Progress, TheEndOfARunIsToldBeforeItsClientHearsOfIt) {
  std::vector<backup_stage> told;
  std::vector<int> results;
  set_status_hook([&](int, int) {
    told.push_back(seen_progress.back().stage);
    results.push_back(seen_progress.back().result);
  });
  manual();
  fake_wifi = 0;
  manual();
  set_status_hook(nullptr);
  EXPECT_THAT(told, ElementsAre(backup_stage::finished, backup_stage::finished));
  EXPECT_THAT(results, ElementsAre(0, 12));
}

TEST_F(Progress, NoSinkIsNotCalled) {
  set_backup_progress_sink(nullptr);
  automatic();
  EXPECT_THAT(seen_progress, IsEmpty());
}

}  // namespace
