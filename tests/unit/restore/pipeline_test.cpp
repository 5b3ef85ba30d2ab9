#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "glib_handles.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/archive_download.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/power.h"
#include "restore_fixture.h"

using ::testing::_;
using ::testing::Return;
using ::testing::StrEq;

namespace {

using Outcome = restore_outcome;
using Stage = restore_stage;

struct Seen {
  std::string package;
  Stage stage;
  Outcome outcome;
  int result;
  std::uint64_t size;
};
std::vector<Seen> progress;

class PipelineTest : public RestoreTest {
 protected:
  PipelineTest() {
    progress.clear();
    set_restore_progress_sink([](const restore_progress &step) {
      progress.push_back({step.package, step.stage, step.outcome, step.result, step.size});
    });
    ON_CALL(platform, pkgmgr_client_new).WillByDefault([](auto) {
      static char client[1];
      return static_cast<pkgmgr_client *>(client);
    });
    ON_CALL(platform, pkgmgr_client_activate).WillByDefault([this](auto, auto, const char *id) {
      shown.emplace_back(id);
      return 0;
    });
  }
  ~PipelineTest() override { stop_wifi_monitor(); }
  void connect_to_wifi() {
    ON_CALL(platform, connection_get_type).WillByDefault([](auto, auto *type) {
      *type = CONNECTION_TYPE_WIFI;
      return 0;
    });
    EXPECT_EQ(start_wifi_monitor(), 1);
  }
  int restore(pkg_restore_context *ctx) { return restore_app_data("app", ctx); }
  /** A restore that nobody waits for, as of a package that was installed. */
  int restore_monitored() {
    RestoreContextPtr ctx(new_context());
    const int result = restore(ctx.get());
    if (ctx->pending > 0) leave_restore(std::move(ctx));
    return result;
  }
  /** A context that the test keeps, as a waiting request does. */
  std::unique_ptr<pkg_restore_context> waiting_context() const {
    std::unique_ptr<pkg_restore_context> ctx(new_context());
    ctx->wait_for_result = true;
    return ctx;
  }
  std::vector<Stage> stages() const {
    std::vector<Stage> all;
    for (const auto &step : progress) all.push_back(step.stage);
    return all;
  }
  const std::vector<Entry> new_data = {{"data/settings.ini", "new settings", 0600},
                                       {"data/db/notes.db", "new notes", 0640, "wrt::db_origin"},
                                       {"shared/data/pictures/one.jpg", "n", 0644},
                                       {"shared/trusted/key.bin", "new key", 0444}};
  std::vector<std::string> shown;
};

TEST_F(PipelineTest, AsksForTheArchiveOfTheChosenSet) {
  auto ctx = waiting_context();
  EXPECT_EQ(restore(ctx.get()), 0);
  expect_info("request download for (org.example.notes)");
  ASSERT_EQ(downloads.size(), 1U);
  EXPECT_EQ(downloads[0].remote, "/350000000000001/org.example.notes/1.2.0/org.example.notes.zip");
  EXPECT_EQ(downloads[0].local, download());
  EXPECT_EQ(ctx->pending, 1);
  answer(BACKUP_TRANS_ERROR_NETWORK);
}

TEST_F(PipelineTest, ARefusedDownloadReturnsFortyTwoSetsThirteenAndTheIconIsNotShown) {
  auto ctx = waiting_context();
  ctx->wait_for_result = false;
  transport_result = 2;
  write_text(download(), "left");
  EXPECT_EQ(restore(ctx.get()), 42);
  EXPECT_EQ(ctx->result, 13);
  EXPECT_EQ(ctx->pending, 0);
  EXPECT_FALSE(exists(download()));
  EXPECT_TRUE(shown.empty());
  expect_error("backup_trans_download_file_ors_async failed... 2");
  EXPECT_TRUE(is_idle_status());
  EXPECT_TRUE(progress.empty());
}

TEST_F(PipelineTest, NamesThatAreNoPathComponentsAreRefused) {
  for (const auto &[serial, version] : std::vector<std::pair<std::string, std::string>>{
           {"../x", "1"}, {"", "1"}, {"1", "a/b"}, {"1", ".."}, {"1", ""}}) {
    auto ctx = waiting_context();
    ctx->serial = serial;
    ctx->version = version;
    EXPECT_EQ(restore(ctx.get()), 42);
    EXPECT_EQ(ctx->result, 13);
    expect_error("refused : not a cloud path (" + serial + ", org.example.notes, " + version + ")");
  }
  EXPECT_TRUE(downloads.empty());
}

TEST_F(PipelineTest, RestoresEveryFileAsItWas) {
  make_old_data();
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(ctx->result, 0);
  EXPECT_EQ(ctx->pending, 0);
  expect_info("backup trans success : download for (org.example.notes)");
  expect_info("restore successfully completed for (org.example.notes)");
  const Tree tree = tree_of(root);
  EXPECT_EQ(tree.at("data/settings.ini"), "100600 5000:5000 app.data new settings");
  EXPECT_EQ(tree.at("data/db/notes.db"), "100640 5000:5000 wrt::db_origin new notes");
  EXPECT_EQ(tree.at("shared/trusted/key.bin"), "100444 5000:5000 app.data new key");
  EXPECT_EQ(tree.size(), 10U) << "nothing temporary is left";
}

TEST_F(PipelineTest, RestoresIntoAFreshlyInstalledPackage) {
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(ctx->result, 0);
  EXPECT_EQ(read_text(at("data/db/notes.db")), "new notes");
  EXPECT_EQ(tree_of(root).at("data/db"), "40755 5000:5000 app.data ");
}

TEST_F(PipelineTest, WhatThisDeviceArchivedComesBackWithEveryAttributeEqual) {
  make_old_data();
  file("data/tool", "x", 06755);
  file("data/empty", "", 0);
  dir("data/sticky", 01777);
  file("data/sticky/inner", "i", 0604);
  const Tree before = tree_of(root);
  const std::string archive = base + "/archive.zip";
  int error = 0;
  make_zip_data(kPkg, root.c_str(), archive.c_str(), &error);
  ASSERT_EQ(error, 0);
  clear_app_dir(kPkg, root.c_str());
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  std::filesystem::copy_file(archive, download());
  answer();
  EXPECT_EQ(ctx->result, 0);
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(PipelineTest, ADownloadErrorLeavesTheDataUntouchedAndSetsTwelve) {
  make_old_data();
  const Tree before = tree_of(root);
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  bool snapshot_taken = false;
  const AtStep step("snapshot", [&] { snapshot_taken = true; });
  answer(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(ctx->result, 12);
  EXPECT_FALSE(snapshot_taken);
  expect_error("download app data of (org.example.notes) failed...err_code[12]");
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(PipelineTest, TheDownloadIsGoneAfterEveryCallback) {
  make_old_data();
  for (const auto error : {BACKUP_TRANS_ERROR_NONE, BACKUP_TRANS_ERROR_NETWORK}) {
    auto ctx = waiting_context();
    ASSERT_EQ(restore(ctx.get()), 0);
    write_text(download(), "not an archive");
    answer(error);
    EXPECT_FALSE(exists(download()));
  }
}

TEST_F(PipelineTest, AFailedDownloadFileIsGoneAndSoIsTheLockOnTheDevice) {
  auto ctx = waiting_context();
  EXPECT_TRUE(is_idle_status());
  ASSERT_EQ(restore(ctx.get()), 0);
  EXPECT_FALSE(is_idle_status()) << "the daemon may not end during a restore";
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PipelineTest, TheLastCallbackSchedulesTerminationWhenNoCandidateIsLeft) {
  pkg_list_to_be_restored = {"org.example.later"};
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  answer(BACKUP_TRANS_ERROR_NETWORK);
  run_pending();
  EXPECT_TRUE(outside.terminations.empty());

  pkg_list_to_be_restored.clear();
  ASSERT_EQ(restore(ctx.get()), 0);
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_TRUE(outside.terminations.empty()) << "from the main loop, not from the callback";
  run_pending();
  EXPECT_EQ(outside.terminations, (std::vector<std::pair<double, bool>>{{0.0, false}}));
}

TEST_F(PipelineTest, AnEarlierTerminationFindsTheDaemonBusyWhileAnotherRestoreIsOnItsWay) {
  auto first = waiting_context();
  auto second = waiting_context();
  second->pkgid = "org.example.other";
  second->root = base + "/opt/usr/apps/org.example.other";
  ASSERT_EQ(restore(first.get()), 0);
  ASSERT_EQ(restore(second.get()), 0);
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_FALSE(is_idle_status());
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PipelineTest, AMonitoredRestoreShowsTheIconAndFreesItsContext) {
  make_old_data();
  ASSERT_EQ(restore_monitored(), 0);
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(shown, std::vector<std::string>{kPkg});
}

TEST_F(PipelineTest, AWaitingRequestGetsItsLoopQuitAndKeepsTheContext) {
  auto ctx = waiting_context();
  const GMainLoopPtr loop(new_wait_loop());
  ASSERT_EQ(restore(ctx.get()), 0);
  ctx->main_loop.reset(g_main_loop_ref(loop.get()));
  auto then = [this] { answer(BACKUP_TRANS_ERROR_NETWORK); };
  g_idle_add(
      [](gpointer call) {
        (*static_cast<decltype(then) *>(call))();
        return static_cast<gboolean>(G_SOURCE_REMOVE);
      },
      &then);
  run_nested_loop(loop.get());
  EXPECT_EQ(ctx->main_loop, nullptr);
  EXPECT_EQ(ctx->result, 12);
  EXPECT_TRUE(shown.empty());
}

TEST_F(PipelineTest, AnAbandonedContextIsFreedByTheEngine) {
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  abandon_restore(std::move(ctx));
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_TRUE(shown.empty());
}

TEST_F(PipelineTest, AnAbandonedRestoreLeavesTheDataAsItIs) {
  make_old_data();
  const Tree before = tree_of(root);
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  abandon_restore(std::move(ctx));
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(tree_of(root), before);
  EXPECT_FALSE(exists(download()));
  expect_info("restore of (org.example.notes) was cancelled");
}

TEST_F(PipelineTest, TheDownloadOfAnAbandonedRestoreIsEndedAndNoOther) {
  connect_to_wifi();
  make_old_data();
  const Tree before = tree_of(root);
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  EXPECT_EQ(transport.last_max_size, kMaxArchiveFileSize);
  EXPECT_CALL(transport, backup_trans_abort_request).Times(1);
  abandon_restore(std::move(ctx));
  answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_TRUE(downloads.empty()) << "it is not begun again";
  EXPECT_EQ(tree_of(root), before);
  expect_info("restore of (org.example.notes) was cancelled");
}

TEST_F(PipelineTest, AnAbandonedRestoreThatWaitsForAnotherLeavesThatAlone) {
  auto first = waiting_context();
  auto second = waiting_context();
  ASSERT_EQ(restore(first.get()), 0);
  ASSERT_EQ(restore(second.get()), 0);
  EXPECT_CALL(transport, backup_trans_abort_request).Times(0);
  abandon_restore(std::move(second));
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(first->result, 12);
  EXPECT_TRUE(downloads.empty());
}

TEST_F(PipelineTest, WithAWithdrawnModeItsDownloadsEndAndNoRequests) {
  connect_to_wifi();
  make_old_data();
  ASSERT_EQ(restore_monitored(), 0);
  EXPECT_CALL(transport, backup_trans_abort_request).Times(1);
  abort_monitored_downloads();
  answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_TRUE(downloads.empty());
  EXPECT_EQ(shown, std::vector<std::string>{kPkg});
  auto requested = waiting_context();
  ASSERT_EQ(restore(requested.get()), 0);
  abort_monitored_downloads();
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(requested->result, 12);
}

TEST_F(PipelineTest, ADownloadAbortedForAnothersSakeIsBegunAgain) {
  connect_to_wifi();
  make_old_data();
  ASSERT_EQ(restore_monitored(), 0);
  for (int i = 0; i < 3; ++i) {
    answer(BACKUP_TRANS_ERROR_CANCELLED);
    ASSERT_EQ(downloads.size(), 1U) << "it goes on";
    EXPECT_TRUE(shown.empty());
  }
  expect_info("download of (org.example.notes) was aborted with others, so it is requested again",
              3);
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  EXPECT_EQ(shown, std::vector<std::string>{kPkg});
}

TEST_F(PipelineTest, ADownloadThatIsAbortedAgainAndAgainEnds) {
  connect_to_wifi();
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  int requested = 1;
  for (; !downloads.empty(); ++requested) answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(requested, 10);
  EXPECT_EQ(ctx->result, 12);
}

TEST_F(PipelineTest, WithoutWifiAnAbortedDownloadIsNotBegunAgain) {
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  answer(BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_TRUE(downloads.empty());
  EXPECT_EQ(ctx->result, 12);
}

TEST_F(PipelineTest, OutstandingDownloadsAreCountedPerPackage) {
  auto ctx = waiting_context();
  ctx->pending = 2;
  check_package_restore_complete(ctx.get());
  EXPECT_EQ(ctx->pending, 1);
  check_package_restore_complete(ctx.get());
  EXPECT_EQ(ctx->pending, 0);
}

TEST_F(PipelineTest, ASecondRestoreOfThePackageWaitsForTheFirst) {
  make_old_data();
  auto first = waiting_context();
  auto second = waiting_context();
  second->version = "2.0.0";
  auto third = waiting_context();
  ASSERT_EQ(restore(first.get()), 0);
  ASSERT_EQ(restore(second.get()), 0);
  ASSERT_EQ(restore(third.get()), 0);
  EXPECT_EQ(second->pending, 1);
  ASSERT_EQ(downloads.size(), 1U) << "both would use the same files";
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(first->result, 0);
  ASSERT_EQ(downloads.size(), 1U);
  EXPECT_EQ(downloads[0].remote, "/350000000000001/org.example.notes/2.0.0/org.example.notes.zip");
  transport_result = 11;
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(second->result, 12);
  EXPECT_EQ(third->result, 13) << "refused when its turn came";
  EXPECT_EQ(third->pending, 0);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PipelineTest, AnArchiveIsNeverPackedFromAMixture) {
  make_old_data();
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  bool held = false;
  std::thread packing;
  std::atomic<bool> packed{false};
  int error = 0;
  const AtStep step("unpacked", [&] {
    packing = std::thread([&] {
      make_zip_data(kPkg, root.c_str(), (base + "/packed.zip").c_str(), &error);
      packed = true;
    });
    // another package is not in its way
    { const PackageDataLock other("org.example.other", PackageUse::kPack); }
    held = !packed;
  });
  answer();
  packing.join();
  EXPECT_TRUE(held);
  EXPECT_EQ(error, 0) << "not refused as half restored";
  EXPECT_EQ(ctx->result, 0);
}

TEST_F(PipelineTest, TheMainLoopGoesOnWhileThePackageIsPacked) {
  make_old_data();
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  std::promise<void> locked;
  std::promise<void> go;
  std::thread packing([&] {
    const PackageDataLock lock(kPkg, PackageUse::kPack);
    locked.set_value();
    go.get_future().wait();
  });
  locked.get_future().wait();
  answer();  // returns
  EXPECT_EQ(ctx->pending, 1);
  EXPECT_EQ(read_text(at("data/settings.ini")), "old settings");
  EXPECT_FALSE(is_idle_status());
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str())) << "nor does this wait";
  auto second = waiting_context();
  ASSERT_EQ(restore(second.get()), 0);
  EXPECT_TRUE(downloads.empty()) << "the first uses the files still";
  go.set_value();
  packing.join();
  ASSERT_TRUE(run_until([&] { return ctx->pending == 0; }));
  EXPECT_EQ(ctx->result, 0);
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(PipelineTest, ARestoreThatIsAbandonedWhileItsPackageIsPackedChangesNothing) {
  make_old_data();
  const Tree before = tree_of(root);
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  auto lock = std::make_unique<PackageDataLock>(kPkg, PackageUse::kPack);
  answer();
  abandon_restore(std::move(ctx));
  ASSERT_TRUE(run_until([&] { return is_idle_status(); }));
  lock.reset();
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(PipelineTest, WhatADeadDaemonLeftIsPutBackBeforeThePackageIsRestoredAgain) {
  make_old_data();
  const Tree before = tree_of(root);
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  unpacked_file("data/settings.ini", "half of a restore");
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  EXPECT_EQ(tree_of(root), before);
  answer(BACKUP_TRANS_ERROR_NETWORK);
}

TEST_F(PipelineTest, ACallbackWithoutItsRequestEndsTheProcess) {
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  const auto callback = downloads[0].callback;
  EXPECT_EXIT(callback(BACKUP_TRANS_ERROR_NONE, nullptr, nullptr),
              ::testing::KilledBySignal(SIGABRT), "user_data != ");
  answer(BACKUP_TRANS_ERROR_NETWORK);
}

TEST_F(PipelineTest, ProgressIsToldStepByStep) {
  make_old_data();
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  const auto size = std::filesystem::file_size(download());
  answer();
  EXPECT_EQ(stages(), (std::vector<Stage>{Stage::downloading, Stage::snapshot, Stage::unpacking,
                                          Stage::attributes, Stage::finished}));
  EXPECT_EQ(progress.back().size, size);
  EXPECT_EQ(progress.back().package, kPkg);
  EXPECT_EQ(progress.back().outcome, Outcome::restored);
  EXPECT_EQ(progress.back().result, 0);

  progress.clear();
  ASSERT_EQ(restore(ctx.get()), 0);
  write_text(download(), "not an archive");
  answer();
  EXPECT_EQ(progress.back().outcome, Outcome::rolled_back);
  EXPECT_EQ(progress.back().result, 31);

  progress.clear();
  ctx->result = 0;
  ASSERT_EQ(restore(ctx.get()), 0);
  answer(BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(progress.back().outcome, Outcome::failed);
  EXPECT_EQ(progress.back().result, 12);
  EXPECT_EQ(progress.back().size, 0U);
}

TEST_F(PipelineTest, APartOfADownloadHindersNoRestore) {
  make_old_data();
  const std::string part =
      daemons_file("shared/data/.quarn-part-0123456789abcdef01234567", "part of an archive");
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  bool copied = false;
  const AtStep step("snapshot-complete", [&] {
    copied = exists(snapshot() + "/shared/data/.quarn-part-0123456789abcdef01234567");
  });
  answer();
  EXPECT_EQ(ctx->result, 0);
  EXPECT_FALSE(copied);
  EXPECT_EQ(read_text(part), "part of an archive");
}

TEST_F(PipelineTest, AFileOfTheApplicationsOwnThatIsNamedLikeAPartIsData) {
  make_old_data();
  file("shared/data/.quarn-part-0123456789abcdef01234567", "its own");
  const Tree before = tree_of(root);
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data, "not json");
  answer();
  EXPECT_EQ(ctx->result, 36);
  EXPECT_EQ(tree_of(root), before);
}

/** Files and folders of the application's own with every name that the daemon uses. */
class OwnNamesTest : public PipelineTest {
 protected:
  OwnNamesTest() {
    make_old_data();
    for (const char *name :
         {"quarn_tmp_rst_dir.kept", "quarn_tmp_rst_dir.icon", "org.example.notes_upload.zip",
          "org.example.notes_download.zip", "org.example.notes.perm"}) {
      file(std::string("shared/data/") + name, std::string("its own ") + name, 0640);
    }
  }
  void make_folder_of_that_name() {
    dir("shared/data/quarn_tmp_rst_dir", 0700);
    file("shared/data/quarn_tmp_rst_dir/shared/data/org.example.notes.perm", "{}");
  }
  /** What has one of those names; the rest is the restore's. */
  Tree own() const {
    Tree found;
    for (const auto &[name, object] : tree_of(root)) {
      if (name.find("quarn_tmp") != std::string::npos ||
          name.find("org.example.notes") != std::string::npos) {
        found[name] = object;
      }
    }
    return found;
  }
  /** Through a restore that succeeds, and one that fails once everything was unpacked. */
  void expect_they_survive() {
    const Tree before = own();
    const Tree all = tree_of(root);
    for (const bool good : {false, true}) {
      auto ctx = waiting_context();
      ASSERT_EQ(restore(ctx.get()), 0);
      ASSERT_EQ(downloads.size(), 1U);
      make_archive(downloads[0].local, new_data, good ? nullptr : "not json");
      answer();
      EXPECT_EQ(ctx->result, good ? 0 : 36);
      EXPECT_EQ(own(), before);
      if (!good) {
        EXPECT_EQ(tree_of(root), all);
      }
    }
    EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  }
};

TEST_F(OwnNamesTest, SurviveARestoreWithAFileInTheSnapshotsPlace) {
  file("shared/data/quarn_tmp_rst_dir", "its own");
  expect_they_survive();
}

TEST_F(OwnNamesTest, SurviveARestoreWithAFolderInTheSnapshotsPlace) {
  make_folder_of_that_name();
  expect_they_survive();
}

TEST_F(OwnNamesTest, SurviveARestoreThatIsKilledAtAnyStepAndItsRecovery) {
  make_folder_of_that_name();
  ON_CALL(platform, package_manager_foreach_package_info)
      .WillByDefault([](package_manager_package_info_cb callback, void *data) {
        callback(nullptr, data);
        return 0;
      });
  ON_CALL(platform, package_info_get_package).WillByDefault([](auto, char **id) {
    *id = strdup(kPkg);
    return 0;
  });
  ON_CALL(platform, package_info_get_root_path).WillByDefault([this](auto, char **path) {
    *path = strdup(root.c_str());
    return 0;
  });
  const Tree before = own();
  const std::string kept = base + "/kept.zip";
  make_archive(kept, new_data);
  for (int steps = 0;; ++steps) {
    const pid_t child = fork();
    if (child == 0) {
      static int left = 0;
      left = steps;
      restore_step_hook = [](const char *) {
        if (left-- == 0) _exit(1);
      };
      auto ctx = waiting_context();
      restore(ctx.get());
      std::filesystem::copy_file(kept, downloads[0].local);
      answer();
      _exit(ctx->result == 0 ? 0 : 2);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    recover_device();
    ASSERT_EQ(own(), before) << steps;
    if (status == 0) break;
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 1) << steps;
    const std::string content = read_text(at("data/settings.ini"));
    ASSERT_TRUE(content == "old settings" || content == "new settings") << steps;
    ASSERT_LT(steps, 500);
  }
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
}

TEST_F(OwnNamesTest, BothNamesOfADownloadTakenIsARefusal) {
  file("shared/data/quarn_tmp_rst_dir.org.example.notes_download.zip", "its own");
  const Tree before = tree_of(root);
  auto ctx = waiting_context();
  EXPECT_EQ(restore(ctx.get()), 42);
  EXPECT_EQ(ctx->result, 13);
  expect_error("there is no place for the archive of (org.example.notes)");
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(PipelineTest, WhatCouldNotBePutBackIsToldAndNotSnapshotOver) {
  make_old_data();
  file("shared/data/org.example.notes.perm", "its own, which comes back before the rest");
  const Tree before = tree_of(root);
  const auto block = [this] {
    std::filesystem::remove_all(at("data/settings.ini"));
    std::filesystem::create_directories(at("data/settings.ini"));
    std::filesystem::create_symlink("/nowhere", at("data/settings.ini/link"));
  };
  auto ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data, "not json");
  {
    const AtStep step("rollback-cleared", block);
    answer();
  }
  EXPECT_EQ(ctx->result, 36);
  EXPECT_EQ(progress.back().outcome, Outcome::incomplete);
  EXPECT_EQ(read_text(snapshot() + "/data/settings.ini"), "old settings");

  // as long as that is so, a further restore changes nothing
  ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(ctx->result, 36);
  EXPECT_EQ(progress.back().outcome, Outcome::incomplete);
  EXPECT_EQ(read_text(snapshot() + "/data/settings.ini"), "old settings");

  std::filesystem::remove_all(at("data/settings.ini"));
  ctx = waiting_context();
  ASSERT_EQ(restore(ctx.get()), 0);
  EXPECT_EQ(tree_of(root), before) << "it is tried again first";
  make_archive(download(), new_data);
  answer();
  EXPECT_EQ(ctx->result, 0);
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
}

TEST_F(PipelineTest, ASnapshotThatIsOnlyKeptGoesWithTheNextRestoreThatSucceeds) {
  make_old_data();
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  file("data/mine", "written since");
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  const std::string kept = "quarn_tmp_rst_dir.kept/data/settings.ini";
  for (const bool good : {false, true}) {
    if (good) std::filesystem::remove(at("data/mine"));  // no archive has it
    auto ctx = waiting_context();
    ASSERT_EQ(restore(ctx.get()), 0);
    make_archive(download(), new_data, good ? nullptr : "not json");
    answer();
    EXPECT_EQ(ctx->result, good ? 0 : 36);
    EXPECT_EQ(exists(at("shared/data/" + kept)), !good) << "what it was kept for is still to come";
  }
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
}

/* ---- from the phone-transfer companion ---- */

class CompanionTest : public PipelineTest {
 protected:
  CompanionTest() {
    current_restore_client = QUARN_CLIENT_COMPANION;
    std::filesystem::create_directories(kCompanionDir);
  }
  ~CompanionTest() override { std::filesystem::remove_all("/opt/usr/apps/com.velmor.pellix-efl"); }
  static std::string archive() {
    return std::string(kCompanionDir) + "/org.example.notes_1.2.0.zip";
  }
  std::unique_ptr<pkg_restore_context> context(bool wait) const {
    auto ctx = waiting_context();
    ctx->wait_for_result = wait;
    return ctx;
  }
};

TEST_F(CompanionTest, RestoresAtOnceAndKeepsTheArchive) {
  make_old_data();
  make_archive(archive(), new_data);
  auto ctx = context(false);
  EXPECT_EQ(restore(ctx.get()), 0);
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  EXPECT_TRUE(exists(archive()));
  EXPECT_TRUE(downloads.empty());
  EXPECT_FALSE(exists(snapshot()));
  expect_info("restore completed for (org.example.notes)");
  expect_info("restore_app_data for org.example.notes complete");
  EXPECT_EQ(ctx->pending, -1);
  EXPECT_TRUE(shown.empty());
  EXPECT_EQ(progress.back().outcome, Outcome::restored);
  EXPECT_EQ(progress.back().size, std::filesystem::file_size(archive()));
}

TEST_F(CompanionTest, AFailingAttributeRestoreStillReportsZeroAndLeavesPendingAtMinusOne) {
  make_old_data();
  auto entries = new_data;
  make_archive(archive(), entries, R"({"data": {"0": 493, "1": 5000, "2": 5000, "3": "app"}})");
  auto ctx = context(true);
  EXPECT_EQ(restore(ctx.get()), 0);
  EXPECT_EQ(ctx->result, 0);
  EXPECT_EQ(ctx->pending, -1);
  expect_error("fail to restore for (org.example.notes)");
  expect_info("restore_app_data for org.example.notes complete");
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings") << "nothing is rolled back";
  EXPECT_EQ(progress.back().outcome, Outcome::incomplete);
  EXPECT_EQ(progress.back().result, 36);
}

TEST_F(CompanionTest, WithoutAUsableTableNothingIsUnpacked) {
  make_old_data();
  const Tree before = tree_of(root);
  for (const bool has_table : {true, false}) {
    if (has_table) {
      make_archive(archive(), new_data, "not json");
    } else {
      make_plain_archive(archive(), new_data);
    }
    clear_captured_log();
    auto ctx = context(true);
    EXPECT_EQ(restore(ctx.get()), 0);
    EXPECT_EQ(ctx->result, 0);
    EXPECT_EQ(ctx->pending, -1);
    EXPECT_EQ(captured_texts(),
              (std::vector<std::string>{
                  has_table ? "cannot read json info..." : "there isn't file-info file...",
                  "app data restore failed, so will be cleared",
                  "fail to restore for (org.example.notes)",
                  "restore_app_data for org.example.notes complete"}));
    EXPECT_EQ(tree_of(root), before);
    EXPECT_EQ(progress.back().outcome, Outcome::failed);
    EXPECT_EQ(progress.back().result, 36);
  }
}

TEST_F(CompanionTest, AnArchiveBeyondTheBoundsIsRefusedWholeAndLeavesTheDataAsItIs) {
  make_old_data();
  const Tree before = tree_of(root);
  std::string deep = "data";
  for (int depth = 0; depth < 30000; ++depth) deep += "/d";
  auto entries = new_data;
  entries.push_back({deep + "/a", "x"});
  make_plain_archive(archive(), entries);
  auto ctx = context(true);
  EXPECT_EQ(restore(ctx.get()), 31);
  EXPECT_EQ(ctx->result, 31);
  expect_error("refused archive " + archive() +
               ": its directories are deeper than a backup's can be");
  EXPECT_EQ(tree_of(root), before);
  const std::string table = "{" + std::string(std::size_t{50} << 20, ' ') + "}";
  make_archive(archive(), new_data, table.c_str());
  EXPECT_EQ(restore(ctx.get()), 31);
  expect_error("refused archive " + archive() + ": its table is larger than a backup's can be");
  EXPECT_EQ(tree_of(root), before);
  EXPECT_EQ(progress.back().outcome, Outcome::failed);
}

/** Everything below the root is the application's, labelled, and no table is left. */
void expect_attributes(const std::string &root, const std::string &but) {
  for (const auto &[name, object] : tree_of(root)) {
    if (name == "shared" || name == but) continue;
    EXPECT_NE(object.find(" 5000:5000 "), std::string::npos) << name << ": " << object;
    EXPECT_EQ(object.find(" 5000:5000 _ "), std::string::npos) << name << ": " << object;
    EXPECT_EQ(name.find(".perm"), std::string::npos);
  }
}

TEST_F(CompanionTest, WhatWasUnpackedHasItsAttributesThoughAnEntryWasRefused) {
  make_old_data();
  auto entries = new_data;
  entries.push_back({"../../escaped", "x"});
  entries.push_back({"/absolute", "x"});
  make_archive(archive(), entries);
  auto ctx = context(true);
  EXPECT_EQ(restore(ctx.get()), 0);
  EXPECT_EQ(ctx->result, 0);
  expect_error("2 entries of (org.example.notes) were not restored");
  expect_info("restore completed for (org.example.notes)");
  expect_attributes(root, "");
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  EXPECT_EQ(progress.back().outcome, Outcome::incomplete);
  EXPECT_EQ(progress.back().result, 31);
}

TEST_F(CompanionTest, WhatWasUnpackedHasItsAttributesThoughAnEntryIsCorrupt) {
  make_old_data();
  make_archive(archive(), new_data);
  {
    std::fstream broken(archive(), std::ios::in | std::ios::out | std::ios::binary);
    broken.seekp(50);
    broken.write("\xff\xff\xff\xff", 4);
  }
  auto ctx = context(true);
  EXPECT_EQ(restore(ctx.get()), 0);
  expect_error("1 entries of (org.example.notes) were not restored");
  expect_attributes(root, "");
  EXPECT_EQ(read_text(at(new_data.back().name)), new_data.back().content);
  EXPECT_EQ(progress.back().outcome, Outcome::incomplete);
  EXPECT_EQ(progress.back().result, 31);
}

TEST_F(CompanionTest, AFileOfTheApplicationsOwnThatIsNamedLikeTheTableStays) {
  make_old_data();
  file("shared/data/org.example.notes.perm", "its own", 0640);
  const Tree before = tree_of(root);
  make_archive(archive(), new_data);
  auto ctx = context(true);
  EXPECT_EQ(restore(ctx.get()), 0);
  const std::string table = "shared/data/org.example.notes.perm";
  EXPECT_EQ(tree_of(root).at(table), before.at(table));
  EXPECT_EQ(progress.back().outcome, Outcome::restored);
}

TEST_F(CompanionTest, AMissingArchiveCarriesTheUnpackCode) {
  auto ctx = context(true);
  EXPECT_EQ(restore(ctx.get()), 31);
  EXPECT_EQ(ctx->result, 31);
  EXPECT_EQ(ctx->pending, -1);
  expect_info("restore_app_data for org.example.notes complete");
}

TEST_F(CompanionTest, AVersionThatIsNoPathComponentIsRefused) {
  auto ctx = context(true);
  ctx->version = "../../x";
  EXPECT_EQ(restore(ctx.get()), 36);
  EXPECT_EQ(ctx->result, 36);
  expect_error("refused : not an archive name (org.example.notes, ../../x)");
}

}  // namespace
