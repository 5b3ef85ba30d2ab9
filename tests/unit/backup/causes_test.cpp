// What a run failed of, as its client is told.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <filesystem>

#include "quarn_common.h"
#include "quarn_d_backup/package_trouble.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_utils/request_cause.h"
#include "run_fixture.h"

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::Not;
using ::testing::Return;
using ::testing::StartsWith;

namespace {

bool file_systems_are_full = false;
std::string finished_cause;

class Causes : public Runs {
 protected:
  Causes() { note_request_end(request_cause::none); }
  ~Causes() override { file_systems_are_full = false; }

  /** The end of one manual run of one package. */
  SeenStep end_of_run() {
    steps().clear();
    manual();
    EXPECT_EQ(steps().back().stage, backup_stage::finished);
    EXPECT_EQ(steps().back().cause, request_cause_word(last_request_cause()))
        << "the status object has it, too";
    return steps().back();
  }
  int uploads() {
    int count = 0;
    for (const std::string &request : cloud_.requests()) {
      if (request.rfind(std::string("upload /") + kSerial, 0) == 0) ++count;
    }
    return count;
  }
  void answer(Op op, const std::string &path, int code) {
    cloud_.fail = [=](Op asked, const std::string &what) {
      return asked == op && what.rfind(path, 0) == 0 ? code : 0;
    };
  }
};

struct CodeAndWord {
  int code;
  const char *word;
};

class CloudCauses : public Causes, public ::testing::WithParamInterface<CodeAndWord> {};

TEST_P(CloudCauses, OfAnArchivesUploadIsTheRunsWhateverIsServedAfterIt) {
  const FakePackage &a = install("org.a");
  install("org.b");
  install("org.c");
  answer(Op::upload, a.object(), GetParam().code);
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 12);
  EXPECT_EQ(end.cause, GetParam().word);
  EXPECT_FALSE(end.list_written);
  EXPECT_EQ(step_of("org.a").outcome, backup_outcome::upload_failed);
  EXPECT_EQ(step_of("org.c").outcome, backup_outcome::uploaded);
}

TEST_P(CloudCauses, OfTheListsDownloadIsTheRuns) {
  install("org.a");
  answer(Op::download, "/app_list", GetParam().code);
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 13);
  EXPECT_EQ(end.cause, GetParam().word);
}

TEST_P(CloudCauses, OfTheListsUploadIsTheRuns) {
  install("org.a");
  answer(Op::upload, "/app_list", GetParam().code);
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 12);
  EXPECT_EQ(end.cause, GetParam().word);
  EXPECT_FALSE(end.list_written);
}

INSTANTIATE_TEST_SUITE_P(
    EveryCode, CloudCauses,
    ::testing::Values(CodeAndWord{BACKUP_TRANS_ERROR_AUTHENTICATION, "password"},
                      CodeAndWord{BACKUP_TRANS_ERROR_NETWORK, "network"},
                      CodeAndWord{BACKUP_TRANS_ERROR_QUOTA, "space"},
                      CodeAndWord{BACKUP_TRANS_ERROR_SERVER, "server"},
                      CodeAndWord{BACKUP_TRANS_ERROR_CERTIFICATE, "certificate"},
                      CodeAndWord{BACKUP_TRANS_ERROR_LOCAL_FILE, "device-file"}));

TEST_F(Causes, AnAddressIsToldByTheTransport) {
  install("org.a");
  ON_CALL(cloud_.transport, backup_trans_last_cause)
      .WillByDefault(Return(BACKUP_TRANS_CAUSE_ADDRESS));
  answer(Op::upload, "/app_list", BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(end_of_run().cause, "address");
}

TEST_F(Causes, AListThatAnotherDeviceChangedIsSaidToBeThat) {
  install("org.a");
  answer(Op::upload, "/app_list", BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(end_of_run().cause, "list-changed");
}

TEST_F(Causes, ALostWifiIsSaidToBeThat) {
  install("org.a");
  at(Op::upload, "", [] { fake_wifi = 0; });
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 12);
  EXPECT_EQ(end.cause, "wifi");
}

TEST_F(Causes, ASuccessHasNone) {
  install("org.a");
  note_request_end(request_cause::space);
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.cause, "");
  EXPECT_TRUE(end.list_written);
}

TEST_F(Causes, AListOfAnotherFormEndsTheRunBeforeTheFirstUpload) {
  const FakePackage &a = install("org.a");
  cloud_.objects[kAppListInCloud] = R"({"format_ver":2,"model_list":[]})";
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 12);
  EXPECT_EQ(end.cause, "list-foreign");
  EXPECT_EQ(uploads(), 0);
  EXPECT_EQ(error("there is no app list to upload, so no app data is uploaded"), 1);
  EXPECT_EQ(info("format version in json changed"), 1);
  EXPECT_FALSE(exists(a.staged()));
}

