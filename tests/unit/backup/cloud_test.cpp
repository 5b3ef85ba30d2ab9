#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "backup_device.h"
#include "backup_transport.h"
#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_upload.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/cloud_cleanup.h"
#include "quarn_d_backup/list_transfer.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/single_folders.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/request_cause.h"

using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

constexpr int kRefused = BACKUP_TRANS_ERROR_NOT_INITIALIZED;
constexpr int kServer = BACKUP_TRANS_ERROR_SERVER;

/** Nothing can be renamed, as where it is a mount point. */
bool stuck_files = false;

class Cloud : public BackupDevice {
 protected:
  Cloud() : ctx_(new backup_context) { ctx_->serial_number = kSerial; }
  ~Cloud() override { stuck_files = false; }

  void refuse_all() {
    cloud_.refuse = [](Op, const std::string &) { return kRefused; };
  }
  void fail_all(int code = kServer) {
    cloud_.fail = [code](Op, const std::string &) { return code; };
  }
  /** An archive as make_app_data_zip() leaves it. */
  FakePackage &staged(const std::string &id) {
    FakePackage &app = install(id);
    write_text(app.staged(), "archive of " + id);
    EXPECT_TRUE(acquire_staged_archive(ctx_.get(), id));
    return app;
  }
  void upload(const FakePackage &app) {
    upload_app_data(ctx_.get(), app.id.c_str(), app.root.c_str(), app.version.c_str());
  }
  void stage_list(const std::string &text) {
    std::filesystem::create_directories("/tmp/quarn");
    write_text(kLocalAppListPath, text);
  }
  void installed(const std::string &id) {
    ctx_->current_pkg_list.push_back({kSerial, id, "1", "", 0});
  }
  std::string in_device(const std::string &name) const {
    return std::string("/") + kSerial + "/" + name;
  }
  int info(const std::string &text) const { return count_logged(DLOG_INFO, text); }
  int error(const std::string &text) const { return count_logged(DLOG_ERROR, text); }

  BackupContextPtr ctx_;
};

/* ---- the list ---- */

TEST_F(Cloud, ListIsDownloadedAsTheBasisOfItsUpload) {
  cloud_.objects[kAppListInCloud] = "the list";
  EXPECT_EQ(get_app_list_from_cloud(ctx_.get()), 0);
  EXPECT_TRUE(ctx_->app_list_downloading);
  cloud_.answer_all();
  EXPECT_FALSE(ctx_->app_list_downloading);
  EXPECT_TRUE(ctx_->app_list_checked);
  EXPECT_STREQ(ctx_->cloud_app_list_text.get(), "the list");
  EXPECT_EQ(info("success : get app list file from cloud"), 1);
  EXPECT_THAT(cloud_.download_options, ElementsAre(BACKUP_TRANS_OPTION_BASIS));
  EXPECT_FALSE(exists(kLocalAppListPath));
}

TEST_F(Cloud, MissingListCountsAsChecked) {
  EXPECT_EQ(get_app_list_from_cloud(ctx_.get()), 0);
  cloud_.answer_all();
  EXPECT_TRUE(ctx_->app_list_checked);
  EXPECT_EQ(ctx_->cloud_app_list_text, nullptr);
  EXPECT_EQ(info("app list file is not exist in cloud"), 1);
}

TEST_F(Cloud, FailedListDownloadIsNotChecked) {
  fail_all();
  EXPECT_EQ(get_app_list_from_cloud(ctx_.get()), 0);
  cloud_.answer_all();
  EXPECT_FALSE(ctx_->app_list_checked);
  EXPECT_FALSE(ctx_->app_list_downloading);
  EXPECT_EQ(error("backup_trans_download_file_ors failed... 16"), 1);
}

TEST_F(Cloud, UnreadableListIsNotChecked) {
  cloud_.objects[kAppListInCloud] = "the list";
  cloud_.lose_downloads = true;
  EXPECT_EQ(get_app_list_from_cloud(ctx_.get()), 0);
  cloud_.answer_all();
  EXPECT_FALSE(ctx_->app_list_checked);
  EXPECT_FALSE(ctx_->app_list_downloading);
  EXPECT_EQ(error("cannot read app list file..."), 1);
}

TEST_F(Cloud, ListBeyondAllReasonIsNotRead) {
  cloud_.objects[kAppListInCloud] = std::string(4 * 1024 * 1024 + 1, ' ');
  EXPECT_EQ(get_app_list_from_cloud(ctx_.get()), 0);
  cloud_.answer_all();
  EXPECT_FALSE(ctx_->app_list_checked);
  EXPECT_EQ(error("cannot read app list file..."), 1);
  EXPECT_FALSE(exists(kLocalAppListPath));
}

TEST_F(Cloud, RefusedListDownloadIsReported) {
  refuse_all();
  stage_list("left over");
  EXPECT_NE(get_app_list_from_cloud(ctx_.get()), 0);
  EXPECT_EQ(error("backup_trans_download_file_ors_async failed... 2"), 1);
  EXPECT_FALSE(ctx_->app_list_downloading);
  EXPECT_FALSE(exists(kLocalAppListPath));
  EXPECT_EQ(ctx_->cloud_app_list_text, nullptr);
}

