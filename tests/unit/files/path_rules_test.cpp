#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <ctime>
#include <string>
#include <thread>

#include "fault.h"
#include "log_capture.h"
#include "loopback.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/path_rules.h"
#include "rules/path_matcher.h"
#include "rules/rules_file.h"
#include "temp_dir.h"

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr char kPackage[] = "org.example.notes";

class PathRules : public ::testing::Test {
 protected:
  void SetUp() override {
    reset_backup_path_info();
    clear_captured_log();
  }
  void TearDown() override { reset_backup_path_info(); }

  void load(const std::string &xml, const char *type = "tpk") {
    const bool native = std::string(type) == "tpk";
    root_.file(native ? "res/backup.path.xml" : "res/wgt/res/backup.path.xml", xml);
    parse_backup_path_xml(kPackage, type, root_.path().c_str());
  }
  static void expect_no_rules() {
    EXPECT_THAT(backup_include_list, IsEmpty());
    EXPECT_THAT(backup_exclude_list, IsEmpty());
    EXPECT_FALSE(xml_has_include_field);
  }
  static void expect_unusable(const std::string &why) {
    EXPECT_FALSE(backup_rules_usable());
    EXPECT_EQ(count_logged(DLOG_ERROR, "rules file of (org.example.notes) cannot be used: " + why),
              1);
  }
  std::uint64_t size() const {
    return get_dir_backup_size((root_ / "data").c_str(), kPackage, root_.path().c_str());
  }
  bool takes(const std::string &name) const { return is_backup_file((root_ / name).c_str()); }

  TempDir root_;
};

/** Nanoseconds of this thread that it takes to ask about many files. */
std::int64_t time_of_questions() {
  timespec before{};
  timespec after{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &before);
  for (int i = 0; i < 3000; ++i) {
    EXPECT_TRUE(is_backup_file(("/opt/usr/apps/one/data/deep/file" + std::to_string(i)).c_str()));
  }
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &after);
  return (after.tv_sec - before.tv_sec) * 1000000000L + after.tv_nsec - before.tv_nsec;
}

TEST_F(PathRules, ThousandsOfRulesMakeNoFileDearer) {
  const auto use_rules = [](int count) {
    reset_backup_path_info();
    for (int i = 0; i < count; ++i) {
      backup_exclude_list.push_back("/opt/usr/apps/one/data/deep/cache" + std::to_string(i) + "/");
    }
  };
  use_rules(8);
  const std::int64_t few = time_of_questions();
  use_rules(8000);
  const std::int64_t many = time_of_questions();
  EXPECT_LT(many, 50 * few) << "a thousand times as many rules";
}

TEST_F(PathRules, AnyNumberOfLinksAndOfOddFilesIsToldInFewLines) {
  root_.dir("data/links");
  root_.dir("data/pipes");
  for (int i = 0; i < 250; ++i) {
    root_.link("data/links/" + std::to_string(i), "12345");
    ASSERT_EQ(mkfifo((root_ / ("data/pipes/" + std::to_string(i))).c_str(), 0600), 0);
  }
  EXPECT_EQ(size(), 250U * 5);
  const std::string left_out = "300 more such lines on " + (root_ / "data") + " are left out";
  EXPECT_EQ(count_logged(DLOG_WARN, left_out), 1);
  EXPECT_EQ(captured_log().size(), 201U);
  clear_captured_log();
  // The next walk tells its own.
  EXPECT_EQ(size(), 250U * 5);
  EXPECT_EQ(captured_log().size(), 201U);
}

TEST_F(PathRules, RulesOfTheNextPackageReplaceThoseOfTheLast) {
  for (const char *name : {"a", "b", "c"}) {
    reset_backup_path_info();
    backup_exclude_list.push_back(std::string("/root/data/") + name);
    for (const char *other : {"a", "b", "c"}) {
      const std::string path = std::string("/root/data/") + other;
      EXPECT_EQ(is_backup_file(path.c_str()), std::string(name) != other);
    }
  }
}

