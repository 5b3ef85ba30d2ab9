#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json-c/json.h>
#include <sys/fsuid.h>
#include <sys/stat.h>
#include <zip.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "codec_choice.h"
#include "fault.h"
#include "files/package_files.h"
#include "json_ptr.h"
#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/path_rules.h"
#include "temp_dir.h"
#include "zip_bytes.h"

namespace {

using ::testing::_;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::NiceMock;
using ::testing::Return;
using ::testing::UnorderedElementsAre;

constexpr char kPackage[] = "org.example.notes";
constexpr char kTableEntry[] = "shared/data/org.example.notes.perm";

class ZipWriter : public ::testing::TestWithParam<ArchiveCodec> {
 protected:
  void SetUp() override {
    choose_codec(GetParam());
    ON_CALL(platform_, smack_getlabel).WillByDefault(label_it);
    ON_CALL(platform_, smack_lgetlabel).WillByDefault(label_it);
    for (const char *dir : {"data", "shared/data", "shared/trusted"}) root_.dir(dir);
    clear_captured_log();
  }
  void TearDown() override {
    reset_backup_path_info();
    set_call_hook(nullptr, nullptr);
    choose_codec(ArchiveCodec::kIsal);
  }
  static int label_it(const char *, char **label, smack_label_type) {
    *label = strdup("App::Label");
    return 0;
  }

  /** Pack the package. @return the error that was told */
  int pack(int error = 0) {
    make_zip_data(kPackage, root_.path().c_str(), archive_.c_str(), &error);
    return error;
  }
  /** The same within bounds; what went beyond is in excess_ then. */
  int pack_within(const archive_bounds &bounds) {
    int error = 0;
    excess_ = {};
    make_zip_data(kPackage, root_.path().c_str(), archive_.c_str(), &error, bounds, &excess_);
    return error;
  }
  void expect_excess(archive_bound bound, std::uint64_t size, std::uint64_t limit) const {
    EXPECT_EQ(excess_.bound, bound);
    EXPECT_EQ(excess_.size, size);
    EXPECT_EQ(excess_.limit, limit);
  }
  std::vector<ZipEntry> entries() const { return parse_zip(read_text(archive_)); }
  std::vector<std::string> names() const {
    std::vector<std::string> all;
    for (const ZipEntry &entry : entries()) all.push_back(entry.name);
    return all;
  }
  ZipEntry entry(const std::string &name) const {
    for (const ZipEntry &found : entries()) {
      if (found.name == name) return found;
    }
    ADD_FAILURE() << "no entry " << name;
    return {};
  }
  /** An entry's bytes, after its size and checksum were compared with them. */
  std::string text(const std::string &name) const {
    const ZipEntry found = entry(name);
    std::string plain = inflate_text(found.data);
    EXPECT_EQ(found.size, plain.size()) << name;
    EXPECT_EQ(found.crc, crc_of_text(plain)) << name;
    return plain;
  }
  std::string table() const { return text(kTableEntry); }
  bool in_table(const std::string &key) const {
    const JsonPtr document(json_tokener_parse(table().c_str()));
    return json_object_object_get_ex(document.get(), key.c_str(), nullptr) != 0;
  }
  static int errors(const std::string &message) { return count_logged(DLOG_ERROR, message); }

  NiceMock<MockPlatform> platform_;
  TempDir root_;
  TempDir place_;
  const std::string archive_ = place_ / "archive.zip";
  archive_excess excess_;
};

INSTANTIATE_TEST_SUITE_P(Codec, ZipWriter,
                         ::testing::Values(ArchiveCodec::kIsal, ArchiveCodec::kZlib),
                         [](const auto &info) {
                           return info.param == ArchiveCodec::kIsal ? "Isal" : "Zlib";
                         });

TEST_P(ZipWriter, PacksTheThreeDirectoriesInOrderAndTheTableLast) {
  root_.file("shared/trusted/key", "trusted");
  root_.file("shared/data/card", "shared");
  root_.file("data/settings.db", "private");
  root_.file("res/icon", "no data");
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre("data/settings.db", "shared/data/card", "shared/trusted/key",
                                   kTableEntry));
  EXPECT_EQ(text("data/settings.db"), "private");
  EXPECT_EQ(text("shared/data/card"), "shared");
  EXPECT_EQ(text("shared/trusted/key"), "trusted");
  EXPECT_TRUE(captured_texts().empty());
}

TEST_P(ZipWriter, ADirectorysEntriesAreInTheOrderOfReadingDepthFirst) {
  for (int i = 0; i < 20; ++i) {
    root_.file("data/" + std::to_string(i * 7919), "x");
    root_.file("data/dir" + std::to_string(i * 7919) + "/inner", "x");
  }
  std::vector<std::string> expected;
  const DirPtr dir(opendir((root_ / "data").c_str()));
  while (const dirent *found = readdir(dir.get())) {
    if (found->d_name[0] == '.') continue;
    expected.push_back(std::string("data/") + found->d_name +
                       (found->d_type == DT_DIR ? "/inner" : ""));
  }
  expected.emplace_back(kTableEntry);
  EXPECT_EQ(pack(), 0);
  EXPECT_EQ(names(), expected);
}

TEST_P(ZipWriter, EveryEntryIsDeflatedAndHasNoDateAttributesExtraOrComment) {
  root_.file("data/text", std::string(5000, 'x'));
  root_.file("data/empty", "");
  ASSERT_EQ(pack(), 0);
  for (const ZipEntry &found : entries()) {
    EXPECT_EQ(found.method, kZipDeflated) << found.name;
    EXPECT_EQ(found.flags & (kZipEncrypted | kZipDescriptor | kZipUtf8), 0U) << found.name;
    EXPECT_EQ(found.date, 0U) << found.name;
    EXPECT_EQ(found.attributes, 0U) << found.name;
    EXPECT_EQ(found.extra_size, 0U) << found.name;
    EXPECT_EQ(found.comment_size, 0U) << found.name;
  }
}