TEST_F(Cloud, RefusedListDownloadTruncatesAnEarlierText) {
  refuse_all();
  ctx_->cloud_app_list_text.reset(strdup("earlier"));
  EXPECT_NE(get_app_list_from_cloud(ctx_.get()), 0);
  EXPECT_STREQ(ctx_->cloud_app_list_text.get(), "");
}

TEST_F(Cloud, ListIsNotRequestedWithoutAStagingDirectory) {
  write_text("/tmp/quarn", "a file");
  stuck_files = true;
  EXPECT_NE(get_app_list_from_cloud(ctx_.get()), 0);
  EXPECT_EQ(error("cannot use staging directory /tmp/quarn"), 1);
  EXPECT_THAT(cloud_.requests(), IsEmpty());
}

TEST_F(Cloud, AbandonedRunsDownloadEndsWithoutATrace) {
  cloud_.objects[kAppListInCloud] = "the list";
  EXPECT_EQ(get_app_list_from_cloud(ctx_.get()), 0);
  ctx_->abandoned = true;
  ctx_.reset();
  cloud_.answer_all();
  EXPECT_FALSE(exists(kLocalAppListPath));
}

TEST_F(Cloud, SynchronousDownloadGivesTheText) {
  cloud_.objects[kAppListInCloud] = "the list";
  char *text = nullptr;
  EXPECT_EQ(download_app_list_info_from_cloud(&text), 0);
  EXPECT_STREQ(text, "the list");
  std::free(text);
  EXPECT_THAT(cloud_.download_options, ElementsAre(BACKUP_TRANS_OPTION_NONE));
  EXPECT_FALSE(exists(cloud_.last_download_local));
}

TEST_F(Cloud, SynchronousDownloadLeavesARunsStagedListAlone) {
  stage_list("of the run");
  cloud_.objects[kAppListInCloud] = "the list";
  char *text = nullptr;
  EXPECT_EQ(download_app_list_info_from_cloud(&text), 0);
  std::free(text);
  EXPECT_EQ(read_text(kLocalAppListPath), "of the run");
}

