#include <linux/capability.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "files/tree_depth.h"
#include "log_scope.h"
#include "platform_security_server.h"
#include "quarn_d_restore/walk.h"
#include "restore_fixture.h"

using ::testing::_;
using ::testing::Return;
using ::testing::StrEq;

namespace {

class WalkTest : public RestoreTest {
 protected:
  int mode_of(const std::string &path) const {
    struct stat status = {};
    EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
    return static_cast<int>(status.st_mode & 07777);
  }
  unsigned int owner_of(const std::string &path) const {
    struct stat status = {};
    EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
    return status.st_uid;
  }
  /** A file as unpacking leaves it, without a label; the table is the daemon's. */
  std::string unpacked(const std::string &name, const std::string &content = "new") {
    const bool is_table = at(name) == perm();
    return is_table ? daemons_file(name, content) : unpacked_file(name, content);
  }
  int restore() { return restore_app_info(kPkg, root.c_str()); }
  int walk(const std::string &name, json_object *table) {
    return parse_app_dir_for_restore(at(name).c_str(), kPkg, root.c_str(), table);
  }
};

TEST_F(WalkTest, RestoresEverythingInTheThreeDirectories) {
  const std::vector<Entry> entries = {{"data/a.ini", "", 0640},
                                      {"data/db/x.db", "", 0600, "wrt::db_origin"},
                                      {"shared/data/b.jpg", "", 0444},
                                      {"shared/trusted/k", "", 04755}};
  for (const auto &entry : entries) unpacked(entry.name);
  unpacked("shared/data/org.example.notes.perm", table_text(entries));
  EXPECT_EQ(restore(), 1);
  for (const auto &entry : entries) {
    EXPECT_EQ(mode_of(at(entry.name)), entry.mode) << entry.name;
    EXPECT_EQ(owner_of(at(entry.name)), 5000U) << entry.name;
    EXPECT_EQ(label_of(at(entry.name)), entry.label) << entry.name;
  }
  EXPECT_EQ(mode_of(at("data/db")), 0755);
  EXPECT_FALSE(exists(perm()));
  for (const char *name : {"data", "shared/data", "shared/trusted"}) {
    expect_info("success : set smack label all files under " + at(name));
  }
}

TEST_F(WalkTest, TellsTheSecurityServerOfEachDirectoryWithItsOwnLabel) {
  set_label(at("shared/trusted"), "app.trusted");
  unpacked("shared/data/org.example.notes.perm", "{}");
  std::vector<std::string> told;
  EXPECT_CALL(platform, security_server_perm_app_setup_path(_, StrEq(kPkg), _, 5, _))
      .Times(3)
      .WillRepeatedly([&](auto, auto, const char *path, int, const char *label) {
        told.push_back(std::filesystem::read_symlink(path).string() + " " + label);
        return 0;
      });
  EXPECT_EQ(restore(), 1);
  EXPECT_EQ(told, (std::vector<std::string>{at("data app.data"), at("shared/data app.data"),
                                            at("shared/trusted app.trusted")}));
}

TEST_F(WalkTest, AnArchiveWithoutTheTableFailsBeforeAnyLabelIsChanged) {
  EXPECT_CALL(platform, security_server_perm_begin).Times(0);
  EXPECT_EQ(restore(), 0);
  expect_error("there isn't file-info file...");
  expect_error("app data restore failed, so will be cleared");
}

TEST_F(WalkTest, ATableThatIsALinkIsNoTable) {
  write_text(base + "/outside.perm", "{}");
  std::filesystem::create_symlink(base + "/outside.perm", perm());
  EXPECT_EQ(restore(), 0);
  expect_error("there isn't file-info file...");
  EXPECT_TRUE(exists(base + "/outside.perm"));
}

TEST_F(WalkTest, ATableThatIsNotJsonIsStillDeleted) {
  for (const char *text : {"not json", "", "{\"data/a\": ", "[1, 2]", "\"text\"", "7"}) {
    clear_captured_log();
    EXPECT_CALL(platform, security_server_perm_begin).Times(0);
    unpacked("shared/data/org.example.notes.perm", text);
    EXPECT_EQ(restore(), 0) << text;
    expect_error("cannot read json info...");
    expect_error("app data restore failed, so will be cleared");
    EXPECT_FALSE(exists(perm())) << text;
  }
}

TEST_F(WalkTest, ATableThatCannotBeReadIsDeleted) {
  unpacked("shared/data/org.example.notes.perm", "{}");
  ASSERT_EQ(chmod(perm().c_str(), 0), 0);
  ASSERT_EQ(chown(perm().c_str(), 5000, 5000), 0);
  ASSERT_EQ(chown(at("shared/data").c_str(), 0, 0), 0);
  {
    const WithoutCapabilities none({CAP_DAC_OVERRIDE, CAP_DAC_READ_SEARCH});
    EXPECT_EQ(restore(), 0);
  }
  expect_error("cannot read file-info file...");
  EXPECT_FALSE(exists(perm()));
}

TEST_F(WalkTest, EachRefusalOfTheSecurityServerFailsTheRestore) {
  const struct {
    int *result;
    std::string message;
  } cases[] = {
      {&begin_result, "fail : security_server_perm_begin...(err=-2)"},
      {&setup_result, "error : security_server_perm_app_setup_path " + at("data") + " (err=-2)"},
      {&commit_result, "fail : security_server_perm_commit...(err=-2)"},
  };
  for (const auto &one : cases) {
    clear_captured_log();
    const std::string path = unpacked("data/a");
    unpacked("shared/data/org.example.notes.perm", table_text({{"data/a", "", 0640}}));
    *one.result = -2;
    EXPECT_EQ(restore(), 0) << one.message;
    *one.result = 0;
    expect_error(one.message);
    expect_error("app data restore failed, so will be cleared");
    EXPECT_EQ(mode_of(path), 01000) << "nothing is walked";
    EXPECT_EQ(transactions, 0);
  }
}

TEST_F(WalkTest, ADirectoryWhoseLabelCannotBeReadFailsTheRestore) {
  unpacked("shared/data/org.example.notes.perm", "{}");
  EXPECT_CALL(platform, smack_getlabel).WillOnce(Return(-9));
  EXPECT_CALL(platform, security_server_perm_commit).Times(0);
  EXPECT_EQ(restore(), 0);
  expect_error("error : cannot get smack label of " + at("data") + " (err=-9)");
}

TEST_F(WalkTest, ADirectoryThatIsMissingFailsTheRestore) {
  unpacked("shared/data/org.example.notes.perm", "{}");
  std::filesystem::remove(at("shared/trusted"));
  EXPECT_EQ(restore(), 0);
  expect_error("error : cannot get smack label of " + at("shared/trusted") + " (err=-1)");
}

TEST_F(WalkTest, ArchivesInTransitAndTheSnapshotAreNeverTouched) {
  const std::vector<std::string> names = {
      "shared/data/org.example.notes_upload.zip", "shared/data/org.example.notes_download.zip",
      "shared/data/quarn_tmp_rst_dir/data/a", "shared/data/quarn_tmp_rst_dir2"};
  for (const auto &name : names) daemons_file(name, "new");
  EXPECT_EQ(walk("shared/data", table({}).get()), 1);
  for (const auto &name : names) {
    EXPECT_EQ(mode_of(at(name)), 0600) << name;
    EXPECT_EQ(owner_of(at(name)), 0U) << name;
    EXPECT_EQ(label_of(at(name)), kFloorLabel) << name;
  }
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(WalkTest, TheSameNamesInOtherDirectoriesAreRestored) {
  unpacked("data/org.example.notes_upload.zip");
  EXPECT_EQ(walk("data", table({}).get()), 0);
  expect_error("fail to restore file info : " + at("data/org.example.notes_upload.zip"));
}

TEST_F(WalkTest, AnEmptyDirectoryThatIsMissingFromTheTableDoesNotFail) {
  dir("data/empty/inner");
  EXPECT_EQ(walk("data", table({}).get()), 1);
  expect_info("it is empty folder : " + at("data/empty"));
  expect_info("it is empty folder : " + at("data/empty/inner"));
}

TEST_F(WalkTest, ANonEmptyDirectoryThatIsMissingFromTheTableFailsAndItsContentsAreStillWalked) {
  JsonPtr entries = table({{"data/dir/a", "", 0640}});
  json_object_object_del(entries.get(), "data/dir");
  const std::string path = unpacked("data/dir/a");
  set_label(path, kDataLabel);
  EXPECT_EQ(walk("data", entries.get()), 0);
  expect_error("fail to restore file info : " + at("data/dir"));
  EXPECT_EQ(mode_of(path), 0640);
  EXPECT_EQ(owner_of(path), 5000U);
}

TEST_F(WalkTest, AFailureDoesNotStopTheWalk) {
  for (const char *name : {"data/a", "data/b", "data/c"}) unpacked(name);
  EXPECT_EQ(walk("data", table({}).get()), 0);
  for (const char *name : {"data/a", "data/b", "data/c"}) {
    expect_error("fail to restore file info : " + at(name));
  }
}

TEST_F(WalkTest, WhatTheTableDoesNotKnowIsToldAHundredTimesAndCounted) {
  constexpr unsigned int kMany = 250;
  for (unsigned int i = 0; i < kMany; ++i) unpacked("data/own" + std::to_string(i));
  unpacked("data/known");
  EXPECT_EQ(walk("data", table({{"data/known", "", 0640}}).get()), 0);
  unsigned int told = 0;
  for (unsigned int i = 0; i < kMany; ++i) {
    told += count_logged(DLOG_ERROR,
                         "fail to restore file info : " + at("data/own" + std::to_string(i)));
  }
  EXPECT_LE(told, kMaxLinesOfAPlace);
  EXPECT_GE(told, kMaxLinesOfAPlace - 1) << "one more line of that place may be about another file";
  const std::string last = captured_texts().back();
  EXPECT_NE(last.find(" more such lines on " + at("data") + " are left out"), std::string::npos)
      << last;
  struct stat status = {};
  ASSERT_EQ(lstat(at("data/known").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0640U) << "the rest is restored all the same";
}

TEST_F(WalkTest, ASymbolicLinkIsLeftAsItIs) {
  const std::string target = base + "/outside";
  write_text(target, "secret");
  ASSERT_EQ(chmod(target.c_str(), 0600), 0);
  std::filesystem::create_symlink(target, at("data/link"));
  std::filesystem::create_directory_symlink(base, at("data/dirlink"));
  EXPECT_EQ(walk("data", table({{"data/link", "", 0777}, {"data/dirlink", "", 0777}}).get()), 1);
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_EQ(std::filesystem::read_symlink(at("data/link")), target);
  EXPECT_EQ(mode_of(target), 0600);
  EXPECT_EQ(owner_of(target), 0U);
}

TEST_F(WalkTest, AnyNumberOfWhatIsUnexpectedIsAHundredLinesAndOne) {
  for (int i = 0; i < 1000; ++i) {
    ASSERT_EQ(mkfifo(at("data/pipe" + std::to_string(i)).c_str(), 0600), 0);
  }
  EXPECT_EQ(walk("data", table({}).get()), 0);
  EXPECT_EQ(captured_texts().size(), 101U);
  EXPECT_EQ(captured_texts().back(), "900 more such lines on " + at("data") + " are left out");
}

TEST_F(WalkTest, AnythingElseIsUnexpected) {
  ASSERT_EQ(mkfifo(at("data/pipe").c_str(), 0600), 0);
  unpacked("data/a");
  EXPECT_EQ(walk("data", table({{"data/pipe", "", 0777}}).get()), 0);
  expect_error("this is unexpected type : " + at("data/pipe"));
  expect_error("fail to restore file info : " + at("data/a"));
  EXPECT_EQ(mode_of(at("data/pipe")), 0600);
}

TEST_F(WalkTest, ADirectoryThatCannotBeOpenedIsAFailure) {
  EXPECT_EQ(walk("missing", table({}).get()), 0);
  expect_error("error : cannot open this path " + at("missing"));
  std::filesystem::create_directory_symlink(at("data"), at("link"));
  EXPECT_EQ(walk("link", table({}).get()), 0);
  expect_error("error : cannot open this path " + at("link"));
}

TEST_F(WalkTest, AnEntryThatVanishesIsLoggedAndTheRestGoesOn) {
  const std::string gone = unpacked("data/a");
  const AtStep step("attributes", [&] { unlink(gone.c_str()); });
  EXPECT_EQ(walk("data", table({}).get()), 1);
  expect_error("error : lstat for -1 " + gone);
}

TEST_F(WalkTest, AFailedWalkLeavesTheLaterDirectoriesUnwalkedAlthoughRelabelled) {
  unpacked("data/a");
  const std::string b = unpacked("shared/data/b");
  const std::string c = unpacked("shared/trusted/c");
  unpacked("shared/data/org.example.notes.perm",
           table_text({{"shared/data/b", "", 0640}, {"shared/trusted/c", "", 0640}}));
  EXPECT_EQ(restore(), 0);
  expect_error("fail to restore directory : " + at("data") + "...");
  expect_error("app data restore failed, so will be cleared");
  for (const auto &path : {b, c}) {
    EXPECT_EQ(mode_of(path), 01000) << "as it was unpacked";
    EXPECT_EQ(owner_of(path), 5000U);
    EXPECT_EQ(label_of(path), kDataLabel);
  }
}

TEST_F(WalkTest, ADeepTreeIsRestoredWithFewDescriptors) {
  std::string name = "data";
  for (int i = 1; i < kMaxDirDepth; ++i) {
    name += "/d";
    dir(name);
  }
  const std::string path = unpacked(name + "/a");
  set_label(path, kDataLabel);
  const JsonPtr entries = table({{name + "/a", "", 0640}});
  rlimit before = {};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit few = {64, before.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &few), 0);
  const int restored = walk("data", entries.get());
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(restored, 1);
  EXPECT_EQ(mode_of(path), 0640);
  EXPECT_EQ(owner_of(path), 5000U);
}

TEST_F(WalkTest, ClearAppDirEmptiesTheThreeDirectoriesAndKeepsTheSnapshot) {
  make_old_data();
  write_text(snapshot() + "/data/a", "kept");
  write_text(download(), "zip");
  clear_app_dir(kPkg, root.c_str());
  expect_info("clearing app data backup directory");
  EXPECT_EQ(read_text(snapshot() + "/data/a"), "kept");
  EXPECT_TRUE(std::filesystem::is_empty(at("data")));
  EXPECT_TRUE(std::filesystem::is_empty(at("shared/trusted")));
  EXPECT_FALSE(exists(download()));
  EXPECT_FALSE(exists(at("shared/data/pictures")));
}

/* ---- links ---- */

class LinkTest : public WalkTest {
 protected:
  int restore_links(const std::string &list) {
    const JsonPtr table(json_tokener_parse(("{\"quarn_symbolic_info\": " + list + "}").c_str()));
    EXPECT_NE(table, nullptr);
    return restore_symlnk(kPkg, root.c_str(), table.get());
  }
  static std::string link(const std::string &name, const std::string &target,
                          const std::string &label = "link.label") {
    return R"({"real_name": ")" + name + R"(", "lnk": ")" + target +
           R"(", "perm": {"0": 511, "1": 0, "2": 0, "3": ")" + label + "\"}}";
  }
};

TEST_F(LinkTest, MakesEachLinkWithItsParentsOwnerAndLabel) {
  EXPECT_CALL(platform, smack_lsetlabel(_, StrEq("link.label"), SMACK_LABEL_ACCESS)).Times(2);
  EXPECT_EQ(restore_links("[" + link("data/new/a", "../target") + "," +
                          link("shared/data/b", "/etc/hostname") + "]"),
            1);
  EXPECT_EQ(std::filesystem::read_symlink(at("data/new/a")), "../target");
  EXPECT_EQ(std::filesystem::read_symlink(at("shared/data/b")), "/etc/hostname");
  EXPECT_EQ(owner_of(at("data/new/a")), 5000U);
  EXPECT_EQ(owner_of(at("shared/data/b")), 5000U);
  expect_error("chmod failed", 2);
  struct stat status = {};
  ASSERT_EQ(stat("/etc/hostname", &status), 0);
  EXPECT_EQ(status.st_uid, 0U) << "the link's target is not touched";
}

TEST_F(LinkTest, TheLabelIsTheLinksOwn) {
  EXPECT_CALL(platform, smack_lsetlabel).WillOnce([&](const char *path, const char *, auto) {
    EXPECT_EQ(std::filesystem::canonical(std::filesystem::path(path).parent_path()), at("data"));
    EXPECT_EQ(std::filesystem::path(path).filename(), "a");
    return 0;
  });
  EXPECT_EQ(restore_links("[" + link("data/a", "b") + "]"), 1);
}

TEST_F(LinkTest, NoListAndAnEmptyOneAreNothingToDo) {
  const JsonPtr empty(json_tokener_parse("{}"));
  EXPECT_EQ(restore_symlnk(kPkg, root.c_str(), empty.get()), 1);
  EXPECT_EQ(restore_symlnk(kPkg, root.c_str(), nullptr), 1);
  EXPECT_EQ(restore_links("[]"), 1);
  EXPECT_EQ(restore_links("\"text\""), 1);
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(LinkTest, AnIncompleteElementEndsTheListThere) {
  const std::string broken[] = {
      "null",
      R"({"lnk": "t", "perm": {"0": 1, "1": 1, "2": 1, "3": "x"}})",
      R"({"real_name": "data/x", "perm": {"0": 1, "1": 1, "2": 1, "3": "x"}})",
      R"({"real_name": "data/x", "lnk": "t"})",
      R"({"real_name": "data/x", "lnk": "t", "perm": {"1": 1, "2": 1, "3": "x"}})",
      R"({"real_name": "data/x", "lnk": "t", "perm": {"0": 1, "2": 1, "3": "x"}})",
      R"({"real_name": "data/x", "lnk": "t", "perm": {"0": 1, "1": 1, "3": "x"}})",
      R"({"real_name": "data/x", "lnk": "t", "perm": {"0": 1, "1": 1, "2": 1}})",
      R"({"real_name": 7, "lnk": "t", "perm": {"0": 1, "1": 1, "2": 1, "3": "x"}})",
  };
  for (const auto &element : broken) {
    std::filesystem::remove(at("data/before"));
    EXPECT_EQ(restore_links("[" + link("data/before", "t") + "," + element + "," +
                            link("data/after", "t") + "]"),
              1)
        << element;
    EXPECT_TRUE(exists(at("data/before"))) << element;
    EXPECT_FALSE(exists(at("data/x"))) << element;
    EXPECT_FALSE(exists(at("data/after"))) << element;
  }
}

TEST_F(LinkTest, ALinkThatCannotBeMadeIsLoggedAndTheNextIsMade) {
  write_text(at("data/a"), "in the way");
  EXPECT_EQ(restore_links("[" + link("data/a", "t") + "," + link("data/b", "t") + "]"), 1);
  expect_error("error : fail to make lnk for " + at("data/a") + " -> t");
  EXPECT_EQ(read_text(at("data/a")), "in the way");
  EXPECT_TRUE(exists(at("data/b")));
}

TEST_F(LinkTest, ALinkWithoutALabelIsMadeAndLogged) {
  EXPECT_CALL(platform, smack_lsetlabel).Times(0);
  EXPECT_EQ(restore_links("[" + link("data/a", "t", "") + "]"), 1);
  expect_error("error : there isn't smack info of " + at("data/a"));
  EXPECT_TRUE(exists(at("data/a")));
}

TEST_F(LinkTest, AnOwnerOrLabelThatCannotBeSetIsLogged) {
  ON_CALL(platform, smack_lsetlabel).WillByDefault(Return(-1));
  const WithoutCapabilities none({CAP_CHOWN});
  EXPECT_EQ(restore_links("[" + link("data/a", "t") + "]"), 1);
  expect_error("fail : smack_lsetlabel for " + at("data/a") + " (err=-1)");
}

TEST_F(LinkTest, NothingIsMadeOutsideOfTheApplicationOrThroughALink) {
  std::filesystem::create_directory_symlink(base, at("data/out"));
  EXPECT_EQ(restore_links("[" + link("../escaped", "t") + "," + link("/tmp/escaped", "t") + "," +
                          link("data/../../escaped", "t") + "," + link("", "t") + "," +
                          link("data/out/escaped", "t") + "," + link("data/good", "t") + "]"),
            1);
  expect_error("refused : link outside of the application (../escaped)");
  expect_error("refused : link outside of the application (/tmp/escaped)");
  expect_error("refused : link outside of the application (data/../../escaped)");
  expect_error("refused : link outside of the application ()");
  expect_error("error : fail to make lnk for " + at("data/out/escaped") + " -> t");
  EXPECT_FALSE(exists(base + "/escaped"));
  EXPECT_TRUE(exists(at("data/good")));
}

}  // namespace
