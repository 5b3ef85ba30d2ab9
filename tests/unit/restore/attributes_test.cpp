#include <linux/capability.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "quarn_common.h"
#include "quarn_d_restore/attributes.h"
#include "restore_fixture.h"

using ::testing::_;
using ::testing::Return;

namespace {

class AttributesTest : public RestoreTest {
 protected:
  struct stat status_of(const std::string &path) const {
    struct stat status = {};
    EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
    return status;
  }
  int mode_of(const std::string &path) const {
    return static_cast<int>(status_of(path).st_mode & 07777);
  }
  /** Restore @p name by a table that holds one entry for it, written as JSON text. */
  int restore(const std::string &name, const std::string &entry) {
    const JsonPtr table(json_tokener_parse(("{\"" + name + "\": " + entry + "}").c_str()));
    EXPECT_NE(table, nullptr);
    return restore_file_info(at(name).c_str(), kPkg, root.c_str(), table.get());
  }
};

TEST_F(AttributesTest, ReadsAllFourMembers) {
  const JsonPtr table(
      json_tokener_parse(R"({"data/a": {"0": 2541, "1": 4294967294, "2": 7, "3": "lab"}})"));
  int mode = 0;
  unsigned int uid = 0;
  unsigned int gid = 0;
  char *label = nullptr;
  EXPECT_EQ(get_file_info_from_backup(table.get(), kPkg, root.c_str(), at("data/a").c_str(), &mode,
                                      &uid, &gid, &label),
            0);
  EXPECT_EQ(mode, 04755);
  EXPECT_EQ(uid, 4294967294U);
  EXPECT_EQ(gid, 7U);
  EXPECT_STREQ(label, "lab");
}

TEST_F(AttributesTest, ATableThatIsNullYieldsNineteenWithAnError) {
  int mode = 0;
  unsigned int uid = 0;
  unsigned int gid = 0;
  char *label = nullptr;
  const std::string path = file("data/a", "x");
  EXPECT_EQ(get_file_info_from_backup(nullptr, kPkg, root.c_str(), path.c_str(), &mode, &uid, &gid,
                                      &label),
            19);
  expect_error("file info for " + path + " not exist...");
  EXPECT_EQ(restore_file_info(path.c_str(), kPkg, root.c_str(), nullptr), 0);
}

TEST_F(AttributesTest, APathThatIsNotInTheTableYieldsZeroWithOnlyAnInfoMessage) {
  const std::string path = file("data/a", "x", 0640);
  EXPECT_EQ(restore("data/b", R"({"0": 1, "1": 1, "2": 1, "3": "x"})"), 0);
  clear_captured_log();
  const JsonPtr table(json_tokener_parse("{}"));
  EXPECT_EQ(restore_file_info(path.c_str(), kPkg, root.c_str(), table.get()), 0);
  EXPECT_EQ(captured_texts(), std::vector<std::string>{"cannot get file info : " + path});
  expect_info("cannot get file info : " + path);
  EXPECT_EQ(mode_of(path), 0640);
}

TEST_F(AttributesTest, APathNoLongerThanTheRootIsNotInTheTable) {
  const JsonPtr table(json_tokener_parse("{}"));
  EXPECT_EQ(restore_file_info(root.c_str(), kPkg, root.c_str(), table.get()), 0);
  expect_info("cannot get file info : " + root);
}

TEST_F(AttributesTest, EachMissingMemberIsAnErrorAndTheModeStays) {
  const struct {
    const char *entry;
    const char *message;
  } cases[] = {
      {R"({"1": 5000, "2": 5000, "3": "x"})", "cannot get permission info..."},
      {R"({"0": 448, "2": 5000, "3": "x"})", "cannot get uid info..."},
      {R"({"0": 448, "1": 5000, "3": "x"})", "cannot get gid info..."},
      {R"({"0": 448, "1": 5000, "2": 5000})", "cannot get smack info..."},
      {R"({"0": "448", "1": 5000, "2": 5000, "3": "x"})", "cannot get permission info..."},
      {R"({"0": 448, "1": "a", "2": 5000, "3": "x"})", "cannot get uid info..."},
      {R"({"0": 448, "1": 5000, "2": null, "3": "x"})", "cannot get gid info..."},
      {R"({"0": 448, "1": 5000, "2": 5000, "3": 4})", "cannot get smack info..."},
      {R"({"0": 448, "1": 5000, "2": 5000, "3": ["x"]})", "cannot get smack info..."},
      {R"("text")", "cannot get permission info..."},
  };
  const std::string path = file("data/a", "x", 0640);
  for (const auto &one : cases) {
    clear_captured_log();
    EXPECT_EQ(restore("data/a", one.entry), 0) << one.entry;
    expect_error(one.message);
    EXPECT_EQ(mode_of(path), 0640) << one.entry;
  }
}

TEST_F(AttributesTest, AnEmptyLabelGetsModeAndOwnerAndThenFails) {
  const std::string path = file("data/a", "x", 0640);
  ASSERT_EQ(chown(path.c_str(), kAppUid, 0), 0);
  EXPECT_EQ(restore("data/a", R"({"0": 384, "1": 0, "2": 0, "3": ""})"), 0);
  expect_error("error : there isn't smack info of " + path);
  EXPECT_EQ(mode_of(path), 0600);
  EXPECT_EQ(status_of(path).st_uid, 5000U);
  EXPECT_EQ(status_of(path).st_gid, 5000U);
}

TEST_F(AttributesTest, AnyStoredOwnerYieldsTheApplicationUser) {
  for (const char *owner : {"0", "1000", "5001"}) {
    const std::string path = file("data/a", "x");
    ASSERT_EQ(chown(path.c_str(), kAppUid, 0), 0);
    const std::string id = owner;
    EXPECT_EQ(
        restore("data/a", R"({"0": 420, "1": )" + id + R"(, "2": )" + id + R"(, "3": "app.data"})"),
        1);
    EXPECT_EQ(status_of(path).st_uid, 5000U);
    EXPECT_EQ(status_of(path).st_gid, 5000U);
  }
}

TEST_F(AttributesTest, AnEqualLabelSucceedsWithoutTheSecurityServer) {
  EXPECT_CALL(platform, security_server_label_access).Times(0);
  file("data/a", "x");
  EXPECT_EQ(restore("data/a", R"({"0": 420, "1": 5000, "2": 5000, "3": "app.data"})"), 1);
  EXPECT_TRUE(captured_texts().empty());
}

TEST_F(AttributesTest, AKnownExceptionLabelIsWrittenThroughTheSecurityServer) {
  for (const std::string label : {"wrt::db_origin", "org.example.notes.native"}) {
    clear_captured_log();
    const std::string path = file("data/a", "x");
    EXPECT_EQ(restore("data/a", R"({"0": 420, "1": 5000, "2": 5000, "3": ")" + label + "\"}"), 1);
    EXPECT_EQ(label_of(path), label);
    EXPECT_EQ(relabelled.back(), path);
    expect_info("OK : smack label of " + path + " is known exception label");
    expect_info("smack label setted for " + path);
  }
}