TEST_F(Cloud, SynchronousDownloadOfNothing) {
  char *text = nullptr;
  EXPECT_EQ(download_app_list_info_from_cloud(&text), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(info("app list file is not exist in cloud"), 1);
}

TEST_F(Cloud, SynchronousDownloadError) {
  fail_all();
  char *text = nullptr;
  EXPECT_EQ(download_app_list_info_from_cloud(&text), kServer);
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(error("backup_trans_download_file_ors failed... 16"), 1);
}

TEST_F(Cloud, SynchronousDownloadThatCannotBeRead) {
  cloud_.objects[kAppListInCloud] = "the list";
  cloud_.lose_downloads = true;
  char *text = nullptr;
  EXPECT_NE(download_app_list_info_from_cloud(&text), 0);
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(error("cannot read app list file..."), 1);
}

TEST_F(Cloud, SynchronousDownloadWithoutAStagingDirectory) {
  write_text("/tmp/quarn", "a file");
  stuck_files = true;
  char *text = nullptr;
  EXPECT_NE(download_app_list_info_from_cloud(&text), 0);
  EXPECT_THAT(cloud_.requests(), IsEmpty());
}

TEST_F(Cloud, ListIsUploaded) {
  stage_list("new list");
  EXPECT_EQ(upload_app_list(ctx_.get()), 1);
  EXPECT_TRUE(ctx_->app_list_uploading);
  EXPECT_EQ(cloud_.last_upload_local, "/tmp/quarn/app_list.txt");
  cloud_.answer_all();
  EXPECT_FALSE(ctx_->app_list_uploading);
  EXPECT_EQ(cloud_.objects[kAppListInCloud], "new list");
  EXPECT_EQ(info("backup trans success : app list upload"), 1);
  EXPECT_EQ(ctx_->result, 0);
  EXPECT_FALSE(exists(kLocalAppListPath));
}

TEST_F(Cloud, ListThatChangedMeanwhileFailsTheRun) {
  stage_list("new list");
  fail_all(BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(upload_app_list(ctx_.get()), 1);
  cloud_.answer_all();
  EXPECT_EQ(error("__upload_app_list_resp_cb failed...err_code[14]"), 1);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_FALSE(ctx_->app_list_uploading);
  EXPECT_FALSE(exists(kLocalAppListPath));
}

TEST_F(Cloud, RefusedListUploadFailsTheRun) {
  stage_list("new list");
  refuse_all();
  EXPECT_EQ(upload_app_list(ctx_.get()), 1);
  EXPECT_EQ(error("backup_trans_upload_file_ors_async failed... 2"), 1);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_FALSE(ctx_->app_list_uploading);
  EXPECT_FALSE(exists(kLocalAppListPath));
}

/* ---- archives ---- */

TEST_F(Cloud, ArchiveIsUploadedBelowDevicePackageAndVersion) {
  const FakePackage &app = staged("org.app");
  upload(app);
  EXPECT_EQ(ctx_->upload_remain, 1);
  EXPECT_EQ(cloud_.last_upload_local, app.root + "/shared/data/org.app_upload.zip");
  cloud_.answer_all();
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_EQ(cloud_.objects["/350000000000001/org.app/1.0.0/org.app.zip"], "archive of org.app");
  EXPECT_EQ(info("request upload for (org.app)"), 1);
  EXPECT_EQ(info("backup trans success : upload for (org.app)"), 1);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

/** What an application may do with the archive of its package, which lies in its own folder. */
class ExchangedArchive : public Cloud, public ::testing::WithParamInterface<const char *> {
 protected:
  void exchange(const std::string &archive) const {
    const std::string kind = GetParam();
    const std::string other = archive + ".other";
    write_text(other, "another archive...");  // of the same size
    if (kind == "own file") {
      EXPECT_EQ(chown(other.c_str(), 5000, 5000), 0);
    } else if (kind == "link to root's file") {
      std::filesystem::remove(archive);
      EXPECT_EQ(link(other.c_str(), archive.c_str()), 0);
      return;
    } else if (kind == "symbolic link") {
      std::filesystem::remove(archive);
      std::filesystem::create_symlink(other, archive);
      return;
    } else if (kind == "pipe") {
      std::filesystem::remove(other);
      EXPECT_EQ(mkfifo(other.c_str(), 0600), 0);
    } else if (kind == "nothing") {
      std::filesystem::remove(archive);
      return;
    }
    std::filesystem::rename(other, archive);
  }
};

TEST_P(ExchangedArchive, IsNotSent) {
  const FakePackage &app = install("org.app");
  ctx_->cur_pkg_id = app.id;
  ctx_->cur_version = app.version;
  ctx_->cur_pkg_type = app.type;
  ctx_->cur_root_path = app.root;
  ASSERT_EQ(make_app_data_zip(ctx_.get(), app.id.c_str()), 0);
  exchange(app.staged());
  upload(app);
  cloud_.answer_all();
  EXPECT_THAT(cloud_.requests(), IsEmpty());
  EXPECT_TRUE(cloud_.objects.empty());
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_EQ(error("backup_trans_upload_file_ors_async failed... " +
                  std::to_string(BACKUP_TRANS_ERROR_LOCAL_FILE)),
            1);
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

INSTANTIATE_TEST_SUITE_P(By, ExchangedArchive,
                         ::testing::Values("own file", "root's file", "link to root's file",
                                           "symbolic link", "pipe", "nothing"),
                         [](const auto &info) { return "Case" + std::to_string(info.index); });

TEST_F(Cloud, ArchiveThatIsExchangedDuringItsUploadIsSentAsItWas) {
  const FakePackage &app = staged("org.app");
  upload(app);
  write_text(app.staged() + ".other", "something else");
  std::filesystem::rename(app.staged() + ".other", app.staged());
  cloud_.answer_all();
  EXPECT_EQ(cloud_.objects["/350000000000001/org.app/1.0.0/org.app.zip"], "archive of org.app");
}

TEST_F(Cloud, FailedUploadFailsTheRunAndFreesTheArchive) {
  const FakePackage &app = staged("org.app");
  fail_all();
  upload(app);
  cloud_.answer_all();
  EXPECT_EQ(error("upload app data of (org.app) failed...err_code[16]"), 1);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Cloud, CauseOfASinglePackagesUploadIsItsRequests) {
  const FakePackage &app = staged("org.app");
  ctx_->single_package = true;
  fail_all();
  note_request_end(request_cause::none);
  upload(app);
  cloud_.answer_all();
  EXPECT_EQ(last_request_cause(), request_cause::server);
}

TEST_F(Cloud, RefusedUploadFailsTheRunAndFreesTheArchive) {
  const FakePackage &app = staged("org.app");
  refuse_all();
  upload(app);
  EXPECT_EQ(error("backup_trans_upload_file_ors_async failed... 2"), 1);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Cloud, NamesThatLeadElsewhereAreNotUploaded) {
  const FakePackage &app = staged("org.app");
  ctx_->serial_number = "../other";
  upload(app);
  ctx_->serial_number = kSerial;
  upload_app_data(ctx_.get(), app.id.c_str(), app.root.c_str(), "..");
  EXPECT_THAT(cloud_.requests(), IsEmpty());
  EXPECT_EQ(error("backup_trans_upload_file_ors_async failed... 1"), 2);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_EQ(ctx_->upload_remain, 0);
}

TEST_F(Cloud, LateFailureDoesNotReplaceTheResultOfACancelledRun) {
  const FakePackage &app = staged("org.app");
  upload(app);
  ctx_->result = 17;
  ctx_->abandoned = true;
  fail_all(BACKUP_TRANS_ERROR_CANCELLED);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->result, 17);
}

TEST_F(Cloud, UploadOutlivesItsAbandonedRun) {
  const FakePackage &app = staged("org.app");
  upload(app);
  ctx_->abandoned = true;
  ctx_.reset();
  const BackupContextPtr next(new backup_context);
  EXPECT_TRUE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(next.get(), "org.app"));
  cloud_.answer_all();
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_TRUE(acquire_staged_archive(next.get(), "org.app"));
}

TEST_F(Cloud, LastAnswerOfASinglePackageRunEndsItsWait) {
  const FakePackage &app = staged("org.app");
  ctx_->single_package = true;
  upload(app);
  const GMainLoopPtr loop(new_wait_loop());
  ctx_->wait_loop = g_main_loop_ref(loop.get());
  g_idle_add(
      [](gpointer cloud) -> gboolean {
        static_cast<FakeCloud *>(cloud)->answer_all();
        return G_SOURCE_REMOVE;
      },
      &cloud_);
  run_nested_loop(loop.get());
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_EQ(ctx_->wait_loop, nullptr);
}

TEST_F(Cloud, UploadAbortedForAnothersSakeIsBegunAgain) {
  const FakePackage &app = staged("org.app");
  ctx_->single_package = true;
  cloud_.aborts = true;
  upload(app);
  constexpr int kCancels = 3;
  for (int i = 0; i < kCancels; ++i) {
    backup_trans_cancel_request(nullptr);
    EXPECT_TRUE(cloud_.answer_next());
    EXPECT_EQ(ctx_->upload_remain, 1) << "it goes on";
  }
  cloud_.answer_all();
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_EQ(ctx_->result, 0);
  EXPECT_EQ(cloud_.objects[app.object()], "archive of org.app");
  EXPECT_EQ(cloud_.count_requests("upload " + app.object()), kCancels + 1);
  EXPECT_EQ(info("upload of (org.app) was aborted with others, so it is requested again"),
            kCancels);
  EXPECT_EQ(error("upload app data of (org.app) failed...err_code[15]"), 0);
  EXPECT_FALSE(exists(app.staged()));
}

TEST_F(Cloud, UploadThatIsAbortedAgainAndAgainEnds) {
  const FakePackage &app = staged("org.app");
  ctx_->single_package = true;
  fail_all(BACKUP_TRANS_ERROR_CANCELLED);
  upload(app);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_EQ(cloud_.count_requests("upload " + app.object()), 9);
  EXPECT_FALSE(exists(app.staged()));
}

TEST_F(Cloud, AbortedUploadIsNotBegunAgainWhenNobodyWantsIt) {
  const FakePackage &app = staged("org.app");
  upload(app);  // of a run: that one is told by its own cancel
  fail_all(BACKUP_TRANS_ERROR_CANCELLED);
  cloud_.answer_all();
  EXPECT_EQ(cloud_.count_requests("upload " + app.object()), 1);

  const FakePackage &withdrawn = staged("org.withdrawn");
  ctx_->single_package = true;
  upload(withdrawn);
  ctx_->abandoned = true;
  cloud_.answer_all();
  EXPECT_EQ(cloud_.count_requests("upload " + withdrawn.object()), 1);

  ctx_->abandoned = false;
  const FakePackage &offline = staged("org.offline");
  upload(offline);
  fake_wifi = 0;
  cloud_.answer_all();
  EXPECT_EQ(cloud_.count_requests("upload " + offline.object()), 1);
  EXPECT_EQ(ctx_->result, 12);
}

TEST_F(Cloud, AbortedUploadThatIsRefusedThenEndsAsItWould) {
  const FakePackage &app = staged("org.app");
  ctx_->single_package = true;
  fail_all(BACKUP_TRANS_ERROR_CANCELLED);
  upload(app);
  refuse_all();
  cloud_.answer_all();
  EXPECT_EQ(ctx_->upload_remain, 0);
  EXPECT_EQ(ctx_->result, 12);
  EXPECT_EQ(error("upload app data of (org.app) failed...err_code[15]"), 1);
}

TEST_F(Cloud, SinglePackageRunWithoutAWaitJustEnds) {
  const FakePackage &app = staged("org.app");
  ctx_->single_package = true;
  upload(app);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->upload_remain, 0);
}

TEST_F(Cloud, WaitLoopOfAFullRunIsLeftAlone) {
  const FakePackage &app = staged("org.app");
  const GMainLoopPtr loop(new_wait_loop());
  ctx_->wait_loop = g_main_loop_ref(loop.get());
  upload(app);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->wait_loop, loop.get());
}