TEST_F(PathRules, AFolderIsNamedWithItsSlashAlone) {
  backup_exclude_list = {"/root/data/cache/", "/root/data/logs"};
  EXPECT_FALSE(is_backup_file("/root/data/cache/"));
  EXPECT_FALSE(is_backup_file("/root/data/cache/deep/er/file"));
  EXPECT_TRUE(is_backup_file("/root/data/cache"));
  EXPECT_TRUE(is_backup_file("/root/data/cache2/file"));
  EXPECT_FALSE(is_backup_file("/root/data/logs"));
  EXPECT_TRUE(is_backup_file("/root/data/logs/file"));
  xml_has_include_field = true;
  EXPECT_FALSE(is_backup_file("/root/data/kept/file"));
  backup_include_list = {"/root/data/kept/", "/root/data/cache/"};
  EXPECT_TRUE(is_backup_file("/root/data/kept/file"));
  EXPECT_FALSE(is_backup_file("/root/data/cache/file")) << "what is excluded stays so";
}

TEST_F(PathRules, WithoutARulesFileEverythingIsTaken) {
  root_.file("data/a", "12345");
  root_.file("data/sub/b", "123");
  root_.link("data/link", "12");
  parse_backup_path_xml(kPackage, "tpk", root_.path().c_str());
  expect_no_rules();
  EXPECT_TRUE(captured_texts().empty());
  EXPECT_TRUE(takes("data/a"));
  EXPECT_EQ(size(), 10U);
  EXPECT_EQ(count_logged(DLOG_INFO, "size of lnk file " + root_ / "data/link" + " : 2"), 1);
}

TEST_F(PathRules, ExcludeWithASlashCoversWhatIsBelow) {
  root_.file("data/cache/a", "12345");
  root_.file("data/cache/sub/b", "12345");
  root_.file("data/other", "123");
  load(R"(<backup><exclude path="data/cache/"/></backup>)");
  EXPECT_EQ(count_logged(DLOG_INFO, "(org.example.notes) has xml file(for include/exlude path)"),
            1);
  EXPECT_THAT(backup_exclude_list, ElementsAre(root_ / "data/cache/"));
  EXPECT_FALSE(takes("data/cache/a"));
  EXPECT_FALSE(takes("data/cache/sub/b"));
  EXPECT_TRUE(takes("data/other"));
  EXPECT_EQ(size(), 3U);
}

TEST_F(PathRules, ExcludeWithoutASlashCoversNothingBelow) {
  root_.file("data/cache/a", "12345");
  load(R"(<backup><exclude path="data/cache"/></backup>)");
  EXPECT_THAT(backup_exclude_list, ElementsAre(root_ / "data/cache"));
  EXPECT_TRUE(takes("data/cache/a"));
  EXPECT_EQ(size(), 5U);
}

TEST_F(PathRules, APathMayBeginWithASlash) {
  root_.file("data/cache/a", "12345");
  load(R"(<backup><exclude path="/data/cache/"/></backup>)");
  EXPECT_THAT(backup_exclude_list, ElementsAre(root_ / "data/cache/"));
}

TEST_F(PathRules, IncludeTakesOnlyWhatItNames) {
  root_.file("data/keep/a", "1");
  root_.file("data/one", "12");
  root_.file("data/other", "123");
  load(R"(<backup>text<other path="data/other"/><include path="data/keep/"/>
          <!-- a comment --><include path="data/one"/></backup>)");
  EXPECT_TRUE(xml_has_include_field);
  EXPECT_THAT(backup_include_list, ElementsAre(root_ / "data/keep/", root_ / "data/one"));
  EXPECT_TRUE(takes("data/keep/a"));
  EXPECT_TRUE(takes("data/one"));
  EXPECT_FALSE(takes("data/other"));
  EXPECT_EQ(size(), 3U);
}

TEST_F(PathRules, AnIncludeThatDoesNotExistLeavesNothing) {
  root_.file("data/a", "12345");
  load(R"(<backup><include path="data/none/"/></backup>)");
  EXPECT_TRUE(xml_has_include_field);
  EXPECT_THAT(backup_include_list, IsEmpty());
  EXPECT_FALSE(takes("data/a"));
  EXPECT_EQ(size(), 0U);
}

