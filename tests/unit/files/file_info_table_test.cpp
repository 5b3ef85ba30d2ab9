#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json-c/json.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <string>

#include "fault.h"
#include "json_ptr.h"
#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/file_info_table.h"
#include "temp_dir.h"

namespace {

using ::testing::_;
using ::testing::NiceMock;
using ::testing::Return;
using ::testing::StrEq;

struct ReleaseTable {
  void operator()(file_info_table_h *table) const { release_file_info_table(table); }
};

class FileInfoTable : public ::testing::Test {
 protected:
  void SetUp() override {
    file_info_table_h *table = nullptr;
    ready_file_info_table(&table);
    table_.reset(table);
    ASSERT_NE(table_, nullptr);
    label_everything("App::Label");
    clear_captured_log();
  }

  void label_everything(const char *text) {
    const auto give = [text](const char *, char **label, smack_label_type) {
      *label = strdup(text);
      return 0;
    };
    ON_CALL(platform_, smack_getlabel).WillByDefault(give);
    ON_CALL(platform_, smack_lgetlabel).WillByDefault(give);
  }

  int add(const std::string &path) {
    struct stat status = {};
    EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
    int error = 0;
    if (S_ISLNK(status.st_mode)) {
      add_sym_info_to_file_info_table(table_.get(), dir_.path().c_str(), path.c_str(), status,
                                      &error);
    } else {
      add_to_file_info_table(table_.get(), dir_.path().c_str(), path.c_str(), status, &error);
    }
    return error;
  }

  std::string text() const { return json_object_get_string(table_->root); }

  TempDir dir_;
  NiceMock<MockPlatform> platform_;
  std::unique_ptr<file_info_table_h, ReleaseTable> table_;
};

TEST_F(FileInfoTable, OfAnEmptyApplicationHoldsTheEmptyLinkListOnly) {
  EXPECT_EQ(text(), R"({ "quarn_symbolic_info": [ ] })");
}

TEST_F(FileInfoTable, RecordsTheLowestTwelveModeBits) {
  const auto file = dir_.file("data/tool", "x");
  ASSERT_EQ(chmod(file.c_str(), 04755), 0);
  ASSERT_EQ(chown(file.c_str(), 5000, 5001), 0);
  ASSERT_EQ(chmod(file.c_str(), 04755), 0);
  EXPECT_EQ(add(file), 0);
  EXPECT_EQ(text(), R"({ "quarn_symbolic_info": [ ], "data\/tool": )"
                    R"({ "0": 2541, "1": 5000, "2": 5001, "3": "App::Label" } })");
}

TEST_F(FileInfoTable, KeepsTheOrderOfAddition) {
  EXPECT_EQ(add(dir_.file("data/z", "x")), 0);
  EXPECT_EQ(add(dir_.file("data/a", "x")), 0);
  EXPECT_EQ(add(dir_ / "data"), 0);
  const auto all = text();
  EXPECT_LT(all.find(R"("quarn_symbolic_info")"), all.find(R"("data\/z")"));
  EXPECT_LT(all.find(R"("data\/z")"), all.find(R"("data\/a")"));
  EXPECT_LT(all.find(R"("data\/a")"), all.find(R"("data":)"));
}

TEST_F(FileInfoTable, ASecondAdditionReplacesTheFirst) {
  const auto file = dir_.file("data/a", "x");
  ASSERT_EQ(chmod(file.c_str(), 0600), 0);
  EXPECT_EQ(add(file), 0);
  ASSERT_EQ(chmod(file.c_str(), 0640), 0);
  EXPECT_EQ(add(file), 0);
  EXPECT_EQ(json_object_object_length(table_->root), 2);
  EXPECT_NE(text().find("\"0\": 416"), std::string::npos);
  EXPECT_EQ(text().find("\"0\": 384"), std::string::npos);
}

TEST_F(FileInfoTable, ALabelThatCannotBeReadIsEmptyAndAnError) {
  const auto file = dir_.file("data/a", "x");
  EXPECT_CALL(platform_, smack_getlabel(StrEq(file), _, SMACK_LABEL_ACCESS)).WillOnce(Return(-7));
  EXPECT_EQ(add(file), QUARN_REFUSED);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : cannot get smack label of " + file + " (err=-7)"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : cannot get smack label of " + file), 1);
  EXPECT_NE(text().find(R"("3": "")"), std::string::npos);
}