/* ---- clean-up of packages ---- */

TEST_F(Cloud, FolderOfAnUninstalledPackageIsRemoved) {
  cloud_.objects[in_device("org.gone/1/org.gone.zip")] = "x";
  cloud_.objects[in_device("org.kept/1/org.kept.zip")] = "x";
  cloud_.objects["/other/org.gone/1/org.gone.zip"] = "x";
  installed("org.kept");
  delete_other_backup_items_in_cloud(ctx_.get());
  EXPECT_EQ(ctx_->serial_clean_pending, 1);
  cloud_.answer_next();
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(ctx_->pkg_delete_pending, 1);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->pkg_delete_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 0);
  EXPECT_THAT(cloud_.paths(),
              ElementsAre(in_device("org.kept/1/org.kept.zip"), "/other/org.gone/1/org.gone.zip"));
  EXPECT_THAT(captured_texts(),
              ElementsAre("clean up cloud items start",
                          "request remove cloud folder [/350000000000001/org.gone]",
                          "clean up cloud items end",
                          "[/350000000000001/org.gone] was removed from cloud"));
}

TEST_F(Cloud, StrayFileInTheDevicesFolderIsLeftAlone) {
  cloud_.objects[in_device("stray.txt")] = "x";
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_THAT(cloud_.paths(), ElementsAre(in_device("stray.txt")));
  EXPECT_EQ(cloud_.count_requests("delete " + in_device("stray.txt")), 0);
}