TEST_F(PathRules, ExclusionWins) {
  root_.file("data/keep/a", "12345");
  root_.file("data/keep/b", "1");
  load(R"(<backup><include path="data/keep/"/><exclude path="data/keep/a"/></backup>)");
  EXPECT_FALSE(takes("data/keep/a"));
  EXPECT_TRUE(takes("data/keep/b"));
}

TEST_F(PathRules, EveryLoadReplacesTheRules) {
  root_.file("data/a", "1");
  load(R"(<backup><include path="data/a"/><exclude path="data/a"/></backup>)");
  load(R"(<backup/>)");
  expect_no_rules();
}

TEST_F(PathRules, AnotherRootElementIsIgnored) {
  root_.file("data/a", "1");
  load(R"(<rules><exclude path="data/a"/></rules>)");
  expect_no_rules();
  EXPECT_EQ(count_logged(DLOG_ERROR, "root name rules error!\n"), 1);
}

TEST_F(PathRules, OtherTypesHaveTheirRulesElsewhere) {
  root_.file("data/a", "1");
  root_.file("res/backup.path.xml", R"(<backup><exclude path="data/a"/></backup>)");
  parse_backup_path_xml(kPackage, "wgt", root_.path().c_str());
  expect_no_rules();
  load(R"(<backup><exclude path="data/a"/></backup>)", "wgt");
  EXPECT_THAT(backup_exclude_list, ElementsAre(root_ / "data/a"));
}

TEST_F(PathRules, AnElementWithoutAPathIsSkipped) {
  root_.file("data/a", "1");
  load(R"(<backup><include/><exclude/><include other="data/a"/></backup>)");
  expect_no_rules();
  EXPECT_TRUE(takes("data/a"));
}

TEST_F(PathRules, WhatIsNotXmlIsIgnored) {
  root_.file("data/a", "1");
  for (const char *text : {"", "no xml", "<backup>", "<backup><exclude path=\"data/a\"></backup>",
                           "\xff\xfe\x01", "<backup><exclude path=data/a/></backup>"}) {
    clear_captured_log();
    load(text);
    expect_no_rules();
    EXPECT_EQ(count_logged(DLOG_ERROR, "Could not load xml file.\n"), 1) << text;
  }
}

TEST_F(PathRules, ADocumentWithoutARootIsIgnored) {
  const Fault fault("xmlDocGetRootElement", 0);
  load(R"(<backup/>)");
  EXPECT_EQ(count_logged(DLOG_ERROR, "empty document.\n"), 1);
}

TEST_F(PathRules, EntitiesThatExpandAreRefusedQuickly) {
  root_.file("data/a", "1");
  std::string xml = "<!DOCTYPE backup [<!ENTITY a0 \"data/aaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaa\">";
  for (int i = 1; i < 12; ++i) {
    xml += "<!ENTITY a" + std::to_string(i) + " \"";
    for (int j = 0; j < 12; ++j) xml += "&a" + std::to_string(i - 1) + ";";
    xml += "\">";
  }
  xml += "]><backup><exclude path=\"&a11;\"/>&a11;<exclude path=\"data/a\"/></backup>";
  const auto begin = std::chrono::steady_clock::now();
  load(xml);
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(2));
  expect_no_rules();
  EXPECT_EQ(count_logged(DLOG_ERROR, "Could not load xml file.\n"), 1);
  expect_unusable("it needs entities");
}

TEST_F(PathRules, AHarmlessEntityIsRefusedToo) {
  root_.file("data/a", "1");
  for (const char *text :
       {R"(<!DOCTYPE backup [<!ENTITY d "data/a">]><backup><exclude path="&d;"/></backup>)",
        R"(<!DOCTYPE backup [<!ENTITY d "data/a">]><backup><exclude path="data/a"/></backup>)",
        R"(<!DOCTYPE backup [<!ELEMENT backup ANY><!ENTITY % d "x">]><backup/>)",
        R"(<!DOCTYPE backup [<!ENTITY d "data/a">]><backup><exclude path="&d;"></backup>)",
        R"(<!DOCTYPE backup SYSTEM "x.dtd"><backup><exclude path="&d;"/></backup>)"}) {
    clear_captured_log();
    load(text);
    expect_no_rules();
    expect_unusable("it needs entities");
  }
}

