#include <fcntl.h>
#include <json-c/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <random>
#include <string>
#include <vector>

#include "backup_device.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/handles.h"

using ::testing::_;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Return;
using ::testing::StartsWith;

namespace {

const std::string kCompanionRoot = "/opt/usr/apps/com.velmor.pellix-efl";
const std::string kCompanionDir = kCompanionRoot + "/shared/data";

class Pellix : public BackupDevice {
 protected:
  Pellix() {
    std::filesystem::create_directories(kCompanionDir);
    ON_CALL(platform_, smack_setlabel)
        .WillByDefault([this](const char *path, const char *label, smack_label_type type) {
          EXPECT_EQ(type, SMACK_LABEL_ACCESS);
          struct stat labelled = {};
          EXPECT_EQ(stat(path, &labelled), 0);
          labels_.push_back(std::to_string(labelled.st_ino) + " " + label);
          return label_result_;
        });
  }
  ~Pellix() override { std::filesystem::remove_all(kCompanionRoot); }

  static std::string archive(const FakePackage &package) {
    return kCompanionDir + "/" + package.id + "_" + package.version + ".zip";
  }
  /** The document that is answered; the empty text when there is none. */
  std::string answered() {
    const CString text(get_app_list_for_pellix());
    return text ? text.get() : "";
  }
  static std::vector<std::string> archives_of(const std::string &text) {
    const AppList list(text);
    std::vector<std::string> all;
    json_object *paths = json_object_object_get(list.model(0), "app_data_path");
    for (std::size_t i = 0; i < json_object_array_length(paths); ++i) {
      all.emplace_back(json_object_get_string(json_object_array_get_idx(paths, i)));
    }
    return all;
  }
  int info(const std::string &text) const { return count_logged(DLOG_INFO, text); }
  int error(const std::string &text) const { return count_logged(DLOG_ERROR, text); }

  std::vector<std::string> labels_;
  int label_result_ = 0;
};

TEST_F(Pellix, ListNamesAnArchiveForEveryPackage) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b", "2.0");
  const std::string text = answered();
  const AppList list(text);
  EXPECT_EQ(info("make_pellix_app_list"), 1);
  EXPECT_EQ(info("app list is made newly"), 1);
  EXPECT_THAT(list.package_ids(0), ElementsAre("org.a", "org.b"));
  EXPECT_THAT(archives_of(text), ElementsAre(archive(a), archive(b)));
  EXPECT_TRUE(exists(archive(a)));
  EXPECT_TRUE(exists(archive(b)));
  EXPECT_FALSE(exists(a.staged()));
  EXPECT_THAT(cloud_.requests(), IsEmpty());
}

TEST_F(Pellix, ArchiveIsLabelledAndOpenToTheCompanion) {
  const FakePackage &a = install("org.a");
  answered();
  struct stat status = {};
  ASSERT_EQ(stat(archive(a).c_str(), &status), 0);
  EXPECT_THAT(labels_, ElementsAre(std::to_string(status.st_ino) + " com.velmor.pellix-efl"));
  EXPECT_EQ(status.st_mode & 07777, 0777U);
}

TEST_F(Pellix, FolderIsClosedToOthersBeforeTheFirstArchiveIsMade) {
  install("org.a");
  ASSERT_EQ(chown(kCompanionDir.c_str(), 5000, 5000), 0);
  ASSERT_EQ(chmod(kCompanionDir.c_str(), 0777), 0);
  struct stat packing = {};
  ON_CALL(platform_, smack_getlabel)
      .WillByDefault([&](const char *, char **label, smack_label_type) {
        EXPECT_EQ(stat(kCompanionDir.c_str(), &packing), 0);
        *label = strdup("_");
        return 0;
      });
  EXPECT_NE(answered(), "");
  EXPECT_EQ(packing.st_mode & 07777, 0700U);
  EXPECT_EQ(packing.st_uid, 5000U);
}