TEST_F(Cloud, FoldersAfterTheFirstHundredAreFoundBeforeAnyIsRemoved) {
  for (int i = 0; i < 250; ++i) {
    cloud_.objects[in_device("org.gone" + std::to_string(1000 + i) + "/1/a.zip")] = "x";
  }
  installed("org.gone1000");
  installed("org.gone1249");
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_next();
  cloud_.answer_next();
  EXPECT_EQ(ctx_->serial_clean_pending, 1);
  EXPECT_EQ(ctx_->pkg_delete_pending, 0);
  cloud_.answer_next();
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(ctx_->pkg_delete_pending, 248);
  cloud_.answer_all();
  EXPECT_THAT(cloud_.paths(),
              ElementsAre(in_device("org.gone1000/1/a.zip"), in_device("org.gone1249/1/a.zip")));
  EXPECT_EQ(cloud_.count_requests("list /350000000000001/ 0"), 1);
  EXPECT_EQ(cloud_.count_requests("list /350000000000001/ 100"), 1);
  EXPECT_EQ(cloud_.count_requests("list /350000000000001/ 200"), 1);
  EXPECT_EQ(info("clean up cloud items start"), 1);
  EXPECT_EQ(info("clean up cloud items end"), 1);
}

TEST_F(Cloud, WhateverAListingNamesOneRunDeletesFiveHundredFoldersAndTheNextGoesOn) {
  for (int i = 0; i < 700; ++i) {
    cloud_.objects[in_device("org.gone" + std::to_string(1000 + i) + "/1/a.zip")] = "x";
  }
  delete_other_backup_items_in_cloud(ctx_.get());
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.gone1699", "2");
  cloud_.answer_all();
  EXPECT_EQ(cloud_.objects.size(), 200U) << "both kinds count together";
  EXPECT_EQ(ctx_->pkg_delete_pending, 0);
  EXPECT_EQ(count_logged(DLOG_WARN,
                         "clean up of cloud folder [/350000000000001/] goes on with the next "
                         "backup"),
            1);
  ctx_.reset(new backup_context);
  ctx_->serial_number = kSerial;
  ctx_->package_walk_complete = true;
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_THAT(cloud_.paths(), IsEmpty());
}

TEST_F(Cloud, AListingWithoutAnEndIsFollowedForTenThousandChildren) {
  for (int i = 0; i < 10200; ++i) {
    cloud_.objects[in_device("stray" + std::to_string(10000 + i))] = "x";
  }
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_EQ(cloud_.count_requests("list /350000000000001/ 9900"), 1);
  EXPECT_EQ(cloud_.count_requests("list /350000000000001/ 10000"), 0);
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
}

TEST_F(Cloud, RefusedLaterPageRemovesNothing) {
  for (int i = 0; i < 150; ++i) {
    cloud_.objects[in_device("org.gone" + std::to_string(1000 + i) + "/1/a.zip")] = "x";
  }
  cloud_.refuse = [this](Op, const std::string &path) {
    return path == in_device(" 100") ? kRefused : 0;
  };
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 12);
  EXPECT_EQ(cloud_.objects.size(), 150U);
  EXPECT_EQ(error("backup_trans_get_folder_child_list_async failed... 2"), 1);
}

TEST_F(Cloud, RefusedPackageListingIsAFailedCleanUp) {
  refuse_all();
  delete_other_backup_items_in_cloud(ctx_.get());
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 12);
  EXPECT_EQ(error("backup_trans_get_folder_child_list_async failed... 2"), 1);
}

TEST_F(Cloud, FailedPackageListingIsAFailedCleanUp) {
  fail_all();
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 13);
  EXPECT_EQ(error("__backup_trans_serial_child_list_resp_cb error : 16!"), 1);
}

TEST_F(Cloud, RefusedPackageDeletionIsAFailedCleanUp) {
  cloud_.objects[in_device("org.gone/1/a.zip")] = "x";
  cloud_.refuse = [](Op op, const std::string &) { return op == Op::remove ? kRefused : 0; };
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_EQ(ctx_->pkg_delete_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 12);
  EXPECT_EQ(error("backup_trans_delete_folder_ors_async failed... 2"), 1);
  EXPECT_EQ(info("clean up cloud items end"), 1);
}

TEST_F(Cloud, FailedPackageDeletionIsAFailedCleanUp) {
  cloud_.objects[in_device("org.gone/1/a.zip")] = "x";
  cloud_.fail = [](Op op, const std::string &) { return op == Op::remove ? kServer : 0; };
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_EQ(ctx_->pkg_delete_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 13);
  EXPECT_EQ(error("__backup_trans_delete_pgk_cb error : 16!"), 1);
  EXPECT_EQ(error("fail to remove [/350000000000001/org.gone] from cloud"), 1);
}

