#include "quarn_d_utils/boot_cleanup.h"
#include "quarn_common.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "log_capture.h"
#include "mock_platform.h"
#include "platform_package_manager.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/working_files.h"
#include "temp_dir.h"

namespace {

using ::testing::_;
using ::testing::NiceMock;
using ::testing::Return;

namespace fs = std::filesystem;

constexpr char kPkgId[] = "org.example.notes";
constexpr int kServiceError = -5;

char info_object[1];
const auto info = reinterpret_cast<package_info_h>(info_object);

class BootCleanupTest : public ::testing::Test {
 protected:
  BootCleanupTest() {
    shared = root / "shared/data";
    fs::create_directories(shared);
    boot_cleanup_done = false;
    clear_captured_log();
    ON_CALL(platform, package_info_get_package).WillByDefault([](package_info_h, char **id) {
      *id = strdup(kPkgId);
      return PACKAGE_MANAGER_ERROR_NONE;
    });
    ON_CALL(platform, package_info_get_root_path)
        .WillByDefault([this](package_info_h, char **path) {
          *path = strdup(root.c_str());
          return PACKAGE_MANAGER_ERROR_NONE;
        });
    ON_CALL(platform, package_manager_foreach_package_info)
        .WillByDefault([](package_manager_package_info_cb callback, void *user_data) {
          EXPECT_TRUE(callback(info, user_data));
          return PACKAGE_MANAGER_ERROR_NONE;
        });
  }

  fs::path make_file(const fs::path &path) {
    std::ofstream(path) << "left behind";
    return path;
  }
  fs::path upload() const { return shared / (std::string(kPkgId) + "_upload.zip"); }
  fs::path download() const { return shared / (std::string(kPkgId) + "_download.zip"); }

  void expect_left_alone(const char *message = nullptr) {
    make_file(upload());
    EXPECT_TRUE(boot_foreach_package_info_callback(info, nullptr));
    EXPECT_TRUE(fs::exists(upload()));
    if (message != nullptr) {
      EXPECT_EQ(captured_texts(), std::vector<std::string>{message});
      EXPECT_EQ(captured_log().front().level, DLOG_ERROR);
    }
  }