TEST_F(AttributesTest, AnotherPackagesNativeLabelIsRefused) {
  EXPECT_CALL(platform, security_server_label_access).Times(0);
  const std::string path = file("data/a", "x");
  EXPECT_EQ(restore("data/a", R"({"0": 420, "1": 1, "2": 1, "3": "org.example.other.native"})"), 0);
  expect_error("Critical! : smack label org.example.other.native of " + path +
               " is unknown exception label");
  expect_error("fail : unknown smack label...");
  EXPECT_EQ(label_of(path), kDataLabel);
}

TEST_F(AttributesTest, ASecurityServerThatRefusesTheLabelIsAFailure) {
  label_result = -2;
  file("data/a", "x");
  EXPECT_EQ(restore("data/a", R"({"0": 420, "1": 1, "2": 1, "3": "wrt::db_origin"})"), 0);
  expect_error("fail : security_server_label_access...(err=-2)");
}

TEST_F(AttributesTest, ALabelThatCannotBeReadIsAFailure) {
  ON_CALL(platform, smack_getlabel).WillByDefault(Return(-5));
  const std::string path = file("data/a", "x");
  EXPECT_EQ(restore("data/a", R"({"0": 420, "1": 1, "2": 1, "3": "app.data"})"), 0);
  expect_error("error : cannot get smack label of " + path + " (err=-5)");
}