TEST_F(Cloud, IncompleteWalkRemovesNoPackage) {
  ctx_->package_walk_complete = false;
  cloud_.objects[in_device("org.unseen/1/a.zip")] = "x";
  delete_other_backup_items_in_cloud(ctx_.get());
  EXPECT_THAT(cloud_.requests(), IsEmpty());
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(error("not every package could be examined, so no package is removed from cloud"), 1);
}

TEST_F(Cloud, PackageThatCouldNotBeExaminedKeepsItsFolder) {
  ctx_->unexamined_pkg_ids = {"org.unseen"};
  cloud_.objects[in_device("org.unseen/1/a.zip")] = "x";
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_EQ(cloud_.objects.size(), 1U);
}

TEST_F(Cloud, PackageUploadedByARequestMeanwhileKeepsItsFolder) {
  forget_single_uploads();
  const BackupContextPtr request(new backup_context);
  request->serial_number = kSerial;
  request->single_package = true;
  FakePackage &app = install("org.fresh");
  write_text(app.staged(), "archive");
  upload_app_data(request.get(), "org.fresh", app.root.c_str(), "1.0.0");
  cloud_.answer_all();
  cloud_.objects[in_device("org.gone/1/a.zip")] = "x";
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_THAT(cloud_.paths(), ElementsAre(app.object()));
  forget_single_uploads();
  remove("org.fresh");
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_all();
  EXPECT_THAT(cloud_.paths(), IsEmpty());
}

// A store that answers with paths from elsewhere must not make us delete there.
TEST_F(Cloud, OnlyDirectChildrenOfTheListedFolderAreRemoved) {
  backup_trans_child_list_cb callback = nullptr;
  void *record = nullptr;
  EXPECT_CALL(cloud_.transport, backup_trans_get_folder_child_list_async)
      .WillOnce([&](backup_trans_handle_h, const char *, int, int, int, void *user_data,
                    backup_trans_child_list_cb cb) {
        callback = cb;
        record = user_data;
        return 0;
      });
  delete_other_backup_items_in_cloud(ctx_.get());
  const backup_trans_file_info_s children[] = {{"/350000000000001", false, 0, 0},
                                               {"/350000000000001/", false, 0, 0},
                                               {"/other", false, 0, 0},
                                               {"/other/org.a", false, 0, 0},
                                               {"/350000000000001/org.a/1", false, 0, 0},
                                               {"/350000000000001/..", false, 0, 0},
                                               {nullptr, false, 0, 0},
                                               {"", false, 0, 0},
                                               {"/350000000000001/org.gone/", false, 0, 0}};
  const backup_trans_child_list_s list = {children, 9, false};
  callback(BACKUP_TRANS_ERROR_NONE, record, &list);
  EXPECT_THAT(cloud_.requests(), ElementsAre("delete /350000000000001/org.gone"));
  cloud_.answer_all();
}

TEST_F(Cloud, EmptyAnswersEndTheListing) {
  std::vector<std::pair<backup_trans_child_list_cb, void *>> calls;
  ON_CALL(cloud_.transport, backup_trans_get_folder_child_list_async)
      .WillByDefault([&](backup_trans_handle_h, const char *, int, int, int, void *user_data,
                         backup_trans_child_list_cb cb) {
        calls.emplace_back(cb, user_data);
        return 0;
      });
  delete_other_backup_items_in_cloud(ctx_.get());
  delete_other_backup_items_in_cloud(ctx_.get());
  const backup_trans_child_list_s nothing_but_more = {nullptr, 0, true};
  calls[0].first(BACKUP_TRANS_ERROR_NONE, calls[0].second, &nothing_but_more);
  calls[1].first(BACKUP_TRANS_ERROR_NONE, calls[1].second, nullptr);
  EXPECT_EQ(calls.size(), 2U);
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
}

TEST_F(Cloud, AbandonedRunRemovesNothingMore) {
  cloud_.objects[in_device("org.gone/1/a.zip")] = "x";
  ctx_->upload_list.push_back({kSerial, "org.app", "2", "/x", 0});
  cloud_.objects[in_device("org.app/1/a.zip")] = "x";
  delete_other_backup_items_in_cloud(ctx_.get());
  delete_other_pkg_version_in_cloud(ctx_.get());
  ctx_->abandoned = true;
  cloud_.answer_all();
  EXPECT_EQ(ctx_->serial_clean_pending, 0);
  EXPECT_EQ(ctx_->version_list_pending, 0);
  EXPECT_EQ(cloud_.objects.size(), 2U);
}

TEST_F(Cloud, DeletionOutlivesItsAbandonedRun) {
  cloud_.objects[in_device("org.gone/1/a.zip")] = "x";
  delete_other_backup_items_in_cloud(ctx_.get());
  cloud_.answer_next();
  ctx_->abandoned = true;
  ctx_.reset();
  cloud_.answer_all();
  EXPECT_EQ(info("[/350000000000001/org.gone] was removed from cloud"), 1);
}

