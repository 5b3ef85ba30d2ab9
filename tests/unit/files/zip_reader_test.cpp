#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unzip.h>

#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "codec_choice.h"
#include "fault.h"
#include "files/package_files.h"
#include "log_capture.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"
#include "quarn_printable.h"
#include "temp_dir.h"
#include "zip_bytes.h"

namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr char kPackage[] = "org.example.notes";

class ZipReader : public ::testing::TestWithParam<ArchiveCodec> {
 protected:
  void SetUp() override {
    choose_codec(GetParam());
    clear_captured_log();
  }
  void TearDown() override { choose_codec(ArchiveCodec::kIsal); }

  /** Unpack an archive of these bytes. */
  int unpack(const std::string &bytes) {
    archive_ = place_.file("archive.zip", bytes);
    return unpack_file(archive_);
  }
  int unpack(const std::vector<ZipEntry> &entries) { return unpack(zip_bytes(entries)); }
  int unpack_file(const std::string &path) {
    report_ = {7, 7, 7};
    return unzip_data(kPackage, root_.path().c_str(), path.c_str(), &report_);
  }
  /** An archive with one entry that must be refused, between two good ones. */
  void expect_refused(const ZipEntry &entry, const std::string &why) {
    clear_captured_log();
    EXPECT_EQ(unpack({deflated_entry("data/first", "1"), entry, deflated_entry("data/last", "2")}),
              QUARN_OK);
    expect_report(2, 1, 0);
    const std::string name = entry.name.c_str();  // logs end at a NUL
    EXPECT_THAT(captured_texts(), ElementsAre("refused archive entry " + name + ": " + why,
                                              "extract_file_from_zip() failed " + name));
    EXPECT_EQ(read_text(root_ / "data/first"), "1");
    EXPECT_EQ(read_text(root_ / "data/last"), "2");
  }
  /** An archive with one entry that cannot be unpacked, between two good ones. */
  void expect_failed(const ZipEntry &entry, const std::string &message) {
    clear_captured_log();
    EXPECT_EQ(unpack({deflated_entry("data/first", "1"), entry, deflated_entry("data/last", "2")}),
              QUARN_OK);
    expect_report(2, 0, 1);
    EXPECT_THAT(captured_texts(),
                ElementsAre(message, "extract_file_from_zip() failed " + logged(entry.name)));
    EXPECT_EQ(read_text(root_ / "data/first"), "1");
    EXPECT_EQ(read_text(root_ / "data/last"), "2");
  }
  static std::string logged(const std::string &name) {
    return quarn_shortened(name, kMaxLoggedArgument);
  }
  void expect_report(unsigned int extracted, unsigned int refused, unsigned int failed) const {
    EXPECT_EQ(report_.extracted, extracted);
    EXPECT_EQ(report_.refused, refused);
    EXPECT_EQ(report_.failed, failed);
    EXPECT_EQ(report_.complete(), refused + failed == 0);
  }
  std::vector<std::string> files() const {
    std::vector<std::string> all;
    for (const auto &found : std::filesystem::recursive_directory_iterator(root_.path())) {
      if (!found.is_directory())
        all.push_back(found.path().string().substr(root_.path().size() + 1));
    }
    return all;
  }
  static int errors(const std::string &message) { return count_logged(DLOG_ERROR, message); }

  TempDir root_;
  TempDir place_;
  std::string archive_;
  unzip_report report_;
};

INSTANTIATE_TEST_SUITE_P(Codec, ZipReader,
                         ::testing::Values(ArchiveCodec::kIsal, ArchiveCodec::kZlib),
                         [](const auto &info) {
                           return info.param == ArchiveCodec::kIsal ? "Isal" : "Zlib";
                         });

/* ---- what archives hold ------------------------------------------------------ */

