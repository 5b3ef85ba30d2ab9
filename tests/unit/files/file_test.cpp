#include <fcntl.h>
#include <glib.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <zlib.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>

#include "fault.h"
#include "files/package_files.h"
#include "log_capture.h"
#include "quarn_common.h"
#include "quarn_d_utils/directory.h"
#include "quarn_d_utils/file.h"
#include "temp_dir.h"

namespace {

class Files : public ::testing::Test {
 protected:
  void SetUp() override { clear_captured_log(); }
  static int errors(const std::string &text) { return count_logged(DLOG_ERROR, text); }

  TempDir dir_;
};

unsigned int mode_of(const std::string &path) {
  struct stat status = {};
  return lstat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

/* ---- names ----------------------------------------------------------------- */

TEST_F(Files, SafePathComponentsAreNamesOfOneEntry) {
  EXPECT_TRUE(is_safe_path_component("org.example.notes"));
  EXPECT_TRUE(is_safe_path_component("1.0.0"));
  EXPECT_TRUE(is_safe_path_component("..."));
  EXPECT_FALSE(is_safe_path_component(""));
  EXPECT_FALSE(is_safe_path_component("."));
  EXPECT_FALSE(is_safe_path_component(".."));
  EXPECT_FALSE(is_safe_path_component("../etc"));
  EXPECT_FALSE(is_safe_path_component("a/b"));
  EXPECT_FALSE(is_safe_path_component(std::string("a\0b", 3)));
}

/* ---- kinds ------------------------------------------------------------------ */

TEST_F(Files, FileExistsForARegularFileOnly) {
  const auto file = dir_.file("file", "x");
  EXPECT_TRUE(file_exist(file.c_str()));
  EXPECT_FALSE(file_exist(dir_.path().c_str()));
  EXPECT_FALSE(file_exist((dir_ / "none").c_str()));
  EXPECT_FALSE(file_exist(nullptr));
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(Files, ALinkIsNeitherFileNorDirectory) {
  const auto to_file = dir_.link("to_file", dir_.file("file", "x"));
  const auto to_dir = dir_.link("to_dir", dir_.dir("dir"));
  EXPECT_FALSE(file_exist(to_file.c_str()));
  EXPECT_FALSE(is_directory(to_file.c_str()));
  EXPECT_FALSE(file_exist(to_dir.c_str()));
  EXPECT_FALSE(is_directory(to_dir.c_str()));
  EXPECT_TRUE(is_directory((dir_ / "dir").c_str()));
}

TEST_F(Files, NothingBehindAnApplicationsLinkExists) {
  dir_.file("real/file", "x");
  const auto link = dir_.link("way", dir_ / "real");
  ASSERT_EQ(lchown(link.c_str(), kAppUid, kAppGid), 0);
  EXPECT_FALSE(file_exist((dir_ / "way/file").c_str()));
  EXPECT_FALSE(delete_file((dir_ / "way/file").c_str()));
  EXPECT_EQ(write_string_to_file("y", dir_ / "way/file"), QUARN_REFUSED);
  EXPECT_FALSE(copy_file((dir_ / "real/file").c_str(), (dir_ / "way/copy").c_str()));
  EXPECT_FALSE(delete_directory_util((dir_ / "way").c_str()));
  EXPECT_EQ(read_text(dir_ / "real/file"), "x");
}

/* ---- empty directories ------------------------------------------------------ */

TEST_F(Files, ADirectoryOfEmptyDirectoriesIsEmpty) {
  dir_.dir("top/a/b");
  dir_.dir("top/c");
  EXPECT_TRUE(is_empty_directory((dir_ / "top").c_str()));
  dir_.file("top/a/b/file", "");
  EXPECT_FALSE(is_empty_directory((dir_ / "top").c_str()));
  EXPECT_TRUE(file_exist_in_directory((dir_ / "top").c_str()));
}

TEST_F(Files, ADirectoryOfLinksIsEmpty) {
  dir_.dir("top");
  dir_.link("top/link", dir_.file("file", "x"));
  EXPECT_TRUE(is_empty_directory((dir_ / "top").c_str()));
  EXPECT_EQ(errors("this is unexpected type : " + dir_ / "top/link"), 1);
}

TEST_F(Files, ADirectoryThatCannotBeOpenedIsEmpty) {
  EXPECT_TRUE(is_empty_directory((dir_ / "none").c_str()));
  EXPECT_EQ(errors("error : cannot open this path " + dir_ / "none"), 1);
}

TEST_F(Files, TheSearchGoesOnAfterAFileAndAfterFailures) {
  dir_.file("top/file", "x");
  dir_.dir("top/sub");
  ASSERT_EQ(mkfifo((dir_ / "top/fifo").c_str(), 0600), 0);
  EXPECT_TRUE(file_exist_in_directory((dir_ / "top").c_str()));
  EXPECT_EQ(errors("this is unexpected type : " + dir_ / "top/fifo"), 1);
  {
    const Fault fault("fstatat", EIO, 0, 3);
    EXPECT_FALSE(file_exist_in_directory((dir_ / "top").c_str()));
  }
  EXPECT_EQ(errors("error : lstat for -1 " + dir_ / "top/file"), 1);
  const Fault fault("openat", EMFILE);
  EXPECT_TRUE(file_exist_in_directory((dir_ / "top").c_str()));
  EXPECT_EQ(errors("error : cannot open this path " + dir_ / "top/sub"), 1);
}

/** Folders one in the other below @p path, and a file in the last of them. */
void make_deep_tree(const std::string &path, int levels) {
  int at = open(path.c_str(), O_PATH | O_DIRECTORY);
  for (int level = 0; level < levels; ++level) {
    ASSERT_EQ(mkdirat(at, "d", 0755), 0);
    const int next = openat(at, "d", O_PATH | O_DIRECTORY);
    close(at);
    at = next;
  }
  close(openat(at, "file", O_WRONLY | O_CREAT, 0600));
  close(at);
}

TEST_F(Files, ATreeIsSearchedHoweverDeepItIs) {
  make_deep_tree(dir_.path(), 2000);
  EXPECT_TRUE(file_exist_in_directory(dir_.path().c_str()));
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_TRUE(delete_directory_util((dir_ / "d").c_str()));
}

TEST_F(Files, ATreeIsDeletedHoweverDeepItIs) {
  make_deep_tree(dir_.path(), 30000);
  EXPECT_TRUE(delete_directory_util((dir_ / "d").c_str()));
  EXPECT_FALSE(exists(dir_ / "d"));
  make_deep_tree(dir_.path(), 2000);
  EXPECT_TRUE(clear_directory(dir_.path().c_str(), false));
  EXPECT_FALSE(exists(dir_ / "d"));
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(Files, ADeepTreeIsDeletedWithFewDescriptors) {
  make_deep_tree(dir_.path(), 1000);
  rlimit before = {};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit few = {32, before.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &few), 0);
  EXPECT_TRUE(delete_directory_util((dir_ / "d").c_str()));
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_FALSE(exists(dir_ / "d"));
}

/* ---- size, content, checksum ------------------------------------------------ */

TEST_F(Files, TellsAFilesSize) {
  EXPECT_EQ(get_file_size(dir_.file("file", "12345").c_str()), 5);
  EXPECT_EQ(get_file_size((dir_ / "none").c_str()), -1);
  EXPECT_EQ(errors("[" + dir_ / "none" + "] is not exist"), 1);
  const Fault fault("fstat", EIO, 1);
  EXPECT_EQ(get_file_size((dir_ / "file").c_str()), -1);
  EXPECT_EQ(errors("lstat() was failed err : -1"), 1);
}

TEST_F(Files, ASizeBeyondTheResultsRangeIsItsLargest) {
  const auto file = dir_.file("file", "");
  ASSERT_EQ(truncate(file.c_str(), 5LL << 30), 0);
  EXPECT_EQ(get_file_size(file.c_str()), INT_MAX);
}

TEST_F(Files, ReadsAWholeFile) {
  char *data = nullptr;
  ASSERT_TRUE(read_data_from_file(dir_.file("file", "some text").c_str(), &data));
  EXPECT_STREQ(data, "some text");
  std::free(data);
  ASSERT_TRUE(read_data_from_file(dir_.file("empty", "").c_str(), &data));
  EXPECT_STREQ(data, "");
  std::free(data);
}

TEST_F(Files, ReadingTellsEveryFailure) {
  const auto file = dir_.file("file", "text");
  char *data = nullptr;
  EXPECT_FALSE(read_data_from_file((dir_ / "none").c_str(), &data));
  EXPECT_EQ(errors("[" + dir_ / "none" + "] is not exist"), 1);
  {
    const Fault fault("fstat", EIO, 1);
    EXPECT_FALSE(read_data_from_file(file.c_str(), &data));
    EXPECT_EQ(errors("lstat() was failed"), 1);
  }
  {
    const Fault fault("calloc", ENOMEM);
    EXPECT_FALSE(read_data_from_file(file.c_str(), &data));
    EXPECT_EQ(errors("calloc() was failed, dataBuffer is NULL"), 1);
  }
  {
    const Fault fault("read", EIO);
    EXPECT_FALSE(read_data_from_file(file.c_str(), &data));
    EXPECT_EQ(errors("fread() was failed, readFileSize < 0"), 1);
  }
  EXPECT_EQ(data, nullptr);
}

std::string vanishing_file;
void remove_vanishing_file() { unlink(vanishing_file.c_str()); }

TEST_F(Files, AFileThatVanishesBeforeItIsOpenedIsTold) {
  vanishing_file = dir_.file("file", "text");
  char *data = nullptr;
  set_call_hook("calloc", remove_vanishing_file);
  EXPECT_FALSE(read_data_from_file(vanishing_file.c_str(), &data));
  set_call_hook("calloc", nullptr);
  EXPECT_EQ(errors("fopen() was failed, fp is NULL"), 1);
}

TEST_F(Files, AnInterruptedReadIsTakenUpAgain) {
  const auto file = dir_.file("file", "text");
  const Fault fault("read", EINTR);
  char *data = nullptr;
  ASSERT_TRUE(read_data_from_file(file.c_str(), &data));
  EXPECT_STREQ(data, "text");
  std::free(data);
  EXPECT_EQ(fault.hits(), 1);
}

TEST_F(Files, TheChecksumIsZlibs) {
  std::string text;
  for (int i = 0; i < 100000; ++i) text += static_cast<char>(i * 7 + i / 256);
  const auto *bytes = reinterpret_cast<const Bytef *>(text.data());
  EXPECT_EQ(get_file_crc(dir_.file("file", text).c_str()),
            crc32(crc32(0, nullptr, 0), bytes, static_cast<uInt>(text.size())));
  EXPECT_EQ(get_file_crc(dir_.file("check", "123456789").c_str()), 0xcbf43926U);
}

TEST_F(Files, TheChecksumOfAnEmptyAndOfAMissingFileIsZero) {
  EXPECT_EQ(get_file_crc(dir_.file("empty", "").c_str()), 0U);
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_EQ(get_file_crc((dir_ / "none").c_str()), 0U);
  EXPECT_EQ(errors("fopen() failed, file is NULL"), 1);
  const Fault fault("calloc", ENOMEM);
  EXPECT_EQ(get_file_crc(dir_.file("file", "x").c_str()), 0U);
  EXPECT_EQ(errors("calloc() failed, buf is NULL"), 1);
}

TEST_F(Files, ReadingNeverWaitsForAPipe) {
  ASSERT_EQ(mkfifo((dir_ / "fifo").c_str(), 0600), 0);
  EXPECT_EQ(get_file_crc((dir_ / "fifo").c_str()), 0U);
  EXPECT_EQ(errors("fopen() failed, file is NULL"), 1);
}

/* ---- deleting --------------------------------------------------------------- */

TEST_F(Files, DeletesAFile) {
  const auto file = dir_.file("file", "x");
  EXPECT_TRUE(delete_file(file.c_str()));
  EXPECT_FALSE(exists(file));
}

TEST_F(Files, DeletingRefusesWhatIsNoFile) {
  const auto link = dir_.link("link", dir_.file("file", "x"));
  EXPECT_FALSE(delete_file(link.c_str()));
  EXPECT_FALSE(delete_file(dir_.dir("dir").c_str()));
  EXPECT_FALSE(delete_file((dir_ / "none/file").c_str()));
  EXPECT_EQ(errors("file is not exist"), 3);
  EXPECT_TRUE(exists(link));
  EXPECT_FALSE(delete_file(nullptr));
  EXPECT_EQ(errors("file_path is NULL"), 1);
}

std::string returning_file;
void make_returning_file() { std::ofstream(returning_file) << "again"; }

TEST_F(Files, DeletingTellsAFileThatStays) {
  const auto file = dir_.file("file", "x");
  {
    const Fault fault("unlinkat", EPERM);
    EXPECT_FALSE(delete_file(file.c_str()));
    EXPECT_EQ(errors("file was not deleted"), 1);
  }
  returning_file = file;
  set_call_hook("fstatat", make_returning_file);
  EXPECT_FALSE(delete_file(file.c_str()));
  set_call_hook("fstatat", nullptr);
  EXPECT_EQ(errors("file is exist"), 1);
}

TEST_F(Files, DeletesATree) {
  dir_.file("top/a/b/file", "x");
  dir_.file("top/file", "x");
  dir_.dir("top/empty");
  EXPECT_TRUE(delete_directory_util((dir_ / "top").c_str()));
  EXPECT_FALSE(exists(dir_ / "top"));
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(Files, DeletingATreeLeavesALinkAndItsParents) {
  dir_.file("outside/file", "x");
  dir_.file("top/sub/file", "x");
  dir_.file("top/other/file", "x");
  dir_.link("top/sub/link", dir_ / "outside");
  EXPECT_FALSE(delete_directory_util((dir_ / "top").c_str()));
  EXPECT_TRUE(exists(dir_ / "top/sub/link"));
  EXPECT_TRUE(exists(dir_ / "outside/file"));
  EXPECT_FALSE(exists(dir_ / "top/sub/file"));
  EXPECT_FALSE(exists(dir_ / "top/other"));
  EXPECT_EQ(errors("fail to delete file : " + dir_ / "top/sub/link"), 1);
  EXPECT_EQ(errors("fail to delete dir : " + dir_ / "top/sub"), 1);
  EXPECT_EQ(errors("Directory delete was failed"), 2);
}

TEST_F(Files, DeletingATreeTellsEveryFailure) {
  EXPECT_FALSE(delete_directory_util(nullptr));
  EXPECT_EQ(errors("directory_path is NULL"), 1);
  EXPECT_FALSE(delete_directory_util(dir_.file("file", "x").c_str()));
  EXPECT_EQ(errors("directory_path is not directory"), 1);
  dir_.dir("top");
  const Fault fault("openat", EMFILE);
  EXPECT_FALSE(delete_directory_util((dir_ / "top").c_str()));
  EXPECT_EQ(errors("directory open failed, err = [Error opening directory “" + dir_ / "top" +
                   "”: Too many open files]"),
            1);
}

TEST_F(Files, ClearingWhatIsNoDirectoryDoesNothing) {
  const auto file = dir_.file("file", "x");
  EXPECT_TRUE(clear_directory(file.c_str(), false));
  EXPECT_TRUE(clear_directory(file.c_str(), true));
  EXPECT_TRUE(clear_directory((dir_ / "none").c_str(), true));
  EXPECT_TRUE(exists(file));
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(Files, ClearingKeepsTheDirectoryOrNot) {
  dir_.file("top/sub/file", "x");
  dir_.file("top/file", "x");
  EXPECT_TRUE(clear_directory((dir_ / "top").c_str(), false));
  EXPECT_TRUE(std::filesystem::is_empty(dir_ / "top"));
  EXPECT_TRUE(clear_directory((dir_ / "top").c_str(), true));
  EXPECT_FALSE(exists(dir_ / "top"));
}

TEST_F(Files, ClearingTellsWhatStays) {
  dir_.dir("top/sub");
  dir_.link("top/sub/link", "x");
  dir_.link("top/link", "x");
  dir_.file("top/file", "x");
  EXPECT_FALSE(clear_directory((dir_ / "top").c_str(), false));
  EXPECT_EQ(errors("this is unexpected type : " + dir_ / "top/link"), 1);
  EXPECT_EQ(errors("fail to delete dir : " + dir_ / "top/sub"), 1);
  EXPECT_TRUE(exists(dir_ / "top/link"));
  EXPECT_FALSE(exists(dir_ / "top/file"));
}

TEST_F(Files, ClearingGoesOnAfterFailures) {
  const auto file = dir_.file("top/file", "x");
  {
    const Fault fault("unlinkat", EPERM);
    EXPECT_FALSE(clear_directory((dir_ / "top").c_str(), false));
    EXPECT_EQ(errors("fail to delete file : " + file), 1);
  }
  {
    const Fault fault("fstatat", EIO);
    EXPECT_TRUE(clear_directory((dir_ / "top").c_str(), false));
    EXPECT_EQ(errors("error : lstat for -1 " + file), 1);
  }
  EXPECT_TRUE(exists(file));
}

TEST_F(Files, ALinkAmongOtherEntriesDoesNotMakeClearingFail) {
  dir_.dir("top");
  dir_.link("top/link", "x");
  EXPECT_TRUE(clear_directory((dir_ / "top").c_str(), false));
  EXPECT_EQ(errors("this is unexpected type : " + dir_ / "top/link"), 1);
}

TEST_F(Files, ClearingSharedDataKeepsTheSnapshot) {
  const auto keep = dir_.dir("top/quarn_tmp_rst_dir");
  dir_.file("top/quarn_tmp_rst_dir/data/file", "x");
  dir_.file("top/quarn_tmp_rst_dir2/file", "x");
  dir_.file("top/file", "x");
  EXPECT_TRUE(clear_shared_data_dir_except_temp_backup((dir_ / "top").c_str(), keep.c_str()));
  EXPECT_TRUE(exists(dir_ / "top/quarn_tmp_rst_dir/data/file"));
  EXPECT_FALSE(exists(dir_ / "top/quarn_tmp_rst_dir2"));
  EXPECT_FALSE(exists(dir_ / "top/file"));
  EXPECT_FALSE(clear_shared_data_dir_except_temp_backup((dir_ / "none").c_str(), keep.c_str()));
  EXPECT_EQ(errors("error : cannot open this path " + dir_ / "none"), 1);
}

/* ---- space ------------------------------------------------------------------- */

TEST_F(Files, FreeSpaceCountsTheReservedBlocks) {
  struct statfs status = {};
  ASSERT_EQ(statfs(dir_.path().c_str(), &status), 0);
  const auto free_bytes = static_cast<std::uint64_t>(status.f_bfree) * status.f_bsize;
  const auto told = get_dir_available_size(dir_.path().c_str());
  // other processes use the file system meanwhile
  EXPECT_NEAR(static_cast<double>(told), static_cast<double>(free_bytes), 1 << 28);
  EXPECT_GT(told, 0U);
}

TEST_F(Files, FreeSpaceOfAMissingPathIsZero) {
  EXPECT_EQ(get_dir_available_size((dir_ / "none").c_str()), 0U);
  EXPECT_EQ(errors("statfs error"), 1);
}

/* ---- writing ----------------------------------------------------------------- */

TEST_F(Files, MakesTheDirectoriesOfAFile) {
  EXPECT_TRUE(create_directory_of_file((dir_ / "a/b/file").c_str()));
  EXPECT_TRUE(is_directory((dir_ / "a/b").c_str()));
  EXPECT_EQ(mode_of(dir_ / "a"), 0755U);
  EXPECT_EQ(mode_of(dir_ / "a/b"), 0755U);
  EXPECT_TRUE(create_directory_of_file((dir_ / "a/b/file").c_str()));
  EXPECT_FALSE(exists(dir_ / "a/b/file"));
}

TEST_F(Files, MakingDirectoriesTellsEveryFailure) {
  EXPECT_FALSE(create_directory_of_file(nullptr));
  EXPECT_EQ(errors("file_name is NULL"), 1);
  dir_.file("file", "x");
  EXPECT_FALSE(create_directory_of_file((dir_ / "file/sub/x").c_str()));
  EXPECT_EQ(errors("directory create was failed, dir = [" + dir_ / "file/sub" + "]"), 1);
  {
    const Fault fault("g_path_get_dirname", 0);
    EXPECT_FALSE(create_directory_of_file((dir_ / "a/x").c_str()));
    EXPECT_EQ(errors("g_path_get_dirname is fail"), 1);
  }
  // Behind the making, which looks at each part of the path.
  const std::string made = dir_ / "a";
  const auto parts = static_cast<int>(std::count(made.begin(), made.end(), '/'));
  const Fault fault("fstat", EIO, parts);
  EXPECT_FALSE(create_directory_of_file((made + "/x").c_str()));
  EXPECT_EQ(errors("directory create was failed, directory is not exist."), 1);
}

TEST_F(Files, WritesAText) {
  EXPECT_EQ(write_string_to_file("text", dir_ / "a/b/file"), QUARN_OK);
  EXPECT_EQ(read_text(dir_ / "a/b/file"), "text");
  EXPECT_EQ(mode_of(dir_ / "a/b/file"), 0600U);
  EXPECT_EQ(write_string_to_file("x", dir_ / "a/b/file"), QUARN_OK);
  EXPECT_EQ(read_text(dir_ / "a/b/file"), "x");
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir_ / "a/b"), {}), 1);
}

TEST_F(Files, WritingNothingLeavesTheFile) {
  const auto file = dir_.file("file", "old");
  EXPECT_EQ(write_string_to_file("", file), QUARN_BAD_ARGUMENT);
  EXPECT_EQ(errors("Invalid Data"), 1);
  EXPECT_EQ(read_text(file), "old");
  EXPECT_EQ(write_string_to_file("text", ""), QUARN_BAD_ARGUMENT);
  EXPECT_EQ(errors("Invalid File Name"), 1);
}

TEST_F(Files, WritingNeverGoesThroughWhatLiesThere) {
  const auto target = dir_.file("target", "old");
  const auto link = dir_.link("link", target);
  EXPECT_EQ(write_string_to_file("new", link), QUARN_OK);
  EXPECT_EQ(read_text(target), "old");
  EXPECT_TRUE(file_exist(link.c_str()));
  EXPECT_EQ(read_text(link), "new");

  // a second name of the old file keeps the old content, and an open mode does not stay
  const auto open_file = dir_.file("open", "old");
  ASSERT_EQ(chmod(open_file.c_str(), 0666), 0);
  std::filesystem::create_hard_link(open_file, dir_ / "second");
  EXPECT_EQ(write_string_to_file("new", open_file), QUARN_OK);
  EXPECT_EQ(read_text(dir_ / "second"), "old");
  EXPECT_EQ(mode_of(open_file), 0600U);
}

TEST_F(Files, WritingWorksWithoutNamelessFiles) {
  const auto link = dir_.link("link", dir_.file("target", "old"));
  {
    const Fault fault("openat O_TMPFILE", EOPNOTSUPP, 0, 9);
    EXPECT_EQ(write_string_to_file("new", link), QUARN_OK);
    EXPECT_EQ(fault.hits(), 1);
  }
  EXPECT_EQ(read_text(link), "new");
  EXPECT_EQ(read_text(dir_ / "target"), "old");
  EXPECT_EQ(mode_of(link), 0600U);
  const Fault fault("linkat", ENOENT);  // /proc is not there
  EXPECT_EQ(write_string_to_file("newer", link), QUARN_OK);
  EXPECT_EQ(read_text(link), "newer");
}

TEST_F(Files, WritingTellsItsFailures) {
  const auto file = dir_ / "file";
  EXPECT_EQ(write_string_to_file("x", dir_.dir("dir")), QUARN_REFUSED);
  EXPECT_EQ(errors("Writing to File " + dir_ / "dir" + " Failed"), 1);
  {
    const Fault fault("write", ENOSPC, 0, 9);
    EXPECT_EQ(write_string_to_file("x", file), QUARN_REFUSED);
  }
  EXPECT_EQ(errors("Writing to File " + file + " Failed"), 1);
  EXPECT_FALSE(exists(file));
  dir_.file("blocked", "x");
  EXPECT_EQ(write_string_to_file("x", dir_ / "blocked/file"), QUARN_REFUSED);
  EXPECT_EQ(errors("Writing to File " + dir_ / "blocked/file" + " Failed"), 1);
}

TEST_F(Files, AFullDiskLeavesTheOldText) {
  const auto file = dir_.file("file", "old");
  const Fault fault("write", ENOSPC, 0, 9);
  EXPECT_EQ(write_string_to_file("new", file), QUARN_REFUSED);
  EXPECT_EQ(read_text(file), "old");
}

/* ---- copying ----------------------------------------------------------------- */

std::string long_text() {
  std::string text;
  for (int i = 0; i < 60000; ++i) text += std::to_string(i);
  return text;
}

TEST_F(Files, CopiesAFile) {
  const auto text = long_text();
  const auto from = dir_.file("from", text);
  EXPECT_TRUE(copy_file(from.c_str(), (dir_ / "to").c_str()));
  EXPECT_EQ(read_text(dir_ / "to"), text);
  EXPECT_EQ(mode_of(dir_ / "to"), 0600U);
  EXPECT_TRUE(copy_file(dir_.file("empty", "").c_str(), (dir_ / "to").c_str()));
  EXPECT_TRUE(file_exist((dir_ / "to").c_str()));
  EXPECT_EQ(read_text(dir_ / "to"), "");
}

TEST_F(Files, CopiesWhereTheKernelDoesNotHelp) {
  const auto text = long_text();
  const auto from = dir_.file("from", text);
  const Fault fault("copy_file_range", EXDEV);
  EXPECT_TRUE(copy_file(from.c_str(), (dir_ / "to").c_str()));
  EXPECT_EQ(read_text(dir_ / "to"), text);
}

TEST_F(Files, CopyingReplacesAnExistingFile) {
  const auto from = dir_.file("from", "new");
  const auto to = dir_.file("to", "old and longer");
  EXPECT_TRUE(copy_file(from.c_str(), to.c_str()));
  EXPECT_EQ(read_text(to), "new");
}

TEST_F(Files, CopyingADirectoryIsRefused) {
  const auto from = dir_.dir("from");
  EXPECT_FALSE(copy_file(from.c_str(), (dir_ / "to").c_str()));
  EXPECT_EQ(errors("Requested source instance '" + from + "' is not a file"), 1);
}

TEST_F(Files, CopyingALinkIsRefused) {
  const auto from = dir_.link("from", dir_.file("file", "x"));
  EXPECT_FALSE(copy_file(from.c_str(), (dir_ / "to").c_str()));
  EXPECT_EQ(errors("Requested source instance '" + from + "' does not exist"), 1);
}

TEST_F(Files, CopyingOntoALinkDoesNotFollowIt) {
  const auto from = dir_.file("from", "new");
  const auto to = dir_.link("to", dir_.file("target", "old"));
  EXPECT_FALSE(copy_file(from.c_str(), to.c_str()));
  EXPECT_EQ(errors("file fDes open error."), 1);
  EXPECT_EQ(read_text(dir_ / "target"), "old");
}

TEST_F(Files, CopyingTellsEveryFailure) {
  const auto from = dir_.file("from", "new");
  const auto to = dir_.file("to", "old");
  EXPECT_FALSE(copy_file(nullptr, to.c_str()));
  EXPECT_FALSE(copy_file(from.c_str(), nullptr));
  EXPECT_EQ(errors("Invalid Parameter..."), 2);
  {
    const Fault fault("unlinkat", EPERM);
    EXPECT_FALSE(copy_file(from.c_str(), to.c_str()));
    EXPECT_EQ(errors("Requested dest instance '" + to + "' exist, can not delete it"), 1);
  }
  for (const int error : {ENOSPC, EIO, EDQUOT}) {
    clear_captured_log();
    const Fault fault("copy_file_range", error);
    EXPECT_FALSE(copy_file(from.c_str(), to.c_str()));
    EXPECT_EQ(errors("write error."), 1);
  }
}

std::string long_gone;
void remove_long_gone() { unlink(long_gone.c_str()); }

TEST_F(Files, CopyingTellsASourceThatVanishes) {
  long_gone = dir_.file("from", "new");
  const auto to = dir_.file("to", "old");
  set_call_hook("unlinkat", remove_long_gone);
  EXPECT_FALSE(copy_file(long_gone.c_str(), to.c_str()));
  set_call_hook("unlinkat", nullptr);
  EXPECT_EQ(errors("file fSrc open error."), 1);
}

TEST_F(Files, CopyingThroughTheBufferTellsReadAndWriteErrors) {
  // an empty read of the kernel's copy leads to the buffer: so does a file of /proc
  const auto to = dir_ / "to";
  {
    const Fault fault("read", EIO);
    EXPECT_FALSE(copy_file("/proc/self/stat", to.c_str()));
    EXPECT_EQ(errors("read error."), 1);
  }
  {
    const Fault fault("write", ENOSPC);
    EXPECT_FALSE(copy_file("/proc/self/stat", to.c_str()));
    EXPECT_EQ(errors("write error."), 1);
  }
  EXPECT_TRUE(copy_file("/proc/self/stat", to.c_str()));
  EXPECT_FALSE(read_text(to).empty());
}

}  // namespace