/* ---- clean-up of versions ---- */

TEST_F(Cloud, OtherVersionsOfAnUploadedPackageAreRemoved) {
  for (const char *version : {"1", "2", "3"}) {
    cloud_.objects[in_device(std::string("org.app/") + version + "/org.app.zip")] = "x";
    cloud_.objects[in_device(std::string("org.same/") + version + "/org.same.zip")] = "x";
  }
  cloud_.objects[in_device("org.app/stray.txt")] = "x";
  ctx_->upload_list.push_back({kSerial, "org.app", "2", "/x", 0});
  delete_other_pkg_version_in_cloud(ctx_.get());
  EXPECT_EQ(ctx_->version_list_pending, 1);
  cloud_.answer_next();
  EXPECT_EQ(ctx_->version_list_pending, 0);
  EXPECT_EQ(ctx_->version_delete_pending, 2);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->version_delete_pending, 0);
  EXPECT_THAT(
      cloud_.paths(),
      ElementsAre(in_device("org.app/2/org.app.zip"), in_device("org.app/stray.txt"),
                  in_device("org.same/1/org.same.zip"), in_device("org.same/2/org.same.zip"),
                  in_device("org.same/3/org.same.zip")))
      << "an unchanged package keeps what it has";
  EXPECT_EQ(info("request remove cloud folder [/350000000000001/org.app/1]"), 1);
  EXPECT_EQ(info("[/350000000000001/org.app/3] was removed from cloud"), 1);
  EXPECT_EQ(info("clean up cloud end"), 1);
  EXPECT_EQ(info("clean up cloud items start"), 0);
}

TEST_F(Cloud, VersionsOfManyPackagesAreListedAFewAtATime) {
  constexpr int kPackages = 300;
  for (int i = 0; i < kPackages; ++i) {
    const std::string package = "org.app" + std::to_string(i);
    for (const char *version : {"1", "2"}) {
      cloud_.objects[in_device(package + "/" + version + "/" + package + ".zip")] = "x";
    }
    ctx_->upload_list.push_back({kSerial, package, "2", "/x", 0});
  }
  // org.app29 and its ten: who is refused makes room for the next as well.
  constexpr int kRefusals = 11;
  cloud_.refuse = [](Op op, const std::string &path) {
    return op == Op::list && path.find("org.app29") != std::string::npos ? kRefused : 0;
  };
  delete_other_pkg_version_in_cloud(ctx_.get());
  EXPECT_EQ(ctx_->version_list_pending, kPackages - 1);
  EXPECT_EQ(cloud_.waiting(), 64U);
  cloud_.answer_all();
  EXPECT_EQ(ctx_->version_list_pending, 0);
  EXPECT_EQ(ctx_->version_delete_pending, 0);
  EXPECT_EQ(cloud_.objects.size(), static_cast<std::size_t>(kPackages + kRefusals));
}

TEST_F(Cloud, VersionsAfterTheFirstHundredAreFound) {
  for (int i = 0; i < 150; ++i) {
    cloud_.objects[in_device("org.app/" + std::to_string(1000 + i) + "/a.zip")] = "x";
  }
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.app", "1149");
  cloud_.answer_all();
  EXPECT_THAT(cloud_.paths(), ElementsAre(in_device("org.app/1149/a.zip")));
  EXPECT_EQ(info("clean up cloud end"), 1);
}

TEST_F(Cloud, RefusedVersionListingIsAFailedCleanUp) {
  refuse_all();
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.app", "1");
  EXPECT_EQ(ctx_->version_list_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 12);
  EXPECT_EQ(error("backup_trans_get_folder_child_list_async failed... 2"), 1);
}

TEST_F(Cloud, FailedVersionListingIsAFailedCleanUp) {
  fail_all();
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.app", "1");
  cloud_.answer_all();
  EXPECT_EQ(ctx_->version_list_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 13);
  EXPECT_EQ(error("__backup_trans_pkg_child_list_resp_cb error : 16!"), 1);
}

TEST_F(Cloud, RefusedVersionDeletionIsAFailedCleanUp) {
  cloud_.objects[in_device("org.app/1/a.zip")] = "x";
  cloud_.refuse = [](Op op, const std::string &) { return op == Op::remove ? kRefused : 0; };
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.app", "2");
  cloud_.answer_all();
  EXPECT_EQ(ctx_->version_delete_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 12);
}

TEST_F(Cloud, FailedVersionDeletionIsAFailedCleanUp) {
  cloud_.objects[in_device("org.app/1/a.zip")] = "x";
  cloud_.fail = [](Op op, const std::string &) { return op == Op::remove ? kServer : 0; };
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.app", "2");
  cloud_.answer_all();
  EXPECT_EQ(ctx_->version_delete_pending, 0);
  EXPECT_EQ(ctx_->cleanup_result, 13);
  EXPECT_EQ(error("__backup_trans_delete_pgk_ver_cb error : 16!"), 1);
  EXPECT_EQ(error("fail to remove [/350000000000001/org.app/1] from cloud"), 1);
}

/* ---- callbacks without their record ---- */