TEST_F(FileInfoTable, TheErrorIsWrittenOnFailureOnly) {
  const auto file = dir_.file("data/a", "x");
  struct stat status = {};
  ASSERT_EQ(lstat(file.c_str(), &status), 0);
  int error = 5;
  add_to_file_info_table(table_.get(), dir_.path().c_str(), file.c_str(), status, &error);
  EXPECT_EQ(error, 5);
}

TEST_F(FileInfoTable, RecordsALinkAndItsOwnAttributes) {
  dir_.dir("data");
  const auto link = dir_.link("data/link", "../else where");
  ASSERT_EQ(lchown(link.c_str(), 5000, 5000), 0);
  EXPECT_CALL(platform_, smack_getlabel).Times(0);
  EXPECT_CALL(platform_, smack_lgetlabel(StrEq(link), _, SMACK_LABEL_ACCESS)).Times(1);
  EXPECT_EQ(add(link), 0);
  EXPECT_EQ(text(), R"({ "quarn_symbolic_info": [ { "real_name": "data\/link", )"
                    R"("lnk": "..\/else where", )"
                    R"("perm": { "0": 511, "1": 5000, "2": 5000, "3": "App::Label" } } ] })");
  EXPECT_EQ(count_logged(DLOG_INFO, link + " -> ../else where"), 1);
}

TEST_F(FileInfoTable, ALinksMissingLabelIsAnError) {
  const auto link = dir_.link("link", "x");
  ON_CALL(platform_, smack_lgetlabel).WillByDefault(Return(-1));
  EXPECT_EQ(add(link), QUARN_REFUSED);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : cannot get smack label of " + link), 1);
  EXPECT_NE(text().find(R"("3": "")"), std::string::npos);
}

TEST_F(FileInfoTable, ATargetMayHave1023Bytes) {
  const std::string longest(1023, 'x');
  EXPECT_EQ(add(dir_.link("longest", longest)), 0);
  EXPECT_NE(text().find(longest), std::string::npos);
  const auto link = dir_.link("longer", longest + "x");
  EXPECT_EQ(add(link), QUARN_REFUSED);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : symlink of " + link + " is too long"), 1);
  EXPECT_EQ(text().find("longer"), std::string::npos);
}

TEST_F(FileInfoTable, ALinkThatIsGoneIsAnErrorAndNotRecorded) {
  const auto link = dir_.link("link", "x");
  struct stat status = {};
  ASSERT_EQ(lstat(link.c_str(), &status), 0);
  ASSERT_EQ(unlink(link.c_str()), 0);
  int error = 0;
  add_sym_info_to_file_info_table(table_.get(), dir_.path().c_str(), link.c_str(), status, &error);
  EXPECT_EQ(error, QUARN_REFUSED);
  EXPECT_EQ(count_logged(DLOG_ERROR, "error : cannot read symbolic info of " + link), 1);
  EXPECT_EQ(text(), R"({ "quarn_symbolic_info": [ ] })");
}

TEST_F(FileInfoTable, NamesWithQuotesAndControlsSurvive) {
  const std::string name = "data/a\"b\\c\nd\te\x01";
  EXPECT_EQ(add(dir_.file(name, "x")), 0);
  const JsonPtr parsed(json_tokener_parse(text().c_str()));
  ASSERT_NE(parsed, nullptr);
  json_object *value = nullptr;
  EXPECT_TRUE(json_object_object_get_ex(parsed.get(), name.c_str(), &value));
}

TEST_F(FileInfoTable, IsSavedAndReleased) {
  EXPECT_EQ(add(dir_.file("data/a", "x")), 0);
  const auto expected = text();
  EXPECT_EQ(save_file_info_table(table_.get(), (dir_ / "out/table.perm").c_str()), QUARN_OK);
  EXPECT_EQ(read_text(dir_ / "out/table.perm"), expected);
  EXPECT_EQ(table_->root, nullptr);
  // nothing left to save
  EXPECT_EQ(save_file_info_table(table_.get(), (dir_ / "out/x").c_str()), QUARN_BAD_ARGUMENT);
}

TEST_F(FileInfoTable, SavingTellsAFailure) {
  EXPECT_EQ(save_file_info_table(table_.get(), dir_.dir("dir").c_str()), QUARN_REFUSED);
}

TEST_F(FileInfoTable, IsNullWhenItCannotBeMade) {
  const Fault fault("json_object_new_object", 0);
  file_info_table_h *table = table_.get();
  ready_file_info_table(&table);
  EXPECT_EQ(table, nullptr);
  release_file_info_table(nullptr);
}

}  // namespace
