#include "files/safe_path.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <stddef.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <cerrno>

#include "temp_dir.h"

namespace {

constexpr uid_t kApp = 5000;

/** Every case runs with openat2(), and again in a child whose kernel has none. */
class SafePath : public ::testing::TestWithParam<bool> {
 protected:
  void run(void (*body)(const TempDir &)) {
    const TempDir dir;
    if (GetParam()) {
      body(dir);
      return;
    }
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      sock_filter program[] = {
          BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
          BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_openat2, 0, 1),
          BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOSYS),
          BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
      };
      const sock_fprog filter = {4, program};
      if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 ||
          prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) != 0) {
        _exit(2);
      }
      body(dir);
      _exit(::testing::Test::HasFailure() ? 1 : 0);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    ASSERT_EQ(WEXITSTATUS(status), 0);
  }
};

INSTANTIATE_TEST_SUITE_P(Kernel, SafePath, ::testing::Values(true, false),
                         [](const auto &info) { return info.param ? "WithOpenat2" : "Without"; });

TEST_P(SafePath, OpensAPlainPath) {
  run([](const TempDir &dir) {
    const auto path = dir.file("a/b/c", "text");
    const UniqueFd fd = safe_open(path.c_str(), O_RDONLY);
    ASSERT_TRUE(fd);
    char buffer[8] = {};
    EXPECT_EQ(read(fd.get(), buffer, sizeof(buffer)), 4);
    EXPECT_EQ(fcntl(fd.get(), F_GETFD), FD_CLOEXEC);
  });
}

TEST_P(SafePath, CreatesWithTheModeGiven) {
  run([](const TempDir &dir) {
    const std::string path = dir / "new";
    EXPECT_TRUE(safe_open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0600));
    struct stat status = {};
    ASSERT_EQ(safe_lstat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0600U);
  });
}