TEST_F(AttributesTest, SetIdBitsSurviveTheChangeOfOwner) {
  const std::string path = file("data/tool", "x", 0700);
  ASSERT_EQ(chown(path.c_str(), kAppUid, 0), 0);
  EXPECT_EQ(restore("data/tool", R"({"0": 3565, "1": 0, "2": 0, "3": "app.data"})"), 1);
  EXPECT_EQ(mode_of(path), 06755);
  EXPECT_EQ(status_of(path).st_uid, 5000U);
}

TEST_F(AttributesTest, AFileThatIsGoneFailsAtItsMode) {
  EXPECT_EQ(restore("data/gone", R"({"0": 420, "1": 1, "2": 1, "3": "app.data"})"), 0);
  expect_error("chmod failed");
}

TEST_F(AttributesTest, ALinkIsNeverFollowed) {
  const std::string outside_file = base + "/outside";
  write_text(outside_file, "secret");
  ASSERT_EQ(chmod(outside_file.c_str(), 0600), 0);
  std::filesystem::create_symlink(outside_file, at("data/a"));
  EXPECT_EQ(restore("data/a", R"({"0": 511, "1": 1, "2": 1, "3": "wrt::db_origin"})"), 0);
  expect_error("chmod failed");
  EXPECT_EQ(mode_of(outside_file), 0600);
  EXPECT_EQ(status_of(outside_file).st_uid, 0U);
  EXPECT_EQ(label_of(outside_file), kFloorLabel);
}

TEST_F(AttributesTest, AFileWithAnotherNameElsewhereIsLeftAsItIs) {
  const std::string secret = file("elsewhere", "root's");
  ASSERT_EQ(chown(secret.c_str(), 0, 0), 0);
  ASSERT_EQ(chmod(secret.c_str(), 0600), 0);
  std::filesystem::create_directories(at("data"));
  ASSERT_EQ(link(secret.c_str(), at("data/a").c_str()), 0);
  EXPECT_EQ(restore("data/a", R"({"0": 438, "1": 0, "2": 0, "3": "App::Label"})"), 0);
  expect_error("refused : " + at("data/a") + " is a link to a file elsewhere");
  EXPECT_EQ(mode_of(secret), 0600);
  EXPECT_EQ(status_of(secret).st_uid, 0U);
}

TEST_F(AttributesTest, AnOwnerThatCannotBeSetIsAFailureAfterTheMode) {
  const std::string path = file("data/a", "x", 0640);
  ASSERT_EQ(chown(path.c_str(), kAppUid, 0), 0);
  const WithoutCapabilities none({CAP_CHOWN});
  EXPECT_EQ(restore("data/a", R"({"0": 384, "1": 1, "2": 1, "3": "app.data"})"), 0);
  expect_error("chown: error \n");
  EXPECT_EQ(mode_of(path), 0600);
}

TEST_F(AttributesTest, KnownExceptionLabels) {
  EXPECT_EQ(is_known_exception_label("/p", "wrt::db_origin", kPkg), 1);
  EXPECT_EQ(is_known_exception_label("/p", "org.example.notes.native", kPkg), 1);
  EXPECT_EQ(is_known_exception_label("/p", "org.example.notes", kPkg), 0);
  EXPECT_EQ(is_known_exception_label("/p", "", kPkg), 0);
  expect_info("OK : smack label of /p is known exception label", 2);
  expect_error("Critical! : smack label org.example.notes of /p is unknown exception label");
}

}  // namespace
