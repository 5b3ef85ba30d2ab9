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

#include "quarn_common.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/file.h"
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
  /**
   * Take @p name away and put a link to the secret in its place, again and again: what a system
   * call does for an application where links to others' files are not forbidden.
   */
  void link_forever(const std::string &name) {
    racer = fork();
    if (racer == 0) {
      const std::string link_name = base + "/link";
      for (;;) {
        if (link(secret.c_str(), link_name.c_str()) == 0) {
          rename(link_name.c_str(), name.c_str());
          unlink(link_name.c_str());  // two names of one file are not renamed
        }
      }
    }
  }
  /** What an application keeps ready to put in the place of a snapshot. */
  void make_fake_snapshot(const std::string &path, const std::vector<std::string> &names) const {
    for (const std::string &name : names) {
      const std::filesystem::path file = path + "/" + name;
      std::filesystem::create_directories(file.parent_path());
      ASSERT_EQ(link(secret.c_str(), file.c_str()), 0);
    }
    ASSERT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
  }
  void restore_while(const std::string &archive, const std::function<void()> &attack) {
    pkg_restore_context ctx;
    request_restore(&ctx);
    std::filesystem::copy_file(archive, download());
    attack();
    answer();
    stop();
    clear_captured_log();
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
    static_cast<void>(
        parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get()));
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
    static_cast<void>(
        parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get()));
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
    request_restore(&ctx);
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
    static_cast<void>(restore_app_info(kPkg, root.c_str()));
    clear_captured_log();
  }
  stop();
  expect_secret_untouched();
}

/* ---- links to files of others ---------------------------------------------- */

TEST_F(RaceTest, AFileSwappedForALinkToAnothersFileIsNeverChanged) {
  file("data/a", "x");
  const JsonPtr entries = table({{"data/a", "", 0777, "wrt::db_origin"}});
  link_forever(at("data/a"));
  for (int i = 0; i < kRounds; ++i) {
    static_cast<void>(
        parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get()));
    static_cast<void>(restore_file_info(at("data/a").c_str(), kPkg, root.c_str(), entries.get()));
    clear_captured_log();
  }
  stop();
  expect_secret_untouched();
}

TEST_F(RaceTest, AFileOfAnothersWithNoOtherNameIsNeverChanged) {
  // its first name has gone, so that the number of its names tells nothing
  file("data/dir/a", "x");
  const JsonPtr entries = table({{"data/dir/a", "", 0777, "wrt::db_origin"}});
  ASSERT_EQ(rename(secret.c_str(), at("data/dir/a").c_str()), 0);
  const Tree before = tree_of(at("data/dir"));
  EXPECT_EQ(parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get()), 0);
  EXPECT_EQ(restore_file_info(at("data/dir/a").c_str(), kPkg, root.c_str(), entries.get()), 0);
  expect_error("refused : " + at("data/dir/a") + " is a link to a file elsewhere", 2);
  EXPECT_EQ(tree_of(at("data/dir")), before);
}

TEST_F(RaceTest, RestoresAndRollbacksNeverChangeAnothersFile) {
  const std::vector<Entry> entries = {{"data/a", "new", 0777, "wrt::db_origin"},
                                      {"data/b", "new", 0777, "wrt::db_origin"}};
  const std::string good = base + "/good.zip";
  const std::string broken = base + "/broken.zip";
  make_archive(good, entries);
  make_archive(broken, entries, "not json");
  for (int i = 0; i < kRounds / 30; ++i) {
    for (const std::string &archive : {good, broken}) {
      file("data/a", "x", 04755);
      file("data/b", "x", 0666);
      restore_while(archive, [this] { link_forever(at("data/b")); });
      unlink(at("data/b").c_str());
    }
  }
  expect_secret_untouched();
}

TEST_F(RaceTest, ASnapshotSwappedForAFolderOfLinksIsNotUsed) {
  const std::string broken = base + "/broken.zip";
  make_archive(broken, {{"data/a", "new", 0777, "wrt::db_origin"}}, "not json");
  const std::string fake = at("shared/data/quarn_tmp_rst_dir.mine");
  int rolled_back = 0;
  for (int i = 0; i < kRounds / 30; ++i) {
    std::filesystem::remove_all(fake);
    std::filesystem::remove_all(snapshot());
    file("data/a", "old", 0666);
    make_fake_snapshot(fake, {"data/a", "data/dir/b"});
    restore_while(broken, [&] { swap_forever(snapshot(), fake); });
    if (read_text(at("data/a")) == "old") ++rolled_back;
  }
  expect_secret_untouched();
  EXPECT_GT(rolled_back, 0);
}

TEST_F(RaceTest, ARecoveryNeverChangesAnothersFile) {
  const std::string fake = at("shared/data/quarn_tmp_rst_dir.mine");
  for (int i = 0; i < kRounds / 30; ++i) {
    std::filesystem::remove_all(fake);
    std::filesystem::remove_all(snapshot());
    file("data/a", "old", 0666);
    ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
    make_fake_snapshot(fake, {"data/a"});
    swap_forever(snapshot(), fake);
    recover_interrupted_restore(kPkg, root.c_str());
    stop();
    clear_captured_log();
  }
  expect_secret_untouched();
}

TEST_F(RaceTest, ASnapshotThatHasGoneAtTheEndIsTold) {
  const std::string archive = base + "/archive.zip";
  make_archive(archive, {{"data/a", "new"}});
  file("data/a", "old");
  const AtStep move("restored",
                    [this] { ASSERT_EQ(rename(snapshot().c_str(), (base + "/mine").c_str()), 0); });
  pkg_restore_context *ctx = new_context();
  ctx->wait_for_result = true;
  ASSERT_EQ(restore_app_data("app", ctx), 0);
  std::filesystem::copy_file(archive, download());
  answer();
  expect_error("snapshot of (org.example.notes) was moved during its restore");
  EXPECT_EQ(ctx->result, QUARN_REFUSED);
  EXPECT_EQ(read_text(at("data/a")), "old");
  delete ctx;
}

TEST_F(RaceTest, ASnapshotThatWasMovedEndsTheRestoreWithoutSuccess) {
  const std::string archive = base + "/archive.zip";
  make_archive(archive, {{"data/a", "new"}});
  file("data/a", "old");
  const Tree before = tree_of(root);
  const AtStep move("unpacked", [this] {
    ASSERT_EQ(rename(snapshot().c_str(), at("shared/data/mine").c_str()), 0);
    ASSERT_EQ(mkdir(snapshot().c_str(), 0755), 0);
    ASSERT_EQ(chown(snapshot().c_str(), kAppUid, kAppGid), 0);
  });
  pkg_restore_context *ctx = new_context();
  ctx->wait_for_result = true;
  ASSERT_EQ(restore_app_data("app", ctx), 0);
  std::filesystem::copy_file(archive, download());
  answer();
  EXPECT_EQ(ctx->result, QUARN_REFUSED);
  EXPECT_EQ(read_text(at("data/a")), "old") << "put back from where it is";
  EXPECT_TRUE(std::filesystem::is_empty(at("shared/data/mine")));
  delete ctx;
}

}  // namespace
