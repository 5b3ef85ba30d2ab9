#include <sys/stat.h>
#include <unistd.h>

#include "conformance.h"

using namespace harness;

namespace {
GTEST_ALLOW_UNINSTANTIATED_PARAMETERIZED_TEST(Conformance);

const char *const kBadObjectPaths[] = {
    "",       "relative", "relative/x", "/",     "//",      "/a/",      "/a//b", "//a",
    "/./a",   "/a/.",     "/../a",      "/a/..", "/a/../b", "/a\xff",   "/\xc3", "/\xed\xa0\x80",
    "/a/./b", ".",        "..",         "/.",    "/..",     "/a/b/../", "/a//",
};

TEST_P(Conformance, PathsThatCannotBeAreRefusedWithoutACallback) {
  const std::string local = cloud.file("x");
  for (const char *path : kBadObjectPaths) {
    EXPECT_EQ(cloud.upload(local, path)->accepted, BACKUP_TRANS_ERROR_ARGUMENT) << path;
    EXPECT_EQ(cloud.download(path, cloud.place())->accepted, BACKUP_TRANS_ERROR_ARGUMENT) << path;
    EXPECT_EQ(backup_trans_download_file_ors(cloud.handle, path, cloud.place().c_str(), 0),
              BACKUP_TRANS_ERROR_ARGUMENT)
        << path;
  }
  for (const char *path : {"", "relative", "//", "/a//", "/a//b", "/./", "/a/../b/", "/\xff/"}) {
    EXPECT_EQ(cloud.list(path)->accepted, BACKUP_TRANS_ERROR_ARGUMENT) << path;
    EXPECT_EQ(cloud.remove(path)->accepted, BACKUP_TRANS_ERROR_ARGUMENT) << path;
  }
  EXPECT_TRUE(store->content().empty());
}

TEST_P(Conformance, LongestPathsAreTakenAndLongerOnesRefused) {
  const std::string component(255, 'c');
  const std::string path = "/" + component + "/" + component + "/" + std::string(254, 'd');
  EXPECT_EQ(cloud.put(path, "deep"), BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(cloud.get(path), "deep");
  EXPECT_EQ(cloud.put(path + "/e", "x"), BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.put("/" + component + "c", "x"), BACKUP_TRANS_ERROR_ARGUMENT);
}

TEST_P(Conformance, RootIsNoFolderToDelete) {
  ASSERT_EQ(cloud.put("/a", "x"), BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(cloud.drop("/"), BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.get("/a"), "x");
}

TEST_P(Conformance, RangesOutsideTheListingBoundsAreRefused) {
  EXPECT_EQ(cloud.list("/", -1, 1)->accepted, BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.list("/", 0, 0)->accepted, BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.list("/", 0, -1)->accepted, BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.list("/", 0, BACKUP_TRANS_MAX_LIST_COUNT + 1)->accepted,
            BACKUP_TRANS_ERROR_ARGUMENT);
}

TEST_P(Conformance, MissingPointersAreRefused) {
  const std::string local = cloud.file("x");
  const auto upload_cb = [](backup_trans_error_code, void *, const backup_trans_file_info_s *) {};
  const auto download_cb = [](backup_trans_error_code, void *, char *) {};
  const int argument = BACKUP_TRANS_ERROR_ARGUMENT;
  backup_trans_handle_h none = nullptr;
  backup_trans_handle_h handle = cloud.handle;
  EXPECT_EQ(backup_trans_init(nullptr, nullptr), argument);
  EXPECT_EQ(backup_trans_upload_file_ors_async(handle, local.c_str(), "/a", nullptr, 0, 0, nullptr,
                                               nullptr),
            argument);
  EXPECT_EQ(
      backup_trans_upload_file_ors_async(handle, nullptr, "/a", upload_cb, 0, 0, nullptr, nullptr),
      argument);
  EXPECT_EQ(backup_trans_upload_file_ors_async(handle, local.c_str(), nullptr, upload_cb, 0, 0,
                                               nullptr, nullptr),
            argument);
  EXPECT_EQ(backup_trans_upload_file_ors_async(none, local.c_str(), "/a", upload_cb, 0, 0, nullptr,
                                               nullptr),
            argument);
  EXPECT_EQ(backup_trans_download_file_ors_async(handle, "/a", local.c_str(), nullptr, nullptr, 0),
            argument);
  EXPECT_EQ(backup_trans_download_file_ors_async(handle, "/a", nullptr, nullptr, download_cb, 0),
            argument);
  EXPECT_EQ(
      backup_trans_download_file_ors_async(handle, nullptr, local.c_str(), nullptr, download_cb, 0),
      argument);
  EXPECT_EQ(
      backup_trans_download_file_ors_async(none, "/a", local.c_str(), nullptr, download_cb, 0),
      argument);
  EXPECT_EQ(backup_trans_download_file_ors(none, "/a", local.c_str(), 0), argument);
  EXPECT_EQ(backup_trans_get_folder_child_list_async(handle, "/", 0, 1, 0, nullptr, nullptr),
            argument);
  EXPECT_EQ(backup_trans_get_folder_child_list_async(
                handle, nullptr, 0, 1, 0, nullptr,
                [](backup_trans_error_code, void *, const backup_trans_child_list_s *) {}),
            argument);
  EXPECT_EQ(backup_trans_delete_folder_ors_async(handle, "/a", nullptr, nullptr), argument);
  EXPECT_EQ(backup_trans_delete_folder_ors_async(handle, nullptr, nullptr, upload_cb), argument);
}

TEST_P(Conformance, UnknownOptionsAndImpossibleValuesAreRefused) {
  const std::string local = cloud.file("x");
  EXPECT_EQ(cloud.download("/a", cloud.place(), 2)->accepted, BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.upload(local, "/a", -1)->accepted, BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(cloud.upload(local, "/a", 0, "text/plain\r\nX-Evil: 1")->accepted,
            BACKUP_TRANS_ERROR_ARGUMENT);
  const auto upload_cb = [](backup_trans_error_code, void *, const backup_trans_file_info_s *) {};
  EXPECT_EQ(backup_trans_upload_file_ors_async(cloud.handle, local.c_str(), "/a", upload_cb, 0,
                                               BACKUP_TRANS_OPTION_BASIS, nullptr, nullptr),
            BACKUP_TRANS_ERROR_ARGUMENT);
}

TEST_P(Conformance, LocalFileThatIsNoRegularFileIsRefused) {
  const TempDir local;
  write_file(local / "real", "x");
  ASSERT_EQ(symlink((local / "real").c_str(), (local / "link").c_str()), 0);
  ASSERT_EQ(mkdir((local / "folder").c_str(), 0700), 0);
  ASSERT_EQ(mkfifo((local / "pipe").c_str(), 0600), 0);
  for (const char *name : {"absent", "link", "folder", "pipe", "real/x", ""}) {
    EXPECT_EQ(cloud.upload(local / name, "/a")->accepted, BACKUP_TRANS_ERROR_LOCAL_FILE) << name;
  }
  for (const char *name : {"absent/x", "real/x", ""}) {
    EXPECT_EQ(cloud.download("/a", local / name)->accepted, BACKUP_TRANS_ERROR_LOCAL_FILE) << name;
  }
  EXPECT_TRUE(store->content().empty());
}

TEST_P(Conformance, NothingIsAcceptedOutsideASession) {
  const std::string local = cloud.file("x");
  backup_trans_deinit();
  EXPECT_EQ(backup_trans_create_handle(), nullptr);
  const int refused = BACKUP_TRANS_ERROR_NOT_INITIALIZED;
  EXPECT_EQ(cloud.upload(local, "/a")->accepted, refused);
  EXPECT_EQ(cloud.download("/a", cloud.place())->accepted, refused);
  EXPECT_EQ(cloud.list("/")->accepted, refused);
  EXPECT_EQ(cloud.remove("/a")->accepted, refused);
  EXPECT_EQ(backup_trans_download_file_ors(cloud.handle, "/a", cloud.place().c_str(), 0), refused);
  backup_trans_cancel_request(cloud.handle);
  backup_trans_deinit();
}

TEST_P(Conformance, ConfigurationThatChangedServesTheRequestsAfterIt) {
  ASSERT_EQ(cloud.put("/a", "first"), BACKUP_TRANS_ERROR_NONE);
  cloud.configure(store->other_config());
  EXPECT_EQ(cloud.get("/a"), "<12>");
  ASSERT_EQ(cloud.put("/a", "second"), BACKUP_TRANS_ERROR_NONE);
  cloud.configure(store->config());
  EXPECT_EQ(cloud.get("/a"), "first");
}

TEST_P(Conformance, ConfigurationThatWentAwayRefusesUntilItIsBack) {
  ASSERT_EQ(cloud.put("/a", "x"), BACKUP_TRANS_ERROR_NONE);
  ASSERT_EQ(unlink(cloud.config_path().c_str()), 0);
  EXPECT_EQ(cloud.get("/a"), "<2>");
  cloud.configure("[cloud]\nurl=gopher://x/\n");
  EXPECT_EQ(cloud.get("/a"), "<2>");
  cloud.configure(store->config());
  EXPECT_EQ(cloud.get("/a"), "x");
}

}  // namespace
