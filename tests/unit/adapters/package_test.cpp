#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "log_capture.h"
#include "mock_platform.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package.h"

namespace {

using ::testing::_;
using ::testing::InSequence;
using ::testing::NiceMock;
using ::testing::Return;
using ::testing::StrEq;

char app_record[1];
char pkg_record[1];
char info_record[1];
char pkgid_text[] = "org.example.notes";
char version_text[] = "1.0.0";
const auto package_info = reinterpret_cast<package_info_h>(info_record);
constexpr int kServiceError = -17;

class PackageTest : public ::testing::Test {
 protected:
  PackageTest() {
    clear_captured_log();
    install_complete_pkgs.clear();
    ON_CALL(platform, pkgmgrinfo_appinfo_get_appinfo)
        .WillByDefault([](const char *, pkgmgrinfo_appinfo_h *handle) {
          *handle = app_record;
          return PMINFO_R_OK;
        });
    ON_CALL(platform, pkgmgrinfo_appinfo_get_api_version)
        .WillByDefault([this](pkgmgrinfo_appinfo_h, char **version) {
          *version = api_version.data();
          return PMINFO_R_OK;
        });
    ON_CALL(platform, pkgmgrinfo_appinfo_get_metadata_value)
        .WillByDefault([this](pkgmgrinfo_appinfo_h, const char *key, char **value) {
          if (std::strcmp(key, "backup") != 0 || metadata.empty()) return PMINFO_R_ENOENT;
          *value = metadata.data();
          return PMINFO_R_OK;
        });
    ON_CALL(platform, pkgmgrinfo_appinfo_get_pkgid)
        .WillByDefault([](pkgmgrinfo_appinfo_h, char **pkgid) {
          *pkgid = pkgid_text;
          return PMINFO_R_OK;
        });
    ON_CALL(platform, pkgmgrinfo_pkginfo_get_pkginfo)
        .WillByDefault([](const char *, pkgmgrinfo_pkginfo_h *handle) {
          *handle = pkg_record;
          return PMINFO_R_OK;
        });
    ON_CALL(platform, pkgmgrinfo_pkginfo_get_version)
        .WillByDefault([](pkgmgrinfo_pkginfo_h, char **version) {
          *version = version_text;
          return PMINFO_R_OK;
        });
    ON_CALL(platform, package_manager_get_package_info)
        .WillByDefault([](const char *, package_info_h *info) {
          *info = package_info;
          return PACKAGE_MANAGER_ERROR_NONE;
        });
    ON_CALL(platform, package_info_get_root_path).WillByDefault([](package_info_h, char **path) {
      *path = strdup("/opt/usr/apps/org.example.notes");
      return PACKAGE_MANAGER_ERROR_NONE;
    });
  }

  /** The application's record is released once, and no other record is opened. */
  void expect_app_record_released() {
    EXPECT_CALL(platform, pkgmgrinfo_appinfo_destroy_appinfo(app_record)).Times(1);
    EXPECT_CALL(platform, pkgmgrinfo_pkginfo_destroy_pkginfo).Times(0);
  }