  NiceMock<MockPlatform> platform;
  const TempDir dir;
  const fs::path root = dir.path();
  fs::path shared;
};

TEST_F(BootCleanupTest, BothArchivesOfAnInterruptedRunAreDeletedAndNothingElse) {
  make_file(upload());
  make_file(download());
  const fs::path kept[] = {
      make_file(shared / "notes.db"),
      make_file(shared / (std::string(kPkgId) + ".perm")),
      make_file(shared / "org.example.chess_upload.zip"),
      make_file(root / (std::string(kPkgId) + "_upload.zip")),
  };
  fs::create_directory(shared / "quarn_tmp_rst_dir");
  boot_cleanup_backup_items();
  EXPECT_FALSE(fs::exists(upload()));
  EXPECT_FALSE(fs::exists(download()));
  for (const fs::path &path : kept) EXPECT_TRUE(fs::exists(path)) << path;
  EXPECT_TRUE(fs::exists(shared / "quarn_tmp_rst_dir"));
  EXPECT_EQ(captured_texts(), std::vector<std::string>{"checking if previous backup item exist"});
  EXPECT_EQ(captured_log().front().level, DLOG_INFO);
}

TEST_F(BootCleanupTest, AnApplicationsOwnFilesOfTheseNamesStay) {
  for (const fs::path &path : {upload(), download()}) {
    make_file(path);
    ASSERT_EQ(chown(path.c_str(), 5000, 5000), 0);
  }
  const fs::path aside =
      make_file(shared / ("quarn_tmp_rst_dir." + std::string(kPkgId) + "_upload.zip"));
  boot_cleanup_backup_items();
  EXPECT_TRUE(fs::exists(upload()));
  EXPECT_TRUE(fs::exists(download()));
  EXPECT_FALSE(fs::exists(aside)) << "which is the daemon's, made beside such a file";
}

TEST_F(BootCleanupTest, ASecondSweepDoesNothing) {
  EXPECT_CALL(platform, package_manager_foreach_package_info).Times(1);
  boot_cleanup_backup_items();
  clear_captured_log();
  make_file(upload());
  boot_cleanup_backup_items();
  EXPECT_TRUE(fs::exists(upload()));
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(BootCleanupTest, RestoresThatWereCutOffAreMendedOnceAlsoAfterAFailedWalk) {
  static int mended;
  mended = 0;
  EXPECT_CALL(platform, package_manager_foreach_package_info).WillOnce(Return(kServiceError));
  set_boot_recovery([] { ++mended; });
  boot_cleanup_backup_items();
  boot_cleanup_backup_items();
  set_boot_recovery(nullptr);
  EXPECT_EQ(mended, 1);
}

TEST_F(BootCleanupTest, AFailedWalkIsLoggedAndNotRepeated) {
  EXPECT_CALL(platform, package_manager_foreach_package_info).WillOnce(Return(kServiceError));
  boot_cleanup_backup_items();
  EXPECT_EQ(count_logged(DLOG_ERROR, "package_manager_foreach_package_info() failed -5"), 1);
  boot_cleanup_backup_items();
}

TEST_F(BootCleanupTest, AnArchiveThatThisProcessUsesIsLeftAlone) {
  claim_working_file(make_file(upload()));
  make_file(download());
  boot_cleanup_backup_items();
  EXPECT_TRUE(fs::exists(upload()));
  EXPECT_FALSE(fs::exists(download()));
}

TEST_F(BootCleanupTest, TheClockIsNotAsked) {
  // A device without a clock of its own boots in the past: what was left lies in the future.
  make_file(upload());
  make_file(download());
  const timespec later[2] = {{4000000000, 0}, {4000000000, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, upload().c_str(), later, 0), 0);
  ASSERT_EQ(utimensat(AT_FDCWD, download().c_str(), later, 0), 0);
  boot_cleanup_backup_items();
  EXPECT_FALSE(fs::exists(upload()));
  EXPECT_FALSE(fs::exists(download()));
}

TEST_F(BootCleanupTest, AnApplicationsOwnFileIsNotDeletedForItsName) {
  const fs::path named[] = {make_file(upload()), make_file(download()),
                            make_file(shared / ".quarn-part-0123456789abcdef01234567"),
                            make_file(shared / (std::string(kPkgId) + ".perm"))};
  for (const fs::path &path : named) {
    ASSERT_EQ(chmod(path.c_str(), 0600), 0);
    ASSERT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
  }
  boot_cleanup_backup_items();
  for (const fs::path &path : named) EXPECT_TRUE(fs::exists(path)) << path;
}

TEST_F(BootCleanupTest, APartOfADownloadIsDeletedOnceNoTransferHoldsIt) {
  const fs::path left = make_file(shared / ".quarn-part-0123456789abcdef01234567");
  const fs::path held = make_file(shared / ".quarn-part-1123456789abcdef01234567");
  const UniqueFd transfer(open(held.c_str(), O_RDONLY));
  ASSERT_EQ(flock(transfer.get(), LOCK_EX), 0);
  boot_cleanup_backup_items();
  EXPECT_FALSE(fs::exists(left));
  EXPECT_TRUE(fs::exists(held));
}

TEST_F(BootCleanupTest, ATableOfTheDaemonsOwnIsDeleted) {
  const fs::path table = make_file(shared / (std::string(kPkgId) + ".perm"));
  ASSERT_EQ(chmod(table.c_str(), 0600), 0);
  boot_cleanup_backup_items();
  EXPECT_FALSE(fs::exists(table));
}

TEST_F(BootCleanupTest, APreloadedPackagesArchiveIsNotDeleted) {
  EXPECT_CALL(platform, package_info_is_preload_package)
      .WillOnce([](package_info_h, bool *preload) {
        *preload = true;
        return PACKAGE_MANAGER_ERROR_NONE;
      });
  expect_left_alone();
}

TEST_F(BootCleanupTest, APackageOfUnknownOriginIsLeftAlone) {
  EXPECT_CALL(platform, package_info_is_preload_package).WillOnce(Return(kServiceError));
  expect_left_alone("package_info_is_preload_package fail, err = [-5]");
}

TEST_F(BootCleanupTest, APackageWithoutAReadableIdIsLeftAlone) {
  EXPECT_CALL(platform, package_info_get_package).WillOnce(Return(kServiceError));
  expect_left_alone("package_info_get_package() was failed, ret = [-5]");
}

TEST_F(BootCleanupTest, APackageWithoutAnIdIsLeftAlone) {
  EXPECT_CALL(platform, package_info_get_package).WillOnce(Return(PACKAGE_MANAGER_ERROR_NONE));
  expect_left_alone("pkg_id is NULL");
}

TEST_F(BootCleanupTest, APackageWithoutAReadableRootIsLeftAlone) {
  EXPECT_CALL(platform, package_info_get_root_path).WillOnce(Return(kServiceError));
  expect_left_alone("package_info_get_root_path() was failed, ret = [-5]");
}

TEST_F(BootCleanupTest, APackageWithoutARootIsLeftAlone) {
  EXPECT_CALL(platform, package_info_get_root_path).WillOnce(Return(PACKAGE_MANAGER_ERROR_NONE));
  expect_left_alone("pkg_root_path is NULL");
}

TEST_F(BootCleanupTest, ALinkInPlaceOfAnArchiveIsLeftAlone) {
  const fs::path target = make_file(root / "target");
  fs::create_symlink(target, upload());
  boot_cleanup_backup_items();
  EXPECT_TRUE(fs::is_symlink(upload()));
  EXPECT_TRUE(fs::exists(target));
}

TEST_F(BootCleanupTest, AnApplicationsLinkToAnotherFolderIsNotFollowed) {
  const fs::path elsewhere = root / "elsewhere";
  fs::create_directory(elsewhere);
  make_file(elsewhere / upload().filename());
  fs::remove(shared);
  fs::create_directory_symlink(elsewhere, shared);
  ASSERT_EQ(lchown(shared.c_str(), kAppUid, kAppGid), 0);
  boot_cleanup_backup_items();
  EXPECT_TRUE(fs::exists(elsewhere / upload().filename()));
}

TEST_F(BootCleanupTest, APackageWithoutLeftoversIsNoFailure) {
  boot_cleanup_backup_items();
  EXPECT_EQ(captured_texts().size(), 1U);
}

}  // namespace