template <typename Callback>
void call_without_record(Callback callback) {
  callback(BACKUP_TRANS_ERROR_NONE, nullptr, nullptr);
}

/** Calls each callback with no record; the assertion ends the process where there is one. */
class MissingRecord : public Cloud {
 protected:
  MissingRecord() {
    GTEST_FLAG_SET(death_test_style, "fast");
    ON_CALL(cloud_.transport, backup_trans_download_file_ors_async)
        .WillByDefault([this](backup_trans_handle_h, const char *, const char *, void *data,
                              backup_trans_download_cb callback, int) {
          record_ = data;
          downloaded_ = callback;
          return 0;
        });
    ON_CALL(cloud_.transport, backup_trans_upload_file_ors_async)
        .WillByDefault([this](backup_trans_handle_h, const char *, const char *,
                              backup_trans_upload_cb callback, std::int64_t, int, void *data,
                              const char *) {
          record_ = data;
          uploaded_ = callback;
          return 0;
        });
    ON_CALL(cloud_.transport, backup_trans_get_folder_child_list_async)
        .WillByDefault([this](backup_trans_handle_h, const char *, int, int, int, void *data,
                              backup_trans_child_list_cb callback) {
          record_ = data;
          listed_ = callback;
          return 0;
        });
    ON_CALL(cloud_.transport, backup_trans_delete_folder_ors_async)
        .WillByDefault([this](backup_trans_handle_h, const char *, void *data,
                              backup_trans_delete_cb callback) {
          record_ = data;
          deleted_ = callback;
          return 0;
        });
  }

  void list_one_folder(const char *path) {
    const backup_trans_file_info_s child = {path, false, 0, 0};
    const backup_trans_child_list_s list = {&child, 1, false};
    listed_(BACKUP_TRANS_ERROR_NONE, record_, &list);
  }

  /** In a build without assertions the call returns, and the line is there. */
  void expect_logged([[maybe_unused]] const char *text) {
#ifdef NDEBUG
    EXPECT_EQ(error(text), 1);
#endif
  }

  void *record_ = nullptr;
  backup_trans_download_cb downloaded_ = nullptr;
  backup_trans_upload_cb uploaded_ = nullptr;
  backup_trans_child_list_cb listed_ = nullptr;
  backup_trans_delete_cb deleted_ = nullptr;
};

TEST_F(MissingRecord, OfAListDownload) {
  ASSERT_EQ(get_app_list_from_cloud(ctx_.get()), QUARN_OK);
  EXPECT_DEBUG_DEATH(call_without_record(downloaded_), "user_data");
  expect_logged("cb user_data is NULL...");
  downloaded_(BACKUP_TRANS_ERROR_CANCELLED, record_, nullptr);
}

TEST_F(MissingRecord, OfAnArchiveUpload) {
  const FakePackage &app = install("org.app");
  write_text(app.staged(), "an archive");
  upload(app);
  EXPECT_DEBUG_DEATH(call_without_record(uploaded_), "user_data");
  expect_logged("cb user_data is NULL...");
  uploaded_(BACKUP_TRANS_ERROR_CANCELLED, record_, nullptr);
}

TEST_F(MissingRecord, OfAListUpload) {
  upload_app_list(ctx_.get());
  EXPECT_DEBUG_DEATH(call_without_record(uploaded_), "user_data");
  expect_logged("cb user_data is NULL...");
  uploaded_(BACKUP_TRANS_ERROR_CANCELLED, record_, nullptr);
}

TEST_F(MissingRecord, OfAPackageListingAndDeletion) {
  delete_other_backup_items_in_cloud(ctx_.get());
  EXPECT_DEBUG_DEATH(call_without_record(listed_), "user_data");
  expect_logged("_cloud_clean_info is NULL...");
  list_one_folder("/350000000000001/org.gone");
  EXPECT_DEBUG_DEATH(call_without_record(deleted_), "user_data");
  expect_logged("_backup_context is NULL...");
  deleted_(BACKUP_TRANS_ERROR_SERVER, record_, nullptr);
  EXPECT_EQ(error("__backup_trans_delete_pgk_cb error : 16!"), 1);
}

TEST_F(MissingRecord, OfAVersionListingAndDeletion) {
  delete_other_version_in_cloud(ctx_.get(), kSerial, "org.app", "2");
  EXPECT_DEBUG_DEATH(call_without_record(listed_), "user_data");
  expect_logged("_cloud_clean_info is NULL...");
  list_one_folder("/350000000000001/org.app/1");
  EXPECT_DEBUG_DEATH(call_without_record(deleted_), "user_data");
  expect_logged("_backup_context is NULL...");
  deleted_(BACKUP_TRANS_ERROR_NONE, record_, nullptr);
  EXPECT_EQ(ctx_->version_delete_pending, 0);
}

}  // namespace

extern "C" {
int __real_renameat2(int from, const char *source, int to, const char *target, unsigned int flags);
int __wrap_renameat2(int from, const char *source, int to, const char *target, unsigned int flags) {
  if (!stuck_files) return __real_renameat2(from, source, to, target, flags);
  errno = EBUSY;
  return -1;
}
}