  NiceMock<MockPlatform> platform;
  std::string api_version = "4.0";
  std::string metadata;
};

TEST_F(PackageTest, ApiVersionsAreComparedAsBytes) {
  expect_app_record_released();
  api_version = "2.10";
  EXPECT_FALSE(app_support_api_version("org.example.notes", "2.4"));
}

TEST_F(PackageTest, TheSameApiVersionIsSupported) {
  expect_app_record_released();
  api_version = "2.4";
  EXPECT_TRUE(app_support_api_version("org.example.notes", "2.4"));
}

TEST_F(PackageTest, AHigherApiVersionIsSupported) {
  api_version = "3.0";
  EXPECT_TRUE(app_support_api_version("org.example.notes", "2.4"));
}

TEST_F(PackageTest, AnUnknownApplicationSupportsNoApiVersion) {
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_appinfo(StrEq("org.example.none"), _))
      .WillOnce(Return(PMINFO_R_ENOENT));
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_destroy_appinfo).Times(0);
  EXPECT_FALSE(app_support_api_version("org.example.none", "2.4"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get app info of org.example.none"), 1);
}

TEST_F(PackageTest, AnUnreadableApiVersionIsNotSupported) {
  expect_app_record_released();
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_api_version).WillOnce(Return(PMINFO_R_ERROR));
  EXPECT_FALSE(app_support_api_version("org.example.notes", "2.4"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get api-version of org.example.notes"), 1);
}

TEST_F(PackageTest, AnApplicationWithoutMetadataIsBackedUp) {
  expect_app_record_released();
  EXPECT_TRUE(backup_enabled_app("org.example.notes"));
  EXPECT_EQ(count_logged(DLOG_INFO, "backup enabled for org.example.notes"), 1);
}

TEST_F(PackageTest, OnlyTheExactTextDisableTurnsBackupOff) {
  for (const char *other : {"Disable", "disabled", "disable ", "no", "false"}) {
    metadata = other;
    EXPECT_TRUE(backup_enabled_app("org.example.notes")) << other;
  }
  clear_captured_log();
  expect_app_record_released();
  metadata = "disable";
  EXPECT_FALSE(backup_enabled_app("org.example.notes"));
  EXPECT_EQ(
      captured_texts(),
      std::vector<std::string>{"backup disabled for org.example.notes => metadata set to disable"});
  EXPECT_EQ(captured_log().front().level, DLOG_INFO);
}

TEST_F(PackageTest, AnEmptyMetadataValueIsBackedUp) {
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_metadata_value)
      .WillOnce([](pkgmgrinfo_appinfo_h, const char *, char **value) {
        *value = nullptr;
        return PMINFO_R_OK;
      });
  EXPECT_TRUE(backup_enabled_app("org.example.notes"));
}

TEST_F(PackageTest, AnUnknownApplicationIsNotBackedUp) {
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_appinfo).WillOnce(Return(PMINFO_R_ENOENT));
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_destroy_appinfo).Times(0);
  EXPECT_FALSE(backup_enabled_app("org.example.none"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get app info of org.example.none"), 1);
}

TEST_F(PackageTest, AnApplicationWithoutApiVersionIsNotBackedUp) {
  expect_app_record_released();
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_api_version).WillOnce(Return(PMINFO_R_ERROR));
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_metadata_value).Times(0);
  EXPECT_FALSE(backup_enabled_app("org.example.notes"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get api-version of org.example.notes"), 1);
}

TEST_F(PackageTest, InstalledPackagesAreFoundByTheirWholeId) {
  install_complete_pkgs = {"org.example.notes", "org.example.chess"};
  EXPECT_TRUE(already_installed_package("org.example.notes"));
  EXPECT_TRUE(already_installed_package("org.example.chess"));
  EXPECT_FALSE(already_installed_package("org.example"));
}

TEST_F(PackageTest, NoPackageIsInstalledAtFirst) {
  EXPECT_FALSE(already_installed_package("org.example.notes"));
}

class StorageTest : public PackageTest {
 protected:
  void storage_is(pkgmgrinfo_installed_storage where) {
    EXPECT_CALL(platform, pkgmgrinfo_pkginfo_get_installed_storage(pkg_record, _))
        .WillOnce([where](pkgmgrinfo_pkginfo_h, pkgmgrinfo_installed_storage *storage) {
          *storage = where;
          return PMINFO_R_OK;
        });
    EXPECT_CALL(platform, pkgmgrinfo_pkginfo_destroy_pkginfo(pkg_record)).Times(1);
  }
};

TEST_F(StorageTest, ExternalStorageIsRecognised) {
  storage_is(PMINFO_EXTERNAL_STORAGE);
  EXPECT_TRUE(app_data_storage_is_external("org.example.notes"));
}

TEST_F(StorageTest, InternalStorageIsNotExternal) {
  storage_is(PMINFO_INTERNAL_STORAGE);
  EXPECT_FALSE(app_data_storage_is_external("org.example.notes"));
}

TEST_F(StorageTest, AnUnknownPackageIsNotExternal) {
  EXPECT_CALL(platform, pkgmgrinfo_pkginfo_get_pkginfo).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, pkgmgrinfo_pkginfo_destroy_pkginfo).Times(0);
  EXPECT_FALSE(app_data_storage_is_external("org.example.none"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "pkgmgrinfo_pkginfo_get_pkginfo() Fail -17"), 1);
}

TEST_F(StorageTest, AnUnreadableStorageIsNotExternalAndTheRecordIsReleased) {
  EXPECT_CALL(platform, pkgmgrinfo_pkginfo_get_installed_storage).WillOnce(Return(kServiceError));
  EXPECT_CALL(platform, pkgmgrinfo_pkginfo_destroy_pkginfo(pkg_record)).Times(1);
  EXPECT_FALSE(app_data_storage_is_external("org.example.notes"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "pkgmgrinfo_pkginfo_get_installed_storage() Fail -17"), 1);
}

class PkgInfoTest : public PackageTest {
 protected:
  PkgInfoTest() {
    ON_CALL(platform, pkgmgrinfo_appinfo_destroy_appinfo).WillByDefault([this](void *) {
      ++app_released;
      return PMINFO_R_OK;
    });
    ON_CALL(platform, pkgmgrinfo_pkginfo_destroy_pkginfo).WillByDefault([this](void *) {
      ++pkg_released;
      return PMINFO_R_OK;
    });
  }

  void expect_failure(const char *appid, const char *message, int apps, int pkgs) {
    char untouched[1];
    char *pkgid = untouched;
    char *version = untouched;
    EXPECT_EQ(get_pkg_info(appid, &pkgid, &version), QUARN_FAILED);
    EXPECT_EQ(pkgid, untouched);
    EXPECT_EQ(version, untouched);
    EXPECT_EQ(count_logged(DLOG_ERROR, message), 1);
    EXPECT_EQ(app_released, apps);
    EXPECT_EQ(pkg_released, pkgs);
  }