TEST_P(ZipWriter, PacksFilesOfEverySize) {
  for (const std::size_t size : {0, 1, 4095, 4096, 4097, 65536, 262144, 262145, 1000000}) {
    std::string content(size, '\0');
    for (std::size_t i = 0; i < size; ++i) content[i] = static_cast<char>(i * i >> 5);
    root_.file("data/" + std::to_string(size), content);
  }
  ASSERT_EQ(pack(), 0);
  for (const std::size_t size : {0, 1, 4095, 4096, 4097, 65536, 262144, 262145, 1000000}) {
    const std::string name = "data/" + std::to_string(size);
    EXPECT_TRUE(text(name) == read_text(root_ / name)) << size;
  }
}

TEST_P(ZipWriter, AnApplicationWithoutItsDirectoriesYieldsTheTableAloneAnd36) {
  for (const char *dir : {"data", "shared/data", "shared/trusted"}) {
    ASSERT_EQ(rmdir((root_ / dir).c_str()), 0);
  }
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_EQ(table(), R"({ "quarn_symbolic_info": [ ] })");
  EXPECT_THAT(captured_texts(),
              ElementsAre("error : cannot open this path " + root_ / "data",
                          "error : cannot open this path " + root_ / "shared/data",
                          "error : cannot open this path " + root_ / "shared/trusted"));
}

TEST_P(ZipWriter, OneMissingDirectoryLeavesTheOthers) {
  root_.file("data/a", "x");
  root_.file("shared/trusted/b", "x");
  ASSERT_EQ(rmdir((root_ / "shared/data").c_str()), 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_THAT(names(), ElementsAre("data/a", "shared/trusted/b", kTableEntry));
}

TEST_P(ZipWriter, LeavesOutTheWorkingFiles) {
  root_.file("shared/data/org.example.notes_upload.zip", "x");
  root_.file("shared/data/org.example.notes_download.zip", "x");
  root_.file("shared/data/quarn_tmp_rst_dir/data/a", "x");
  root_.file("shared/data/quarn_tmp_rst_dir2", "x");
  root_.file("shared/data/quarn_tmp_rst_dir_too/b", "x");
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_EQ(table(), R"({ "quarn_symbolic_info": [ ] })");
}

TEST_P(ZipWriter, PacksWhatHasAWorkingFilesNameElsewhere) {
  root_.file("data/org.example.notes_upload.zip", "x");
  root_.file("shared/data/sub/quarn_tmp_rst_dir/b", "x");
  root_.file("shared/data/org.example.other_upload.zip", "x");
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(),
              UnorderedElementsAre("data/org.example.notes_upload.zip",
                                   "shared/data/sub/quarn_tmp_rst_dir/b",
                                   "shared/data/org.example.other_upload.zip", kTableEntry));
}

TEST_P(ZipWriter, ADirectoryWithNothingInItIsNeitherPackedNorRecorded) {
  root_.dir("data/empty/deeper");
  root_.file("data/kept/a", "x");
  root_.file("data/cache/b", "x");
  backup_exclude_list = {root_ / "data/cache/"};
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre("data/kept/a", kTableEntry));
  EXPECT_TRUE(in_table("data/kept"));
  EXPECT_FALSE(in_table("data/empty"));
  EXPECT_FALSE(in_table("data/empty/deeper"));
  EXPECT_FALSE(in_table("data/cache"));
  EXPECT_FALSE(in_table("data/cache/b"));
  EXPECT_FALSE(in_table("data")) << "the data directories themselves are not recorded";
}

TEST_P(ZipWriter, RecordsADirectoryAfterItsContents) {
  root_.file("data/dir/sub/a", "x");
  EXPECT_EQ(pack(), 0);
  const std::string text = table();
  EXPECT_LT(text.find(R"("data\/dir\/sub\/a")"), text.find(R"("data\/dir\/sub":)"));
  EXPECT_LT(text.find(R"("data\/dir\/sub":)"), text.find(R"("data\/dir":)"));
}

TEST_P(ZipWriter, ALinkIsRecordedAndNeitherPackedNorFollowed) {
  root_.file("data/real/a", "x");
  root_.link("data/link", "real");
  root_.link("data/none", "/nowhere");
  root_.link("data/excluded", "real");
  backup_exclude_list = {root_ / "data/excluded"};
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre("data/real/a", kTableEntry));
  const std::string text = table();
  EXPECT_NE(text.find(R"("real_name": "data\/link", "lnk": "real")"), std::string::npos);
  EXPECT_NE(text.find(R"("real_name": "data\/none", "lnk": "\/nowhere")"), std::string::npos);
  EXPECT_EQ(text.find("excluded"), std::string::npos);
}

TEST_P(ZipWriter, ADirectoryThatHoldsALinkAloneIsRecorded) {
  root_.dir("data/dir");
  root_.link("data/dir/link", "x");
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_TRUE(in_table("data/dir"));
}