TEST_F(Causes, AListThatArrivesUnreadableIsSaidToBeThat) {
  cloud_.objects[kAppListInCloud] = "{}";
  cloud_.lose_downloads = true;
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 13);
  EXPECT_EQ(end.cause, "list-unreadable");
}

TEST_F(Causes, AListThatCannotBeStagedEndsTheRunBeforeTheFirstUpload) {
  install("org.a");
  // once the download has been read: what lies in the list's place is no file
  const auto block = [](const backup_progress &progress) {
    if (progress.stage == backup_stage::archiving) {
      std::filesystem::create_directories(std::string(kLocalAppListPath) + "/in the way");
    }
    if (progress.stage == backup_stage::finished) finished_cause = progress.cause;
  };
  for (const bool full : {false, true}) {
    file_systems_are_full = full;
    set_backup_progress_sink(block);
    manual();
    std::filesystem::remove_all(kLocalAppListPath);
    EXPECT_EQ(sent_statuses().back().err, 12);
    EXPECT_EQ(uploads(), 0);
    EXPECT_EQ(finished_cause, full ? "device-full" : "device-file");
    EXPECT_EQ(request_cause_word(last_request_cause()), finished_cause);
  }
}

TEST_F(Causes, AFullDevicesListDownloadIsSaidToBeThat) {
  install("org.a");
  file_systems_are_full = true;
  answer(Op::download, "/app_list", BACKUP_TRANS_ERROR_LOCAL_FILE);
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 13);
  EXPECT_EQ(end.cause, "device-full");
}

/* ---- packages ---- */

TEST_F(Causes, APackageThatIsRemovedBeforeItIsPackedIsSaidToBeThat) {
  FakePackage &a = install("org.a");
  std::filesystem::remove_all(a.root);
  EXPECT_EQ(end_of_run().result, 0);
  EXPECT_EQ(step_of("org.a").outcome, backup_outcome::removed);
  EXPECT_THAT(cloud_list().packages(0), ElementsAre("org.a 1.0.0 0"));
}

TEST_F(Causes, APackageThatIsRemovedBeforeItsUploadIsSaidToBeThat) {
  const std::string first = install("org.a").object();
  const std::string root = install("org.b").root;
  at(Op::upload, first, [&] { std::filesystem::remove_all(root); });
  const SeenStep end = end_of_run();
  EXPECT_EQ(end.result, 12);
  EXPECT_EQ(end.cause, "removed");
  EXPECT_EQ(step_of("org.b").outcome, backup_outcome::removed);
}

/** Folders nested to the depth, counted from the data directory's own. */
void nest(const std::string &folder, int depth) {
  const int start = open(folder.c_str(), O_RDONLY | O_DIRECTORY);
  int at = start;
  for (int i = 0; i < depth; ++i) {
    ASSERT_EQ(mkdirat(at, "d", 0755), 0);
    const int next = openat(at, "d", O_RDONLY | O_DIRECTORY);
    close(at);
    at = next;
  }
  close(at);
}

TEST_F(Causes, TooDeepIsNotUnreadableAndNotTooLarge) {
  const FakePackage &deep = install("org.deep");
  nest(deep.root + "/data", 401);
  const FakePackage &closed = install("org.closed");
  std::filesystem::remove_all(closed.root + "/shared/trusted");
  const FakePackage &large = install("org.large");
  write_sparse(large.root + "/data/big", kMaxBackupSize + 1);
  install("org.external").external = true;
  install("org.disabled").apps[0].disabled = true;
  EXPECT_EQ(end_of_run().result, 0);
  EXPECT_EQ(step_of("org.deep").outcome, backup_outcome::too_deep);
  EXPECT_EQ(step_of("org.closed").outcome, backup_outcome::unreadable);
  EXPECT_EQ(step_of("org.large").outcome, backup_outcome::too_large);
  EXPECT_EQ(step_of("org.external").outcome, backup_outcome::external);
  EXPECT_EQ(step_of("org.disabled").outcome, backup_outcome::disabled);
  EXPECT_EQ(cloud_list().package_ids(0).size(), 5U) << "listed, as ever";
}

TEST_F(Causes, ADeepPackageOnAFullDeviceIsStillTooDeep) {
  const FakePackage &deep = install("org.deep");
  nest(deep.root + "/data", 401);
  EXPECT_EQ(find_package_trouble(deep.root), backup_outcome::too_deep);
  EXPECT_EQ(find_package_trouble(deep.root + "/none"), backup_outcome::removed);
  EXPECT_EQ(find_package_trouble(install("org.fine").root), backup_outcome::none);
}

}  // namespace

extern "C" {
int __real_statvfs(const char *path, struct statvfs *space);
int __wrap_statvfs(const char *path, struct statvfs *space) {
  const int result = __real_statvfs(path, space);
  if (result == 0 && file_systems_are_full) space->f_bfree = space->f_bavail = 0;
  return result;
}
}
