#include "core/local_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "harness.h"

using namespace harness;
using transport::LocalSource;
using transport::LocalTarget;
using transport::open_local_parent;

namespace {

constexpr uid_t kApplication = 5000;

bool reaches(const std::string &path) {
  std::string name;
  return static_cast<bool>(open_local_parent(path, &name));
}

class LocalPath : public ::testing::Test {
 protected:
  LocalPath() {
    mkdir((dir / "real").c_str(), 0755);
    mkdir((dir / "app").c_str(), 0755);
    write_file(dir / "real/file", "x");
    EXPECT_EQ(chown((dir / "app").c_str(), kApplication, kApplication), 0);
  }
  TempDir dir;
};

TEST_F(LocalPath, WhatTheCallerHoldsIsSentWhateverItsNameHasBecome) {
  write_file(dir / "app/archive", "looked at");
  const int held = open((dir / "app/archive").c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(held, 0);
  ASSERT_EQ(unlink((dir / "app/archive").c_str()), 0);
  write_file(dir / "app/archive", "something else");
  LocalSource source;
  EXPECT_TRUE(source.open("/proc/self/fd/" + std::to_string(held)));
  close(held);
  char text[32] = {};
  EXPECT_EQ(read(source.fd(), text, sizeof text), 9);
  EXPECT_STREQ(text, "looked at");
}

TEST_F(LocalPath, NoOtherWayThroughADescriptorsNameIsTaken) {
  const int held = open((dir / "app").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(held, 0);
  const std::string name = "/proc/self/fd/" + std::to_string(held);
  LocalSource source;
  EXPECT_FALSE(source.open(name)) << "a folder";
  EXPECT_FALSE(source.open(name + "/file"));
  EXPECT_FALSE(source.open("/proc/self/fd/"));
  EXPECT_FALSE(source.open("/proc/self/cwd"));
  close(held);
  EXPECT_FALSE(source.open(name)) << "nothing is held any more";
}

TEST_F(LocalPath, PlainPathsAreReached) {
  EXPECT_TRUE(reaches(dir / "real/file"));
  EXPECT_TRUE(reaches(dir / "app/absent"));
  std::string name;
  EXPECT_TRUE(open_local_parent("relative", &name));
  EXPECT_EQ(name, "relative");
  EXPECT_TRUE(open_local_parent("/file", &name));
  EXPECT_EQ(name, "file");
}

TEST_F(LocalPath, NamesThatAreNoneAreRefused) {
  for (const char *path : {"", "/", "/tmp/", "/tmp/.", "/tmp/.."}) {
    errno = 0;
    EXPECT_FALSE(reaches(path)) << path;
    EXPECT_EQ(errno, EISDIR);
  }
}

TEST_F(LocalPath, LinkOfRootInADirectoryOfRootIsFollowed) {
  ASSERT_EQ(symlink("real", (dir / "link").c_str()), 0);
  ASSERT_EQ(symlink((dir / "real").c_str(), (dir / "absolute").c_str()), 0);
  ASSERT_EQ(symlink("./link/../link", (dir / "chain").c_str()), 0);
  EXPECT_TRUE(reaches(dir / "link/file"));
  EXPECT_TRUE(reaches(dir / "absolute/file"));
  EXPECT_TRUE(reaches(dir / "chain/./file"));
}

TEST_F(LocalPath, LinkOfAnApplicationIsNotFollowed) {
  ASSERT_EQ(symlink((dir / "real").c_str(), (dir / "theirs").c_str()), 0);
  ASSERT_EQ(lchown((dir / "theirs").c_str(), kApplication, kApplication), 0);
  EXPECT_FALSE(reaches(dir / "theirs/file"));
  EXPECT_EQ(errno, ELOOP);
}

TEST_F(LocalPath, LinkOfRootInADirectoryOfAnApplicationIsNotFollowed) {
  ASSERT_EQ(symlink((dir / "real").c_str(), (dir / "app/link").c_str()), 0);
  EXPECT_FALSE(reaches(dir / "app/link/file"));
  EXPECT_EQ(errno, ELOOP);
}

TEST_F(LocalPath, LinkInADirectoryThatOthersMayWriteIsNotFollowed) {
  ASSERT_EQ(symlink("real", (dir / "link").c_str()), 0);
  for (const mode_t mode : {0770U, 0707U}) {
    ASSERT_EQ(chmod(dir.path().c_str(), mode), 0);
    EXPECT_FALSE(reaches(dir / "link/file"));
    EXPECT_EQ(errno, ELOOP);
  }
}

TEST_F(LocalPath, CircleOfLinksEnds) {
  ASSERT_EQ(symlink("two", (dir / "one").c_str()), 0);
  ASSERT_EQ(symlink("one", (dir / "two").c_str()), 0);
  EXPECT_FALSE(reaches(dir / "one/file"));
  EXPECT_EQ(errno, ELOOP);
}

TEST_F(LocalPath, FileOrNothingOnTheWayIsNoDirectory) {
  ASSERT_EQ(symlink("real", (dir / "link").c_str()), 0);
  EXPECT_FALSE(reaches(dir / "link/file/x"));
  EXPECT_EQ(errno, ENOTDIR);
  EXPECT_FALSE(reaches(dir / "link/absent/x"));
  EXPECT_EQ(errno, ENOENT);
}

TEST_F(LocalPath, SourceNoticesThatItChanged) {
  LocalSource source;
  ASSERT_TRUE(source.open(dir / "real/file"));
  EXPECT_EQ(source.size(), 1U);
  EXPECT_TRUE(source.unchanged());
  write_file(dir / "real/file", "longer");
  EXPECT_FALSE(source.unchanged());
}

TEST_F(LocalPath, TargetStaysInTheDirectoryThatWasFound) {
  mkdir((dir / "app/data").c_str(), 0755);
  LocalTarget target;
  ASSERT_TRUE(target.open(dir / "app/data/file"));
  ASSERT_EQ(rename((dir / "app/data").c_str(), (dir / "app/moved").c_str()), 0);
  ASSERT_EQ(symlink((dir / "real").c_str(), (dir / "app/data").c_str()), 0);
  ASSERT_TRUE(target.begin());
  ASSERT_EQ(write(target.fd(), "new", 3), 3);
  ASSERT_TRUE(target.sync());
  ASSERT_TRUE(target.publish());
  EXPECT_EQ(read_file(dir / "real/file"), "x");
  EXPECT_EQ(read_file(dir / "app/moved/file"), "new");
}

TEST_F(LocalPath, TargetThatIsGivenUpLeavesNothing) {
  for (const bool nameless : {true, false}) {
    transport::StagedFile::set_nameless_allowed(nameless);
    LocalTarget target;
    ASSERT_TRUE(target.open(dir / "app/file"));
    ASSERT_TRUE(target.begin());
    ASSERT_EQ(write(target.fd(), "half", 4), 4);
    target.discard();
    ASSERT_TRUE(target.begin());
  }
  transport::StagedFile::set_nameless_allowed(true);
  EXPECT_EQ(tree(dir / "app").size(), 0U);
}

}  // namespace