TEST_F(PathRules, OtherDeclarationsMakeNoDifference) {
  root_.file("data/a", "1");
  for (const char *declarations :
       {"[]", "[<!ELEMENT backup (include|exclude)*>]", "SYSTEM \"backup.dtd\" []",
        "[<!ATTLIST exclude path CDATA #REQUIRED>\n<!-- a remark --><?and so on?>]",
        "[<!NOTATION n SYSTEM \"n\">]"}) {
    load("<!DOCTYPE backup " + std::string(declarations) +
         "><backup><exclude path=\"data/a\"/></backup>");
    EXPECT_FALSE(takes("data/a")) << declarations;
    EXPECT_TRUE(backup_rules_usable()) << declarations;
  }
}

TEST_F(PathRules, WhatIsNoRulesFileLeavesARunUsable) {
  for (const char *text : {"<backup>", "<other/>", ""}) {
    load(text);
    EXPECT_EQ(backup_rules_state(), rules_state::ignored) << text;
    EXPECT_TRUE(backup_rules_usable()) << text;
  }
}

TEST_F(PathRules, AResetForgetsThatTheRulesCouldNotBeUsed) {
  load(R"(<!DOCTYPE backup [<!ENTITY d "x">]><backup/>)");
  EXPECT_FALSE(backup_rules_usable());
  reset_backup_path_info();
  EXPECT_TRUE(backup_rules_usable());
  load(R"(<!DOCTYPE backup [<!ENTITY d "x">]><backup/>)");
  parse_backup_path_xml(kPackage, "wgt", root_.path().c_str());
  EXPECT_TRUE(backup_rules_usable()) << "another package's, which has none";
}

TEST_F(PathRules, ExternalPartsAreNeverRead) {
  // a pipe without a writer would stop whoever opens it
  ASSERT_EQ(mkfifo((root_ / "pipe").c_str(), 0600), 0);
  const std::string pipe = root_ / "pipe";
  load("<!DOCTYPE backup SYSTEM \"" + pipe + "\"><backup/>");
  load("<!DOCTYPE backup [<!ENTITY % p SYSTEM \"" + pipe + "\"> %p;]><backup/>");
  load("<!DOCTYPE backup [<!ENTITY p SYSTEM \"" + pipe + "\">]><backup>&p;</backup>");
  expect_no_rules();
}

TEST_F(PathRules, TheNetworkIsNeverAsked) {
  const UniqueFd listener(socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK, 0));
  sockaddr_in address = loopback(0);
  socklen_t length = sizeof(address);
  ASSERT_EQ(bind(listener.get(), reinterpret_cast<sockaddr *>(&address), length), 0);
  ASSERT_EQ(listen(listener.get(), 1), 0);
  ASSERT_EQ(getsockname(listener.get(), reinterpret_cast<sockaddr *>(&address), &length), 0);
  const std::string url =
      "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port)) + "/backup.dtd";
  load("<!DOCTYPE backup SYSTEM \"" + url + "\"><backup/>");
  load("<!DOCTYPE backup [<!ENTITY % p SYSTEM \"" + url + "\"> %p;]><backup/>");
  load("<!DOCTYPE backup [<!ENTITY p SYSTEM \"" + url + "\">]><backup>&p;</backup>");
  expect_no_rules();
  EXPECT_EQ(accept(listener.get(), nullptr, nullptr), -1);
  EXPECT_EQ(errno, EAGAIN);
}

TEST_F(PathRules, AHugeFileIsNotParsed) {
  root_.file("data/a", "1");
  std::string xml = "<backup><exclude path=\"data/a\"/>";
  while (xml.size() < 300000) xml += "<other/>";
  load(xml + "</backup>");
  expect_no_rules();
  EXPECT_EQ(count_logged(DLOG_ERROR, "Could not load xml file.\n"), 1);
  expect_unusable("it is larger than 262144 bytes");
}