TEST_P(SafePath, NeverFollowsTheLastComponent) {
  run([](const TempDir &dir) {
    dir.file("target", "x");
    const auto link = dir.link("link", dir / "target");
    EXPECT_FALSE(safe_open(link.c_str(), O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_FALSE(safe_open(link.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600));
    EXPECT_EQ(read_text(dir / "target"), "x");
    struct stat status = {};
    ASSERT_EQ(safe_lstat(link.c_str(), &status), 0);
    EXPECT_TRUE(S_ISLNK(status.st_mode));
  });
}

TEST_P(SafePath, FollowsRootsLinkInRootsDirectory) {
  run([](const TempDir &dir) {
    dir.file("real/sub/file", "x");
    dir.link("way", dir / "real");
    dir.link("relative", "real/../real/./sub");
    EXPECT_TRUE(safe_open((dir / "way/sub/file").c_str(), O_RDONLY));
    EXPECT_TRUE(safe_open((dir / "relative/file").c_str(), O_RDONLY));
    std::string name;
    EXPECT_TRUE(safe_open_parent((dir / "relative/file").c_str(), &name));
    EXPECT_EQ(name, "file");
    EXPECT_NE(safe_opendir((dir / "way/sub").c_str()), nullptr);
  });
}

TEST_P(SafePath, RefusesALinkThatAnApplicationOwns) {
  run([](const TempDir &dir) {
    dir.file("real/file", "x");
    const auto link = dir.link("way", dir / "real");
    ASSERT_EQ(lchown(link.c_str(), kApp, kApp), 0);
    EXPECT_FALSE(safe_open((dir / "way/file").c_str(), O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
    std::string name;
    EXPECT_FALSE(safe_open_parent((dir / "way/file").c_str(), &name));
    EXPECT_EQ(errno, ELOOP);
    struct stat status = {};
    EXPECT_EQ(safe_lstat((dir / "way/file").c_str(), &status), -1);
    EXPECT_EQ(safe_mkdir_with_parents((dir / "way/new").c_str(), 0755), -1);
    EXPECT_FALSE(exists(dir / "real/new"));
  });
}

TEST_P(SafePath, RefusesRootsLinkInADirectoryThatOthersMayWrite) {
  run([](const TempDir &dir) {
    dir.file("real/file", "x");
    dir.dir("open");
    dir.link("open/way", dir / "real");
    ASSERT_EQ(chmod((dir / "open").c_str(), 0777), 0);
    EXPECT_FALSE(safe_open((dir / "open/way/file").c_str(), O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
    ASSERT_EQ(chmod((dir / "open").c_str(), 0755), 0);
    EXPECT_TRUE(safe_open((dir / "open/way/file").c_str(), O_RDONLY));
    ASSERT_EQ(chown((dir / "open").c_str(), kApp, kApp), 0);
    EXPECT_FALSE(safe_open((dir / "open/way/file").c_str(), O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
  });
}

TEST_P(SafePath, EndsOnLinksThatGoInACircle) {
  run([](const TempDir &dir) {
    dir.link("a", "b");
    dir.link("b", "a");
    EXPECT_FALSE(safe_open((dir / "a/file").c_str(), O_RDONLY));
    EXPECT_EQ(errno, ELOOP);
  });
}

TEST_P(SafePath, TellsWhatIsMissingOrNoDirectory) {
  run([](const TempDir &dir) {
    dir.file("file", "x");
    EXPECT_FALSE(safe_open((dir / "none/file").c_str(), O_RDONLY));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_FALSE(safe_open((dir / "file/below").c_str(), O_RDONLY));
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_EQ(safe_opendir((dir / "file").c_str()), nullptr);
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_FALSE(safe_open("relative", O_RDONLY));
    EXPECT_EQ(errno, EINVAL);
    EXPECT_FALSE(safe_open(nullptr, O_RDONLY));
    EXPECT_EQ(errno, EINVAL);
    std::string name;
    EXPECT_FALSE(safe_open_parent("/", &name));
    EXPECT_EQ(errno, EINVAL);
    EXPECT_FALSE(safe_open_parent((dir / "..").c_str(), &name));
    EXPECT_EQ(errno, EINVAL);
  });
}

TEST_P(SafePath, ReachesTheRootDirectory) {
  run([](const TempDir &) {
    EXPECT_NE(safe_opendir("/"), nullptr);
    std::string name;
    EXPECT_TRUE(safe_open_parent("/tmp/", &name));
    EXPECT_EQ(name, "tmp");
  });
}

TEST_P(SafePath, MakesMissingAncestors) {
  run([](const TempDir &dir) {
    EXPECT_EQ(safe_mkdir_with_parents((dir / "a/b//c/").c_str(), 0755), 0);
    EXPECT_EQ(safe_mkdir_with_parents((dir / "a/b/c").c_str(), 0755), 0);
    struct stat status = {};
    ASSERT_EQ(safe_lstat((dir / "a/b/c").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, 0755U | S_IFDIR);
    dir.file("file", "x");
    EXPECT_EQ(safe_mkdir_with_parents((dir / "file/x").c_str(), 0755), -1);
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_EQ(safe_mkdir_with_parents("x", 0755), -1);
    EXPECT_EQ(errno, EINVAL);
  });
}

TEST_P(SafePath, StaysBelowADirectory) {
  run([](const TempDir &dir) {
    dir.file("root/a/file", "x");
    dir.file("outside", "x");
    dir.link("root/up", "..");
    const UniqueFd root = safe_open((dir / "root").c_str(), O_PATH | O_DIRECTORY);
    ASSERT_TRUE(root);
    EXPECT_TRUE(safe_open_below(root.get(), "a/file", O_RDONLY));
    EXPECT_TRUE(safe_open_below(root.get(), "./a/./new", O_WRONLY | O_CREAT | O_EXCL, 0600));
    for (const char *path : {"../outside", "a/../../outside", "/etc/passwd", "", "/"}) {
      EXPECT_FALSE(safe_open_below(root.get(), path, O_RDONLY)) << path;
      EXPECT_EQ(errno, EINVAL);
      EXPECT_FALSE(safe_mkdir_below(root.get(), path, 0755)) << path;
    }
    // root's own link is no way out either
    EXPECT_FALSE(safe_open_below(root.get(), "up/outside", O_RDONLY));
    EXPECT_FALSE(safe_mkdir_below(root.get(), "up/made", 0755));
    EXPECT_FALSE(exists(dir / "made"));
    EXPECT_TRUE(safe_mkdir_below(root.get(), "b/c/d", 0755));
    EXPECT_TRUE(safe_mkdir_below(root.get(), "b/c/d", 0755));
    EXPECT_TRUE(exists(dir / "root/b/c/d"));
  });
}

TEST_P(SafePath, OpensRegularFilesOfADirectoryOnly) {
  run([](const TempDir &dir) {
    dir.file("file", "four");
    dir.link("link", "file");
    mkdir((dir / "folder").c_str(), 0755);
    mkfifo((dir / "fifo").c_str(), 0600);
    const UniqueFd parent = safe_open(dir.path().c_str(), O_RDONLY | O_DIRECTORY);
    struct stat status = {};
    EXPECT_TRUE(safe_open_file_at(parent.get(), "file", &status));
    EXPECT_EQ(status.st_size, 4);
    for (const char *name : {"link", "folder", "fifo", "none"}) {
      EXPECT_FALSE(safe_open_file_at(parent.get(), name, &status)) << name;
    }
  });
}

TEST_P(SafePath, ReadsAFileWithoutANewTimeOfAccess) {
  run([](const TempDir &dir) {
    const std::string path = dir.file("file", "four");
    const timespec times[2] = {{1000, 0}, {2000, 0}};  // accessed before it was written
    ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    const UniqueFd parent = safe_open(dir.path().c_str(), O_RDONLY | O_DIRECTORY);
    struct stat status = {};
    const UniqueFd file = safe_open_file_at(parent.get(), "file", &status);
    char text[4];
    ASSERT_EQ(read(file.get(), text, sizeof text), 4);
    ASSERT_EQ(fstat(file.get(), &status), 0);
    EXPECT_EQ(status.st_atim.tv_sec, 1000);
  });
}

TEST_P(SafePath, ReadsAFileOfSomebodyElseAllTheSame) {
  run([](const TempDir &dir) {
    const std::string path = dir.file("file", "four");
    ASSERT_EQ(chmod(path.c_str(), 0644), 0);
    const UniqueFd parent = safe_open(dir.path().c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_EQ(seteuid(kApp), 0);
    struct stat status = {};
    const bool opened = static_cast<bool>(safe_open_file_at(parent.get(), "file", &status));
    ASSERT_EQ(seteuid(0), 0);
    EXPECT_TRUE(opened);
  });
}

TEST_P(SafePath, NamesADescriptor) {
  run([](const TempDir &dir) {
    const auto path = dir.file("file", "x");
    const UniqueFd fd = safe_open(path.c_str(), O_RDONLY);
    EXPECT_EQ(fd_path(fd.get()),
              "/proc/" + std::to_string(getpid()) + "/fd/" + std::to_string(fd.get()));
    EXPECT_EQ(read_text(fd_path(fd.get())), "x");
    const UniqueFd held = safe_open(path.c_str(), O_PATH);
    EXPECT_EQ(own_place_path(held.get()), "/proc/thread-self/fd/" + std::to_string(held.get()));
    EXPECT_EQ(read_text(own_place_path(held.get())), "x");
  });
}

}  // namespace