TEST_P(ZipWriter, AnotherTypeIsAnErrorAndTheRestIsPacked) {
  root_.file("data/a", "x");
  ASSERT_EQ(mkfifo((root_ / "data/pipe").c_str(), 0600), 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_THAT(names(), ElementsAre("data/a", kTableEntry));
  EXPECT_FALSE(in_table("data/pipe"));
  EXPECT_THAT(captured_texts(), ElementsAre("this is unexpected type : " + root_ / "data/pipe"));
}

TEST_P(ZipWriter, AnyNumberOfWhatCannotBePackedAndOfLinksIsAHundredLinesOfEachAndOne) {
  for (int i = 0; i < 1000; ++i) {
    ASSERT_EQ(mkfifo((root_ / ("data/pipe" + std::to_string(i))).c_str(), 0600), 0);
    root_.link("data/link" + std::to_string(i), "x");
  }
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(captured_log().size(), 201U);
  EXPECT_EQ(captured_texts().back(),
            "1800 more such lines on the data of " + std::string(kPackage) + " are left out");
}

TEST_P(ZipWriter, NamesMayHoldAnyByte) {
  const std::vector<std::string> all = {"data/two words",
                                        "data/back\\slash",
                                        "data/line\nbreak",
                                        "data/gr\xc3\xbc\xc3\x9f"
                                        "e",
                                        "data/\xff\xfe",
                                        "data/per%cent"};
  for (const std::string &name : all) root_.file(name, name);
  EXPECT_EQ(pack(), 0);
  for (const std::string &name : all) EXPECT_EQ(text(name), name);
  EXPECT_EQ(entry("data/gr\xc3\xbc\xc3\x9f"
                  "e")
                    .flags &
                kZipUtf8,
            kZipUtf8);
  EXPECT_EQ(entry("data/\xff\xfe").flags & kZipUtf8, 0U) << "which is not UTF-8";
  EXPECT_EQ(entry("data/two words").flags & kZipUtf8, 0U);
}

TEST_P(ZipWriter, ASecondRunReplacesTheFirstArchive) {
  root_.file("data/a", std::string(100000, 'x'));
  root_.file("data/b", "x");
  ASSERT_EQ(pack(), 0);
  ASSERT_EQ(unlink((root_ / "data/a").c_str()), 0);
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre("data/b", kTableEntry));
}

TEST_P(ZipWriter, TheSameDataMakesTheSameArchive) {
  for (int i = 0; i < 50; ++i) {
    root_.file("data/" + std::to_string(i), std::string(static_cast<std::size_t>(i) * 997, 'a'));
  }
  ASSERT_EQ(pack(), 0);
  const std::string first = read_text(archive_);
  ASSERT_EQ(pack(), 0);
  EXPECT_TRUE(read_text(archive_) == first);
}

TEST_P(ZipWriter, TheArchiveIsTheDaemonsAloneAndItsDirectoryIsMade) {
  const std::string path = place_ / "new/deeper/archive.zip";
  int error = 0;
  make_zip_data(kPackage, root_.path().c_str(), path.c_str(), &error);
  EXPECT_EQ(error, 0);
  struct stat status = {};
  ASSERT_EQ(lstat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFREG | 0600U);
  ASSERT_EQ(lstat((place_ / "new/deeper").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFDIR | 0755U);
}

TEST_P(ZipWriter, TheTablesFileIsGoneAfterwards) {
  root_.file("data/a", "x");
  EXPECT_EQ(pack(), 0);
  EXPECT_FALSE(exists(root_ / kTableEntry));
}

TEST_P(ZipWriter, TheErrorIsWrittenOnFailureOnly) {
  root_.file("data/a", "x");
  EXPECT_EQ(pack(5), 5);
}

TEST_P(ZipWriter, AnArchiveThatCannotBeOpenedIs31) {
  place_.dir("archive.zip");
  EXPECT_EQ(pack(), QUARN_UNREADABLE);
  EXPECT_EQ(errors("zipOpen() failed, zf is NULL"), 1);
}

TEST_P(ZipWriter, ALinkInTheArchivesPlaceIsNotFollowed) {
  const std::string other = place_.file("other", "x");
  place_.link("archive.zip", other);
  EXPECT_EQ(pack(), QUARN_UNREADABLE);
  EXPECT_EQ(read_text(other), "x");
  EXPECT_EQ(errors("zipOpen() failed, zf is NULL"), 1);
}

TEST_P(ZipWriter, ALibraryThatDoesNotOpenIs31) {
  const Fault fault("zipOpen2_64", 0);
  EXPECT_EQ(pack(), QUARN_UNREADABLE);
  EXPECT_EQ(errors("zipOpen() failed, zf is NULL"), 1);
}

TEST_P(ZipWriter, WithoutATableThereIsNoArchive) {
  const Fault fault("json_object_new_object", 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("file_info_table is NULL"), 1);
  EXPECT_FALSE(exists(archive_));
}

TEST_P(ZipWriter, WithoutMemoryEveryEntryFails) {
  root_.file("data/a", "x");
  choose_codec(ArchiveCodec::kNone);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("calloc() failed, buf is NULL"), 2) << "the file and the table";
  EXPECT_TRUE(names().empty());
}

TEST_P(ZipWriter, AFileWhoseStatusCannotBeReadIsLeftOut) {
  static std::string path;
  path = root_.file("data/a", "x");
  set_call_hook("openat", [] { unlink(path.c_str()); });
  EXPECT_EQ(pack(), QUARN_REFUSED);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(errors("error : lstat for -1 " + path), 1);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_FALSE(in_table("data/a"));
}

TEST_P(ZipWriter, ADirectoryWhoseStatusCannotBeReadIsLeftOut) {
  root_.file("data/dir/a", "x");
  const Fault fault("fstatat", EIO);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("error : lstat for -1 " + root_ / "data/dir"), 1);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_FALSE(in_table("data/dir"));
}

TEST_P(ZipWriter, AFileThatCannotBeOpenedIsRecordedOnly) {
  root_.file("data/a", "x");
  const Fault fault("openat", EIO, 0, 2);  // by the name, and again by what it proves to be
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("fopen() failed, file is NULL"), 1);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_TRUE(in_table("data/a"));
}

