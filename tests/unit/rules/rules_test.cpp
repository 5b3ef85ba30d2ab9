#include "rules.h"

#include <gtest/gtest.h>
#include <json-c/json.h>
#include <libxml/xmlschemas.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "files/safe_path.h"
#include "files/tree_depth.h"
#include "mock_platform.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/path_rules.h"
#include "rules/rules_file.h"
#include "temp_dir.h"

namespace {

namespace fs = std::filesystem;

class Rules : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const char *folder : {"data/cache", "shared/data", "shared/trusted", "res"}) {
      fs::create_directories(root_ + "/" + folder);
    }
    write("data/keep.db", "12345");
    write("data/cache/tile", "123");
  }

  void write(const std::string &path, const std::string &text) {
    write_text(root_ + "/" + path, text);
  }
  void rules(const std::string &xml) { write("res/backup.path.xml", xml); }
  rules_report check(const std::string &type = "tpk") {
    return check_rules("org.example.app", type, root_);
  }
  static const rule_entry &entry(const rules_report &report, const std::string &path) {
    for (const rule_entry &one : report.entries) {
      if (one.path == path) return one;
    }
    ADD_FAILURE() << "no entry " << path;
    static const rule_entry none;
    return none;
  }
  static std::vector<std::string> kinds(const rules_report &report) {
    std::vector<std::string> result;
    for (const rule_problem &problem : report.problems) result.push_back(problem.kind);
    return result;
  }

  ::testing::NiceMock<MockPlatform> platform_;
  const TempDir dir_;
  const std::string root_ = dir_.path();
};

TEST_F(Rules, WithoutAFileEverythingIsIn) {
  const rules_report report = check();
  EXPECT_EQ(report.file, "");
  EXPECT_TRUE(entry(report, "data/keep.db").in);
  EXPECT_TRUE(entry(report, "data/cache/tile").in);
  EXPECT_EQ(report.total, 8u);
  EXPECT_EQ(rules_exit_code(report), RULES_OK);
  EXPECT_NE(rules_text(report).find("no rules file, everything is backed up"), std::string::npos);
}

TEST_F(Rules, NamesTheElementThatDecided) {
  rules("<backup>\n<include path=\"data/\"/>\n<exclude path=\"/data/cache/\"/>\n</backup>");
  const rules_report report = check();
  const rule_entry &kept = entry(report, "data/keep.db");
  EXPECT_TRUE(kept.in);
  EXPECT_EQ(report.elements.at(kept.element).given, "data/");
  const rule_entry &cached = entry(report, "data/cache/tile");
  EXPECT_FALSE(cached.in);
  EXPECT_EQ(report.elements.at(cached.element).line, 3);
  EXPECT_EQ(rules_exit_code(report), RULES_OK);
}

TEST_F(Rules, WarnsOfADirectoryWithoutATrailingSlash) {
  rules("<backup><exclude path=\"data/cache\"/></backup>");
  const rules_report report = check();
  EXPECT_TRUE(entry(report, "data/cache/tile").in);
  EXPECT_EQ(kinds(report), std::vector<std::string>{"no-trailing-slash"});
  EXPECT_EQ(rules_exit_code(report), RULES_PROBLEMS);
}

TEST_F(Rules, WarnsOfElementsThatMatchNothing) {
  rules("<backup><exclude path=\"data/gone/\"/><exclude path=\"shared/trusted/\"/></backup>");
  EXPECT_EQ(kinds(check()), (std::vector<std::string>{"nothing-there", "matches-nothing"}));
}

TEST_F(Rules, AnElementMatchesWhateverAnotherOneDecided) {
  rules(
      "<backup><exclude path=\"data/cache/\"/><exclude path=\"data/cache/tile\"/>"
      "<include path=\"data/\"/><include path=\"data/keep.db\"/></backup>");
  EXPECT_TRUE(check().problems.empty());
}