  int app_released = 0;
  int pkg_released = 0;
};

TEST_F(PkgInfoTest, GivesCopiesOfIdAndVersion) {
  char *pkgid = nullptr;
  char *version = nullptr;
  EXPECT_EQ(get_pkg_info("org.example.notes.app", &pkgid, &version), QUARN_OK);
  const CString pkgid_owner(pkgid);
  const CString version_owner(version);
  EXPECT_STREQ(pkgid, "org.example.notes");
  EXPECT_STREQ(version, "1.0.0");
  EXPECT_NE(pkgid, pkgid_text);
  EXPECT_EQ(app_released, 1);
  EXPECT_EQ(pkg_released, 1);
}

TEST_F(PkgInfoTest, AnUnknownApplicationGives42AndLeavesTheOutPointers) {
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_appinfo).WillOnce(Return(kServiceError));
  expect_failure("org.example.none", "pkgmgrinfo_appinfo_get_appinfo() Fail -17", 0, 0);
}

TEST_F(PkgInfoTest, AMissingPackageIdGives42) {
  EXPECT_CALL(platform, pkgmgrinfo_appinfo_get_pkgid).WillOnce(Return(kServiceError));
  expect_failure("org.example.notes", "pkgmgrinfo_appinfo_get_pkgid() Fail -17", 1, 0);
}

TEST_F(PkgInfoTest, AMissingPackageRecordGives42) {
  EXPECT_CALL(platform, pkgmgrinfo_pkginfo_get_pkginfo(StrEq("org.example.notes"), _))
      .WillOnce(Return(kServiceError));
  expect_failure("org.example.notes", "pkgmgrinfo_pkginfo_get_pkginfo() Fail -17", 1, 0);
}

TEST_F(PkgInfoTest, AMissingVersionGives42) {
  EXPECT_CALL(platform, pkgmgrinfo_pkginfo_get_version).WillOnce(Return(kServiceError));
  expect_failure("org.example.notes", "pkgmgrinfo_pkginfo_get_version() Fail -17", 1, 1);
}

TEST_F(PackageTest, TheRootPathIsACopyOfThePlatforms) {
  EXPECT_CALL(platform, package_info_destroy(package_info)).Times(1);
  const CString root(get_app_root_path("org.example.notes"));
  EXPECT_STREQ(root.get(), "/opt/usr/apps/org.example.notes");
}

TEST_F(PackageTest, AnUnknownPackageHasNoRootPath) {
  EXPECT_CALL(platform, package_manager_get_package_info)
      .WillOnce(Return(PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE));
  EXPECT_CALL(platform, package_info_destroy).Times(0);
  EXPECT_EQ(get_app_root_path("org.example.none"), nullptr);
  EXPECT_EQ(count_logged(DLOG_ERROR, "Fail: package_manager_get_package_info : no such package"),
            1);
}

TEST_F(PackageTest, EachPackageErrorHasItsWords) {
  const std::pair<int, const char *> errors[] = {
      {PACKAGE_MANAGER_ERROR_INVALID_PARAMETER, "invalid parameter"},
      {PACKAGE_MANAGER_ERROR_OUT_OF_MEMORY, "out of memory"},
      {PACKAGE_MANAGER_ERROR_IO_ERROR, "input or output error"},
      {kServiceError, "unknown error"},
  };
  for (const auto &[error, words] : errors) {
    EXPECT_CALL(platform, package_info_get_root_path).WillOnce(Return(error));
    EXPECT_CALL(platform, package_info_destroy(package_info)).Times(1);
    EXPECT_EQ(get_app_root_path("org.example.notes"), nullptr);
    EXPECT_EQ(count_logged(DLOG_ERROR, std::string("Fail: package_info_get_root_path : ") + words),
              1);
  }
}

TEST_F(PackageTest, ANullRootPathIsNoRootPath) {
  EXPECT_CALL(platform, package_info_get_root_path).WillOnce([](package_info_h, char **path) {
    *path = nullptr;
    return PACKAGE_MANAGER_ERROR_NONE;
  });
  EXPECT_CALL(platform, package_info_destroy(package_info)).Times(1);
  EXPECT_EQ(get_app_root_path("org.example.notes"), nullptr);
}

TEST_F(PackageTest, TheRootPathIsAssignedToAString) {
  std::string root = "before";
  EXPECT_EQ(get_string_app_root_path("org.example.notes", root), QUARN_OK);
  EXPECT_EQ(root, "/opt/usr/apps/org.example.notes");
}

TEST_F(PackageTest, AFailedRootPathGives36AndKeepsTheString) {
  EXPECT_CALL(platform, package_manager_get_package_info)
      .WillOnce(Return(PACKAGE_MANAGER_ERROR_IO_ERROR));
  std::string root = "before";
  EXPECT_EQ(get_string_app_root_path("org.example.none", root), QUARN_REFUSED);
  EXPECT_EQ(root, "before");
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get root path info of (org.example.none)..."), 1);
}

}  // namespace