TEST_F(Pellix, FolderOfAnotherOwnerStaysOpenToTheCompanionsGroup) {
  install("org.a");
  ASSERT_EQ(chown(kCompanionDir.c_str(), 0, 5000), 0);
  ASSERT_EQ(chmod(kCompanionDir.c_str(), 0775), 0);
  EXPECT_NE(answered(), "");
  struct stat status = {};
  ASSERT_EQ(stat(kCompanionDir.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0770U);
  EXPECT_EQ(status.st_gid, 5000U);
}

TEST_F(Pellix, WhatLiesAtTheArchivesNameIsReplacedAndNotWrittenInto) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b");
  const FakePackage &c = install("org.c");
  const std::string victim = kCompanionDir + "/victim";
  write_text(victim, "untouched");
  ASSERT_EQ(link(victim.c_str(), archive(a).c_str()), 0);
  ASSERT_EQ(symlink(victim.c_str(), archive(b).c_str()), 0);
  ASSERT_EQ(mkfifo(archive(c).c_str(), 0666), 0);
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(a), archive(b), archive(c)));
  EXPECT_EQ(read_text(victim), "untouched");
  struct stat status = {};
  ASSERT_EQ(lstat(victim.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644U);
  for (const FakePackage *package : {&a, &b, &c}) {
    ASSERT_EQ(lstat(archive(*package).c_str(), &status), 0);
    EXPECT_TRUE(S_ISREG(status.st_mode));
    EXPECT_EQ(status.st_nlink, 1U);
    EXPECT_EQ(status.st_mode & 07777, 0777U);
  }
}

TEST_F(Pellix, FolderAtTheArchivesNameCostsThatPackageOnly) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b");
  std::filesystem::create_directories(archive(a) + "/in the way");
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(b)));
  EXPECT_EQ(error("cannot put archive " + archive(a) + " in its place"), 1);
  EXPECT_TRUE(exists(archive(a) + "/in the way"));
  int left = 0;
  for ([[maybe_unused]] const auto &entry : std::filesystem::directory_iterator(kCompanionDir)) {
    ++left;
  }
  EXPECT_EQ(left, 2) << "nothing is left of what could not be named";
}

TEST_F(Pellix, LabelThatCannotBeSetIsLoggedAndTheArchiveIsNamed) {
  const FakePackage &a = install("org.a");
  label_result_ = -1;
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(a)));
  EXPECT_EQ(error("smack_setlabel failed for " + archive(a)), 1);
}

TEST_F(Pellix, ModeThatCannotBeSetIsLoggedAndTheArchiveIsNamed) {
  const FakePackage &a = install("org.a");
  // the archive is reached by what is held open: take that away
  ON_CALL(platform_, smack_setlabel)
      .WillByDefault([](const char *path, const char *, smack_label_type) {
        return close(std::stoi(std::filesystem::path(path).filename().string()));
      });
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(a)));
  EXPECT_EQ(error("chmod failed"), 1);
}

TEST_F(Pellix, TwoComponentsOfAPackageYieldOneArchive) {
  FakePackage &a = install("org.a");
  a.apps = {{"org.a.one"}, {"org.a.two"}};
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(a)));
  EXPECT_EQ(labels_.size(), 1U);
}

TEST_F(Pellix, DisabledPackageYieldsNoArchive) {
  FakePackage &a = install("org.a");
  a.apps[0].disabled = true;
  const std::string text = answered();
  EXPECT_THAT(archives_of(text), IsEmpty());
  EXPECT_FALSE(exists(archive(a)));
  EXPECT_THAT(AppList(text).packages(0), ElementsAre("org.a 1.0.0 0"));
}

TEST_F(Pellix, ExactlyTheCapIsPackedAndOneByteMoreIsNot) {
  const FakePackage &exact = install("org.exact", "1", "");
  write_sparse(exact.root + "/data/big", 26214400);
  const FakePackage &over = install("org.over", "1", "");
  write_sparse(over.root + "/data/big", 26214401);
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(exact)));
  EXPECT_FALSE(exists(archive(over)));
  EXPECT_EQ(info("app backup size exceed 25MB, so will not backup data"), 1);
}