TEST_F(Rules, AnIncludeOfWhatIsAllExcludedIsNamed) {
  rules("<backup><include path=\"data/cache/\"/><exclude path=\"data/cache/tile\"/></backup>");
  const rules_report report = check();
  EXPECT_EQ(kinds(report), std::vector<std::string>{"all-excluded"});
  EXPECT_EQ(report.problems[0].text,
            "include \"data/cache/\" has no effect: all that it covers is excluded");
}

TEST_F(Rules, AnIncludeThatDoesNotExistLeavesEverythingOut) {
  rules("<backup><include path=\"data/gone\"/></backup>");
  const rules_report report = check();
  EXPECT_FALSE(entry(report, "data/keep.db").in);
  EXPECT_EQ(report.total, 0u);
  EXPECT_NE(rules_text(report).find("no include covers it"), std::string::npos);
}

TEST_F(Rules, ARootElementWithTheWrongNameIsUnusable) {
  rules("<backups><exclude path=\"data/\"/></backups>");
  const rules_report report = check();
  EXPECT_EQ(kinds(report), std::vector<std::string>{"root-element"});
  EXPECT_TRUE(entry(report, "data/keep.db").in);
  EXPECT_EQ(rules_exit_code(report), RULES_UNUSABLE);
}

TEST_F(Rules, AMalformedFileIsUnusable) {
  rules("<backup><exclude");
  EXPECT_EQ(kinds(check()), std::vector<std::string>{"malformed"});
  EXPECT_EQ(rules_exit_code(check()), RULES_UNUSABLE);
}

TEST_F(Rules, WhyOfAFileWhoseRulesAreIgnoredSaysSo) {
  rules("<backup><exclude");
  EXPECT_NE(rules_text(check()).find("the rules file is ignored"), std::string::npos);
  int code = -1;
  EXPECT_EQ(explain_rules(check(), "data/keep.db", false, &code),
            "data/keep.db: in (the rules file is ignored)\n");
}

TEST_F(Rules, ARulesFileThatIsNoFileIsUnusable) {
  write("rules.xml", "<backup/>");
  fs::create_symlink("../rules.xml", root_ + "/res/backup.path.xml");
  const rules_report link = check();
  EXPECT_TRUE(link.ignored);
  EXPECT_EQ(link.file, "res/backup.path.xml");
  EXPECT_EQ(kinds(link), std::vector<std::string>{"unreadable"});
  EXPECT_EQ(link.problems[0].text, "the rules file is no regular file: it is ignored");
  EXPECT_EQ(rules_exit_code(link), RULES_UNUSABLE);
  fs::remove(root_ + "/res/backup.path.xml");
  fs::create_directory(root_ + "/res/backup.path.xml");
  EXPECT_EQ(rules_exit_code(check()), RULES_UNUSABLE);
}

TEST_F(Rules, ADataDirectoryThatIsNoneIsUnreadable) {
  fs::rename(root_ + "/data", root_ + "/elsewhere");
  EXPECT_TRUE(check().problems.empty());
  fs::create_directory_symlink("elsewhere", root_ + "/data");
  EXPECT_EQ(kinds(check()), std::vector<std::string>{"unreadable"});
  fs::remove(root_ + "/data");
  write("data", "x");
  const rules_report report = check();
  EXPECT_EQ(kinds(report), std::vector<std::string>{"unreadable"});
  EXPECT_EQ(report.problems[0].path, "data");
  EXPECT_EQ(rules_exit_code(report), RULES_PROBLEMS);
}

TEST_F(Rules, AnInstalledPackageHasAllItsDataDirectories) {
  fs::remove_all(root_ + "/shared/trusted");
  EXPECT_TRUE(check_rules("org.example.app", "tpk", root_).problems.empty());
  EXPECT_EQ(kinds(check_rules("org.example.app", "tpk", root_, true)),
            std::vector<std::string>{"unreadable"});
}