TEST_P(ZipWriter, ADirectoryThatCannotBeOpenedIsLeftOut) {
  root_.file("data/dir/a", "x");
  root_.file("shared/data/b", "x");
  const Fault fault("openat", EIO);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("error : cannot open this path " + root_ / "data/dir"), 1);
  EXPECT_THAT(names(), ElementsAre("shared/data/b", kTableEntry));
  EXPECT_FALSE(in_table("data/dir"));
}

TEST_P(ZipWriter, DirectoriesAreFollowedDownToTheBoundOnly) {
  std::string path = root_ / "data";
  for (int i = 0; i < 405; ++i) {
    path += "/d";
    ASSERT_EQ(mkdir(path.c_str(), 0755), 0);
  }
  EXPECT_EQ(pack(), QUARN_REFUSED);
  ASSERT_EQ(captured_texts().size(), 1U);
  EXPECT_EQ(captured_texts()[0].find("error : cannot open this path " + root_ / "data/d/d"), 0U);
}

TEST_P(ZipWriter, AFileThatTurnsIntoAnotherTypeIsAnErrorAndNotRead) {
  static std::string path;
  path = root_.file("data/a", "x");
  set_call_hook("openat", [] {
    unlink(path.c_str());
    mkfifo(path.c_str(), 0600);
  });
  EXPECT_EQ(pack(), QUARN_REFUSED);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(errors("this is unexpected type : " + path), 1);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
}

TEST_P(ZipWriter, AFileThatTurnsIntoALinkIsRecordedAndNotFollowed) {
  static std::string path;
  static std::string secret;
  path = root_.file("data/a", "x");
  secret = place_.file("secret", "do not pack");
  set_call_hook("openat", [] {
    unlink(path.c_str());
    static_cast<void>(symlink(secret.c_str(), path.c_str()));
  });
  EXPECT_EQ(pack(), 0);
  set_call_hook(nullptr, nullptr);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_NE(table().find(R"("real_name": "data\/a")"), std::string::npos);
}

TEST_P(ZipWriter, AFileThatCannotBeReadLeavesAWholeEntryOfWhatWasRead) {
  const std::string file = root_.file("data/a", std::string(300000, 'x'));
  const Fault fault("read", EIO, 1);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("cannot read " + file), 1);
  EXPECT_THAT(names(), ElementsAre("data/a", kTableEntry));
  EXPECT_EQ(text("data/a"), std::string(entry("data/a").size, 'x'));
}

TEST_P(ZipWriter, AFileThatGrowsIsPackedAsItWas) {
  const std::string file = root_.file("data/a", std::string(1000, 'x'));
  static std::string grown;
  grown = file;
  set_call_hook("read", [] { std::ofstream(grown, std::ios::app) << "more"; });
  EXPECT_EQ(pack(), QUARN_OK);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(count_logged(DLOG_INFO, "file grew while it was archived : " + file), 1);
  EXPECT_EQ(text("data/a"), std::string(1000, 'x'));
}

TEST_P(ZipWriter, AFileThatShrinksIsPackedAsFarAsItGoes) {
  const std::string file = root_.file("data/a", std::string(300000, 'x'));
  static std::string cut;
  cut = file;
  set_call_hook("read", [] { static_cast<void>(truncate(cut.c_str(), 10)); });
  EXPECT_EQ(pack(), QUARN_OK);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(count_logged(DLOG_INFO, "file shrank while it was archived : " + file), 1);
  EXPECT_EQ(text("data/a"), std::string(10, 'x'));
}

TEST_P(ZipWriter, AFileThatIsEmptiedIsPackedEmpty) {
  static std::string cut;
  cut = root_.file("data/a", "words");
  set_call_hook("read", [] { static_cast<void>(truncate(cut.c_str(), 0)); });
  EXPECT_EQ(pack(), QUARN_OK);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(text("data/a"), "");
}

/* ---- bounds ------------------------------------------------------------------ */

TEST_P(ZipWriter, DataBeyondTheBoundEndsTheWork) {
  root_.file("data/a", std::string(600, 'x'));
  const std::string beyond = root_.file("shared/data/b", std::string(401, 'x'));
  root_.file("shared/trusted/c", "x");
  archive_bounds bounds = kBackupBounds;
  bounds.content = 1000;
  EXPECT_EQ(pack_within(bounds), QUARN_REFUSED);
  EXPECT_EQ(errors("archive is full at " + beyond), 1);
  expect_excess(archive_bound::content, 1001, 1000);
  EXPECT_THAT(names(), ElementsAre("data/a")) << "and no table";
  bounds.content = 1002;
  EXPECT_EQ(pack_within(bounds), QUARN_OK);
  expect_excess(archive_bound::none, 0, 0);
}

TEST_P(ZipWriter, FilesLinksAndDirectoriesAllCount) {
  root_.file("data/dir/a", "x");
  root_.link("data/dir/link", "a");
  root_.file("shared/data/b", "x");
  archive_bounds bounds = kBackupBounds;
  bounds.members = 4;
  EXPECT_EQ(pack_within(bounds), QUARN_OK);
  bounds.members = 3;
  EXPECT_EQ(pack_within(bounds), QUARN_REFUSED);
  expect_excess(archive_bound::members, 4, 3);
  EXPECT_EQ(errors("archive is full at " + root_ / "shared/data/b"), 1);
}

