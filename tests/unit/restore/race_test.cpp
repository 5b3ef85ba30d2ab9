// An application that swaps its files for links while the daemon works on them.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <filesystem>

#include "restore_fixture.h"

namespace {

constexpr int kRounds = 1500;
constexpr std::chrono::seconds kPatience(30);

class RaceTest : public RestoreTest {
 protected:
  RaceTest() {
    secret_dir = base + "/secret";
    secret = secret_dir + "/file";
    write_text(secret, "secret");
    EXPECT_EQ(chmod(secret.c_str(), 0600), 0);
    EXPECT_EQ(chmod(secret_dir.c_str(), 0700), 0);
    set_label(secret, "secret");
    set_label(secret_dir, "secret");
    untouched = tree_of(base + "/secret");
    EXPECT_EQ(lstat(secret_dir.c_str(), &dir_status), 0);
  }
  ~RaceTest() override { stop(); }

  /** Swap two names for each other, again and again, until stop(). */
  void swap_forever(const std::string &a, const std::string &b) {
    racer = fork();
    if (racer == 0) {
      for (;;) {
        renameat2(AT_FDCWD, a.c_str(), AT_FDCWD, b.c_str(), RENAME_EXCHANGE);
      }
    }
  }
  void stop() {
    if (racer <= 0) return;
    kill(racer, SIGKILL);
    waitpid(racer, nullptr, 0);
    racer = 0;
  }
  void expect_secret_untouched() const {
    EXPECT_EQ(tree_of(base + "/secret"), untouched);
    struct stat status = {};
    EXPECT_EQ(lstat(secret_dir.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, dir_status.st_mode);
    EXPECT_EQ(status.st_uid, dir_status.st_uid);
    EXPECT_EQ(label_of(secret_dir), "secret");
  }

  std::string secret_dir;
  std::string secret;
  Tree untouched;
  struct stat dir_status = {};
  pid_t racer = 0;
};

TEST_F(RaceTest, AFileSwappedForALinkIsNeverFollowed) {
  file("data/a", "x");
  std::filesystem::create_symlink(secret, at("data/b"));
  const JsonPtr entries = table({{"data/a", "", 0777, "wrt::db_origin"}});
  swap_forever(at("data/a"), at("data/b"));
  int restored = 0;
  int refused = 0;
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (restored + refused < kRounds || restored == 0 || refused == 0) {
    if (std::chrono::steady_clock::now() > deadline) break;
    const bool done =
        restore_file_info(at("data/a").c_str(), kPkg, root.c_str(), entries.get()) != 0;
    ++(done ? restored : refused);
    clear_captured_log();
  }
  stop();
  EXPECT_GT(restored, 0);
  EXPECT_GT(refused, 0) << "the race took place";
  expect_secret_untouched();
}

TEST_F(RaceTest, AWalkNeverLeavesTheApplicationThroughASwappedDirectory) {
  file("data/dir/file", "x");
  std::filesystem::create_directory_symlink(secret_dir, at("data/swap"));
  const JsonPtr entries = table({{"data/dir/file", "", 0777, "wrt::db_origin"},
                                 {"data/swap/file", "", 0777, "wrt::db_origin"}});
  swap_forever(at("data/dir"), at("data/swap"));
  for (int i = 0; i < kRounds; ++i) {
    parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get());
    clear_captured_log();
  }
  stop();
  expect_secret_untouched();
}

TEST_F(RaceTest, AWalkNeverLeavesTheApplicationThroughASwappedFile) {
  file("data/a", "x");
  std::filesystem::create_symlink(secret, at("data/b"));
  const JsonPtr entries =
      table({{"data/a", "", 0777, "wrt::db_origin"}, {"data/b", "", 0777, "wrt::db_origin"}});
  swap_forever(at("data/a"), at("data/b"));
  for (int i = 0; i < kRounds; ++i) {
    parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get());
    clear_captured_log();
  }
  stop();
  expect_secret_untouched();
}

TEST_F(RaceTest, WholeRestoresAndRollbacksTouchNothingOutside) {
  const std::string archive = base + "/archive.zip";
  make_archive(archive, {{"data/dir/file", "new", 0777, "wrt::db_origin"},
                         {"data/swap/file", "new", 0777, "wrt::db_origin"}});
  for (int i = 0; i < kRounds / 30; ++i) {
    std::filesystem::remove_all(at("data/dir"));
    std::filesystem::remove_all(at("data/swap"));
    file("data/dir/file", "x");
    std::filesystem::create_directory_symlink(secret_dir, at("data/swap"));
    pkg_restore_context ctx;
    ctx.serial = kSerial;
    ctx.pkgid = kPkg;
    ctx.version = kVersion;
    ctx.root = root;
    ctx.wait_for_result = true;
    ASSERT_EQ(restore_app_data("app", &ctx), 0);
    std::filesystem::copy_file(archive, download());
    swap_forever(at("data/dir"), at("data/swap"));
    answer();
    stop();
    clear_captured_log();
  }
  expect_secret_untouched();
}

TEST_F(RaceTest, ASwappedDataDirectoryIsNotRelabelledElsewhere) {
  // the root is the application's own here, so even the data directory can be swapped
  std::filesystem::create_directory_symlink(secret_dir, at("swap"));
  swap_forever(at("data"), at("swap"));
  for (int i = 0; i < kRounds / 10; ++i) {
    write_text(perm(), "{}");
    restore_app_info(kPkg, root.c_str());
    clear_captured_log();
  }
  stop();
  expect_secret_untouched();
}

}  // namespace