TEST_F(Rules, ATreeThatIsTooDeepForTheDaemonIsUnreadable) {
  std::string path = root_ + "/data";
  for (int depth = 1; depth < kMaxDirDepth; ++depth) path += "/d";
  fs::create_directories(path);
  EXPECT_TRUE(check().problems.empty());
  fs::create_directories(path + "/d");
  EXPECT_EQ(kinds(check()), std::vector<std::string>{"unreadable"});
  EXPECT_GT(get_dir_backup_size((root_ + "/data").c_str(), "org.example.app", root_.c_str()),
            kMaxBackupSize);
}

using SchemaSource = Handle<xmlSchemaParserCtxt, &xmlSchemaFreeParserCtxt>;
using Document = Handle<xmlDoc, &xmlFreeDoc>;
using Schema = Handle<xmlSchema, &xmlSchemaFree>;
using SchemaCheck = Handle<xmlSchemaValidCtxt, &xmlSchemaFreeValidCtxt>;

TEST(RulesSchema, TakesWhatTheCheckerHasNothingAgainst) {
  const SchemaSource source(xmlSchemaNewParserCtxt(QUARN_RULES_SCHEMA));
  const Schema schema(xmlSchemaParse(source.get()));
  ASSERT_TRUE(schema);
  const auto is_valid = [&](const std::string &text) {
    const Document document(
        xmlReadMemory(text.data(), static_cast<int>(text.size()), "rules", nullptr, 0));
    const SchemaCheck check(xmlSchemaNewValidCtxt(schema.get()));
    xmlSchemaSetValidStructuredErrors(
        check.get(), [](void *, auto *) {}, nullptr);
    return xmlSchemaValidateDoc(check.get(), document.get()) == 0;
  };
  EXPECT_TRUE(is_valid("<backup/>"));
  EXPECT_TRUE(
      is_valid("<backup>\n<exclude path=\"data/cache/\"/><!-- text -->"
               "<include path=\"data/\"/><exclude path=\"/data/a\"/></backup>"));
  EXPECT_FALSE(is_valid("<Backup/>"));
  EXPECT_FALSE(is_valid("<backup><include/></backup>"));
  EXPECT_FALSE(is_valid("<backup><skip path=\"data/\"/></backup>"));
}

TEST_F(Rules, ElementsWithoutPathAndUnknownOnesAreNamed) {
  rules("<backup><exclude/><skip path=\"data/\"/></backup>");
  EXPECT_EQ(kinds(check()), (std::vector<std::string>{"no-path", "unknown-element"}));
}

TEST_F(Rules, EveryFileIsDecidedAsTheDaemonDecides) {
  for (const char *path : {"data/a", "data/b/c", "data/b/d/e", "data/bc", "shared/data/f"}) {
    write(path, "x");
  }
  const std::vector<std::string> paths = {
      "data/",       "data",      "data/a",    "data/b",   "data/b/",
      "data/b/d",    "data/b/d/", "data/none", "/data/bc", "shared/",
      "shared/data", "data//b/",  "data/b/c/", "",         "/"};
  for (const std::string &one : paths) {
    for (const std::string &other : paths) {
      for (const char *kinds : {"ii", "ie", "ei", "ee"}) {
        const auto rule = [](char kind, const std::string &path) {
          return (kind == 'i' ? "<include path=\"" : "<exclude path=\"") + path + "\"/>";
        };
        rules("<backup>" + rule(kinds[0], one) + rule(kinds[1], other) + "</backup>");
        const rules_report report = check();
        parse_backup_path_xml("org.example.app", "tpk", root_.c_str());
        for (const rule_entry &entry : report.entries) {
          EXPECT_EQ(entry.in, is_backup_file((root_ + "/" + entry.path).c_str()))
              << kinds << " " << one << " " << other << ": " << entry.path;
        }
      }
    }
  }
  reset_backup_path_info();
}

TEST_F(Rules, OverTheCapShowsTheLargestFiles) {
  write("data/small.bin", "x");
  write("data/big.bin", "");
  fs::resize_file(root_ + "/data/big.bin", kMaxBackupSize);
  const rules_report report = check();
  EXPECT_EQ(rules_exit_code(report), RULES_OVER_CAP);
  const std::string text = rules_text(report);
  EXPECT_NE(text.find(" 26214409 bytes (25.0 MiB) of at most 26214400 (25.0 MiB)\n"),
            std::string::npos);
  EXPECT_NE(text.find("over the limit: the application would be skipped"), std::string::npos);
  EXPECT_NE(text.find("data/big.bin", text.find("largest files")), std::string::npos);
}

