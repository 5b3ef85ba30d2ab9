#include "core/config.h"

#include <glib.h>
#include <sys/stat.h>

#include <filesystem>

#include "harness.h"

using namespace harness;
using transport::Config;
using transport::ConfigFile;

namespace {

TEST(ConfigFileTest, ReadsTheGroup) {
  const TempDir dir;
  write_file(dir / "c",
             "[cloud]\nurl=webdav+https://h/p\nuser=u\npassword=p w\nca-file=/ca\nregion=r\n"
             "addressing=virtual\n");
  ConfigFile file(dir / "c");
  ASSERT_TRUE(file.refresh());
  EXPECT_TRUE(file.problem().empty());
  EXPECT_TRUE((file.config() == Config{"webdav+https://h/p", "u", "p w", "/ca", "r", "virtual"}));
}

TEST(ConfigFileTest, PasswordDemandsMode0600) {
  const TempDir dir;
  for (const mode_t mode : {0644U, 0640U, 0604U, 0660U, 0601U}) {
    write_file(dir / "c", "[cloud]\nurl=webdav+https://h/\nuser=u\npassword=secret\n", mode);
    ConfigFile file(dir / "c");
    EXPECT_FALSE(file.refresh()) << std::oct << mode;
    EXPECT_EQ(file.problem(), (dir / "c") + ": holds a password and is not of mode 0600");
    EXPECT_TRUE(file.config().password.empty());
  }
  write_file(dir / "c", "[cloud]\nurl=webdav+https://h/\nuser=u\npassword=secret\n", 0600);
  ConfigFile file(dir / "c");
  EXPECT_TRUE(file.refresh());
  write_file(dir / "c", "[cloud]\nurl=file:///x\n", 0644);
  EXPECT_TRUE(file.refresh());
}

TEST(ConfigFileTest, ModeThatIsCorrectedIsNoticed) {
  const TempDir dir;
  write_file(dir / "c", "[cloud]\nurl=webdav+https://h/\npassword=secret\n", 0644);
  ConfigFile file(dir / "c");
  EXPECT_FALSE(file.refresh());
  ASSERT_EQ(chmod((dir / "c").c_str(), 0600), 0);
  EXPECT_TRUE(file.refresh());
}

TEST(ConfigFileTest, ProblemsNeverQuoteTheContent) {
  const TempDir dir;
  const std::pair<const char *, const char *> cases[] = {
      {"secret without a group", "not a key file"},
      {"[cloud]\nsecret line\n", "not a key file"},
      {"[cloud]\npassword=secret\n", "names no url"},
      {"[other]\nurl=file:///secret\n", "names no url"},
      {"", "names no url"},
  };
  for (const auto &[text, problem] : cases) {
    write_file(dir / "c", text);
    ConfigFile file(dir / "c");
    EXPECT_FALSE(file.refresh());
    EXPECT_EQ(file.problem(), (dir / "c") + ": " + problem);
  }
}

TEST(ConfigFileTest, ValuesAreLinesOfText) {
  const TempDir dir;
  const std::pair<const char *, const char *> cases[] = {
      {"url=file:///x\npassword=\xff\xfe", "password is not a line of UTF-8 text"},
      {"url=file:///x\npassword=a\\nb", "password is not a line of UTF-8 text"},
      {"url=file:///x\npassword=a\x01", "password is not a line of UTF-8 text"},
      {"url=file:///x\npassword=\\q", "password is not a line of UTF-8 text"},
      {"url=file:///x\nuser=a\\rb", "user is not a line of UTF-8 text"},
      {"url=file:///\\n", "url is not a line of UTF-8 text"},
  };
  for (const auto &[text, problem] : cases) {
    write_file(dir / "c", std::string("[cloud]\n") + text + "\n", 0600);
    ConfigFile file(dir / "c");
    EXPECT_FALSE(file.refresh()) << text;
    EXPECT_EQ(file.problem(), (dir / "c") + ": " + problem);
    EXPECT_TRUE(file.config().password.empty());
  }
  write_file(dir / "c", "[cloud]\nurl=file:///x\npassword= \\sp\xc3\xa4 \\\\#;=: \n", 0600);
  ConfigFile file(dir / "c");
  ASSERT_TRUE(file.refresh());
  EXPECT_EQ(file.config().password, " p\xc3\xa4 \\#;=: ");
}

TEST(ConfigFileTest, AbsentAndUnreadableFilesAreNamed) {
  const TempDir dir;
  ConfigFile absent(dir / "absent");
  EXPECT_FALSE(absent.refresh());
  EXPECT_EQ(absent.problem(), (dir / "absent") + ": No such file or directory");
  ConfigFile folder(dir.path());
  EXPECT_FALSE(folder.refresh());
  EXPECT_EQ(folder.problem(), dir.path() + ": not a readable configuration file");
  write_file(dir / "huge", "[cloud]\n#" + std::string(100000, 'x') + "\nurl=file:///x\n");
  ConfigFile huge(dir / "huge");
  EXPECT_FALSE(huge.refresh());
  EXPECT_EQ(huge.problem(), (dir / "huge") + ": not a readable configuration file");
}

TEST(ConfigFileTest, ReplacedFileIsReadAgain) {
  const TempDir dir;
  write_file(dir / "c", "[cloud]\nurl=file:///one\n");
  ConfigFile file(dir / "c");
  ASSERT_TRUE(file.refresh());
  write_file(dir / "d", "[cloud]\nurl=file:///two\n");
  std::filesystem::rename(dir / "d", dir / "c");
  ASSERT_TRUE(file.refresh());
  EXPECT_EQ(file.config().url, "file:///two");
  std::filesystem::remove(dir / "c");
  EXPECT_FALSE(file.refresh());
  write_file(dir / "c", "[cloud]\nurl=file:///six\n");
  ASSERT_TRUE(file.refresh());
  EXPECT_EQ(file.config().url, "file:///six");
}

TEST(ConfigFileTest, PathComesFromTheEnvironmentElseTheSystem) {
  setenv("QUARN_CLOUD_CONFIG", "/some/where", 1);
  EXPECT_EQ(ConfigFile::default_path(), "/some/where");
  setenv("QUARN_CLOUD_CONFIG", "", 1);
  EXPECT_EQ(ConfigFile::default_path(), "/etc/quarn/cloud.conf");
  unsetenv("QUARN_CLOUD_CONFIG");
  EXPECT_EQ(ConfigFile::default_path(), "/etc/quarn/cloud.conf");
}

}  // namespace