TEST_P(ZipWriter, NamesCountWithTheirDirectories) {
  root_.file("data/dir/a", "");
  archive_bounds bounds = kBackupBounds;
  bounds.names = std::strlen("data/dir/a") + std::strlen("data/dir");
  EXPECT_EQ(pack_within(bounds), QUARN_OK);
  --bounds.names;
  EXPECT_EQ(pack_within(bounds), QUARN_REFUSED);
  expect_excess(archive_bound::names, bounds.names + 1, bounds.names);
}

TEST_P(ZipWriter, TheTableCountsAsItWillBeWritten) {
  root_.file("data/quote\" back\\ line\n bell\a gr\xc3\xbc\xc3\x9f", "x");
  root_.file("data/dir/a", "x");
  root_.link("data/link", "to\t\x01");
  ASSERT_EQ(pack(), QUARN_OK);
  const std::size_t size = table().size();
  constexpr std::size_t kFrame = 32;  // what a table without members has
  archive_bounds bounds = kBackupBounds;
  bounds.table = size;
  EXPECT_EQ(pack_within(bounds), QUARN_OK);
  bounds.table = size - kFrame;
  EXPECT_EQ(pack_within(bounds), QUARN_REFUSED);
  EXPECT_EQ(excess_.bound, archive_bound::table);
  EXPECT_EQ(excess_.limit, bounds.table);
}

TEST_P(ZipWriter, ManyLongNamesEndTheWorkBeforeTheyTakeMemory) {
  std::string below = root_ / "data";
  const std::string part(200, 'p');
  for (int i = 0; i < 17; ++i) below += "/" + part;
  std::filesystem::create_directories(below);
  for (int i = 0; i < 5200; ++i) {
    ASSERT_EQ(mknod((below + "/" + std::to_string(i)).c_str(), S_IFREG | 0600, 0), 0);
  }
  EXPECT_EQ(pack_within(kBackupBounds), QUARN_REFUSED);
  EXPECT_EQ(excess_.bound, archive_bound::table) << "where every name stands";
  EXPECT_EQ(excess_.limit, kBackupBounds.table);
}

TEST_P(ZipWriter, TheMostMembersOfABackupAreTakenByARestoreAndOneMoreIsNot) {
  for (std::uint64_t i = 0; i < kBackupBounds.members; ++i) {
    const std::string path = root_ / ("data/" + std::to_string(i));
    ASSERT_EQ(mknod(path.c_str(), S_IFREG | 0600, 0), 0);
  }
  EXPECT_EQ(pack_within(kBackupBounds), QUARN_OK);
  const TempDir out;
  unzip_report report;
  EXPECT_EQ(unzip_data(kPackage, out.path().c_str(), archive_.c_str(), &report), QUARN_OK);
  EXPECT_TRUE(report.complete());
  EXPECT_EQ(report.extracted, kBackupBounds.members + 1);
  ASSERT_EQ(symlink("/nowhere", (root_ / "shared/trusted/link").c_str()), 0);
  EXPECT_EQ(pack_within(kBackupBounds), QUARN_REFUSED);
  EXPECT_EQ(errors("archive is full at " + (root_ / "shared/trusted/link")), 1);
  expect_excess(archive_bound::members, kBackupBounds.members + 1, kBackupBounds.members);
}

TEST_P(ZipWriter, TheDeepestTreeIsTakenByARestoreAndADeeperOneIsNot) {
  std::string path = "data";
  for (int depth = 1; depth < kMaxDirDepth; ++depth) {
    path += "/d";
    ASSERT_EQ(mkdir((root_ / path).c_str(), 0755), 0);
  }
  root_.file(path + "/deepest", "text");
  EXPECT_EQ(pack_within(kBackupBounds), QUARN_OK);
  const TempDir out;
  unzip_report report;
  EXPECT_EQ(unzip_data(kPackage, out.path().c_str(), archive_.c_str(), &report), QUARN_OK);
  EXPECT_TRUE(report.complete());
  EXPECT_EQ(read_text(out / (path + "/deepest")), "text");
  root_.file(path + "/d/beyond", "text");
  EXPECT_EQ(pack_within(kBackupBounds), QUARN_REFUSED);
  expect_excess(archive_bound::depth, kMaxDirDepth + 1, kMaxDirDepth);
  constexpr std::size_t kShown = 256;
  EXPECT_EQ(errors("archive is full at " + (root_ / path).substr(0, kShown) + "..."), 1);
}

TEST_P(ZipWriter, OtherProgramsFindEveryEntryHoweverMany) {
  for (const int count : {65533, 65535}) {
    for (int i = 0; i < count; ++i) {
      static_cast<void>(mknod((root_ / ("data/" + std::to_string(i))).c_str(), S_IFREG | 0600, 0));
    }
    EXPECT_EQ(pack(), QUARN_OK);
    const std::string command = "unzip -l '" + archive_ + "' | tail -n 1 | grep -qw '" +
                                std::to_string(count + 1) + " files'";
    EXPECT_EQ(std::system(command.c_str()), 0) << count;
  }
}

TEST_P(ZipWriter, AnArchiveThatStaysOnTheDeviceHasNoBounds) {
  for (std::uint64_t i = 0; i < kBackupBounds.members; ++i) {
    ASSERT_EQ(mknod((root_ / ("data/" + std::to_string(i))).c_str(), S_IFREG | 0600, 0), 0);
  }
  for (int i = 0; i < 3; ++i) root_.file("shared/data/" + std::to_string(i), "x");
  EXPECT_EQ(pack(), QUARN_OK);
  const std::string command = "unzip -tqq '" + archive_ + "' >/dev/null";
  EXPECT_EQ(std::system(command.c_str()), 0);
}

