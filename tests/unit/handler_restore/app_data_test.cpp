#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <future>
#include <thread>

#include "glib_handles.h"
#include "handler_fixture.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/admission.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/power.h"
#include "this_process.h"

using ::testing::_;
using ::testing::Return;
using ::testing::StrEq;

namespace {

/** What both per-application requests have in common. */
struct Request {
  const char *name;
  int (*start)(const char *pkg_id, void *record);
  const char *callback;
};
const Request kBackup = {"quarnd_backup_app_data", quarnd_backup_app_data,
                         "app_data_backup_complete"};
const Request kRestore = {"quarnd_restore_app_data", quarnd_restore_app_data,
                          "app_data_restore_complete"};

class AppDataTest : public HandlerTest {
 protected:
  int back_up(const char *pkg = kPkg) { return quarnd_backup_app_data(pkg, make_record(7)); }
  int restore(const char *pkg = kPkg) { return quarnd_restore_app_data(pkg, make_record(7)); }
  static Answers backed_up(int err) { return {{"app_data_backup_complete", err, kPkg, 7}}; }
  static Answers restored(int err) { return {{"app_data_restore_complete", err, kPkg, 7}}; }
  std::string staged() const { return at("shared/data/org.example.notes_upload.zip"); }
  const std::vector<Entry> new_data = {{"data/settings.ini", "new settings", 0600}};
};

class BothRequests : public AppDataTest, public ::testing::WithParamInterface<Request> {
 protected:
  int start(const char *pkg = kPkg) { return GetParam().start(pkg, make_record(7)); }
  Answers answered(int err, const std::string &pkg = kPkg) const {
    return {{GetParam().callback, err, pkg, 7}};
  }
  void expect_no_transfer() const {
    EXPECT_TRUE(downloads.empty());
    EXPECT_TRUE(uploads.empty());
    EXPECT_TRUE(is_idle_status());
  }
};

TEST_P(BothRequests, WithoutASessionTheAnswerIsThirtyThreeBeforeAnyLookup) {
  session.ready = false;
  EXPECT_CALL(platform, package_manager_get_package_info).Times(0);
  EXPECT_EQ(start(), 0);
  EXPECT_EQ(outside.answers, answered(33));
  expect_info(GetParam().name);
  expect_no_transfer();
}

TEST_P(BothRequests, AnUnknownPackageIsAnsweredWithOneTwice) {
  ON_CALL(platform, package_manager_get_package_info).WillByDefault(Return(-71));
  EXPECT_EQ(start(), 1);
  EXPECT_EQ(outside.answers, answered(1));
  expect_error("package_manager_get_package_info() failed : -71");
  expect_no_transfer();
}

TEST_P(BothRequests, AnImpossiblePackageIsUnknownWithoutTouchingThePlatform) {
  EXPECT_CALL(platform, package_manager_get_package_info).Times(0);
  for (const char *pkg : {"", ".", "..", "a/b", "../../etc"}) {
    outside.answers.clear();
    EXPECT_EQ(start(pkg), 1) << pkg;
    EXPECT_EQ(outside.answers, answered(1, pkg));
    expect_error("refused : not a package id (" + std::string(pkg) + ")");
  }
  EXPECT_EQ(start(nullptr), 1);
  EXPECT_EQ(session.asked, 0);
  expect_no_transfer();
}

TEST_P(BothRequests, APreloadedPackageIsAnsweredWithTwentySeven) {
  ON_CALL(platform, package_info_is_preload_package).WillByDefault([](auto, bool *preload) {
    *preload = true;
    return 0;
  });
  EXPECT_EQ(start(), 0);
  EXPECT_EQ(outside.answers, answered(27));
  expect_error("we don't support preload app");
  expect_no_transfer();
}

TEST_P(BothRequests, EveryFactThatCannotBeReadIsAnsweredWithFortyTwo) {
  const auto none = [](auto, char **text) {
    *text = nullptr;
    return 0;
  };
  const auto version = [](auto, char **text) {
    *text = strdup(kVersion);
    return 0;
  };
  ON_CALL(platform, package_info_is_preload_package).WillByDefault(Return(-5));
  EXPECT_EQ(start(), 0);
  expect_error("package_info_is_preload_package fail, err = [-5]");
  ON_CALL(platform, package_info_is_preload_package).WillByDefault([](auto, bool *preload) {
    *preload = false;
    return 0;
  });

  ON_CALL(platform, package_info_get_version).WillByDefault(Return(-5));
  EXPECT_EQ(start(), 0);
  expect_error("package_info_get_version() was failed, ret = [-5]");
  ON_CALL(platform, package_info_get_version).WillByDefault(none);
  EXPECT_EQ(start(), 0);
  expect_error("pkg_version is NULL");
  ON_CALL(platform, package_info_get_version).WillByDefault(version);

  ON_CALL(platform, package_info_get_root_path).WillByDefault(Return(-5));
  EXPECT_EQ(start(), 0);
  expect_error("package_info_get_root_path() was failed, ret = [-5]");
  ON_CALL(platform, package_info_get_root_path).WillByDefault(none);
  EXPECT_EQ(start(), 0);
  expect_error("pkg_root_path is NULL");

  ASSERT_EQ(outside.answers.size(), 5U);
  for (const auto &answer : outside.answers) EXPECT_EQ(answer.err, 42);
  expect_no_transfer();
}

TEST_P(BothRequests, AFailedFirstVisitIsAnsweredWithFortyTwo) {
  ON_CALL(platform, package_info_foreach_app_from_package).WillByDefault(Return(-5));
  EXPECT_EQ(start(), 0);
  EXPECT_EQ(outside.answers, answered(42));
  expect_error("package_info_foreach_app_from_package() failed : -5");
  expect_no_transfer();
}

TEST_P(BothRequests, AFailedSecondVisitIsAnsweredWithFortyTwo) {
  int visit = 0;
  ON_CALL(platform, package_info_foreach_app_from_package)
      .WillByDefault([&](auto, auto, auto, void *) { return ++visit == 2 ? -5 : 0; });
  EXPECT_EQ(start(), 0);
  EXPECT_EQ(outside.answers, answered(42));
  expect_error("package_info_foreach_app_from_package() failed : -5");
  expect_no_transfer();
}

TEST_P(BothRequests, ADisabledPackageIsAnsweredWithFortyOne) {
  opted_out = true;
  EXPECT_EQ(start(), 0);
  EXPECT_EQ(outside.answers, answered(41));
  expect_info("backup disabled for (org.example.notes)");
  EXPECT_FALSE(exists(staged())) << "nothing is zipped";
  expect_no_transfer();
}

TEST_P(BothRequests, APackageWithoutApplicationsHasNothingToTransfer) {
  apps.clear();
  EXPECT_EQ(start(), 0);
  EXPECT_EQ(outside.answers, answered(0));
  expect_no_transfer();
}

TEST_P(BothRequests, ThePackagesHandleIsReleased) {
  EXPECT_CALL(platform, package_info_destroy).Times(1);
  opted_out = true;
  EXPECT_EQ(start(), 0);
}

INSTANTIATE_TEST_SUITE_P(AppData, BothRequests, ::testing::Values(kBackup, kRestore),
                         [](const auto &info) {
                           return std::string(info.index == 0 ? "Backup" : "Restore");
                         });

/* ---- backup ---- */

TEST_F(AppDataTest, ABackupWaitsForItsUpload) {
  make_old_data();
  later([this] {
    EXPECT_TRUE(outside.answers.empty());
    EXPECT_FALSE(is_idle_status());
    ASSERT_EQ(uploads.size(), 1U) << "the first application only";
    EXPECT_EQ(uploads[0].local, staged());
    EXPECT_EQ(uploads[0].remote, "/350000000000001/org.example.notes/1.2.0/org.example.notes.zip");
    answer_upload();
  });
  EXPECT_EQ(back_up(), 0);
  EXPECT_EQ(outside.answers, backed_up(0));
  expect_info("backup enabled for (org.example.notes)");
  EXPECT_FALSE(exists(staged()));
  EXPECT_TRUE(is_idle_status());
}

TEST_F(AppDataTest, AnUploadThatFailsIsAnsweredWithTwelve) {
  make_old_data();
  later([this] { answer_upload(BACKUP_TRANS_ERROR_NETWORK); });
  EXPECT_EQ(back_up(), 0);
  EXPECT_EQ(outside.answers, backed_up(12));
}

TEST_F(AppDataTest, AnUploadThatIsRefusedIsAnsweredWithTwelveAtOnce) {
  make_old_data();
  upload_result = 2;
  EXPECT_EQ(back_up(), 0);
  EXPECT_EQ(outside.answers, backed_up(12));
}

TEST_F(AppDataTest, AnArchiveThatCannotBeMadeIsAnsweredWithItsCode) {
  ON_CALL(platform, pkgmgrinfo_pkginfo_get_installed_storage).WillByDefault([](auto, auto *where) {
    *where = PMINFO_EXTERNAL_STORAGE;
    return 0;
  });
  EXPECT_EQ(back_up(), 0);
  EXPECT_EQ(outside.answers, backed_up(34));
  expect_error("cannot make app data zip...");
}

TEST_F(AppDataTest, ABackupWithoutATypeIsAnsweredWithFortyTwo) {
  ON_CALL(platform, package_info_get_type).WillByDefault(Return(-5));
  EXPECT_EQ(back_up(), 0);
  expect_error("package_info_get_type() was failed, ret = [-5]");
  ON_CALL(platform, package_info_get_type).WillByDefault([](auto, char **text) {
    *text = nullptr;
    return 0;
  });
  EXPECT_EQ(back_up(), 0);
  expect_error("pkg_type is NULL");
  for (const auto &answer : outside.answers) EXPECT_EQ(answer.err, 42);
}

TEST_F(AppDataTest, ABackupWithoutDeviceInformationIsAnsweredWithFortyTwo) {
  ON_CALL(platform, tel_init).WillByDefault(Return(nullptr));
  EXPECT_EQ(back_up(), 0);
  EXPECT_EQ(outside.answers, backed_up(42));
  expect_error("cannot get device info");
}

// In a process of its own: from then on nothing waits any more.
TEST_F(AppDataTest, ABackupIsCancelledWhenTheDaemonEnds) {
  make_old_data();
  EXPECT_EXIT(
      {
        run_on_fiber([this] { back_up(); });
        const bool waited = outside.answers.empty();
        quit_nested_loops();
        const bool told = outside.answers == backed_up(17);
        answer_upload();  // comes too late, and finds everything it needs
        _exit(waited && told && outside.answers.size() == 1 ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

/* ---- restore ---- */

TEST_F(AppDataTest, ARestoreWaitsForItsDownloadAndIsWhole) {
  make_old_data();
  later([this] {
    EXPECT_TRUE(outside.answers.empty());
    EXPECT_FALSE(is_idle_status());
    ASSERT_EQ(downloads.size(), 1U) << "the first application only";
    EXPECT_EQ(downloads[0].remote,
              "/350000000000001/org.example.notes/1.2.0/org.example.notes.zip");
    clear_app_dir(kPkg, root.c_str());  // as freshly installed
    make_archive(download(), new_data);
    answer();
  });
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(0));
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  EXPECT_TRUE(is_idle_status());
}

TEST_F(AppDataTest, ARestoreDoesNotAskForTheType) {
  EXPECT_CALL(platform, package_info_get_type).Times(0);
  transport_result = 2;
  EXPECT_EQ(restore(), 0);
}

TEST_F(AppDataTest, ADownloadThatIsRefusedIsAnsweredWithThirteenWithoutWaiting) {
  transport_result = 2;
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(13));
}

TEST_F(AppDataTest, ADownloadThatFailsIsAnsweredWithTwelve) {
  later([this] { answer(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT); });
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(12));
}

TEST_F(AppDataTest, AnArchiveThatCannotBeUnpackedIsAnsweredWithThirtyOne) {
  make_old_data();
  const Tree before = tree_of(root);
  later([this] {
    write_text(download(), "not an archive");
    answer();
  });
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(31));
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(AppDataTest, AttributesThatCannotBeRestoredAreAnsweredWithThirtySix) {
  make_old_data();
  const Tree before = tree_of(root);
  later([this] {
    make_archive(download(), new_data, "not json");
    answer();
  });
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(36));
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(AppDataTest, ARestoreWithoutDeviceInformationIsAnsweredWithThirtySix) {
  ON_CALL(platform, system_info_get_platform_string).WillByDefault(Return(-1));
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(36));
  expect_error("cannot get device info");
}

TEST_F(AppDataTest, ARestoreInTheCompanionsModeDoesNotWait) {
  current_restore_client = QUARN_CLIENT_COMPANION;
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(outside.answers, restored(31)) << "there is no archive of the companion's";
  EXPECT_TRUE(downloads.empty());
}

TEST_F(AppDataTest, ARestoreInTheCompanionsModeLetsOthersBeServedWhileItsPackageIsPacked) {
  current_restore_client = QUARN_CLIENT_COMPANION;
  std::promise<void> locked;
  std::promise<void> go;
  bool in_time = false;
  std::thread packing([&] {
    const PackageDataLock lock(kPkg, PackageUse::kPack);
    locked.set_value();
    in_time = go.get_future().wait_for(std::chrono::seconds(20)) == std::future_status::ready;
  });
  locked.get_future().wait();
  run_on_fiber([this] { restore(); });
  EXPECT_TRUE(outside.answers.empty());
  go.set_value();
  packing.join();
  EXPECT_TRUE(in_time) << "the main loop stood still";
  ASSERT_TRUE(run_until([&] { return !outside.answers.empty(); }));
  EXPECT_EQ(outside.answers, restored(31));
}

TEST_F(AppDataTest, TwoRestoresOfOnePackageAreAnsweredInTheirOrder) {
  make_old_data();
  run_on_fiber([this] { quarnd_restore_app_data(kPkg, make_record(1)); });
  run_on_fiber([this] { quarnd_restore_app_data(kPkg, make_record(2)); });
  make_archive(download(), new_data, "not json");
  answer();
  run_pending();
  ASSERT_EQ(outside.answers.size(), 1U) << "its own event has come";
  EXPECT_EQ(outside.answers[0].req_id, 1U);
  EXPECT_EQ(outside.answers[0].err, 36);
  write_text(download(), "not an archive");
  answer();
  run_pending();
  ASSERT_EQ(outside.answers.size(), 2U);
  EXPECT_EQ(outside.answers[1].req_id, 2U);
  EXPECT_EQ(outside.answers[1].err, 31);
}

TEST_F(AppDataTest, ARestoreIsCancelledWhenTheDaemonEnds) {
  make_old_data();
  EXPECT_EXIT(
      {
        const Tree before = tree_of(root);
        run_on_fiber([this] { restore(); });
        quit_nested_loops();
        const bool told = outside.answers == restored(17);
        answer(BACKUP_TRANS_ERROR_CANCELLED);
        _exit(told && outside.answers.size() == 1 && tree_of(root) == before ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

/* ---- withdrawn ---- */

/** Requests of one client that wait, and another's beside them. */
class Withdrawn : public BothRequests {
 protected:
  static constexpr char kOwn[] = ":1.7";
  static constexpr char kOther[] = ":1.8";

  Withdrawn() { make_old_data(); }

  void start_on_fiber(const char *sender, unsigned int req_id) {
    run_on_fiber([this, sender, req_id] {
      replies.push_back(GetParam().start(kPkg, make_record(req_id, sender)));
    });
  }
  void session_waits() {
    session.meanwhile = [this] {
      mark.reset(new_wait_loop());
      run_nested_loop(mark.get());
      session.ready = !waits_are_ended();
    };
  }
  /** The transfer that is under way, done. */
  void let_it_end(bool newly_installed = true) {
    if (!uploads.empty()) {
      answer_upload();
    } else {
      answer_with_archive(newly_installed);
    }
    run_pending();
  }
  void answer_with_archive(bool newly_installed = true) {
    if (newly_installed) clear_app_dir(kPkg, root.c_str());
    make_archive(download(), new_data);
    answer();
  }
  bool transfers() const { return !uploads.empty() || !downloads.empty(); }

  std::vector<int> replies;
  GMainLoopPtr mark;
};

TEST_P(Withdrawn, WhileTheSessionStarts) {
  session_waits();
  start_on_fiber(kOwn, 7);
  EXPECT_EQ(quarnd_cancel_own(kOther), 0U);
  EXPECT_EQ(quarnd_cancel_own(kOwn), 1U);
  EXPECT_EQ(quarnd_cancel_own(kOwn), 0U);
  EXPECT_TRUE(outside.answers.empty()) << "the caller has its reply first";
  run_pending();
  EXPECT_EQ(outside.answers, answered(17));
  EXPECT_EQ(replies, std::vector<int>{0});
  expect_no_transfer();
  EXPECT_EQ(waiting_requests(), 0U);
}

TEST_P(Withdrawn, WhileItsTransferRuns) {
  const Tree before = tree_of(root);
  start_on_fiber(kOwn, 7);
  ASSERT_TRUE(transfers());
  EXPECT_EQ(quarnd_cancel_own(kOwn), 1U);
  run_pending();
  EXPECT_EQ(outside.answers, answered(17));
  EXPECT_EQ(replies, std::vector<int>{0});
  let_it_end(false);
  EXPECT_EQ(outside.answers.size(), 1U);
  EXPECT_EQ(tree_of(root), before) << "what comes too late changes nothing";
  EXPECT_TRUE(is_idle_status());
}

TEST_P(Withdrawn, ItsTransferEndsAndAnothersGoesOn) {
  std::vector<void *> aborted;
  ON_CALL(transport, backup_trans_abort_request).WillByDefault([&](auto, void *data) {
    aborted.push_back(data);
    return 0;
  });
  start_on_fiber(kOwn, 7);
  ASSERT_TRUE(transfers());
  void *const own = uploads.empty() ? downloads[0].user_data : uploads[0].user_data;
  EXPECT_EQ(quarnd_cancel_own(kOther), 0U);
  run_pending();
  EXPECT_TRUE(aborted.empty());
  EXPECT_EQ(quarnd_cancel_own(kOwn), 1U);
  run_pending();
  EXPECT_EQ(aborted, std::vector<void *>{own});
  if (uploads.empty()) {
    answer(BACKUP_TRANS_ERROR_CANCELLED);
  } else {
    answer_upload(BACKUP_TRANS_ERROR_CANCELLED);
  }
  run_pending();
  EXPECT_FALSE(transfers()) << "it is not begun again";
  EXPECT_TRUE(is_idle_status());
}

TEST_P(Withdrawn, WhileItWaitsForAnothersRequest) {
  start_on_fiber(kOther, 8);
  start_on_fiber(kOwn, 7);
  EXPECT_EQ(quarnd_cancel_own(kOwn), 1U);
  run_pending();
  EXPECT_EQ(outside.answers, answered(17));
  let_it_end();
  ASSERT_EQ(outside.answers.size(), 2U);
  EXPECT_EQ(outside.answers[1].req_id, 8U);
  EXPECT_EQ(outside.answers[1].err, 0) << "nobody else's";
  EXPECT_FALSE(transfers()) << "the withdrawn one does not begin";
  EXPECT_TRUE(is_idle_status());
}

TEST_P(Withdrawn, WhatHasEndedIsNot) {
  start_on_fiber(kOwn, 7);
  if (uploads.empty()) {
    answer_with_archive();
  } else {
    answer_upload();
  }
  EXPECT_EQ(quarnd_cancel_own(kOwn), 0U) << "it is about to be told of its success";
  run_pending();
  EXPECT_EQ(outside.answers, answered(0));
}

TEST_P(Withdrawn, AllOfOneClient) {
  for (unsigned int request = 1; request <= 3; ++request) start_on_fiber(kOwn, request);
  start_on_fiber(kOther, 8);
  EXPECT_EQ(quarnd_cancel_own(kOwn), 3U);
  run_pending();
  EXPECT_EQ(outside.answers.size(), 3U);
  for (const auto &told : outside.answers) EXPECT_EQ(told.err, 17);
  while (transfers()) let_it_end();
  ASSERT_EQ(outside.answers.size(), 4U);
  EXPECT_EQ(outside.answers[3].req_id, 8U);
  EXPECT_EQ(outside.answers[3].err, 0);
  EXPECT_EQ(waiting_requests(), 0U);
}

INSTANTIATE_TEST_SUITE_P(AppData, Withdrawn, ::testing::Values(kBackup, kRestore),
                         [](const auto &info) {
                           return std::string(info.index == 0 ? "Backup" : "Restore");
                         });

TEST_F(AppDataTest, AnUploadThatIsAnsweredByAnotherThreadAtOnceIsNotWaitedForForEver) {
  make_old_data();
  ON_CALL(transport, backup_trans_upload_file_ors_async)
      .WillByDefault(
          [](auto, auto, auto, backup_trans_upload_cb callback, auto, auto, void *data, auto) {
            std::thread([=] { callback(BACKUP_TRANS_ERROR_NONE, data, nullptr); }).join();
            return 0;
          });
  EXPECT_EQ(back_up(), 0);
  EXPECT_EQ(outside.answers, backed_up(0));
}

TEST_F(AppDataTest, WhatADeadDaemonLeftIsPutBackWhenTheRestoreIsRequested) {
  make_old_data();
  const Tree before = tree_of(root);
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  unpacked_file("data/settings.ini", "half of a restore");
  opted_out = true;
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(tree_of(root), before);
}

/* ---- export ---- */

class ExportTest : public AppDataTest {
 protected:
  ExportTest() { make_old_data(); }
  ~ExportTest() override { std::filesystem::remove_all(kTarget); }
  static constexpr char kTarget[] = "/tmp/org.example.notes_tmp.zip";
  static constexpr unsigned int kClient = 1234;
  int make(const char *pkg = kPkg) { return quarnd_make_app_data(pkg, kClient); }
  void expect_exported() const {
    struct stat status = {};
    ASSERT_EQ(lstat(kTarget, &status), 0);
    EXPECT_TRUE(S_ISREG(status.st_mode));
    EXPECT_EQ(status.st_mode & 07777, 0600U);
    EXPECT_EQ(status.st_uid, kClient);
    EXPECT_GT(status.st_size, 0);
  }
  /** Let packing go on only once the main loop has served what sets go. */
  void hold_packing() {
    ON_CALL(platform, smack_getlabel)
        .WillByDefault([this](const char *, char **label, smack_label_type) {
          const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
          while (!go && std::chrono::steady_clock::now() < end) std::this_thread::yield();
          *label = strdup("User");
          return 0;
        });
  }
  std::atomic<bool> go{false};
  static int staging_directories() {
    int count = 0;
    if (!std::filesystem::exists("/tmp/quarn")) return 0;
    for (const auto &item : std::filesystem::directory_iterator("/tmp/quarn")) {
      count += item.path().filename().string().rfind("export_", 0) == 0;
    }
    return count;
  }
};

TEST_F(ExportTest, PacksThePackageForTheClientAlone) {
  const int before = staging_directories();
  EXPECT_EQ(make(), 0);
  expect_exported();
  expect_info("quarnd_make_app_data zip_result = 0");
  EXPECT_TRUE(outside.answers.empty());
  EXPECT_TRUE(uploads.empty());
  EXPECT_EQ(staging_directories(), before);
}

TEST_F(ExportTest, AnApplicationsHasItsLabelBeforeAnybodyCanReachIt) {
  bool reachable = true;
  EXPECT_CALL(platform, smack_setlabel(_, StrEq(kPkg), SMACK_LABEL_ACCESS))
      .WillOnce([&](const char *path, const char *, enum smack_label_type) {
        struct stat status = {};
        EXPECT_EQ(stat(path, &status), 0);
        EXPECT_EQ(status.st_uid, 0U);
        reachable = exists(kTarget);
        return 0;
      });
  EXPECT_EQ(quarnd_make_app_data(kPkg, kClient, kPkg), 0);
  EXPECT_FALSE(reachable);
  expect_exported();
}

TEST_F(ExportTest, OneThatCannotBeLabelledIsNotHandedOver) {
  ON_CALL(platform, smack_setlabel).WillByDefault(Return(-1));
  EXPECT_EQ(quarnd_make_app_data(kPkg, kClient, kPkg), 31);
  expect_error("smack_setlabel failed for the export of (org.example.notes)");
  EXPECT_FALSE(exists(kTarget));
}

TEST_F(ExportTest, ASecondExportReplacesTheFirst) {
  EXPECT_EQ(make(), 0);
  struct stat first = {};
  ASSERT_EQ(lstat(kTarget, &first), 0);
  write_text(kTarget, "");
  EXPECT_EQ(make(), 0);
  expect_exported();
}

TEST_F(ExportTest, EverythingIsPackedWhateverTheRulesOfAnEarlierPackageWere) {
  backup_exclude_list = {root + "/"};
  EXPECT_EQ(make(), 0);
  EXPECT_TRUE(backup_exclude_list.empty());
}

TEST_F(ExportTest, ALinkThatLiesThereIsReplacedAndNotFollowed) {
  write_text(base + "/outside", "untouched");
  std::filesystem::create_symlink(base + "/outside", kTarget);
  EXPECT_EQ(make(), 0);
  expect_exported();
  EXPECT_EQ(read_text(base + "/outside"), "untouched");
}

/** What somebody else may have put where the export is to be. */
class ExportSquat : public ExportTest, public ::testing::WithParamInterface<const char *> {
 protected:
  ExportSquat() {
    const std::string kind = GetParam();
    write_text(base + "/outside", "untouched");
    if (kind == "directory") {
      std::filesystem::create_directories(std::string(kTarget) + "/in/the/way");
    } else if (kind == "file") {
      write_text(kTarget, "another's");
    } else if (kind == "link") {
      std::filesystem::create_symlink(base + "/outside", kTarget);
    } else {
      EXPECT_EQ(mkfifo(kTarget, 0666), 0);
    }
    EXPECT_EQ(lchown(kTarget, 5000, 5000), 0);
    EXPECT_EQ(chmod("/tmp", 01777), 0);
  }
  ~ExportSquat() override {
    for (const std::string &aside : set_aside()) std::filesystem::remove_all(aside);
  }
  static std::vector<std::string> set_aside() {
    std::vector<std::string> found;
    for (const auto &entry : std::filesystem::directory_iterator("/tmp")) {
      if (entry.path().string().rfind(std::string(kTarget) + ".aside.", 0) == 0) {
        found.push_back(entry.path().string());
      }
    }
    return found;
  }
};

TEST_P(ExportSquat, StopsNoExport) {
  EXPECT_EQ(make(), 0);
  expect_exported();
  EXPECT_EQ(read_text(base + "/outside"), "untouched");
  if (std::string(GetParam()) != "directory") return;
  ASSERT_EQ(set_aside().size(), 1U);
  EXPECT_TRUE(exists(set_aside()[0] + "/in/the/way")) << "it is left as it is";
}

TEST_P(ExportSquat, StopsNoExportOfAnyKindInTheStagingDirectorysPlace) {
  std::filesystem::remove_all("/tmp/quarn");
  std::filesystem::rename(kTarget, "/tmp/quarn");
  EXPECT_EQ(make(), 0);
  expect_exported();
  EXPECT_EQ(read_text(base + "/outside"), "untouched");
  for (const auto &entry : std::filesystem::directory_iterator("/tmp")) {
    struct stat status = {};
    if (entry.path().filename().string().rfind("quarn.aside.", 0) == 0 &&
        lstat(entry.path().c_str(), &status) == 0 && status.st_uid == 5000) {
      std::filesystem::remove_all(entry.path());
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Things, ExportSquat,
                         ::testing::Values("file", "directory", "link", "pipe"),
                         [](const auto &info) { return std::string(info.param); });

TEST_F(ExportTest, WithoutARootPathItIsRefusedAndTheEarlierArchiveIsGone) {
  write_text(kTarget, "earlier");
  ON_CALL(platform, package_info_get_root_path).WillByDefault(Return(-5));
  EXPECT_EQ(make(), 36);
  EXPECT_GE(count_logged(DLOG_ERROR, "cannot get root path info of (org.example.notes)..."), 1);
  EXPECT_FALSE(exists(kTarget));
}

TEST_F(ExportTest, AnImpossiblePackageIsRefused) {
  EXPECT_CALL(platform, package_manager_get_package_info).Times(0);
  for (const char *pkg : {"", "..", "../etc/x"}) EXPECT_EQ(make(pkg), 36) << pkg;
  EXPECT_EQ(make(nullptr), 36);
  expect_error("cannot get root path info of (../etc/x)...");
}

TEST_F(ExportTest, AnIncompleteArchiveIsHandedOverAndToldToBeSuch) {
  const int before = staging_directories();
  std::filesystem::remove_all(at("shared/trusted"));
  EXPECT_EQ(make(), 36);
  expect_info("quarnd_make_app_data zip_result = 36");
  expect_exported();
  const std::string command = std::string("unzip -l ") + kTarget + " | grep -q data/settings.ini";
  EXPECT_EQ(std::system(command.c_str()), 0);
  EXPECT_EQ(staging_directories(), before);
}

TEST_F(ExportTest, APackageWithoutItsSharedDataKeepsNoneOfTheDaemons) {
  std::filesystem::remove_all(at("shared/data"));
  EXPECT_EQ(make(), 36);
  expect_exported();
  EXPECT_FALSE(exists(at("shared/data")));
}

TEST_F(ExportTest, WhatWasNotEvenBegunIsNotHandedOver) {
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  EXPECT_EQ(make(), 36);
  EXPECT_FALSE(exists(kTarget));
}

TEST_F(ExportTest, OthersAreServedWhileAPackageIsPacked) {
  hold_packing();
  later([&] { go = true; });
  EXPECT_EQ(make(), 0);
  EXPECT_TRUE(go);
}

TEST_F(ExportTest, ASecondRequestIsServedInsideTheFirst) {
  int inner = -1;
  hold_packing();
  later([&] {
    go = true;
    inner = make();
  });
  EXPECT_EQ(make(), 0);
  EXPECT_EQ(inner, 0);
  expect_exported();
}

TEST_F(ExportTest, AnyNumberOfThemTakesOneThreadAndAllAreAnswered) {
  constexpr std::size_t kMany = 64;
  hold_packing();
  std::vector<int> results;
  const int before = threads_in_use();
  for (std::size_t i = 0; i < kMany; ++i) run_on_fiber([&] { results.push_back(make()); });
  EXPECT_LE(threads_in_use(), before + 1);
  EXPECT_FALSE(is_idle_status());
  go = true;
  ASSERT_TRUE(run_until([&] { return results.size() >= kMany; }));
  EXPECT_EQ(results, std::vector<int>(kMany, 0));
  expect_exported();
  EXPECT_TRUE(is_idle_status());
}

TEST_F(ExportTest, WhoAsksAgainAndAgainIsNotServedBeforeWhoAsksOnce) {
  hold_packing();
  std::vector<unsigned int> served;
  const auto ask = [&](unsigned int client) {
    run_on_fiber([&served, client] {
      EXPECT_EQ(quarnd_make_app_data(kPkg, client), 0);
      served.push_back(client);
    });
  };
  for (int i = 0; i < 3; ++i) ask(kClient);
  ask(kClient + 1);
  ask(kClient + 2);
  go = true;
  ASSERT_TRUE(run_until([&] { return served.size() >= 5; }));
  EXPECT_EQ(served,
            (std::vector<unsigned int>{kClient, kClient + 1, kClient + 2, kClient, kClient}));
}

TEST_F(ExportTest, OneThatWaitsForAnotherIsWithdrawnAtOnce) {
  hold_packing();
  std::vector<int> results(3, -1);
  std::uint64_t second = 0;
  run_on_fiber([&] { results[0] = make(); });
  run_on_fiber([&] {
    second = fiber_id(current_fiber());
    results[1] = make();
  });
  run_on_fiber([&] { results[2] = make(); });
  EXPECT_TRUE(withdraw_waits(second));
  ASSERT_TRUE(run_until([&] { return results[1] != -1; }));
  EXPECT_EQ(results, (std::vector<int>{-1, 17, -1})) << "nothing of the others' is waited for";
  go = true;
  ASSERT_TRUE(run_until([&] { return results[2] != -1; }));
  EXPECT_EQ(results, (std::vector<int>{0, 17, 0}));
}

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)  // they map more themselves
/** Takes what room for threads there is, until it goes. */
class NoThreads {
 public:
  NoThreads() {
    threads_.reserve(kMost);
    EXPECT_EQ(getrlimit(RLIMIT_DATA, &before_), 0);
    const rlimit none{4096, before_.rlim_max};  // for the kernel 0 is no bound
    EXPECT_EQ(setrlimit(RLIMIT_DATA, &none), 0);
    hold_.lock();
    try {
      // The library keeps the room of threads that have ended.
      while (threads_.size() < kMost) {
        threads_.emplace_back([this] { const std::lock_guard<std::mutex> held(hold_); });
      }
    } catch (const std::system_error &) {
    }
    EXPECT_LT(threads_.size(), kMost);
  }
  ~NoThreads() {
    setrlimit(RLIMIT_DATA, &before_);
    hold_.unlock();
    for (std::thread &thread : threads_) thread.join();
  }
  NoThreads(const NoThreads &) = delete;
  NoThreads &operator=(const NoThreads &) = delete;

 private:
  static constexpr std::size_t kMost = 64;
  rlimit before_{};
  std::mutex hold_;
  std::vector<std::thread> threads_;
};

TEST_F(ExportTest, WithoutAThreadToPackInItFailsAndTheNextIsMade) {
  {
    const NoThreads taken;
    EXPECT_EQ(make(), 42);
  }
  expect_error("no thread to pack (org.example.notes) in : Resource temporarily unavailable");
  EXPECT_TRUE(is_idle_status());
  EXPECT_EQ(make(), 0);
  expect_exported();
}
#endif

TEST_F(ExportTest, TheDaemonIsNotIdleWhileAPackageIsPacked) {
  bool idle = true;
  hold_packing();
  later([&] {
    idle = is_idle_status();
    go = true;
  });
  EXPECT_EQ(make(), 0);
  EXPECT_FALSE(idle);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(ExportTest, AWithdrawnExportLeavesNothing) {
  const int before = staging_directories();
  hold_packing();
  std::uint64_t own = 0;
  int result = -1;
  run_on_fiber([&] {
    own = fiber_id(current_fiber());
    result = make();
  });
  EXPECT_TRUE(withdraw_waits(own));
  go = true;
  ASSERT_TRUE(run_until([&] { return result != -1; }));
  EXPECT_EQ(result, 17);
  EXPECT_FALSE(exists(kTarget));
  EXPECT_EQ(staging_directories(), before);
  expect_info("quarnd_make_app_data zip_result = 17");
}

}  // namespace