TEST_P(ZipReader, UnpacksEveryEntryAndMakesItsDirectories) {
  const std::string large(700000, 'x');
  EXPECT_EQ(unpack({deflated_entry("data/deep/er/a", "text"), deflated_entry("data/deep/b", large),
                    deflated_entry("shared/trusted/empty", ""),
                    deflated_entry("shared/data/org.example.notes.perm", "{}")}),
            QUARN_OK);
  expect_report(4, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/deep/er/a"), "text");
  EXPECT_TRUE(read_text(root_ / "data/deep/b") == large);
  EXPECT_TRUE(exists(root_ / "shared/trusted/empty"));
  EXPECT_EQ(read_text(root_ / "shared/data/org.example.notes.perm"), "{}");
  EXPECT_TRUE(captured_texts().empty());
}

TEST_P(ZipReader, WhatIsMadeIsThePackagesAndItsTableTheDaemons) {
  for (const uid_t owner : {0U, kAppUid}) {
    ASSERT_EQ(chown(root_.dir("data").c_str(), owner, owner), 0);
    ASSERT_EQ(chmod(root_.dir("data/own").c_str(), 0555), 0);
    ASSERT_EQ(chown(root_.dir("data/own").c_str(), kAppUid, kAppGid), 0);
    ASSERT_EQ(unpack({deflated_entry("data/dir/a", "x"), deflated_entry("data/own/a", "x"),
                      deflated_entry("shared/data/org.example.notes.perm", "{}")}),
              QUARN_OK);
    struct stat status = {};
    for (const char *name : {"data/dir/a", "data/own/a"}) {
      ASSERT_EQ(lstat((root_ / name).c_str(), &status), 0);
      EXPECT_EQ(status.st_mode, S_IFREG | S_ISVTX) << "nobody opens it before it has its mode";
      EXPECT_EQ(status.st_uid, kAppUid);
      EXPECT_EQ(status.st_gid, kAppGid);
    }
    ASSERT_EQ(lstat((root_ / "data/dir").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, S_IFDIR | 0755U);
    EXPECT_EQ(status.st_uid, kAppUid);
    ASSERT_EQ(lstat((root_ / "shared/data/org.example.notes.perm").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, S_IFREG | 0600U);
    EXPECT_EQ(status.st_uid, 0U);
  }
}

TEST_P(ZipReader, WithoutAReportTheResultIsTheSame) {
  const std::string good = place_.file("good.zip", zip_bytes({deflated_entry("data/a", "x")}));
  EXPECT_EQ(unzip_data(kPackage, root_.path().c_str(), good.c_str()), QUARN_OK);
  EXPECT_EQ(unzip_data(kPackage, root_.path().c_str(), (place_ / "none").c_str()),
            QUARN_UNREADABLE);
}

TEST_P(ZipReader, ReplacesAFileAndLeavesWhoHoldsItOpenTheOldOne) {
  const std::string path = root_.file("data/a", "old and longer");
  const UniqueFd held(open(path.c_str(), O_RDONLY));
  ASSERT_EQ(unpack({deflated_entry("data/a", "new")}), QUARN_OK);
  EXPECT_EQ(read_text(path), "new");
  EXPECT_EQ(read_text("/proc/self/fd/" + std::to_string(held.get())), "old and longer");
}

TEST_P(ZipReader, ReplacesALinkAndDoesNotFollowIt) {
  const std::string other = place_.file("other", "untouched");
  root_.dir("data");
  root_.link("data/a", other);
  ASSERT_EQ(unpack({deflated_entry("data/a", "new")}), QUARN_OK);
  expect_report(1, 0, 0);
  EXPECT_EQ(read_text(other), "untouched");
  EXPECT_TRUE(std::filesystem::is_regular_file(std::filesystem::symlink_status(root_ / "data/a")));
}

TEST_P(ZipReader, ReplacesWhatIsThereAndMakesWhatIsNotInAnyOrder) {
  root_.file("data/a", "old");
  root_.file("data/b", "old");
  root_.file("data/d", "old");
  root_.dir("data/e");
  root_.file("data/f", "old");
  EXPECT_EQ(unpack({deflated_entry("data/a", "1"), deflated_entry("data/b", "2"),
                    deflated_entry("data/c", "3"), deflated_entry("data/d", "4"),
                    deflated_entry("data/e", "5"), deflated_entry("data/f", "6")}),
            QUARN_OK);
  expect_report(5, 0, 1);
  EXPECT_EQ(read_text(root_ / "data/a") + read_text(root_ / "data/b") +
                read_text(root_ / "data/c") + read_text(root_ / "data/d") +
                read_text(root_ / "data/f"),
            "12346");
  EXPECT_EQ(errors("fopen() failed, file is NULL " + root_ / "data/e"), 1);
}

TEST_P(ZipReader, OfTwoEntriesOfOneNameTheLastStays) {
  EXPECT_EQ(
      unpack({deflated_entry("data/a", "the first and longer"), deflated_entry("data/a", "2")}),
      QUARN_OK);
  expect_report(2, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/a"), "2");
}

TEST_P(ZipReader, TakesStoredEntries) {
  const std::string large(100000, 'y');
  EXPECT_EQ(unpack({stored_entry("data/a", "text"), stored_entry("data/b", large),
                    stored_entry("data/empty", "")}),
            QUARN_OK);
  expect_report(3, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/a"), "text");
  EXPECT_TRUE(read_text(root_ / "data/b") == large);
}

TEST_P(ZipReader, AnEntryWithZip64SizesIsUnpackedWholeOrRefused) {
  // The library of version 1.1 takes such sizes for 4 GiB where a long has 64 bits.
  ZipEntry entry = deflated_entry("data/a", "text");
  entry.zip64 = true;
  if (unpack({entry, deflated_entry("data/b", "x")}) == QUARN_OK) {
    expect_report(2, 0, 0);
    EXPECT_EQ(read_text(root_ / "data/a"), "text");
  } else {
    EXPECT_THAT(files(), IsEmpty());
  }
}

TEST_P(ZipReader, TakesAnArchiveWithAZip64EndRecord) {
  EXPECT_EQ(unpack(zip64_bytes({deflated_entry("data/a", "text")})), QUARN_OK);
  expect_report(1, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/a"), "text");
}

TEST_P(ZipReader, TakesMoreEntriesThanTheEndRecordCanTell) {
  // as earlier releases wrote them
  constexpr unsigned int kEntries = 70000;
  std::vector<ZipEntry> entries(kEntries, stored_entry("data/a", ""));
  EXPECT_EQ(unpack(zip_bytes(entries, 0xffff)), QUARN_OK);
  expect_report(kEntries, 0, 0);
}

TEST_P(ZipReader, TakesAnArchiveBehindOtherBytes) {
  EXPECT_EQ(unpack(std::string(1000, '#') + zip_bytes({deflated_entry("data/a", "text")})),
            QUARN_OK);
  expect_report(1, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/a"), "text");
}

TEST_P(ZipReader, TakesTenThousandEntries) {
  std::vector<ZipEntry> entries;
  for (int i = 0; i < 10000; ++i) {
    entries.push_back(stored_entry("data/" + std::to_string(i % 100) + "/" + std::to_string(i),
                                   std::to_string(i)));
  }
  EXPECT_EQ(unpack(entries), QUARN_OK);
  expect_report(10000, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/99/9999"), "9999");
}

/* ---- archives that are none -------------------------------------------------- */

TEST_P(ZipReader, WhatIsNoArchiveIs31) {
  place_.dir("dir");
  place_.link("link", place_.file("good.zip", zip_bytes({deflated_entry("data/a", "x")})));
  ASSERT_EQ(mkfifo((place_ / "pipe").c_str(), 0600), 0);
  place_.file("text", "this is no archive, though it is long enough for an end record");
  place_.file("empty", "");
  for (const char *name : {"none", "dir", "link", "pipe", "text", "empty"}) {
    clear_captured_log();
    EXPECT_EQ(unpack_file(place_ / name), QUARN_UNREADABLE) << name;
    EXPECT_THAT(captured_texts(), ElementsAre("unzOpen() failed, unzf is NULL")) << name;
    expect_report(0, 0, 0);
  }
  EXPECT_THAT(files(), IsEmpty());
}

TEST_P(ZipReader, AnArchiveWithoutEntriesIs31) {
  // The library looks for the end record behind the first byte only.
  EXPECT_EQ(unpack(std::vector<ZipEntry>{}), QUARN_UNREADABLE);
  EXPECT_THAT(captured_texts(), ElementsAre("unzOpen() failed, unzf is NULL"));
  clear_captured_log();
  EXPECT_EQ(unpack("####" + zip_bytes({})), QUARN_UNREADABLE);
  EXPECT_THAT(captured_texts(), ElementsAre("unzGoToFirstFile() failed, unz_err = [-103]"));
}

TEST_P(ZipReader, NoCutOffArchiveIsTakenForAWholeOne) {
  const std::string whole = zip_bytes(
      {deflated_entry("data/a", "some text, and some more text"), stored_entry("data/b", "12345")});
  // the last four bytes are zeros, and tell of nothing
  for (std::size_t length = 0; length < whole.size() - 4; ++length) {
    const int result = unpack(whole.substr(0, length));
    EXPECT_TRUE(result == QUARN_UNREADABLE || !report_.complete()) << length;
  }
}

TEST_P(ZipReader, NoArchiveThatMissesItsBeginningIsTakenForAWholeOne) {
  const std::string whole = zip_bytes(
      {deflated_entry("data/a", "some text, and some more text"), stored_entry("data/b", "12345")});
  for (std::size_t gone = 1; gone < whole.size(); ++gone) {
    const int result = unpack(whole.substr(gone));
    EXPECT_TRUE(result == QUARN_UNREADABLE || !report_.complete()) << gone;
  }
}

TEST_P(ZipReader, ADirectoryThatBreaksOffIsNotComplete) {
  EXPECT_EQ(unpack(zip_bytes({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")}, 5)),
            QUARN_OK);
  expect_report(2, 0, 1);
}

/* ---- hostile names ----------------------------------------------------------- */

TEST_P(ZipReader, NothingKeepsTheTableOutOfItsPlace) {
  const std::string table = "shared/data/org.example.notes.perm";
  EXPECT_EQ(unpack({stored_entry(table + "/", ""), deflated_entry(table + "/x", "1"),
                    stored_entry(table + "/y/", ""), deflated_entry(table, "{}")}),
            QUARN_OK);
  expect_report(1, 1, 0);
  EXPECT_EQ(read_text(root_ / table), "{}");
  EXPECT_EQ(errors("refused archive entry " + table + "/: it is a working file of a restore"), 1);
  EXPECT_EQ(errors("refused archive entry " + table + "/x: it is a working file of a restore"), 1);
  EXPECT_EQ(errors("refused archive entry " + table + "/y/: it is a working file of a restore"), 1);
}

TEST_P(ZipReader, AnyNumberOfRefusedEntriesIsTwoHundredLinesAndOne) {
  std::vector<ZipEntry> entries;
  for (int i = 0; i < 5000; ++i) entries.push_back(deflated_entry("../" + std::to_string(i), "x"));
  EXPECT_EQ(unpack(entries), QUARN_OK);
  expect_report(0, 5000, 0);
  EXPECT_EQ(captured_log().size(), 201U);
  EXPECT_EQ(errors("refused archive entry ../99: its name leaves its place"), 1);
  EXPECT_EQ(errors("extract_file_from_zip() failed ../99"), 1);
  EXPECT_EQ(captured_texts().back(),
            "9800 more such lines on the archive of org.example.notes are left out");
}

TEST_P(ZipReader, RefusesNamesThatLeaveTheirPlace) {
  for (const char *name :
       {"data/../../outside", "data/..", "../data/a", "data/./a", "data//a", "data/sub/../a"}) {
    expect_refused(deflated_entry(name, "x"), "its name leaves its place");
  }
  EXPECT_FALSE(exists(root_ / "../outside"));
}

TEST_P(ZipReader, RefusesAbsoluteAndEmptyNames) {
  expect_refused(deflated_entry("/tmp/quarn_absolute", "x"), "its name is absolute or empty");
  expect_refused(deflated_entry("", "x"), "its name is absolute or empty");
  EXPECT_FALSE(exists("/tmp/quarn_absolute"));
}

TEST_P(ZipReader, RefusesANameWithANul) {
  expect_refused(deflated_entry(std::string("data/a\0.txt", 11), "x"), "its name holds a NUL");
  EXPECT_FALSE(exists(root_ / "data/a"));
}

TEST_P(ZipReader, AFolderEntryMakesTheFolderForTheApplication) {
  root_.dir("data/there");
  EXPECT_EQ(unpack({stored_entry("data/", ""), stored_entry("shared/", ""),
                    stored_entry("shared/trusted/", ""), stored_entry("data/there/", ""),
                    stored_entry("data/new/", ""), stored_entry("data/new/er/", ""),
                    deflated_entry("data/new/a", "x"), deflated_entry("data/packed/", "")}),
            QUARN_OK);
  expect_report(1, 0, 0);
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_EQ(read_text(root_ / "data/new/a"), "x");
  for (const char *name : {"data/new", "data/new/er", "data/packed"}) {
    struct stat status = {};
    ASSERT_EQ(lstat((root_ / name).c_str(), &status), 0) << name;
    EXPECT_EQ(status.st_mode, S_IFDIR | 0755U) << name;
    EXPECT_EQ(status.st_uid, kAppUid) << name;
    EXPECT_EQ(status.st_gid, kAppGid) << name;
  }
}

TEST_P(ZipReader, ARefusedFolderEntryCostsNothing) {
  const std::string outside = place_.dir("outside");
  root_.dir("data");
  root_.link("data/link", outside);
  const std::pair<const char *, const char *> refused[] = {
      {"../out/", "it does not belong to the application's data"},
      {"/data/", "it does not belong to the application's data"},
      {"res/", "it does not belong to the application's data"},
      {"data/../../out/", "its name leaves its place"},
      {"data//", "its name leaves its place"},
      {"shared/data/quarn_tmp_rst_dir/", "it is a working file of a restore"}};
  for (const auto &[name, why] : refused) {
    clear_captured_log();
    EXPECT_EQ(unpack({stored_entry(name, ""), deflated_entry("data/a", "x")}), QUARN_OK) << name;
    expect_report(1, 0, 0);
    EXPECT_THAT(captured_texts(),
                ElementsAre(std::string("refused archive entry ") + name + ": " + why));
  }
  clear_captured_log();
  EXPECT_EQ(unpack({stored_entry("data/link/in/", ""), deflated_entry("data/a", "x")}), QUARN_OK);
  expect_report(1, 0, 0);
  EXPECT_FALSE(exists(outside + "/in"));
  EXPECT_FALSE(exists(root_ / "../out"));
  EXPECT_FALSE(exists(root_ / "res"));
}

TEST_P(ZipReader, AFolderEntryWithContentIsRefusedAsAFile) {
  expect_refused(stored_entry("data/dir/", "text"), "it is a directory");
  EXPECT_FALSE(exists(root_ / "data/dir"));
}

TEST_P(ZipReader, RefusesWhatDoesNotBelongToTheData) {
  for (const char *name : {"res/icon", "data", "shared/a", "database/a", "shared/trusted2/a"}) {
    expect_refused(deflated_entry(name, "x"), "it does not belong to the application's data");
  }
}

TEST_P(ZipReader, RefusesTheWorkingFilesOfARestore) {
  for (const char *name :
       {"shared/data/org.example.notes_upload.zip", "shared/data/org.example.notes_download.zip",
        "shared/data/quarn_tmp_rst_dir/data/a", "shared/data/quarn_tmp_rst_dir2"}) {
    expect_refused(deflated_entry(name, "x"), "it is a working file of a restore");
  }
}

TEST_P(ZipReader, RefusesANameBelowALink) {
  const std::string outside = place_.dir("outside");
  root_.dir("data");
  root_.link("data/link", outside);
  expect_refused(deflated_entry("data/link/a", "x"), "its way leads through a link");
  expect_refused(deflated_entry("data/link/deeper/a", "x"), "its way leads through a link");
  EXPECT_FALSE(exists(outside + "/a"));
  EXPECT_FALSE(exists(outside + "/deeper"));
}

TEST_P(ZipReader, RefusesANameBelowAFile) {
  root_.file("data/file", "x");
  expect_refused(deflated_entry("data/file/a", "x"), "its way leads through a file");
  EXPECT_EQ(read_text(root_ / "data/file"), "x");
}

TEST_P(ZipReader, OfAFileAndADirectoryOfOneNameTheFirstStays) {
  EXPECT_EQ(unpack({deflated_entry("data/a", "file"), deflated_entry("data/a/b", "x")}), QUARN_OK);
  expect_report(1, 1, 0);
  EXPECT_EQ(read_text(root_ / "data/a"), "file");
  EXPECT_THAT(captured_texts(),
              ElementsAre("refused archive entry data/a/b: its way leads through a file",
                          "extract_file_from_zip() failed data/a/b"));
}

TEST_P(ZipReader, ADirectoryInTheFilesPlaceStays) {
  root_.file("data/a/b", "x");
  expect_failed(deflated_entry("data/a", "file"),
                "fopen() failed, file is NULL " + root_ / "data/a");
  EXPECT_EQ(read_text(root_ / "data/a/b"), "x");
}

TEST_P(ZipReader, ANameThatIsTooLongFails) {
  const std::string name = "data/" + std::string(300, 'n');
  expect_failed(deflated_entry(name, "x"), "fopen() failed, file is NULL " + logged(root_ / name));
}

TEST_P(ZipReader, ADirectoryNameThatIsTooLongFails) {
  const std::string name = "data/" + std::string(300, 'n') + "/a";
  expect_failed(deflated_entry(name, "x"), "fopen() failed, file is NULL " + logged(root_ / name));
}

/* ---- hostile content --------------------------------------------------------- */

TEST_P(ZipReader, RefusesEncryptedEntries) {
  ZipEntry entry = deflated_entry("data/a", "x");
  entry.flags = kZipEncrypted;
  expect_refused(entry, "it is encrypted");
}

TEST_P(ZipReader, RefusesOtherCompressions) {
  ZipEntry entry = deflated_entry("data/a", "x");
  entry.method = kZipBzip2;
  expect_refused(entry, "its compression is not known");
}

TEST_P(ZipReader, ACompressionThatTheLibraryDoesNotKnowIsSkipped) {
  ZipEntry entry = deflated_entry("data/a", "x");
  entry.method = 99;
  EXPECT_EQ(unpack({entry, deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("unzOpenCurrentFile() failed, unz_err = [-103]"));
}

TEST_P(ZipReader, AnEntryWithAnotherHeaderThanItsDirectoryIsSkipped) {
  std::string bytes = zip_bytes({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")});
  bytes[14] = static_cast<char>(bytes[14] + 1);  // the first local header's checksum
  EXPECT_EQ(unpack(bytes), QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("unzOpenCurrentFile() failed, unz_err = [-103]"));
}

TEST_P(ZipReader, AWrongChecksumIsCorrupt) {
  ZipEntry deflated = deflated_entry("data/a", "text");
  deflated.crc ^= 1;
  expect_failed(deflated, "archive entry data/a is corrupt");
  ZipEntry stored = stored_entry("data/a", "text");
  stored.crc ^= 1;
  expect_failed(stored, "archive entry data/a is corrupt");
}

TEST_P(ZipReader, LessThanAnnouncedIsCorrupt) {
  ZipEntry entry = deflated_entry("data/a", "text");
  entry.size = 5;
  expect_failed(entry, "archive entry data/a is corrupt");
}

TEST_P(ZipReader, GarbageIsCorrupt) {
  ZipEntry entry = deflated_entry("data/a", "text");
  entry.data = "\xff\xff\xff\xff";
  entry.packed_size = 4;
  expect_failed(entry, "archive entry data/a is corrupt");
}

TEST_P(ZipReader, ACutOffStreamIsCorrupt) {
  ZipEntry entry = deflated_entry("data/a", std::string(100000, 'x') + "y");
  entry.data.resize(entry.data.size() / 2);
  entry.packed_size = entry.data.size();
  expect_failed(entry, "archive entry data/a is corrupt");
}

TEST_P(ZipReader, BytesAfterAStreamAreLeftAlone) {
  ZipEntry entry = deflated_entry("data/a", "text");
  entry.data += "and more";
  entry.packed_size = entry.data.size();
  EXPECT_EQ(unpack({entry, deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(2, 0, 0);
  EXPECT_EQ(read_text(root_ / "data/a"), "text");
}

TEST_P(ZipReader, MoreThanAnnouncedIsRefusedAndLeavesNothing) {
  ZipEntry entry = deflated_entry("data/a", std::string(8 << 20, '\0'));
  entry.size = 1024;
  expect_refused(entry, "it holds more than it announces");
  EXPECT_FALSE(exists(root_ / "data/a"));
  entry = stored_entry("data/a", "12345");
  entry.size = 4;
  expect_refused(entry, "it holds more than it announces");
  EXPECT_FALSE(exists(root_ / "data/a"));
}

TEST_P(ZipReader, ABombIsRefusedBeforeAnythingIsWritten) {
  // honest about its sizes: 24 entries of 3 MiB of zeros
  std::vector<ZipEntry> entries;
  for (int i = 0; i < 24; ++i) {
    entries.push_back(deflated_entry("data/" + std::to_string(i), std::string(3 << 20, '\0')));
  }
  EXPECT_EQ(unpack(entries), QUARN_UNREADABLE);
  EXPECT_THAT(captured_texts(), ElementsAre("refused archive " + archive_ +
                                            ": it unpacks to more than a backup can hold"));
  EXPECT_THAT(files(), IsEmpty());
}

TEST_P(ZipReader, AByteThatClaimsFourGigabytesIsRefused) {
  ZipEntry entry = stored_entry("data/a", "x");
  entry.size = 0xfffffffe;
  EXPECT_EQ(unpack({entry}), QUARN_UNREADABLE);
  EXPECT_EQ(errors("refused archive " + archive_ + ": it unpacks to more than a backup can hold"),
            1);
  entry.zip64 = true;
  entry.size = 1ULL << 62;
  EXPECT_EQ(unpack({entry, entry, entry, entry}), QUARN_UNREADABLE) << "their sum overflows";
}

TEST_P(ZipReader, AByteThatClaimsToTakeFourGigabytesIsCorrupt) {
  ZipEntry entry = stored_entry("data/a", "x");
  entry.packed_size = 0xfffffffe;
  EXPECT_EQ(unpack({deflated_entry("data/b", "x"), entry}), QUARN_OK);
  EXPECT_FALSE(report_.complete());
  EXPECT_EQ(report_.extracted, 1U);
}

TEST_P(ZipReader, EntriesThatLieOverOneAnotherAreRefusedBeforeAnythingIsWritten) {
  // Each is read to the end of the same bytes, which inflate to nothing.
  const std::string nothing("\0\0\0\xff\xff", 5);
  std::string padding;
  for (int i = 0; i < 20000; ++i) padding += nothing;
  std::vector<ZipEntry> entries;
  for (int i = 0; i < 4; ++i) {
    entries.push_back(deflated_entry("data/" + std::to_string(i), ""));
    entries.back().packed_size = padding.size();
  }
  entries.push_back(stored_entry("data/padding", padding));
  EXPECT_EQ(unpack(entries), QUARN_UNREADABLE);
  EXPECT_THAT(captured_texts(),
              ElementsAre("refused archive " + archive_ + ": its entries lie over one another"));
  EXPECT_THAT(files(), IsEmpty());
}

TEST_P(ZipReader, MoreDirectoriesThanABackupCanHoldAreRefusedBeforeAnythingIsMade) {
  // Few entries, each with hundreds of directories of its own on its way.
  constexpr std::uint64_t kDirectories = 300;
  std::string way;
  for (std::uint64_t i = 0; i < kDirectories; ++i) way += "/d";
  std::vector<ZipEntry> entries;
  for (std::uint64_t i = 0; i * kDirectories <= 4 * kMaxArchiveEntries; ++i) {
    entries.push_back(stored_entry("data/" + std::to_string(i) + way + "/f", ""));
  }
  EXPECT_EQ(unpack(entries), QUARN_UNREADABLE);
  EXPECT_THAT(captured_texts(), ElementsAre("refused archive " + archive_ +
                                            ": its directories are more than a backup can hold"));
  EXPECT_THAT(files(), IsEmpty());
}

TEST_P(ZipReader, MoreEntriesThanABackupCanHoldAreRefused) {
  std::vector<ZipEntry> entries(kMaxArchiveEntries + 1, stored_entry("data/a", ""));
  EXPECT_EQ(unpack(zip64_bytes(entries)), QUARN_UNREADABLE);
  EXPECT_EQ(errors("refused archive " + archive_ + ": it unpacks to more than a backup can hold"),
            1);
}

TEST_P(ZipReader, DirectoriesDeeperThanABackupsAreRefusedBeforeAnythingIsMade) {
  for (const char *top : {"data", "shared/trusted"}) {
    std::string name = top;
    for (int depth = 1; depth < kMaxDirDepth; ++depth) name += "/d";
    EXPECT_EQ(unpack({deflated_entry("data/first", "x"), deflated_entry(name + "/a", "x")}),
              QUARN_OK);
    expect_report(2, 0, 0);
    std::filesystem::remove_all(root_ / "data");
    std::filesystem::remove_all(root_ / "shared");
    EXPECT_EQ(unpack({deflated_entry("data/first", "x"), deflated_entry(name + "/d/a", "x")}),
              QUARN_UNREADABLE);
    EXPECT_EQ(errors("refused archive " + archive_ +
                     ": its directories are deeper than a backup's can be"),
              1);
    EXPECT_THAT(files(), IsEmpty());
    clear_captured_log();
  }
}

TEST_P(ZipReader, LongerNamesThanABackupsAreRefusedBeforeAnythingIsMade) {
  std::vector<ZipEntry> entries(1000, stored_entry("data/" + std::string(65000, 'n'), ""));
  EXPECT_EQ(unpack(entries), QUARN_UNREADABLE);
  EXPECT_EQ(errors("refused archive " + archive_ + ": its names are longer than a backup's can be"),
            1);
  EXPECT_THAT(files(), IsEmpty());
}

TEST_P(ZipReader, ATableThatOnlyEarlierReleasesMadeIsTaken) {
  const std::string table(std::size_t{20} << 20, ' ');
  ASSERT_GT(table.size(), kBackupBounds.table);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"),
                    deflated_entry("shared/data/org.example.notes.perm", table)}),
            QUARN_OK);
  expect_report(2, 0, 0);
}

constexpr char kTableName[] = "shared/data/org.example.notes.perm";

TEST_P(ZipReader, AnEntryThatIsThousandsOfLevelsDeepIsRefusedBeforeAnythingIsMade) {
  std::string name = "data";
  for (int depth = 0; depth < 30000; ++depth) name += "/d";
  for (const std::string &deep : {name + "/a", name + "/"}) {
    clear_captured_log();
    EXPECT_EQ(unpack({deflated_entry("data/first", "x"), stored_entry(deep, "")}),
              QUARN_UNREADABLE);
    EXPECT_THAT(captured_texts(),
                ElementsAre("refused archive " + archive_ +
                            ": its directories are deeper than a backup's can be"));
    EXPECT_THAT(files(), IsEmpty());
    EXPECT_FALSE(exists(root_ / "data"));
  }
}

TEST_P(ZipReader, ATableBeyondItsBoundsIsRefusedBeforeAnythingIsWritten) {
  std::string members = "{";
  std::string links;
  for (int i = 0; i < 400000; ++i) {
    members += "\"\":0,";
    links += "0,";
  }
  const std::vector<std::pair<const char *, std::string>> tables = {
      {"text", "{" + std::string(std::size_t{50} << 20, ' ') + "}"},
      {"members", members + "\"a\":0}"},
      {"links", R"({"quarn_symbolic_info":[)" + links + "0]}"},
      {"values", R"({"a":[)" + std::string(1000, ',') + "]}"},
      {"depth", "{\"a\":" + std::string(30000, '[')},
      {"attributes", R"({"a":{"3":")" + std::string(4096, 'x') + "\"}}"},
  };
  for (const auto &[what, table] : tables) {
    clear_captured_log();
    EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry(kTableName, table)}),
              QUARN_UNREADABLE)
        << what;
    EXPECT_THAT(captured_texts(), ElementsAre("refused archive " + archive_ +
                                              ": its table is larger than a backup's can be"))
        << what;
    EXPECT_THAT(files(), IsEmpty()) << what;
    EXPECT_FALSE(exists(root_ / "data")) << what;
  }
}

TEST_P(ZipReader, OnlyTheLastOfSeveralTablesIsHeldToTheBounds) {
  // The others are an application's own file of that name.
  const std::string own[] = {R"({"a":[[[[[1]]]]]})", "{" + std::string(std::size_t{33} << 20, ' '),
                             R"({"a":")" + std::string(4096, 'x') + "\"}"};
  for (const std::string &text : own) {
    EXPECT_EQ(unpack({deflated_entry(kTableName, text), deflated_entry(kTableName, "{}")}),
              QUARN_OK);
    expect_report(2, 0, 0);
    EXPECT_EQ(read_text(root_ / kTableName), "{}");
    EXPECT_EQ(unpack({deflated_entry(kTableName, "{}"), deflated_entry(kTableName, text)}),
              QUARN_UNREADABLE);
  }
}

TEST_P(ZipReader, ATableThatIsNoneCostsNothingWhereTheUnpackingCanBeUndone) {
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry(kTableName, "not json")}),
            QUARN_OK);
  expect_report(2, 0, 0);
}

TEST_P(ZipReader, WithoutAWholeTableNothingIsUnpackedWhereThatCannotBeUndone) {
  const auto found = [&](const std::vector<ZipEntry> &entries) {
    archive_ = place_.file("archive.zip", zip_bytes(entries));
    archived_table table = archived_table::none;
    const int result =
        unzip_data_with_table(kPackage, root_.path().c_str(), archive_.c_str(), &report_, &table);
    EXPECT_EQ(result, table == archived_table::whole ? QUARN_OK : QUARN_NO_FILE_INFO);
    EXPECT_EQ(exists(root_ / "data/a"), result == QUARN_OK);
    return table;
  };
  const ZipEntry data = deflated_entry("data/a", "x");
  EXPECT_EQ(found({data}), archived_table::none);
  for (const char *text : {"not json", "", "[]", "{", R"({"a": tru})", R"({"a": {"0": 1})"}) {
    EXPECT_EQ(found({data, deflated_entry(kTableName, text)}), archived_table::malformed) << text;
  }
  ZipEntry corrupt = deflated_entry(kTableName, "{}");
  corrupt.crc ^= 1;
  EXPECT_EQ(found({data, corrupt}), archived_table::malformed);
  ZipEntry longer = deflated_entry(kTableName, "{}" + std::string(1000, ' '));
  longer.size = 100;
  EXPECT_EQ(found({data, longer}), archived_table::malformed);
  EXPECT_EQ(found({data, deflated_entry(kTableName, "{}"), deflated_entry(kTableName, "{")}),
            archived_table::malformed)
      << "the last one stays";
  // What is not unpacked is no table.
  EXPECT_EQ(found({data, stored_entry(kTableName + std::string("\0", 1), "{}")}),
            archived_table::none);
  ZipEntry encrypted = deflated_entry(kTableName, "{}");
  encrypted.flags |= 1;
  EXPECT_EQ(found({data, encrypted}), archived_table::malformed);
  EXPECT_EQ(found({data, stored_entry(kTableName, R"({"data/a": {"0": 420}})")}),
            archived_table::whole);
}

std::string changing_archive;
std::string changed_bytes;
void change_archive() {
  const UniqueFd file(open(changing_archive.c_str(), O_WRONLY));
  const auto size = static_cast<ssize_t>(changed_bytes.size());
  EXPECT_EQ(pwrite(file.get(), changed_bytes.data(), changed_bytes.size(), 0), size);
}

TEST_P(ZipReader, AnArchiveThatChangesWhileItIsReadIsHeldToItsBoundsAsWell) {
  // So many entries that the directory is not read ahead, with names of one length.
  std::vector<ZipEntry> entries;
  std::vector<ZipEntry> deep;
  for (int i = 100; i < 500; ++i) {
    std::string name = "data";
    std::string deep_name = "data";
    for (int part = 0; part < 4; ++part) name += "/" + std::string(199, 'n');
    for (int part = 0; part < 400; ++part) deep_name += "/d";
    entries.push_back(stored_entry(name + "/" + std::to_string(i), "x"));
    deep.push_back(stored_entry(deep_name + "/" + std::to_string(i), "x"));
  }
  changing_archive = place_ / "archive.zip";
  changed_bytes = zip_bytes(deep);
  ASSERT_EQ(changed_bytes.size(), zip_bytes(entries).size());
  set_call_hook("unzOpenCurrentFile2", change_archive);
  EXPECT_EQ(unpack(entries), QUARN_UNREADABLE);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(errors("archive was changed while it was read"), 1);
  EXPECT_FALSE(report_.complete());
  EXPECT_FALSE(exists(root_ / "data/d"));
}

/* ---- failures ---------------------------------------------------------------- */

TEST_P(ZipReader, AnEntryThatCannotBeOpenedIsSkipped) {
  const Fault fault("unzOpenCurrentFile2", 0);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("unzOpenCurrentFile() failed, unz_err = [-103]"));
  EXPECT_THAT(files(), ElementsAre("data/b"));
}

/** Calls of unzGetCurrentFileInfo64() before those for the first entry: one for each to count them.
 */
constexpr int kCounted = 2;

TEST_P(ZipReader, AnEntryWithoutInformationIsSkipped) {
  const Fault fault("unzGetCurrentFileInfo64", 0, kCounted);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("unzGetCurrentFileInfo() failed, unz_err = [-103]"));
  EXPECT_THAT(files(), ElementsAre("data/b"));
}

TEST_P(ZipReader, AnEntryWithoutANameIsSkipped) {
  const Fault fault("unzGetCurrentFileInfo64", 0, kCounted + 1);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("unzGetCurrentFileInfo() failed , unz_err = [-103]"));
  EXPECT_THAT(files(), ElementsAre("data/b"));
}

TEST_P(ZipReader, WithoutMemoryForANameTheResultIs14) {
  const Fault fault("calloc", ENOMEM);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x")}), QUARN_OUT_OF_MEMORY);
  EXPECT_THAT(captured_texts(), ElementsAre("calloc() failed, current_file_path_in_zip is NULL"));
}

TEST_P(ZipReader, WithoutMemoryForTheCodecEveryEntryFails) {
  choose_codec(ArchiveCodec::kNone);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(0, 0, 2);
  EXPECT_EQ(errors("calloc() failed, buf is NULL"), 2);
  EXPECT_EQ(errors("extract_file_from_zip() failed data/a"), 1);
  EXPECT_THAT(files(), IsEmpty());
}

TEST_P(ZipReader, AnArchiveThatCannotBeReadIs31) {
  const Fault fault("pread", EIO, 0, 1000);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x")}), QUARN_UNREADABLE);
  EXPECT_THAT(captured_texts(), ElementsAre("unzOpen() failed, unzf is NULL"));
}

TEST_P(ZipReader, AnEntryThatCannotBeReadIsCorrupt) {
  const Fault fault("pread", EIO, 4);  // the directory is read by then, and a part of the data
  EXPECT_EQ(unpack({stored_entry("data/a", std::string(700000, 'x'))}), QUARN_OK);
  EXPECT_EQ(fault.hits(), 1);
  expect_report(0, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("archive entry data/a is corrupt",
                                            "extract_file_from_zip() failed data/a"));
}

TEST_P(ZipReader, EntriesOfManyDirectoriesComeInAnyOrder) {
  std::vector<ZipEntry> entries;
  for (int i = 0; i < 60; ++i) {
    entries.push_back(deflated_entry(
        "data/" + std::to_string(i % 3) + "/" + std::to_string(i % 5) + "/" + std::to_string(i),
        std::to_string(i)));
  }
  EXPECT_EQ(unpack(entries), QUARN_OK);
  expect_report(60, 0, 0);
  for (int i = 0; i < 60; ++i) EXPECT_EQ(read_text(root_ / entries[i].name), std::to_string(i));
}

TEST_P(ZipReader, AFileThatCannotBeWrittenIsLeftInPart) {
  const Fault fault("write", ENOSPC);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry("data/b", "x")}), QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(),
              ElementsAre("fwrite() failed", "extract_file_from_zip() failed data/a"));
  EXPECT_EQ(read_text(root_ / "data/b"), "x");
}

TEST_P(ZipReader, ADirectoryThatCannotBeMadeFails) {
  const Fault fault("mkdirat", EIO);
  EXPECT_EQ(unpack({deflated_entry("data/a", "x"), deflated_entry("shared/data/b", "x")}),
            QUARN_OK);
  expect_report(1, 0, 1);
  EXPECT_THAT(captured_texts(), ElementsAre("fopen() failed, file is NULL " + root_ / "data/a",
                                            "extract_file_from_zip() failed data/a"));
}

TEST_P(ZipReader, ADestinationThatIsMissingFailsEveryEntry) {
  archive_ = place_.file("archive.zip", zip_bytes({deflated_entry("data/a", "x")}));
  EXPECT_EQ(unzip_data(kPackage, (root_ / "none").c_str(), archive_.c_str(), &report_), QUARN_OK);
  expect_report(0, 0, 1);
  EXPECT_EQ(errors("fopen() failed, file is NULL " + root_ / "none/data/a"), 1);
  EXPECT_FALSE(exists(root_ / "none"));
}

TEST_P(ZipReader, OneEntryCanBeUnpackedByItself) {
  archive_ =
      place_.file("archive.zip",
                  zip_bytes({deflated_entry("data/a", "text"), deflated_entry("data/../b", "x")}));
  unzFile archive = unzOpen(archive_.c_str());
  ASSERT_NE(archive, nullptr);
  ASSERT_EQ(unzGoToFirstFile(archive), UNZ_OK);
  ASSERT_EQ(unzOpenCurrentFile2(archive, nullptr, nullptr, 1), UNZ_OK);
  EXPECT_TRUE(extract_file_from_zip(kPackage, root_.path().c_str(), archive, "data/a"));
  ASSERT_EQ(unzGoToNextFile(archive), UNZ_OK);
  ASSERT_EQ(unzOpenCurrentFile2(archive, nullptr, nullptr, 1), UNZ_OK);
  EXPECT_FALSE(extract_file_from_zip(kPackage, root_.path().c_str(), archive, "data/../b"));
  unzClose(archive);
  EXPECT_EQ(read_text(root_ / "data/a"), "text");
  EXPECT_THAT(captured_texts(),
              Contains("refused archive entry data/../b: its name leaves its place"));
}

}  // namespace