TEST_P(ZipWriter, WorkThatIsNoLongerWantedEnds) {
  static std::atomic<bool> stop;
  stop = false;
  root_.file("data/a", std::string(2000000, 'x'));
  root_.file("shared/data/b", "x");
  set_call_hook("read", [] { stop = true; });
  int error = 0;
  make_zip_data(kPackage, root_.path().c_str(), archive_.c_str(), &error, kNoBounds, nullptr,
                &stop);
  set_call_hook(nullptr, nullptr);
  EXPECT_EQ(error, QUARN_REFUSED);
  EXPECT_THAT(names(), ElementsAre("data/a"));
}

/* ---- packages that go, and what is not ours ---------------------------------- */

TEST_P(ZipWriter, APackageThatIsRemovedMeanwhileDoesNotComeBack) {
  static std::string root;
  for (const char *archive : {"/archive.zip", "/shared/data/org.example.notes_upload.zip"}) {
    const TempDir place;
    root = place / "app";
    place.file("app/data/a", "x");
    place.file("app/shared/data/b", "x");
    place.file("app/shared/trusted/c", "x");
    set_call_hook("read", [] { std::filesystem::remove_all(root); });
    const std::string path = archive[1] == 'a' ? place_ / "archive.zip" : root + archive;
    int error = 0;
    make_zip_data(kPackage, root.c_str(), path.c_str(), &error);
    set_call_hook(nullptr, nullptr);
    EXPECT_EQ(error, QUARN_REFUSED) << archive;
    EXPECT_EQ(errors("(org.example.notes) was removed while it was packed"), 1);
    EXPECT_FALSE(exists(root)) << archive;
    clear_captured_log();
  }
}

TEST_P(ZipWriter, APackageThatLosesADataDirectoryMeanwhileFails) {
  static std::string dir;
  root_.file("shared/trusted/c", "x");
  dir = root_ / "shared/trusted";
  set_call_hook("read", [] { std::filesystem::remove_all(dir); });
  EXPECT_EQ(pack(), QUARN_REFUSED);
  set_call_hook(nullptr, nullptr);
  EXPECT_FALSE(exists(dir));
  EXPECT_EQ(errors("(org.example.notes) was removed while it was packed"), 1);
}

TEST_P(ZipWriter, APackageThatHasGoneIsNotMade) {
  const std::string root = place_ / "gone";
  const std::string archive = root + "/shared/data/org.example.notes_upload.zip";
  int error = 0;
  make_zip_data(kPackage, root.c_str(), archive.c_str(), &error);
  EXPECT_EQ(error, QUARN_UNREADABLE);
  EXPECT_EQ(errors("zipOpen() failed, zf is NULL"), 1);
  EXPECT_FALSE(exists(root));
}

TEST_P(ZipWriter, ADirectoryThatIsMissingIsNotMadeForTheTable) {
  ASSERT_EQ(rmdir((root_ / "shared/data").c_str()), 0);
  root_.file("data/a", "x");
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_THAT(names(), ElementsAre("data/a", kTableEntry));
  EXPECT_FALSE(exists(root_ / "shared/data"));
}

TEST_P(ZipWriter, ADirectoryThatTheArchiveNeedsIsTheApplications) {
  ASSERT_EQ(rmdir((root_ / "shared/data").c_str()), 0);
  const std::string archive = root_ / "shared/data/org.example.notes_upload.zip";
  int error = 0;
  make_zip_data(kPackage, root_.path().c_str(), archive.c_str(), &error);
  EXPECT_EQ(error, QUARN_OK);
  struct stat status = {};
  ASSERT_EQ(lstat((root_ / "shared/data").c_str(), &status), 0);
  EXPECT_EQ(status.st_uid, kAppUid);
  EXPECT_EQ(status.st_gid, kAppGid);
}

TEST_P(ZipWriter, AnotherOwnersFileIsNotPackedByALinkToIt) {
  const std::string secret = root_.file("secret", "root's");
  ASSERT_EQ(link(secret.c_str(), (root_ / "data/a").c_str()), 0);
  root_.file("data/own", "x");
  ASSERT_EQ(chown((root_ / "data/own").c_str(), kAppUid, kAppGid), 0);
  ASSERT_EQ(link((root_ / "data/own").c_str(), (root_ / "shared/data/again").c_str()), 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("refused : " + (root_ / "data/a") + " is a link to another owner's file"), 1);
  EXPECT_THAT(names(), UnorderedElementsAre("data/own", "shared/data/again", kTableEntry));
}

/** A package as it is on a device: its data is its application's. */
class OwnedData : public ZipWriter {
 protected:
  void SetUp() override {
    ZipWriter::SetUp();
    for (const char *dir : {"data", "shared/data", "shared/trusted"}) own(dir, 0755);
  }
  void own(const std::string &name, mode_t mode, uid_t owner = kAppUid) const {
    ASSERT_EQ(lchown((root_ / name).c_str(), owner, owner), 0);
    ASSERT_EQ(chmod((root_ / name).c_str(), mode), 0);
  }
  void file(const std::string &name, mode_t mode, uid_t owner = kAppUid) const {
    root_.file(name, "text of " + name);
    own(name, mode, owner);
  }
  std::uint64_t measured() const {
    return get_dir_backup_size((root_ / "data").c_str(), kPackage, root_.path().c_str());
  }
};

INSTANTIATE_TEST_SUITE_P(Codec, OwnedData, ::testing::Values(ArchiveCodec::kIsal));