TEST_F(Rules, ExactlyTheCapIsAllowed) {
  fs::remove_all(root_ + "/data");
  fs::create_directories(root_ + "/data");
  write("data/big.bin", "");
  fs::resize_file(root_ + "/data/big.bin", kMaxBackupSize);
  EXPECT_EQ(rules_exit_code(check()), RULES_OK);
}

TEST_F(Rules, AFileAtTheOtherTypesPlaceIsNamed) {
  rules("<backup/>");
  EXPECT_EQ(kinds(check("wgt")), std::vector<std::string>{"wrong-place"});
}

TEST_F(Rules, ExplainsOnePath) {
  rules("<backup><exclude path=\"data/cache/\"/></backup>");
  int code = -1;
  EXPECT_EQ(explain_rules(check(), "data/cache/tile", false, &code),
            "data/cache/tile: out (exclude \"data/cache/\", line 1)\n");
  EXPECT_EQ(code, RULES_OK);
  EXPECT_EQ(explain_rules(check(), root_ + "/data/keep.db", false, &code),
            "data/keep.db: in (no rule speaks of it)\n");
  EXPECT_EQ(explain_rules(check(), "./data//cache/../keep.db", false, &code),
            "data/keep.db: in (no rule speaks of it)\n");
  explain_rules(check(), "data/none", false, &code);
  EXPECT_EQ(code, RULES_NO_INPUT);
}

TEST_F(Rules, JsonHoldsEveryEntryAndProblem) {
  rules("<backup><exclude path=\"data/cache/\"/><exclude path=\"nowhere\"/></backup>");
  json_object *document = json_tokener_parse(rules_json(check()).c_str());
  ASSERT_NE(document, nullptr);
  EXPECT_EQ(json_object_array_length(json_object_object_get(document, "entries")), 2u);
  EXPECT_EQ(json_object_array_length(json_object_object_get(document, "problems")), 1u);
  EXPECT_EQ(json_object_get_int(json_object_object_get(document, "exit")), RULES_PROBLEMS);
  json_object_put(document);
}

TEST_F(Rules, ControlCharactersOfNamesDoNotReachTheTerminal) {
  write("data/\033[31mred", "x");
  write(
      "data/\xc2\x9b"
      "31mred",
      "x");
  write("data/\xff", "x");
  const std::string text = rules_text(check());
  EXPECT_EQ(text.find('\033'), std::string::npos);
  EXPECT_NE(text.find("\\x1b[31mred"), std::string::npos);
  EXPECT_NE(text.find("\\u{9b}31mred"), std::string::npos);
  EXPECT_NE(text.find("data/\\xff"), std::string::npos);
}

TEST_F(Rules, JsonIsTextWhateverAFileIsCalled) {
  write("data/\xff", "x");
  const std::string text = rules_json(check());
  EXPECT_NE(text.find("\"data/\\ufffd\""), std::string::npos);
  EXPECT_EQ(text.find('\xff'), std::string::npos);
}

TEST_F(Rules, JsonHasWhatEveryVerbHas) {
  rules("<backup/>");
  EXPECT_EQ(rules_json(check()).find("{\"verb\":\"rules check\",\"package\":\"org.example.app\","),
            0u);
  EXPECT_NE(rules_json(check()).find("\"exit\":0,\"message\":\"success\"}\n"), std::string::npos);
  rules("<backups/>");
  EXPECT_NE(rules_json(check()).find("\"exit\":3,\"message\":\"the rules file is ignored\"}\n"),
            std::string::npos);
  int code = -1;
  EXPECT_EQ(explain_rules(check(), "data/keep.db", true, &code),
            "{\"verb\":\"rules explain\",\"package\":\"org.example.app\",\"path\":\"data/keep.db\","
            "\"type\":\"file\",\"size\":5,\"in\":true,\"rule\":null,\"exit\":0,"
            "\"message\":\"success\"}\n");
}

