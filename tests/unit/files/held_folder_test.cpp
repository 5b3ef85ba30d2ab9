#include "files/held_folder.h"
#include "quarn_d_utils/package_identity.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <optional>
#include <string>
#include <thread>

#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "temp_dir.h"

namespace {

class HeldFolderTest : public ::testing::Test {
 protected:
  HeldFolderTest() { dir_.file("root/data/file", "first"); }
  /** Another folder takes the path. */
  void replace() const {
    std::filesystem::rename(dir_ / "root", dir_ / "aside");
    dir_.file("root/data/file", "second");
  }
  static std::string read_by_path(const std::string &path) {
    char *raw = nullptr;
    const bool read = read_data_from_file(path.c_str(), &raw);
    const CString text(raw);
    return read ? text.get() : "";
  }

  TempDir dir_;
};

TEST_F(HeldFolderTest, PathsLeadToTheFolderThatWasOpened) {
  const std::string path = dir_ / "root/data/file";
  {
    const HeldFolder held(dir_ / "root");
    EXPECT_TRUE(held.is_in_place());
    replace();
    EXPECT_FALSE(held.is_in_place());
    EXPECT_EQ(read_by_path(path), "first");
    EXPECT_EQ(write_string_to_file("new", dir_ / "root/data/new/file"), QUARN_OK);
    EXPECT_TRUE(delete_file(path.c_str()));
  }
  EXPECT_EQ(read_by_path(path), "second");
  EXPECT_FALSE(exists(dir_ / "root/data/new"));
  EXPECT_EQ(read_text(dir_ / "aside/data/new/file"), "new");
}

TEST_F(HeldFolderTest, NothingIsFoundOrMadeWhenItHasGone) {
  const HeldFolder held(dir_ / "root");
  std::filesystem::remove_all(dir_ / "root");
  EXPECT_FALSE(held.is_in_place());
  for (int round = 0; round < 2; ++round) {
    EXPECT_EQ(write_string_to_file("new", dir_ / "root/data/file"), QUARN_REFUSED);
    EXPECT_EQ(safe_mkdir_with_parents((dir_ / "root/data").c_str(), 0755), -1);
    EXPECT_EQ(errno, ENOENT);
    EXPECT_FALSE(exists(dir_ / "root/data/file") && round == 0);
    dir_.file("root/data/other", "second");  // and nothing in another
  }
  EXPECT_FALSE(file_exist((dir_ / "root/data/other").c_str()));
}

TEST_F(HeldFolderTest, OneThatWasNotThereHoldsNothing) {
  const HeldFolder held(dir_ / "none");
  EXPECT_FALSE(held);
  EXPECT_FALSE(held.is_in_place());
  dir_.file("none/file", "x");
  EXPECT_FALSE(file_exist((dir_ / "none/file").c_str()));
  EXPECT_FALSE(is_directory((dir_ / "none").c_str()));
  const HeldFolder again(dir_ / "none");
  EXPECT_TRUE(file_exist((dir_ / "none/file").c_str())) << "looked for once more";
}

TEST_F(HeldFolderTest, TheInnermostCountsAndTheOuterOneKeepsTheSame) {
  std::optional<HeldFolder> root(dir_ / "root");
  std::optional<HeldFolder> data(dir_ / "root/data");
  std::filesystem::rename(dir_ / "root/data", dir_ / "root/moved");
  dir_.file("root/data/file", "second");
  EXPECT_EQ(read_by_path(dir_ / "root/data/file"), "first");
  EXPECT_FALSE(data->is_in_place());
  {
    const HeldFolder same(dir_ / "root/data");
    EXPECT_EQ(same.fd(), data->fd());
    EXPECT_FALSE(same.is_in_place());
  }
  EXPECT_EQ(read_by_path(dir_ / "root/data/file"), "first");
  data.reset();
  EXPECT_EQ(read_by_path(dir_ / "root/data/file"), "second");
  // in whatever order they end
  data.emplace(dir_ / "root/data");
  root.reset();
  EXPECT_TRUE(data->is_in_place());
  EXPECT_EQ(read_by_path(dir_ / "root/data/file"), "second");
}

TEST_F(HeldFolderTest, AFileIsHeldLikeAFolder) {
  const std::string path = dir_ / "root/data/file";
  const HeldFile held(path);
  dir_.file("other", "second");
  std::filesystem::rename(dir_ / "other", path);
  EXPECT_FALSE(held.is_in_place());
  EXPECT_EQ(read_by_path(path), "first");
  struct stat status = {};
  EXPECT_EQ(safe_lstat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_nlink, 0U);
}

TEST_F(HeldFolderTest, IsOfTheThreadAndOfItsNameOnly) {
  const HeldFolder held(dir_ / "root");
  dir_.file("root2/file", "beside");
  EXPECT_EQ(read_by_path(dir_ / "root2/file"), "beside");
  replace();
  std::thread([&] { EXPECT_EQ(read_by_path(dir_ / "root/data/file"), "second"); }).join();
}

TEST_F(HeldFolderTest, NoWayLeadsOutOfIt) {
  const HeldFolder held(dir_ / "root");
  dir_.file("outside", "x");
  EXPECT_FALSE(safe_open((dir_ / "root/../outside").c_str(), O_RDONLY));
  std::filesystem::create_symlink(dir_ / "outside", dir_ / "root/link");
  ASSERT_EQ(lchown((dir_ / "root/link").c_str(), kAppUid, kAppGid), 0);
  EXPECT_FALSE(safe_open((dir_ / "root/link/").c_str(), O_RDONLY));
  EXPECT_FALSE(open_held_as_package(dir_ / "root/../outside", O_RDONLY));
  EXPECT_TRUE(open_held_as_package(dir_ / "root/data/file", O_RDONLY));
}

}  // namespace