TEST_P(OwnedData, WhatTheApplicationItselfHasClosedIsPacked) {
  file("data/closed", 0000);
  file("data/readable", 0400);
  file("data/dir/one", 0644);
  root_.link("data/dir/link", "one");
  own("data/dir", 0555);
  file("data/shut/two", 0600);
  root_.dir("data/shut/deeper");
  file("data/shut/deeper/three", 0000);
  root_.link("data/shut/deeper/link", "three");
  own("data/shut/deeper", 0400);
  own("data/shut", 0000);
  EXPECT_EQ(pack(), QUARN_OK);
  EXPECT_THAT(names(),
              UnorderedElementsAre("data/closed", "data/readable", "data/dir/one", "data/shut/two",
                                   "data/shut/deeper/three", kTableEntry));
  EXPECT_EQ(text("data/shut/deeper/three"), "text of data/shut/deeper/three");
  EXPECT_TRUE(in_table("data/shut/deeper"));
  EXPECT_NE(table().find("data\\/shut\\/deeper\\/link"), std::string::npos);
  const std::string counted =
      "text of data/closed"
      "text of data/readable"
      "text of data/dir/one"
      "one"
      "text of data/shut/two"
      "text of data/shut/deeper/three"
      "three";
  EXPECT_EQ(measured(), counted.size());
}

TEST_P(OwnedData, AnotherOwnersFilesArePackedWhereTheApplicationCannotHavePutThem) {
  file("data/system/settings", 0600, 0);
  file("data/system/deeper/state", 0600, 1234);
  own("data/system/deeper", 0750, 0);
  own("data/system", 0755, 0);
  file("data/open", 0644, 0);
  EXPECT_EQ(pack(), QUARN_OK);
  EXPECT_THAT(names(), UnorderedElementsAre("data/system/settings", "data/system/deeper/state",
                                            "data/open", kTableEntry));
}

TEST_P(OwnedData, AnotherOwnersFileWhoseOtherNameIsGoneIsNotPacked) {
  file("data/a", 0600, 0);
  file("data/b", 0600);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("refused : " + (root_ / "data/a") +
                   " is another owner's file, and its application may not read it"),
            1);
  EXPECT_THAT(names(), UnorderedElementsAre("data/b", kTableEntry));
  EXPECT_FALSE(in_table("data/a"));
}

TEST_P(OwnedData, TheCallersIdentityIsItsOwnAgain) {
  file("data/a", 0600);
  EXPECT_EQ(pack(), QUARN_OK);
  EXPECT_EQ(setfsuid(static_cast<uid_t>(-1)), 0);
  EXPECT_EQ(setfsgid(static_cast<gid_t>(-1)), 0);
}

TEST_P(OwnedData, TheArchiveAmongTheDataIsRootsWhoeverReadsTheData) {
  file("data/a", 0600);
  const std::string archive = root_ / "shared/data/org.example.notes_upload.zip";
  int error = 0;
  make_zip_data(kPackage, root_.path().c_str(), archive.c_str(), &error);
  EXPECT_EQ(error, QUARN_OK);
  struct stat status = {};
  ASSERT_EQ(lstat(archive.c_str(), &status), 0);
  EXPECT_EQ(status.st_uid, 0U);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
}

TEST_P(ZipWriter, AnEntryThatCannotBeOpenedCostsThatFileOnly) {
  root_.file("data/a", "x");
  root_.file("shared/data/b", "x");
  const Fault fault("zipOpenNewFileInZip4_64", 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("zipOpenNewFileInZip() failed, zip_err = [-102]"), 1);
  EXPECT_THAT(names(), ElementsAre("shared/data/b", kTableEntry));
  EXPECT_TRUE(in_table("data/a"));
}

TEST_P(ZipWriter, AnEntryThatCannotBeWrittenCostsThatFileOnly) {
  root_.file("data/a", "x");
  root_.file("shared/data/b", "x");
  const Fault fault("zipWriteInFileInZip", 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("zipWriteInFileInZip() failed, zip_err = [-1]"), 1);
  EXPECT_EQ(text("shared/data/b"), "x");
}

TEST_P(ZipWriter, AnEntryThatCannotBeClosedIsAnError) {
  root_.file("data/a", "x");
  const Fault fault("zipCloseFileInZipRaw64", 0);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("zipCloseFileInZip() failed, zip_err = [-1]"), 1);
}

TEST_P(ZipWriter, AnArchiveThatCannotBeClosedIsAnError) {
  root_.file("data/a", "x");
  const Fault fault("pwrite", ENOSPC);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("zipClose() failed, zip_err = [-1]"), 1);
  EXPECT_EQ(fault.hits(), 1);
}

TEST_P(ZipWriter, AFullDiskIsAnErrorOfTheEntryThatMetIt) {
  std::string noise(400000, '\0');
  std::uint32_t state = 1;
  for (char &c : noise) c = static_cast<char>((state = state * 1664525 + 1013904223) >> 24);
  root_.file("data/a", noise);
  const Fault fault("pwrite", ENOSPC, 0, 1000);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("zipWriteInFileInZip() failed, zip_err = [-1]"), 1);
  EXPECT_EQ(errors("zipOpenNewFileInZip() failed, zip_err = [-1]"), 1) << "of the table";
  EXPECT_EQ(errors("zipClose() failed, zip_err = [-1]"), 1);
}

TEST_P(ZipWriter, ALabelThatCannotBeReadIs36AndTheFileIsPacked) {
  const std::string file = root_.file("data/a", "x");
  ON_CALL(platform_, smack_getlabel).WillByDefault(Return(-7));
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("error : cannot get smack label of " + file + " (err=-7)"), 1);
  EXPECT_THAT(names(), ElementsAre("data/a", kTableEntry));
}

TEST_P(ZipWriter, ATableThatCannotBeWrittenIsAnError) {
  root_.dir(kTableEntry);
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_THAT(names(), ElementsAre());
  EXPECT_EQ(errors("Writing to File " + root_ / kTableEntry + " Failed"), 1);
  EXPECT_EQ(errors("fail. insert_file_info_table_to_zip : 36"), 2) << "not written, not there";
}

