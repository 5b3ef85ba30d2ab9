#include <fcntl.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>

#include "quarn_common.h"
#include "quarn_d_restore/copy_bytes.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_info_table.h"
#include "restore_fixture.h"

using ::testing::_;
using ::testing::Return;

namespace {

/** What an application does while a file of its is copied. */
std::function<void()> on_copy;

}  // namespace

extern "C" ssize_t copy_file_range(int from, off64_t *in, int to, off64_t *out, std::size_t size,
                                   unsigned int flags) {
  if (on_copy) on_copy();
  return syscall(SYS_copy_file_range, from, in, to, out, size, flags);
}

namespace {

class SnapshotTest : public RestoreTest {
 protected:
  int take() { return temp_backup_initial_app_data(kPkg, root.c_str()); }
  int roll_back() { return rollback_to_initial_app_data(kPkg, root.c_str()); }
  std::string snapshot_table() const { return snapshot() + "/shared/data/org.example.notes.perm"; }
  Tree tree() const { return tree_of(root); }
  /** What a restore that broke off might leave. */
  void spoil() {
    unpacked_file("data/settings.ini", "broken");
    set_label(at("data/settings.ini"), "other");
    std::filesystem::remove(at("shared/trusted/key.bin"));
    unpacked_file("data/new/half.tmp", "half");
    daemons_file("shared/data/org.example.notes.perm", "{}");
  }
};

TEST_F(SnapshotTest, CopiesEveryFileAndWritesTheTableLast) {
  make_old_data();
  bool table_there = true;
  {
    const AtStep step("snapshot-copied", [&] { table_there = exists(snapshot_table()); });
    ASSERT_EQ(take(), 0);
  }
  EXPECT_FALSE(table_there);
  EXPECT_EQ(read_text(snapshot() + "/data/settings.ini"), "old settings");
  EXPECT_EQ(read_text(snapshot() + "/data/db/notes.db"), "old notes");
  EXPECT_EQ(read_text(snapshot() + "/shared/trusted/key.bin"), "old key");
  const JsonPtr table(json_tokener_parse(read_text(snapshot_table()).c_str()));
  json_object *entry = nullptr;
  ASSERT_TRUE(json_object_object_get_ex(table.get(), "data/db/notes.db", &entry));
  EXPECT_EQ(json_object_get_int(json_object_object_get(entry, "0")), 0600);
  EXPECT_STREQ(json_object_get_string(json_object_object_get(entry, "3")), "wrt::db_origin");
  EXPECT_TRUE(json_object_object_get_ex(table.get(), "data/db", nullptr));
  EXPECT_FALSE(exists(snapshot() + "/table"));
}

TEST_F(SnapshotTest, IsReadableToNobodyElse) {
  make_old_data();
  ASSERT_EQ(take(), 0);
  struct stat status = {};
  ASSERT_EQ(lstat(snapshot().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0700U);
  EXPECT_EQ(status.st_uid, 0U);
}

TEST_F(SnapshotTest, WhileItIsCompleteTheHalfRestoredDataIsNotPacked) {
  make_old_data();
  ASSERT_EQ(take(), 0);
  spoil();
  std::filesystem::remove(perm());
  const std::string archive = base + "/archive.zip";
  int error = 0;
  make_zip_data(kPkg, root.c_str(), archive.c_str(), &error);
  EXPECT_EQ(error, 36);
  EXPECT_FALSE(exists(archive));
  expect_error("restore of (org.example.notes) was interrupted, so its data is not packed");
  ASSERT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
  error = 0;
  make_zip_data(kPkg, root.c_str(), archive.c_str(), &error);
  EXPECT_EQ(error, 0);
  EXPECT_TRUE(exists(archive));
}

TEST_F(SnapshotTest, AnApplicationsOwnFolderOfThatNameHindersNoBackup) {
  make_old_data();
  dir("shared/data/quarn_tmp_rst_dir", 0700);
  file("shared/data/quarn_tmp_rst_dir/shared/data/org.example.notes.perm", "{}");
  int error = 0;
  make_zip_data(kPkg, root.c_str(), (base + "/archive.zip").c_str(), &error);
  EXPECT_EQ(error, 0);
}

TEST_F(SnapshotTest, LeavesTheDataAlone) {
  make_old_data();
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  EXPECT_TRUE(discard_snapshot(kPkg, root.c_str()));
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, ArchivesInTransitAndTheSnapshotItselfAreNotCopied) {
  file("data/a", "x");
  file("shared/data/org.example.notes_upload.zip", "up");
  file("shared/data/org.example.notes_download.zip", "down");
  file("shared/data/quarn_tmp_rst_dir2", "sibling");
  ASSERT_EQ(take(), 0);
  ASSERT_EQ(take(), 0) << "a second restore cannot copy the snapshot into itself";
  EXPECT_EQ(tree_of(snapshot()).size(), 6U)
      << "data, data/a, shared, shared/data, the table, the stamps";
}

TEST_F(SnapshotTest, ASymbolicLinkIsUnexpectedAndNotCopied) {
  file("data/a", "x");
  std::filesystem::create_symlink("/etc/hostname", at("data/link"));
  EXPECT_EQ(take(), 0);
  expect_error("this is unexpected type : " + at("data/link"));
  EXPECT_FALSE(exists(snapshot() + "/data/link"));
  EXPECT_EQ(read_text(snapshot_table()).find("data/link"), std::string::npos);
}

TEST_F(SnapshotTest, AnEmptyDirectoryIsRecordedButNotRecreatedByARollback) {
  file("data/a", "x");
  dir("data/empty");
  ASSERT_EQ(take(), 0);
  EXPECT_NE(read_text(snapshot_table()).find("data\\/empty"), std::string::npos);
  roll_back();
  EXPECT_FALSE(exists(at("data/empty")));
  EXPECT_EQ(read_text(at("data/a")), "x");
}

TEST_F(SnapshotTest, ATableInTheDataNeverMakesTheSnapshotLookComplete) {
  file("shared/data/org.example.notes.perm", "{}");
  file("data/a", "x");
  bool looked_complete = true;
  const AtStep step("snapshot-copied", [&] { looked_complete = exists(snapshot_table()); });
  ASSERT_EQ(take(), 0);
  EXPECT_FALSE(looked_complete);
}

TEST_F(SnapshotTest, AFileThatCannotBeReadFailsIt) {
  make_old_data();
  ASSERT_EQ(chmod(at("shared/data").c_str(), 0777), 0);
  ASSERT_EQ(chmod(at("data").c_str(), 0777), 0);
  ASSERT_EQ(chmod(at("data/db").c_str(), 0777), 0);
  ASSERT_EQ(chmod(at("data/db/notes.db").c_str(), 0), 0);
  const Tree before = tree();
  {
    const WithoutCapabilities none({CAP_DAC_OVERRIDE, CAP_DAC_READ_SEARCH});
    EXPECT_EQ(take(), 36);
  }
  expect_error("fail copy : from " + at("data/db/notes.db") + " to " + snapshot() +
               "/data/db/notes.db");
  expect_error("fail to temp backup : " + at("data"));
  EXPECT_FALSE(exists(snapshot()));
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, AFullDiskFailsItAndSharedTrustedIsNotCopied) {
  file("data/small", "x");
  file("shared/data/large", std::string(200000, 'l'));
  file("shared/trusted/key", "k");
  const Tree before = tree();
  bool trusted_reached = false;
  const AtStep step(
      "snapshot-entry", [&] { trusted_reached = true; }, 3);
  {
    const DiskFullAfter limit(100000);
    EXPECT_EQ(take(), 36);
  }
  expect_error("fail copy : from " + at("shared/data/large") + " to " + snapshot() +
               "/shared/data/large");
  expect_error("fail to temp backup : " + at("shared/data"));
  EXPECT_FALSE(trusted_reached) << "the third entry is its key";
  EXPECT_FALSE(exists(snapshot()));
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, ALabelThatCannotBeReadFailsIt) {
  make_old_data();
  ON_CALL(platform, smack_getlabel).WillByDefault(Return(-1));
  EXPECT_EQ(take(), 36);
  expect_error("fail to temp backup : " + at("data"));
}

TEST_F(SnapshotTest, AMissingDirectoryFailsIt) {
  make_old_data();
  std::filesystem::remove_all(at("shared/trusted"));
  EXPECT_EQ(take(), 36);
  expect_error("error : cannot open this path " + at("shared/trusted"));
  expect_error("fail to temp backup : " + at("shared/trusted"));
  EXPECT_FALSE(exists(snapshot()));
}

TEST_F(SnapshotTest, ATableThatCannotBeWrittenIsReportedAndTheSnapshotIsIncomplete) {
  file("data/a", "x");
  const AtStep step("snapshot-copied", [&] {
    // the name of the unfinished table is taken by a directory
    std::filesystem::create_directories(snapshot() + "/table/in/the/way");
  });
  EXPECT_EQ(take(), 36);
  expect_error("fail. temp_backup_initial_app_data : 36");
  EXPECT_EQ(read_text(snapshot() + "/data/a"), "x") << "left in place";
  EXPECT_FALSE(exists(snapshot_table()));
}

TEST_F(SnapshotTest, AnEntryThatVanishesIsLogged) {
  const std::string gone = file("data/a", "x");
  const AtStep step("snapshot-folder", [&] { unlink(gone.c_str()); });
  EXPECT_EQ(take(), 0);
  expect_error("error : lstat for -1 " + gone);
}

TEST_F(SnapshotTest, ADirectoryThatCannotBeOpenedIsAFailure) {
  file_info_table_h *table = nullptr;
  ready_file_info_table(&table);
  EXPECT_EQ(parse_dir_for_copy(at("none").c_str(), snapshot().c_str(), kPkg, root.c_str(), table),
            0);
  release_file_info_table(table);
  expect_error("error : cannot open this path " + at("none"));
  EXPECT_EQ(parse_dir_for_rollback(at("none").c_str(), kPkg, root.c_str()), 0);
  expect_error("error : cannot open this path " + at("none"), 2);
}

/* ---- what may lie in the snapshot's place ---- */

TEST_F(SnapshotTest, ALinkInItsPlaceIsRemovedAndNotFollowed) {
  file("data/a", "x");
  std::filesystem::create_directory(base + "/outside");
  std::filesystem::create_directory_symlink(base + "/outside", snapshot());
  ASSERT_EQ(take(), 0);
  EXPECT_TRUE(std::filesystem::is_empty(base + "/outside"));
  EXPECT_TRUE(std::filesystem::is_directory(std::filesystem::symlink_status(snapshot())));
}

TEST_F(SnapshotTest, AnApplicationsDirectoryInItsPlaceStaysAndIsNeverTheSnapshot) {
  file("data/a", "x");
  dir("shared/data/quarn_tmp_rst_dir");
  file("shared/data/quarn_tmp_rst_dir/data/planted", "evil");
  file("shared/data/quarn_tmp_rst_dir/shared/data/org.example.notes.perm", "{}");
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  EXPECT_EQ(read_text(snapshot() + "/data/planted"), "evil");
  EXPECT_EQ(read_text(snapshot() + ".snapshot/data/a"), "x");
  struct stat status = {};
  ASSERT_EQ(lstat((snapshot() + ".snapshot").c_str(), &status), 0);
  EXPECT_EQ(status.st_uid, 0U);
  unpacked_file("data/a", "half of a restore");
  EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, WhereTheApplicationHasBothNamesNothingIsTouched) {
  file("data/a", "x");
  file("shared/data/quarn_tmp_rst_dir", "its own");
  dir("shared/data/quarn_tmp_rst_dir.snapshot", 0700);
  file("shared/data/quarn_tmp_rst_dir.snapshot/inner", "its own");
  const Tree before = tree();
  EXPECT_EQ(take(), 36);
  EXPECT_TRUE(discard_snapshot(kPkg, root.c_str()));
  recover_interrupted_restore(kPkg, root.c_str());
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, OneBesideTheUsualPlaceCountsWhenThatIsFreeAgain) {
  file("data/a", "x");
  file("shared/data/quarn_tmp_rst_dir", "its own");
  ASSERT_EQ(take(), 0);
  unpacked_file("data/a", "half of a restore");
  ASSERT_EQ(unlink(snapshot().c_str()), 0);
  int error = 0;
  make_zip_data(kPkg, root.c_str(), (base + "/archive.zip").c_str(), &error);
  EXPECT_EQ(error, 36) << "a half restored package is not packed";
  EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(read_text(at("data/a")), "x");
  EXPECT_FALSE(exists(snapshot() + ".snapshot"));
}

TEST_F(SnapshotTest, ALinkInAFolderInItsPlaceHindersNothing) {
  file("data/a", "x");
  std::filesystem::create_directories(snapshot());
  std::filesystem::create_symlink("/nowhere", snapshot() + "/link");
  EXPECT_EQ(take(), 0);
  EXPECT_FALSE(std::filesystem::is_symlink(snapshot() + "/link"));
}

TEST_F(SnapshotTest, HolesOfAnySizeTakeNeitherTimeNorRoom) {
  constexpr off_t kHole = off_t{1} << 40;
  const std::string path = file("data/huge", "begin");
  const UniqueFd huge(open(path.c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(pwrite(huge.get(), "middle", 6, kHole), 6);
  if (ftruncate(huge.get(), 2 * kHole) != 0) GTEST_SKIP() << "no file can be as large here";
  struct stat status = {};
  EXPECT_EQ(take(), 0);
  ASSERT_EQ(stat((snapshot() + "/data/huge").c_str(), &status), 0);
  EXPECT_EQ(status.st_size, 2 * kHole);
  EXPECT_LT(status.st_blocks, 1024);
  ASSERT_EQ(ftruncate(huge.get(), 0), 0);
  EXPECT_EQ(roll_back(), 0);
  const UniqueFd back(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  char text[7] = {};
  EXPECT_EQ(pread(back.get(), text, 5, 0), 5);
  EXPECT_STREQ(text, "begin");
  EXPECT_EQ(pread(back.get(), text, 6, kHole), 6);
  EXPECT_STREQ(text, "middle");
  ASSERT_EQ(fstat(back.get(), &status), 0);
  EXPECT_EQ(status.st_size, 2 * kHole);
}

TEST_F(SnapshotTest, AFileThatGrowsForEverIsCopiedAsItWas) {
  for (const std::size_t size : {100U, 1U << 20}) {
    const std::string path = file("data/log", std::string(size, 'x'));
    std::size_t grown = 0;
    on_copy = [&] {
      std::ofstream(path, std::ios::app) << std::string(size, 'y');
      ASSERT_LT(++grown, 10U) << "nothing ends it";
    };
    EXPECT_EQ(take(), 0);
    on_copy = nullptr;
    EXPECT_EQ(grown > 0, size > 100);
    EXPECT_TRUE(read_text(snapshot() + "/data/log") == std::string(size, 'x'));
    EXPECT_EQ(roll_back(), 0);
  }
}

TEST_F(SnapshotTest, AFileThatShrinksIsCopiedAsFarAsItGoes) {
  const std::string path = file("data/log", std::string(1U << 20, 'x'));
  on_copy = [&] { std::filesystem::resize_file(path, 4096); };
  EXPECT_EQ(take(), 0);
  on_copy = nullptr;
  EXPECT_TRUE(read_text(snapshot() + "/data/log") == std::string(4096, 'x'));
}

/* ---- rollback ---- */

TEST_F(SnapshotTest, ARollbackPutsContentModesOwnersAndLabelsBack) {
  make_old_data();
  const std::string other = file("data/others", "x", 0640);
  ASSERT_EQ(chown(other.c_str(), 5001, 100), 0);
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  EXPECT_EQ(roll_back(), 0);
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, ARollbackDoesNotNeedTheSecurityServer) {
  make_old_data();
  const Tree before = tree();
  for (int *refusing : {&begin_result, &setup_result, &commit_result}) {
    ASSERT_EQ(take(), 0);
    spoil();
    *refusing = -2;
    label_result = -2;
    EXPECT_EQ(roll_back(), 0);
    *refusing = 0;
    label_result = 0;
    EXPECT_EQ(tree(), before);
  }
}

TEST_F(SnapshotTest, ARollbackReachesTheDirectoriesBehindWhatItCannotRemove) {
  make_old_data();
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  ASSERT_EQ(mkfifo(at("data/pipe").c_str(), 0600), 0);
  EXPECT_EQ(roll_back(), 0);
  expect_error("this is unexpected type : " + at("data/pipe"));
  std::filesystem::remove(at("data/pipe"));
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, ARollbackDoesNotBringALinkBack) {
  file("data/dir/a", "x");
  std::filesystem::create_symlink("/etc/hostname", at("data/dir/link"));
  ASSERT_EQ(take(), 0);
  std::filesystem::remove(at("data/dir/link"));
  roll_back();
  EXPECT_FALSE(exists(at("data/dir/link")));
  EXPECT_EQ(read_text(at("data/dir/a")), "x");
}

TEST_F(SnapshotTest, AFileThatCannotBeCopiedBackIsTakenOutOfTheSnapshot) {
  file("data/large", std::string(200000, 'l'), 0640);
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  {
    const DiskFullAfter limit(100000);
    EXPECT_EQ(roll_back(), 0);
  }
  expect_error("fail copy : from " + snapshot() + "/data/large to " + at("data/large"), 0);
  EXPECT_EQ(tree(), before);
}

/** A file with something at its begin and at its end, and a hole between them. */
void make_hole(const std::string &path, off_t size) {
  const UniqueFd file(open(path.c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_TRUE(file);
  ASSERT_EQ(ftruncate(file.get(), size), 0);
  ASSERT_EQ(pwrite(file.get(), "end", 3, size), 3);
}

void expect_hole(const std::string &path, off_t size) {
  const UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(file) << path;
  struct stat status = {};
  ASSERT_EQ(fstat(file.get(), &status), 0);
  EXPECT_EQ(status.st_size, size + 3) << path;
  EXPECT_LT(status.st_blocks * 512, 1 << 20) << path;
  std::string text(9, '-');
  EXPECT_EQ(pread(file.get(), text.data(), 5, 0), 5);
  EXPECT_EQ(pread(file.get(), text.data() + 5, 4, size - 1), 4);
  EXPECT_EQ(text, std::string("begin\0end", 9)) << path;
}

TEST_F(SnapshotTest, AHoleOfAnySizeIsNeitherCopiedNorFilled) {
  constexpr off_t kSize = off_t{2} << 30;
  file("data/holes", "begin");
  make_hole(at("data/holes"), kSize);
  file("data/nothing else", "");
  ASSERT_EQ(truncate(at("data/nothing else").c_str(), kSize), 0);
  ASSERT_EQ(take(), 0);
  expect_hole(snapshot() + "/data/holes", kSize);
  EXPECT_EQ(std::filesystem::file_size(snapshot() + "/data/nothing else"), kSize);
  std::filesystem::remove(at("data/holes"));
  EXPECT_EQ(put_snapshot_back(kPkg, root.c_str()), rollback_result::whole);
  expect_hole(at("data/holes"), kSize);
  EXPECT_EQ(std::filesystem::file_size(at("data/nothing else")), kSize);
}

TEST_F(SnapshotTest, BytesAreCopiedWhateverAFilesSizeWasAndIs) {
  const auto copied = [this](const std::string &bytes, off_t looked_at) {
    write_text(base + "/from", bytes);
    write_text(base + "/to", "");
    const UniqueFd from(open((base + "/from").c_str(), O_RDONLY | O_CLOEXEC));
    const UniqueFd to(open((base + "/to").c_str(), O_WRONLY | O_CLOEXEC));
    EXPECT_TRUE(copy_bytes(from.get(), to.get(), looked_at));
    return read_text(base + "/to") == bytes;
  };
  const std::string large(1000000, 'l');
  EXPECT_TRUE(copied("", 0));
  EXPECT_TRUE(copied("small", 5));
  EXPECT_TRUE(copied(large, 1000000));
  EXPECT_TRUE(copied(large, 5)) << "it has grown";
  EXPECT_TRUE(copied("small", 1000000)) << "it has become shorter";
  EXPECT_TRUE(copied("", 1000000));
  EXPECT_TRUE(copied("small", 70));
}

TEST_F(SnapshotTest, AFileThatCannotBePutBackIsLoggedAndKeptAndTheRestIsRestored) {
  file("data/a", "x");
  file("data/b", "y");
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  const AtStep step("rollback-cleared", [&] {
    // a directory that is not removed, for the link in it, has taken the file's name
    std::filesystem::remove(at("data/a"));
    std::filesystem::create_directories(at("data/a/in/the/way"));
    std::filesystem::create_symlink("/nowhere", at("data/a/in/the/way/link"));
  });
  EXPECT_EQ(put_snapshot_back(kPkg, root.c_str()), rollback_result::kept);
  expect_error("fail copy : from " + snapshot() + "/data/a to " + at("data/a"));
  expect_error("not all data of (org.example.notes) could be put back, so its snapshot is kept");
  EXPECT_EQ(read_text(at("data/b")), "y");
  EXPECT_EQ(read_text(snapshot() + "/data/a"), "x");
  std::filesystem::remove_all(at("data/a"));
  EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str())) << "it is tried again";
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, ADirectoryInAFilesPlaceMakesWay) {
  file("data/a", "x");
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  std::filesystem::remove(at("data/a"));
  unpacked_file("data/a/in/the/way", "new");
  EXPECT_EQ(put_snapshot_back(kPkg, root.c_str()), rollback_result::whole);
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, AFileInADirectorysPlaceMakesWay) {
  file("data/a/deep/file", "x");
  dir("data/a", 0711);
  dir("data/a/deep", 0700, "other");
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  std::filesystem::remove_all(at("data/a"));
  unpacked_file("data/a", "new");
  EXPECT_EQ(put_snapshot_back(kPkg, root.c_str()), rollback_result::whole);
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, WhatIsNoFileInTheSnapshotIsUnexpected) {
  std::filesystem::create_directories(snapshot() + "/data");
  ASSERT_EQ(mkfifo((snapshot() + "/data/pipe").c_str(), 0600), 0);
  EXPECT_EQ(parse_dir_for_rollback(snapshot().c_str(), kPkg, root.c_str()), 1);
  expect_error("this is unexpected type : " + snapshot() + "/data/pipe");
}

TEST_F(SnapshotTest, AnEntryOfTheSnapshotThatVanishesIsLogged) {
  write_text(snapshot() + "/data/a", "x");
  const AtStep step(
      "rollback-entry", [&] { unlink((snapshot() + "/data/a").c_str()); }, 2);
  EXPECT_EQ(parse_dir_for_rollback(snapshot().c_str(), kPkg, root.c_str()), 1);
  expect_error("error : lstat for -1 " + snapshot() + "/data/a");
}

TEST_F(SnapshotTest, AnArchiveIsNotCopiedBack) {
  write_text(download(), "zip");
  EXPECT_EQ(parse_dir_for_rollback(at("shared/data").c_str(), kPkg, root.c_str()), 1);
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(SnapshotTest, ARollbackKeepsWhatNoSnapshotHolds) {
  make_old_data();
  file("shared/data/org.example.notes_upload.zip", "staged by a backup run", 0600);
  file("shared/data/quarn_tmp_rst_dir2", "skipped for its name", 0640);
  dir("shared/data/quarn_tmp_rst_directory");
  file("shared/data/quarn_tmp_rst_directory/inner", "as well", 0640);
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  roll_back();
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, WhatAnEarlierReleaseHasSetAsideComesBack) {
  make_old_data();
  ASSERT_EQ(take(), 0);
  spoil();
  write_text(snapshot() + "/kept/quarn_tmp_rst_dir2", "no snapshot holds it");
  roll_back();
  EXPECT_EQ(read_text(at("shared/data/quarn_tmp_rst_dir2")), "no snapshot holds it");
  EXPECT_EQ(read_text(at("data/settings.ini")), "old settings");
}

TEST_F(SnapshotTest, WithoutASnapshotARollbackTouchesNothing) {
  make_old_data();
  const Tree before = tree();
  EXPECT_EQ(roll_back(), 0);
  expect_error("there isn't a snapshot of (org.example.notes) to roll back to");
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, AnApplicationsOwnSnapshotIsNeverRolledBackTo) {
  make_old_data();
  const Tree before = tree();
  file("shared/data/quarn_tmp_rst_dir/data/settings.ini", "planted");
  file("shared/data/quarn_tmp_rst_dir/shared/data/org.example.notes.perm", "{}");
  const Tree with_it = tree();
  roll_back();
  EXPECT_EQ(tree(), with_it);
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(tree(), with_it) << "nor is it removed";
  EXPECT_NE(tree(), before);
}

TEST_F(SnapshotTest, ARollbackPutsAnotherUsersProgramBackAsItWas) {
  const std::string path = file("data/tool", "x");
  ASSERT_EQ(chown(path.c_str(), 0, 0), 0);
  ASSERT_EQ(chmod(path.c_str(), 04755), 0);
  dir("data/group", 02775);
  file("data/group/a", "x", 02755);
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  unpacked_file("data/tool", "new");
  unpacked_file("data/group/a", "new");
  roll_back();
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, NoOtherFileIsMadeAnotherUsersProgram) {
  const std::string path = file("data/tool", "x");
  ASSERT_EQ(chown(path.c_str(), 0, 0), 0);
  ASSERT_EQ(chmod(path.c_str(), 04755), 0);
  ASSERT_EQ(take(), 0);
  // As soon as a file is in its place, the application may put one of its own there.
  const AtStep step("rollback-moved", [&] { file("data/tool", "its own", 0755); });
  std::filesystem::remove(path);
  roll_back();
  struct stat status = {};
  ASSERT_EQ(lstat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0755U);
  EXPECT_EQ(read_text(path), "its own");
}

TEST_F(SnapshotTest, AnOwnerOrLabelThatCannotBePutBackIsLogged) {
  const std::string path = file("data/a", "x", 0644, "wrt::db_origin");
  ASSERT_EQ(chown(path.c_str(), 5001, 5001), 0);
  ASSERT_EQ(take(), 0);
  std::unique_ptr<WithoutCapabilities> none;
  const AtStep without("rollback-attributes", [&] {
    label_result = -2;
    ON_CALL(platform, smack_setlabel).WillByDefault(Return(-1));
    set_label(snapshot() + "/data/a", "other");
    none = std::make_unique<WithoutCapabilities>(std::initializer_list<int>{CAP_CHOWN, CAP_FOWNER});
  });
  roll_back();
  none.reset();
  expect_error("chown: error \n");
  expect_error("fail to put label of data/a back");
}

TEST_F(SnapshotTest, ADirectoryThatPassesItsGroupOnHoldsASnapshotAsWell) {
  make_old_data();
  ASSERT_EQ(chmod(at("shared/data").c_str(), 02775), 0);
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  roll_back();
  EXPECT_EQ(tree(), before);
}

/* ---- recovery ---- */

TEST_F(SnapshotTest, RecoveryPutsACompleteSnapshotBack) {
  make_old_data();
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
  expect_info("restore of (org.example.notes) was interrupted, so its data will be put back");
  EXPECT_EQ(tree(), before);
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
}

/* ---- an application that went on with half-restored data ---- */

class WrittenSinceTest : public SnapshotTest {
 protected:
  WrittenSinceTest() {
    make_old_data();
    EXPECT_EQ(take(), 0);
    unpacked_file("data/settings.ini", "new settings");
    unpacked_file("data/added/file", "added");
  }
  /** The interrupted restore had come to its attributes. */
  void note_and_restore_attributes() {
    ASSERT_TRUE(note_unpacked_files(kPkg, root.c_str()));
    for (const char *name : {"data/settings.ini", "data/added", "data/added/file"}) {
      ASSERT_EQ(chown(at(name).c_str(), kAppUid, kAppGid), 0);
    }
    ASSERT_EQ(chmod(at("data/settings.ini").c_str(), 0640), 0);
  }
  void expect_told(const std::string &written) {
    const Tree before = data();
    clear_captured_log();
    EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
    expect_error("application (org.example.notes) has written " + at(written) +
                 " since its restore was interrupted, so its data stays; the data from before is "
                 "kept in " +
                 snapshot());
    EXPECT_EQ(data(), before);
    EXPECT_EQ(read_text(snapshot() + "/data/settings.ini"), "old settings");
    EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str())) << "nor ever again";
    EXPECT_EQ(data(), before);
  }
  void expect_put_back() {
    EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
    EXPECT_EQ(read_text(at("data/settings.ini")), "old settings");
    EXPECT_FALSE(exists(at("data/added")));
  }
  /** The data without the snapshot. */
  Tree data() const {
    Tree all = tree();
    for (auto at = all.begin(); at != all.end();) {
      at = at->first.find("quarn_tmp_rst_dir") == std::string::npos ? std::next(at) : all.erase(at);
    }
    return all;
  }
};

TEST_F(WrittenSinceTest, WhatTheRestoreItselfLeftIsPutBack) { expect_put_back(); }

TEST_F(WrittenSinceTest, WhatTheAttributesChangedIsPutBack) {
  note_and_restore_attributes();
  expect_put_back();
}

TEST_F(WrittenSinceTest, AFileOfItsOwnWhileTheArchiveWasUnpacked) {
  file("data/mine", "written since");
  expect_told("data/mine");
}

TEST_F(WrittenSinceTest, AFileOfItsOwnAfterTheAttributes) {
  note_and_restore_attributes();
  file("shared/trusted/mine", "written since");
  expect_told("shared/trusted/mine");
}

TEST_F(WrittenSinceTest, AnOldFileThatItChanged) {
  write_text(at("data/db/notes.db"), "old notes and one more");
  expect_told("data/db/notes.db");
}

TEST_F(WrittenSinceTest, ARestoredFileThatItChangedWithoutChangingItsSize) {
  note_and_restore_attributes();
  std::fstream restored(at("data/settings.ini"), std::ios::in | std::ios::out);
  restored << "NEW";
  restored.close();
  expect_told("data/settings.ini");
}

TEST_F(WrittenSinceTest, AFileThatItChangedWhileTheClockStoodInThePast) {
  write_text(at("data/db/notes.db"), "old notes and one more");
  const timespec past[2] = {{1000, 0}, {1000, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, at("data/db/notes.db").c_str(), past, 0), 0);
  expect_told("data/db/notes.db");
}

TEST_F(WrittenSinceTest, AFileInAnInterruptedRollback) {
  const pid_t child = fork();
  if (child == 0) {
    const AtStep step("rollback-moved", [] { _exit(7); });
    static_cast<void>(put_snapshot_back(kPkg, root.c_str()));
    _exit(0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_EQ(WEXITSTATUS(status), 7);
  file("data/db/notes.db", "newer", 0600, "wrt::db_origin");
  const Tree before = data();
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(data(), before);
  EXPECT_EQ(read_text(at("data/settings.ini")), "old settings");
}

TEST_F(WrittenSinceTest, ItsDataIsPackedAgain) {
  file("data/mine", "written since");
  expect_told("data/mine");
  int error = 0;
  make_zip_data(kPkg, root.c_str(), (base + "/archive.zip").c_str(), &error);
  EXPECT_EQ(error, 0);
}

TEST_F(WrittenSinceTest, AFurtherRestoreKeepsTheToldSnapshotAsideUntilOneSucceeds) {
  file("data/mine", "written since");
  expect_told("data/mine");
  ASSERT_EQ(take(), 0);
  EXPECT_EQ(read_text(snapshot() + ".kept/data/settings.ini"), "old settings");
  EXPECT_EQ(read_text(snapshot() + "/data/mine"), "written since");
  ASSERT_TRUE(discard_snapshot(kPkg, root.c_str()));
  EXPECT_TRUE(exists(snapshot() + ".kept"));
  forget_told_snapshot(restore_files(kPkg, root));
  EXPECT_FALSE(exists(snapshot() + ".kept"));
}

TEST_F(WrittenSinceTest, ASnapshotOfAnEarlierReleaseIsPutBack) {
  std::filesystem::remove(snapshot() + "/stamps");
  file("data/mine", "written since");
  EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(read_text(at("data/settings.ini")), "old settings");
}

TEST_F(SnapshotTest, RecoveryRemovesAnIncompleteSnapshot) {
  make_old_data();
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  ASSERT_EQ(unlink(snapshot_table().c_str()), 0);
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, RecoveryLeavesALinkInTheSnapshotsPlace) {
  std::filesystem::create_directory_symlink(base, snapshot());
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_TRUE(exists(snapshot())) << "it is not the daemon's";
  EXPECT_TRUE(exists(base));
}

TEST_F(SnapshotTest, RecoveryLeavesWhatTheApplicationCallsTheSame) {
  write_text(snapshot(), "the application's own");
  ASSERT_EQ(chown(snapshot().c_str(), kAppUid, kAppGid), 0);
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_EQ(read_text(snapshot()), "the application's own");
  ASSERT_EQ(unlink(snapshot().c_str()), 0);
  std::filesystem::create_directories(snapshot() + "/mine");
  ASSERT_EQ(chown(snapshot().c_str(), kAppUid, kAppGid), 0);
  EXPECT_FALSE(recover_interrupted_restore(kPkg, root.c_str()));
  EXPECT_TRUE(exists(snapshot() + "/mine"));
}

TEST_F(SnapshotTest, RecoveryVisitsEveryInstalledPackage) {
  make_old_data();
  const Tree before = tree();
  ASSERT_EQ(take(), 0);
  spoil();
  int call = 0;
  ON_CALL(platform, package_info_get_package).WillByDefault([&](auto, char **id) {
    *id = call == 1 ? nullptr : strdup(kPkg);
    return call == 0 ? -5 : 0;
  });
  ON_CALL(platform, package_info_get_root_path).WillByDefault([&](auto, char **path) {
    *path = call == 3 ? nullptr : strdup(root.c_str());
    return call == 2 ? -5 : 0;
  });
  ON_CALL(platform, package_manager_foreach_package_info)
      .WillByDefault([&](package_manager_package_info_cb callback, void *data) {
        for (; call < 5; ++call) EXPECT_TRUE(callback(nullptr, data));
        return 0;
      });
  recover_interrupted_restores();
  expect_error("package_info_get_package() was failed, ret = [-5]");
  expect_error("package_info_get_package() was failed, ret = [0]");
  expect_error("package_info_get_root_path() was failed, ret = [-5]");
  expect_error("package_info_get_root_path() was failed, ret = [0]");
  EXPECT_EQ(tree(), before);
}

TEST_F(SnapshotTest, ASweepThatFailsIsLogged) {
  ON_CALL(platform, package_manager_foreach_package_info).WillByDefault(Return(-5));
  recover_interrupted_restores();
  expect_error("package_manager_foreach_package_info() failed -5");
}

TEST_F(SnapshotTest, DiscardingTakesTheTableAwayFirst) {
  make_old_data();
  ASSERT_EQ(take(), 0);
  bool table_there = true;
  bool copy_there = false;
  const AtStep step("snapshot-released", [&] {
    table_there = exists(snapshot_table());
    copy_there = exists(snapshot() + "/data/settings.ini");
  });
  EXPECT_TRUE(discard_snapshot(kPkg, root.c_str()));
  EXPECT_FALSE(table_there);
  EXPECT_TRUE(copy_there);
  EXPECT_FALSE(exists(snapshot()));
}

}  // namespace
