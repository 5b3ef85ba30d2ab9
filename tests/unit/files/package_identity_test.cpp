#include "quarn_d_utils/package_identity.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/fsuid.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <thread>
#include <vector>

#include "temp_dir.h"

namespace {

constexpr package_user kApp = {5000, 5000};
constexpr uid_t kOther = 1234;

uid_t present_user() { return static_cast<uid_t>(setfsuid(static_cast<uid_t>(-1))); }

std::uint32_t effective_capabilities() {
  __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[2] = {};
  syscall(SYS_capget, &header, data);
  return data[0].effective;
}

/** A package's folder, the application's own, beside one that only root may enter. */
class PackageIdentity : public ::testing::Test {
 protected:
  void SetUp() override {
    give("data", 0755, kApp.uid);
    give("root", 0700, 0);
    dir_.file("root/secret", "secret");
    ASSERT_EQ(chmod((dir_ / "root/secret").c_str(), 0600), 0);
    open_folder("data");
  }
  void TearDown() override { EXPECT_EQ(present_user(), 0U); }

  void give(const std::string &name, mode_t mode, uid_t owner) const {
    dir_.dir(name);
    own(name, mode, owner);
  }
  void own(const std::string &name, mode_t mode, uid_t owner) const {
    ASSERT_EQ(chown((dir_ / name).c_str(), owner, owner), 0);
    ASSERT_EQ(chmod((dir_ / name).c_str(), mode), 0);
  }
  void file(const std::string &name, mode_t mode, uid_t owner) const {
    dir_.file(name, name);
    own(name, mode, owner);
  }
  void hard_link(const std::string &from, const std::string &to) const {
    ASSERT_EQ(link((dir_ / from).c_str(), (dir_ / to).c_str()), 0);
  }
  void open_folder(const std::string &name) {
    folder_.reset(open((dir_ / name).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(folder_);
  }
  /** What can be read of @p name in the open folder; the error where nothing can. */
  std::string read_as_package(const char *name) const {
    struct stat status = {};
    const UniqueFd fd = open_as_package(folder_.get(), name, O_RDONLY, 0, kApp, &status);
    if (!fd) return std::strerror(errno);
    std::array<char, 256> text = {};
    const ssize_t count = read(fd.get(), text.data(), text.size());
    EXPECT_EQ(status.st_size, count);
    return {text.data(), static_cast<std::size_t>(count)};
  }
  struct stat status_of(const std::string &name) const {
    struct stat status = {};
    EXPECT_EQ(lstat((dir_ / name).c_str(), &status), 0) << name;
    return status;
  }

  const std::string kRefused = std::strerror(EACCES);
  TempDir dir_;
  UniqueFd folder_;
};

/* ---- the identity ------------------------------------------------------------ */

TEST_F(PackageIdentity, IsOfTheThreadAndOfTheTimeThatItLives) {
  {
    const ActAsPackage acting(kApp);
    EXPECT_TRUE(acting);
    EXPECT_EQ(present_user(), kApp.uid);
    EXPECT_EQ(geteuid(), 0U);
    {
      const ActAsPackage again(kApp);
      const ActAsRoot root;
      EXPECT_TRUE(root);
      EXPECT_EQ(present_user(), 0U);
    }
    EXPECT_EQ(present_user(), kApp.uid);
  }
  EXPECT_EQ(present_user(), 0U);
  std::thread([] { EXPECT_EQ(present_user(), 0U); }).join();
}

TEST_F(PackageIdentity, AThreadThatWasBegunAsThePackageKnowsIt) {
  const ActAsPackage acting(kApp);
  std::thread([] {
    EXPECT_EQ(present_user(), kApp.uid);
    { const ActAsRoot root; }
    EXPECT_EQ(present_user(), kApp.uid);
  }).join();
}

TEST_F(PackageIdentity, LabelsAreSetWithTheDaemonsRights) {
  file("data/file", 0600, kApp.uid);
  const ActAsPackage acting(kApp);
  const UniqueFd fd = open_as_package(folder_.get(), "file", O_RDONLY, 0, kApp, nullptr);
  ASSERT_TRUE(fd);
  EXPECT_EQ(fsetxattr(fd.get(), "security.quarn", "label", 5, 0), 0) << std::strerror(errno);
}

TEST_F(PackageIdentity, ANamelessFileIsThePackagesAndCanBeLinked) {
  const UniqueFd fd =
      open_as_package(folder_.get(), ".", O_WRONLY | O_TMPFILE, 0600, kApp, nullptr);
  ASSERT_TRUE(fd) << std::strerror(errno);
  const ActAsPackage acting(kApp);
  const std::string source = "/proc/self/fd/" + std::to_string(fd.get());
  EXPECT_EQ(linkat(AT_FDCWD, source.c_str(), folder_.get(), "new", AT_SYMLINK_FOLLOW), 0)
      << std::strerror(errno);
  EXPECT_EQ(status_of("data/new").st_uid, kApp.uid);
}

TEST_F(PackageIdentity, AFallbackLeavesNoRightBehind) {
  give("data/closed", 0555, kApp.uid);
  open_folder("data/closed");
  const ActAsPackage acting(kApp);
  const std::uint32_t before = effective_capabilities();
  EXPECT_EQ(before & (1U << CAP_DAC_OVERRIDE), 0U);
  EXPECT_EQ(mkdir_as_package(folder_.get(), "new", 0755, kApp), 0);
  EXPECT_EQ(effective_capabilities(), before);
}

/* ---- what is there ----------------------------------------------------------- */

TEST_F(PackageIdentity, AHardLinkToAFileOfRootsIsRefused) {
  hard_link("root/secret", "data/link");
  EXPECT_EQ(read_as_package("link"), kRefused);
}

TEST_F(PackageIdentity, AFileOfRootsWhoseOtherNameHasGoneIsRefused) {
  hard_link("root/secret", "data/link");
  ASSERT_EQ(unlink((dir_ / "root/secret").c_str()), 0);
  EXPECT_EQ(read_as_package("link"), kRefused);
}

TEST_F(PackageIdentity, AHardLinkToWhatTheApplicationMayReadIsRead) {
  ASSERT_EQ(chmod((dir_ / "root/secret").c_str(), 0644), 0);
  hard_link("root/secret", "data/link");
  EXPECT_EQ(read_as_package("link"), "secret");
}

TEST_F(PackageIdentity, TheApplicationsOwnFilesAreReadWhateverTheirMode) {
  for (const mode_t mode : {0000U, 0200U, 0400U, 0444U}) {
    file("data/own", mode, kApp.uid);
    EXPECT_EQ(read_as_package("own"), "data/own") << std::oct << mode;
    hard_link("data/own", "data/second");
    EXPECT_EQ(read_as_package("second"), "data/own") << std::oct << mode;
    ASSERT_EQ(unlink((dir_ / "data/second").c_str()), 0);
  }
}

TEST_F(PackageIdentity, TheApplicationsOwnFileIsWrittenWhateverItsMode) {
  file("data/own", 0400, kApp.uid);
  const UniqueFd fd = open_as_package(folder_.get(), "own", O_WRONLY, 0, kApp, nullptr);
  ASSERT_TRUE(fd);
  EXPECT_EQ(write(fd.get(), "x", 1), 1);
}

TEST_F(PackageIdentity, TheApplicationsOwnFoldersAreEnteredWhateverTheirMode) {
  for (const mode_t mode : {0000U, 0444U, 0111U, 0555U}) {
    file("data/a/b/file", 0600, kApp.uid);
    own("data/a/b", mode, kApp.uid);
    own("data/a", mode, kApp.uid);
    struct stat status = {};
    const UniqueFd fd =
        open_below_as_package(folder_.get(), "a/b/file", O_RDONLY, 0, kApp, &status);
    EXPECT_TRUE(fd) << std::oct << mode;
    EXPECT_EQ(status.st_ino, status_of("data/a/b/file").st_ino);
    EXPECT_TRUE(open_as_package(folder_.get(), "a", O_RDONLY | O_DIRECTORY, 0, kApp, nullptr));
  }
}

TEST_F(PackageIdentity, AnothersFileIsReadWhereTheApplicationCannotHavePutIt) {
  file("data/theirs/file", 0600, kOther);
  own("data/theirs", 0755, kOther);
  open_folder("data/theirs");
  EXPECT_EQ(read_as_package("file"), "data/theirs/file");
  hard_link("data/theirs/file", "root/second");
  EXPECT_EQ(read_as_package("file"), kRefused);
}

TEST_F(PackageIdentity, AnothersFileIsRefusedWhereTheApplicationMayHavePutIt) {
  struct Folder {
    mode_t mode;
    uid_t owner;
    gid_t group;
  };
  const Folder folders[] = {
      {0555, kApp.uid, kOther}, {0757, kOther, kOther}, {0775, kOther, kApp.gid}, {01777, 0, 0}};
  for (const Folder &folder : folders) {
    file("data/theirs/file", 0600, kOther);
    ASSERT_EQ(chown((dir_ / "data/theirs").c_str(), folder.owner, folder.group), 0);
    ASSERT_EQ(chmod((dir_ / "data/theirs").c_str(), folder.mode), 0);
    open_folder("data/theirs");
    EXPECT_EQ(read_as_package("file"), kRefused) << std::oct << folder.mode;
  }
}

TEST_F(PackageIdentity, AnAccessListCountsAsTheModeDoes) {
  file("data/theirs/file", 0600, kOther);
  own("data/theirs", 0775, kOther);
  open_folder("data/theirs");
  EXPECT_EQ(read_as_package("file"), "data/theirs/file");
  struct Entry {
    std::uint16_t tag;
    std::uint16_t permissions;
    std::uint32_t id;
  };
  struct {
    std::uint32_t version = 2;
    Entry entries[5] = {
        {0x01, 7, ~0U}, {0x02, 7, kApp.uid}, {0x04, 5, ~0U}, {0x10, 7, ~0U}, {0x20, 5, ~0U}};
  } list;
  if (fsetxattr(folder_.get(), "system.posix_acl_access", &list, sizeof list, 0) != 0) {
    ASSERT_EQ(errno, EOPNOTSUPP) << std::strerror(errno);  // then nobody can have one
    return;
  }
  EXPECT_EQ(read_as_package("file"), kRefused);
}

TEST_F(PackageIdentity, AnothersFolderIsEnteredWhereTheApplicationCannotHaveMovedIt) {
  give("data/theirs", 0700, kOther);
  EXPECT_TRUE(open_as_package(folder_.get(), "theirs", O_RDONLY | O_DIRECTORY, 0, kApp, nullptr));
  own("data/theirs", 0733, kOther);  // one that it may write it may have moved
  EXPECT_FALSE(open_as_package(folder_.get(), "theirs", O_RDONLY | O_DIRECTORY, 0, kApp, nullptr));
  EXPECT_EQ(errno, EACCES);
  give("data/open", 0777, kOther);  // and with it what lies in it
  give("data/open/inner", 0700, kOther);
  open_folder("data/open");
  EXPECT_FALSE(open_as_package(folder_.get(), "inner", O_RDONLY | O_DIRECTORY, 0, kApp, nullptr));
  EXPECT_EQ(errno, EACCES);
}

TEST_F(PackageIdentity, WhatLiesDeepInAFolderThatTheApplicationMayHaveMovedIsRefused) {
  struct Above {
    mode_t mode;
    uid_t owner;
    bool trusted;
  };
  const Above folders[] = {
      {0755, kOther, true}, {0777, kOther, false}, {01777, kOther, false}, {0700, kApp.uid, false}};
  struct stat status = {};
  for (const Above &above : folders) {
    SCOPED_TRACE(above.mode);
    give("data/above", above.mode, above.owner);
    give("data/above/middle", 0755, kOther);
    give("data/above/middle/theirs", 0755, kOther);
    file("data/above/middle/theirs/file", 0600, kOther);
    open_folder("data/above/middle/theirs");
    EXPECT_EQ(read_as_package("file") != kRefused, above.trusted);
    EXPECT_EQ(names_may_be_changed(folder_.get(), kApp), above.trusted);
    const UniqueFd made =
        open_as_package(folder_.get(), "new", O_WRONLY | O_CREAT, 0, kApp, &status);
    EXPECT_EQ(static_cast<bool>(made), above.trusted);
    EXPECT_EQ(unlink_as_package(folder_.get(), "file", 0, kApp) == 0, above.trusted);
    EXPECT_EQ(exists(dir_ / "data/above/middle/theirs/file"), !above.trusted);
    EXPECT_EQ(unlink_as_package(folder_.get(), "new", 0, kApp) == 0, above.trusted);
  }
}

TEST_F(PackageIdentity, WhatOthersKeepInAFolderThatTheApplicationCanMoveIsRefused) {
  give("elsewhere", 0755, kApp.uid);
  give("elsewhere/mine", 0755, kApp.uid);
  give("elsewhere/mine/theirs", 0700, kOther);
  file("elsewhere/mine/theirs/file", 0600, kOther);
  {
    const ActAsPackage acting(kApp);
    const UniqueFd from(open((dir_ / "elsewhere").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    ASSERT_EQ(renameat(from.get(), "mine", folder_.get(), "moved"), 0) << std::strerror(errno);
  }
  open_folder("data/moved");
  struct stat status = {};
  EXPECT_FALSE(open_as_package(folder_.get(), "theirs", O_RDONLY | O_DIRECTORY, 0, kApp, &status));
  EXPECT_EQ(errno, EACCES);
  open_folder("data/moved/theirs");
  EXPECT_EQ(read_as_package("file"), kRefused);
  EXPECT_FALSE(open_as_package(folder_.get(), "new", O_WRONLY | O_CREAT, 0, kApp, &status));
  EXPECT_EQ(unlink_as_package(folder_.get(), "file", 0, kApp), -1);
  const UniqueFd object(openat(folder_.get(), "file", O_PATH | O_CLOEXEC));
  ASSERT_EQ(fstat(object.get(), &status), 0);
  EXPECT_FALSE(may_be_changed(folder_.get(), object.get(), status, kApp));
}

TEST_F(PackageIdentity, WhatOthersKeepRightInAPackagesDataStaysInReach) {
  for (const char *data : {"package/data", "package/shared/data", "package/shared/trusted"}) {
    const std::string theirs = std::string(data) + "/theirs";
    file(theirs + "/deeper/file", 0600, kOther);
    for (const std::string &name : {theirs, theirs + "/deeper"}) own(name, 0700, kOther);
    for (const char *name : {"package/shared", "package"}) {
      if (exists(dir_ / name)) own(name, 0755, kApp.uid);
    }
    own(data, 0755, kApp.uid);
    open_folder(data);
    struct stat status = {};
    EXPECT_TRUE(
        open_below_as_package(folder_.get(), "theirs/deeper/file", O_RDONLY, 0, kApp, &status))
        << data;
  }
  give("package/data/other", 0755, kApp.uid);
  give("package/data/other/data", 0755, kApp.uid);
  give("package/data/other/data/theirs", 0700, kOther);
  open_folder("package/data/other/data");
  EXPECT_FALSE(open_as_package(folder_.get(), "theirs", O_RDONLY, 0, kApp, nullptr))
      << "a name alone makes no folder for data";
}

TEST_F(PackageIdentity, WhatMayHaveBeenMovedIntoAFolderForAllIsRefused) {
  give("public", 01777, 0);
  give("public/open", 0777, kOther);
  file("public/open/theirs/file", 0600, kOther);
  own("public/open/theirs", 0755, kOther);
  open_folder("public/open/theirs");
  EXPECT_EQ(read_as_package("file"), kRefused);
}

TEST_F(PackageIdentity, WhatLiesInAFolderForAllThatNobodyMovesStaysInReach) {
  // as a package's folder in /tmp
  give("public", 01777, 0);
  give("public/package", 0755, kOther);
  file("public/package/file", 0600, kOther);
  open_folder("public/package");
  EXPECT_EQ(read_as_package("file"), "public/package/file");
  EXPECT_EQ(unlink_as_package(folder_.get(), "file", 0, kApp), 0);
}

TEST_F(PackageIdentity, LinksAreNotFollowedAndOtherTypesNotOpened) {
  ASSERT_EQ(symlink((dir_ / "root/secret").c_str(), (dir_ / "data/link").c_str()), 0);
  ASSERT_EQ(mkfifo((dir_ / "data/fifo").c_str(), 0), 0);
  own("data/fifo", 0, kOther);
  EXPECT_EQ(read_as_package("link"), std::strerror(ELOOP));
  EXPECT_EQ(read_as_package("fifo"), kRefused);
  EXPECT_EQ(read_as_package("none"), std::strerror(ENOENT));
  own("data", 0000, kApp.uid);
  EXPECT_EQ(read_as_package("link"), kRefused);
  EXPECT_FALSE(open_below_as_package(folder_.get(), "link/x", O_RDONLY, 0, kApp, nullptr));
}

TEST_F(PackageIdentity, APathStaysBelow) {
  file("data/a/file", 0600, kApp.uid);
  for (const char *path : {"", "/a/file", "../root/secret", "a/../../root/secret", "a//file"}) {
    own("data/a", 0000, kApp.uid);
    EXPECT_FALSE(open_below_as_package(folder_.get(), path, O_RDONLY, 0, kApp, nullptr)) << path;
  }
}

TEST_F(PackageIdentity, WhatLiesThereIsTold) {
  hard_link("root/secret", "data/link");
  own("data", 0000, kApp.uid);
  struct stat status = {};
  EXPECT_TRUE(open_as_package(folder_.get(), "link", O_PATH, 0, kApp, &status));
  EXPECT_EQ(status.st_uid, 0U);
  EXPECT_EQ(status.st_nlink, 2U);
  EXPECT_FALSE(open_as_package(folder_.get(), "link", O_PATH | O_DIRECTORY, 0, kApp, &status));
  EXPECT_EQ(errno, ENOTDIR);
}

/* ---- what is made and removed ------------------------------------------ */

TEST_F(PackageIdentity, WhatIsMadeIsThePackagesAtOnce) {
  for (const mode_t mode : {0755U, 0555U, 0000U}) {
    own("data", mode, kApp.uid);
    struct stat status = {};
    EXPECT_TRUE(open_as_package(folder_.get(), "file", O_WRONLY | O_CREAT, 0600, kApp, &status));
    EXPECT_EQ(status.st_uid, kApp.uid);
    EXPECT_EQ(status.st_gid, kApp.gid);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
    EXPECT_FALSE(open_as_package(folder_.get(), "file", O_WRONLY | O_CREAT, 0600, kApp, nullptr));
    EXPECT_EQ(errno, EEXIST);
    EXPECT_EQ(mkdir_as_package(folder_.get(), "folder", 0755, kApp), 0);
    EXPECT_EQ(status_of("data/folder").st_uid, kApp.uid);
    EXPECT_EQ(unlink_as_package(folder_.get(), "file", 0, kApp), 0);
    EXPECT_EQ(unlink_as_package(folder_.get(), "folder", AT_REMOVEDIR, kApp), 0);
    EXPECT_EQ(unlink_as_package(folder_.get(), "folder", AT_REMOVEDIR, kApp), -1);
    EXPECT_EQ(errno, ENOENT);
  }
}

TEST_F(PackageIdentity, AnothersFolderIsChangedWhereTheApplicationCannotHaveMovedIt) {
  give("data/theirs", 0755, kOther);
  open_folder("data/theirs");
  struct stat status = {};
  EXPECT_TRUE(open_as_package(folder_.get(), "file", O_WRONLY | O_CREAT, 0600, kApp, &status));
  EXPECT_EQ(status.st_uid, kApp.uid);
  EXPECT_EQ(unlink_as_package(folder_.get(), "file", 0, kApp), 0);
  // may be filled, but not be entered
  own("data/theirs", 0772, kOther);
  EXPECT_FALSE(open_as_package(folder_.get(), "file", O_WRONLY | O_CREAT, 0600, kApp, nullptr));
  EXPECT_EQ(errno, EACCES);
  EXPECT_EQ(mkdir_as_package(folder_.get(), "new", 0755, kApp), -1);
  EXPECT_EQ(errno, EACCES);
}

TEST_F(PackageIdentity, ADescriptorThatIsNoneIsAFailure) {
  EXPECT_FALSE(open_as_package(-1, "file", O_RDONLY, 0, kApp, nullptr));
  EXPECT_FALSE(open_below_as_package(-1, "a/file", O_RDONLY, 0, kApp, nullptr));
  EXPECT_EQ(mkdir_as_package(-1, "file", 0755, kApp), -1);
  EXPECT_EQ(unlink_as_package(-1, "file", 0, kApp), -1);
}

/* ---- where the daemon is not root ---------------------------------------------- */

TEST_F(PackageIdentity, WithoutRootsRightsEverythingIsDoneWithThoseThatAreThere) {
  file("data/own", 0600, kOther);
  own("data", 0755, kOther);
  open_folder("data");
  // the user of a thread, not of the process that runs the other tests
  std::thread([&] {
    ASSERT_EQ(syscall(SYS_setresuid, kOther, kOther, kOther), 0);
    EXPECT_EQ(read_as_package("own"), "data/own");
    EXPECT_EQ(present_user(), kOther);
    ASSERT_EQ(chmod((dir_ / "data/own").c_str(), 0000), 0);
    EXPECT_EQ(read_as_package("own"), kRefused);
  }).join();
}

}  // namespace