TEST_P(ZipWriter, AFileInTheTablesPlaceIsPackedAndStays) {
  const std::string own = root_.file(kTableEntry, "the application's own");
  ASSERT_EQ(chown(own.c_str(), kAppUid, kAppGid), 0);
  struct stat before = {};
  ASSERT_EQ(lstat(own.c_str(), &before), 0);
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre(kTableEntry, kTableEntry));
  EXPECT_EQ(inflate_text(entries()[1].data).find(R"({ "quarn_symbolic_info")"), 0U);
  EXPECT_EQ(read_text(own), "the application's own");
  struct stat after = {};
  ASSERT_EQ(lstat(own.c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
}

TEST_P(ZipWriter, WhateverAFileInTheTablesPlaceHoldsTheArchiveIsTakenByARestore) {
  root_.file("data/a", "x");
  root_.file(kTableEntry, R"({"its own": [[[[["deeper than any attributes"]]]]]})");
  ASSERT_EQ(pack_within(kBackupBounds), QUARN_OK);
  const TempDir out;
  unzip_report report;
  EXPECT_EQ(unzip_data(kPackage, out.path().c_str(), archive_.c_str(), &report), QUARN_OK);
  EXPECT_TRUE(report.complete());
  EXPECT_EQ(read_text(out / "data/a"), "x");
}

TEST_P(ZipWriter, ALinkInTheTablesPlaceStays) {
  root_.link(kTableEntry, "elsewhere");
  EXPECT_EQ(pack(), 0);
  EXPECT_THAT(names(), ElementsAre(kTableEntry));
  EXPECT_TRUE(std::filesystem::is_symlink(root_ / kTableEntry));
}

TEST_P(ZipWriter, DataOfAnInterruptedRestoreIsNotPacked) {
  root_.file("shared/data/quarn_tmp_rst_dir/shared/data/org.example.notes.perm", "{}");
  EXPECT_EQ(pack(), QUARN_REFUSED);
  EXPECT_EQ(errors("restore of (org.example.notes) was interrupted, so its data is not packed"), 1);
  EXPECT_FALSE(exists(archive_));
}

/** The single steps, on an archive of their own. */
class ZipSteps : public ZipWriter {
 protected:
  void SetUp() override {
    ZipWriter::SetUp();
    zip_ = zipOpen(archive_.c_str(), APPEND_STATUS_CREATE);
    ready_file_info_table(&table_);
    ASSERT_NE(zip_, nullptr);
    ASSERT_NE(table_, nullptr);
  }
  void TearDown() override {
    if (zip_ != nullptr) zipClose(zip_, nullptr);
    release_file_info_table(table_);
    ZipWriter::TearDown();
  }
  bool walk(const std::string &dir) {
    return parse_app_dir_for_zip(kPackage, root_.path().c_str(), zip_, (root_ / dir).c_str(),
                                 table_, &error_);
  }
  bool add(const std::string &path) {
    return add_file_to_zip(root_.path().c_str(), zip_, path.c_str(), &error_);
  }
  void finish() {
    EXPECT_EQ(zipClose(zip_, nullptr), ZIP_OK);
    zip_ = nullptr;
  }

  zipFile zip_ = nullptr;
  file_info_table_h *table_ = nullptr;
  int error_ = 0;
};

INSTANTIATE_TEST_SUITE_P(Codec, ZipSteps,
                         ::testing::Values(ArchiveCodec::kIsal, ArchiveCodec::kZlib),
                         [](const auto &info) {
                           return info.param == ArchiveCodec::kIsal ? "Isal" : "Zlib";
                         });

TEST_P(ZipSteps, AWalkTellsWhetherAnythingWasRecorded) {
  root_.file("data/dir/a", "x");
  root_.link("shared/data/link", "x");
  root_.dir("shared/trusted/empty");
  EXPECT_TRUE(walk("data"));
  EXPECT_TRUE(walk("shared/data"));
  EXPECT_FALSE(walk("shared/trusted"));
  EXPECT_EQ(error_, 0);
  EXPECT_FALSE(walk("none"));
  EXPECT_EQ(error_, QUARN_REFUSED);
}

TEST_P(ZipSteps, AFileIsNamedByItsPathBelowTheRoot) {
  EXPECT_TRUE(add(root_.file("data/dir/a", "text")));
  EXPECT_EQ(error_, 0);
  finish();
  EXPECT_THAT(names(), ElementsAre("data/dir/a"));
  EXPECT_EQ(text("data/dir/a"), "text");
}

TEST_P(ZipSteps, WhatIsNoFileIsNotAdded) {
  root_.file("data/a", "x");
  root_.link("data/link", root_ / "data/a");
  for (const char *name : {"data/none", "data/link", "data"}) {
    error_ = 0;
    clear_captured_log();
    EXPECT_FALSE(add(root_ / name)) << name;
    EXPECT_EQ(error_, QUARN_REFUSED) << name;
    EXPECT_THAT(captured_texts(), ElementsAre("fopen() failed, file is NULL")) << name;
  }
  finish();
  EXPECT_TRUE(names().empty());
}

TEST_P(ZipSteps, TheTableIsWrittenAddedAndDeleted) {
  EXPECT_TRUE(walk("data") || error_ == 0);
  insert_file_info_table_to_zip(table_, zip_, kPackage, root_.path().c_str(), &error_);
  EXPECT_EQ(error_, 0);
  EXPECT_EQ(table_->root, nullptr);
  EXPECT_FALSE(exists(root_ / kTableEntry));
  finish();
  EXPECT_EQ(table(), R"({ "quarn_symbolic_info": [ ] })");
}

}  // namespace