TEST_F(PathRules, ARulesFileThatIsALinkIsNotRead) {
  root_.file("elsewhere.xml", R"(<backup><include path="data/none"/></backup>)");
  root_.dir("res");
  root_.link("res/backup.path.xml", root_ / "elsewhere.xml");
  parse_backup_path_xml(kPackage, "tpk", root_.path().c_str());
  expect_no_rules();
}

TEST_F(PathRules, AReadErrorIsAMalformedFile) {
  root_.file("res/backup.path.xml", "<backup/>");
  const Fault fault("read", EIO);
  parse_backup_path_xml(kPackage, "tpk", root_.path().c_str());
  EXPECT_EQ(count_logged(DLOG_ERROR, "Could not load xml file.\n"), 1);
}

TEST_F(PathRules, AChildLiesBelowAParentWithASlash) {
  EXPECT_TRUE(is_child_file("/a/", "/a/b"));
  EXPECT_TRUE(is_child_file("/a/", "/a/"));
  EXPECT_FALSE(is_child_file("/a", "/a/b"));
  EXPECT_FALSE(is_child_file("/a/", "/ab"));
  EXPECT_FALSE(is_child_file("", "/a"));
}

TEST_F(PathRules, BelongToOneThread) {
  root_.file("data/a", "1");
  load(R"(<backup><exclude path="data/a"/></backup>)");
  bool taken_elsewhere = false;
  std::thread([&] { taken_elsewhere = takes("data/a"); }).join();
  EXPECT_TRUE(taken_elsewhere);
  EXPECT_FALSE(takes("data/a"));
}

/* ---- size ------------------------------------------------------------------- */

TEST_F(PathRules, AMissingDirectoryCountsAsTooLarge) {
  EXPECT_EQ(size(), 26214401U);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : cannot open this path " + root_ / "data"), 1);
}

TEST_F(PathRules, ASubdirectoryThatCannotBeOpenedMakesTheWholeTooLarge) {
  root_.file("data/a", "12");
  root_.dir("data/sub");
  const Fault fault("openat", EIO);
  EXPECT_EQ(size(), 26214403U);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : cannot open this path " + root_ / "data/sub"), 1);
}

TEST_F(PathRules, TheSizeLeavesOutTheDaemonsOwnFiles) {
  root_.file("shared/data/org.example.notes_upload.zip", "12345");
  root_.file("shared/data/org.example.notes_download.zip", "12345");
  root_.file("shared/data/quarn_tmp_rst_dir/data/a", "12345");
  root_.file("shared/data/quarn_tmp_rst_dir2", "12345");
  root_.file("shared/data/own", "1");
  root_.file("shared/data/sub/org.example.notes_upload.zip", "12");
  EXPECT_EQ(get_dir_backup_size((root_ / "shared/data").c_str(), kPackage, root_.path().c_str()),
            3U);
}

TEST_F(PathRules, TheSizeLeavesOutWhatIsNotAFile) {
  root_.file("data/a", "12");
  ASSERT_EQ(mkfifo((root_ / "data/pipe").c_str(), 0600), 0);
  EXPECT_EQ(size(), 2U);
  EXPECT_EQ(count_logged(DLOG_ERROR, "this is unexpected type : " + root_ / "data/pipe"), 1);
}

TEST_F(PathRules, TheSizeLeavesOutWhatCannotBeStatted) {
  root_.file("data/a", "12");
  const Fault fault("fstatat", EIO);
  EXPECT_EQ(size(), 0U);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : lstat for -1 " + root_ / "data/a"), 1);
}

TEST_F(PathRules, ALargeSizeIsNotCutOff) {
  const auto file = root_.file("data/a", "");
  ASSERT_EQ(truncate(file.c_str(), 6LL << 30), 0);
  EXPECT_EQ(size(), 6ULL << 30);
}

}  // namespace