TEST_F(Pellix, PackageThatCannotBePackedIsLeftOutAndItsArchiveDeleted) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b");
  // labels are asked of open files
  ON_CALL(platform_, smack_getlabel)
      .WillByDefault([&](const char *path, char **label, smack_label_type) {
        std::error_code none;
        const std::string held = std::filesystem::read_symlink(path, none).string();
        if ((none ? std::string(path) : held).rfind(b.root, 0) == 0) return -1;
        *label = strdup("_");
        return 0;
      });
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(a)));
  EXPECT_FALSE(exists(archive(b)));
}

TEST_F(Pellix, CompanionsOwnArchiveDoesNotHoldItself) {
  FakePackage &companion = install("com.velmor.pellix-efl");
  companion.root = kCompanionRoot;
  std::filesystem::create_directories(kCompanionRoot + "/data");
  std::filesystem::create_directories(kCompanionRoot + "/shared/trusted");
  // more than the writer keeps in memory, so that the archive grows while it is walked
  std::string noise;
  std::minstd_rand random(7);
  while (noise.size() < 1U << 20) noise += static_cast<char>(random() >> 16);
  write_text(kCompanionRoot + "/data/noise", noise);
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(companion)));
  EXPECT_THAT(archives_of(answered()), ElementsAre(archive(companion)));
  const std::string bytes = read_text(archive(companion));
  EXPECT_NE(bytes.find("data/noise"), std::string::npos);
  EXPECT_EQ(bytes.find("com.velmor.pellix-efl_1.0.0.zip"), std::string::npos);
}

TEST_F(Pellix, ListFileDoesNotRemain) {
  install("org.a");
  EXPECT_NE(answered(), "");
  EXPECT_FALSE(exists(kCompanionDir + "/app_list.txt"));
}

TEST_F(Pellix, FailedWalkGivesNothing) {
  install("org.a");
  package_walk_result_ = -5;
  EXPECT_EQ(answered(), "");
  EXPECT_EQ(error("package_manager_foreach_package_info() failed -5"), 1);
}

TEST_F(Pellix, MissingCompanionGivesNothingAndMakesNothing) {
  std::filesystem::remove_all(kCompanionRoot);
  install("org.a");
  EXPECT_EQ(answered(), "");
  EXPECT_FALSE(exists(kCompanionRoot));
}

TEST_F(Pellix, ListThatCannotBeWrittenGivesNothing) {
  std::filesystem::create_directories(kCompanionDir + "/app_list.txt/in the way");
  EXPECT_EQ(answered(), "");
}

TEST_F(Pellix, PlantedLinkIsNotWrittenThrough) {
  write_text(path("victim"), "untouched");
  ASSERT_EQ(symlink(path("victim").c_str(), (kCompanionDir + "/app_list.txt").c_str()), 0);
  EXPECT_EQ(answered(), "");
  EXPECT_EQ(read_text(path("victim")), "untouched");
}

TEST_F(Pellix, PlantedPipeDoesNotStopTheDaemon) {
  ASSERT_EQ(mkfifo((kCompanionDir + "/app_list.txt").c_str(), 0666), 0);
  EXPECT_EQ(answered(), "");
}

TEST_F(Pellix, CloudsListPlaysNoPart) {
  install("org.a");
  cloud_.objects[kAppListInCloud] = "{";
  EXPECT_EQ(AppList(answered()).info(0, "serial_number"), "");
}

TEST_F(Pellix, ProgressOfRunsIsNotDisturbed) {
  static int calls;
  calls = 0;
  set_backup_progress_sink([](const backup_progress &) { ++calls; });
  FakePackage &a = install("org.a");
  write_sparse(a.root + "/data/big", kMaxBackupSize + 1);
  answered();
  EXPECT_EQ(calls, 0);
}

}  // namespace