TEST_F(Rules, ErrorsAreToldOnStandardErrorAndAsEveryVerbsJson) {
  ON_CALL(platform_, package_manager_get_package_info)
      .WillByDefault(::testing::Return(PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE));
  ::testing::internal::CaptureStdout();
  ::testing::internal::CaptureStderr();
  EXPECT_EQ(rules_command({"check", "none"}, true), RULES_NO_INPUT);
  EXPECT_EQ(::testing::internal::GetCapturedStderr(),
            "quarnctl: \"none\" is neither a package source nor an installed package\n");
  EXPECT_EQ(::testing::internal::GetCapturedStdout(),
            "{\"verb\":\"rules check\",\"exit\":66,\"message\":\"\\\"none\\\" is neither a package "
            "source nor an installed package\"}\n");
}

TEST_F(Rules, FileOverTheDaemonsOwnLimitIsSaidToBlockEveryBackup) {
  const std::string element = "<backup><exclude path=\"data/cache/\"/></backup>";
  rules(element + std::string(kMaxRulesSize - element.size(), '\n'));
  EXPECT_FALSE(check().ignored);
  EXPECT_FALSE(entry(check(), "data/cache/tile").in);
  rules(element + std::string(kMaxRulesSize - element.size() + 1, '\n'));
  const rules_report report = check();
  EXPECT_TRUE(report.blocked);
  EXPECT_FALSE(report.ignored);
  EXPECT_FALSE(entry(report, "data/keep.db").in);
  EXPECT_EQ(kinds(report), std::vector<std::string>{"too-large"});
  EXPECT_EQ(rules_exit_code(report), RULES_UNUSABLE);
  EXPECT_NE(
      rules_text(report).find("it is larger than 262144 bytes: the application is not backed up"),
      std::string::npos);
  EXPECT_NE(rules_json(report).find("\"exit\":3,\"message\":\"the rules file cannot be used, so "
                                    "nothing is backed up\"}\n"),
            std::string::npos);
}

TEST_F(Rules, FileThatDefinesEntitiesBlocksEveryBackupAsInTheDaemon) {
  rules("<!DOCTYPE backup [<!ENTITY p \"data/cache/\">]><backup><exclude path=\"&p;\"/></backup>");
  const rules_report report = check();
  EXPECT_TRUE(report.blocked);
  EXPECT_FALSE(entry(report, "data/keep.db").in);
  EXPECT_EQ(kinds(report), std::vector<std::string>{"entities"});
  EXPECT_EQ(rules_exit_code(report), RULES_UNUSABLE);
}

TEST_F(Rules, FileWithOtherDeclarationsOfItsOwnIsARulesFile) {
  rules(
      "<!DOCTYPE backup [<!ELEMENT backup ANY><!-- none -->]>"
      "<backup><exclude path=\"data/cache/\"/></backup>");
  const rules_report report = check();
  EXPECT_FALSE(report.blocked);
  EXPECT_FALSE(report.ignored);
  EXPECT_FALSE(entry(report, "data/cache/tile").in);
}

TEST_F(Rules, CommandReadsASource) {
  write("package.ini", "[package]\nid=org.example.app\nversion=1\ntype=tpk\n");
  EXPECT_EQ(rules_command({"check", root_}, true), RULES_OK);
  EXPECT_EQ(rules_command({"explain", root_, "data/keep.db"}, true), RULES_OK);
  EXPECT_EQ(rules_command({"check"}, true), 64);
}

TEST_F(Rules, CommandRefusesWhatIsNoPackage) {
  ON_CALL(platform_, package_manager_get_package_info)
      .WillByDefault(::testing::Return(PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE));
  EXPECT_EQ(rules_command({"check", "org.example.none"}, true), RULES_NO_INPUT);
  EXPECT_EQ(rules_command({"check", "../etc"}, true), RULES_NO_INPUT);
}

}  // namespace
