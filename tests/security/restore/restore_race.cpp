// An application that changes its data at the very moment: between any two steps of a restore, good
// or rolled back, it puts another's file in the place of its own, or a link in that of its folder.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>

#include "each_moment.h"
#include "quarn_d_utils/file.h"
#include "restore_fixture.h"

// Nothing is to outlive this, and most of a restore's time is the disk's.
extern "C" int fsync(int /*fd*/) { return 0; }
extern "C" int syncfs(int /*fd*/) noexcept { return 0; }

namespace {

constexpr char kSecret[] = "what only root may read";
/** How many moments what was put there stays. */
constexpr int kStays[] = {1, 1000000};

/**
 * How long each attack goes on after its first pass over all moments, which takes some seconds.
 * With the rights of root for everything the first restores of it reach another's file, after 0.1
 * seconds.
 */
std::chrono::milliseconds race() {
  const char *seconds = std::getenv("QUARN_RACE_SECONDS");
  return std::chrono::milliseconds(seconds == nullptr ? 0 : 1000 * std::atoi(seconds));
}

class RestoreRace : public RestoreTest {
 protected:
  RestoreRace() {
    EXPECT_EQ(chmod(base.c_str(), 0755), 0);
    EXPECT_EQ(mkdir(vault_.c_str(), 0755), 0);
    write_text(vault_ + "/file", kSecret);
    EXPECT_EQ(chmod((vault_ + "/file").c_str(), 0600), 0);
    untouched_ = tree_of(vault_);
    EXPECT_EQ(lstat(vault_.c_str(), &vault_status_), 0);
    const std::vector<Entry> entries = {{"data/dir/file", "saved", 0666, "wrt::db_origin"},
                                        {"data/other", "saved", 0644}};
    make_archive(base + "/good.zip", entries);
    make_archive(base + "/broken.zip", entries, "not json");
  }

  /** The package's data as it is before each restore. */
  void set_up_data() {
    for (const char *folder : {"data", "shared/data", "shared/trusted", "mine"}) {
      std::filesystem::remove_all(at(folder));
      dir(folder);
    }
    dir("data/dir");
    file("data/dir/file", "its own");
    const AsApplication application;
    EXPECT_EQ(symlink(vault_.c_str(), at("mine/link").c_str()), 0);
    EXPECT_EQ(link((vault_ + "/file").c_str(), at("mine/spare").c_str()), 0);
  }
  /** What the application puts in the place of its own, and back. */
  void exchange() const {
    const AsApplication application;
    const char *mine = folder_ ? "mine/link" : "mine/spare";
    const char *place = folder_ ? "data/dir" : "data/dir/file";
    if (renameat2(AT_FDCWD, at(mine).c_str(), AT_FDCWD, at(place).c_str(), RENAME_EXCHANGE) != 0) {
      // while the place is free
      static_cast<void>(
          renameat2(AT_FDCWD, at(mine).c_str(), AT_FDCWD, at(place).c_str(), RENAME_NOREPLACE));
    }
  }
  /** Restore with the exchange from the moment @p from on, to @p until. @return moments */
  int restore(const std::string &archive, int from, int until) {
    set_up_data();
    pkg_restore_context ctx;
    request_restore(&ctx);
    std::filesystem::copy_file(archive, download());
    int moments = 0;
    std::function<void()> action = [&] {
      if (moments == from || moments == until) exchange();
      ++moments;
    };
    at_each_moment = &action;
    answer();
    at_each_moment = nullptr;
    clear_captured_log();
    restored_ += ctx.result == 0;
    failed_ += ctx.result != 0;
    return moments;
  }
  /** The other's file is as it was, and nothing of it is in the application's hands. */
  void expect_nothing_was_reached() const {
    ASSERT_EQ(tree_of(vault_), untouched_);
    struct stat status = {};
    ASSERT_EQ(lstat(vault_.c_str(), &status), 0);
    ASSERT_EQ(status.st_mode, vault_status_.st_mode);
    ASSERT_EQ(status.st_uid, vault_status_.st_uid);
    struct stat secret = {};
    ASSERT_EQ(lstat((vault_ + "/file").c_str(), &secret), 0);
    for (const auto &entry : std::filesystem::recursive_directory_iterator(root)) {
      const std::string path = entry.path();
      if (lstat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) continue;
      if (status.st_ino == secret.st_ino && status.st_dev == secret.st_dev) continue;
      ASSERT_NE(read_text(path), kSecret) << path;
    }
  }
  void race_once(const std::string &archive) {
    const int moments = restore(archive, -1, -1);
    ASSERT_GT(moments, 100) << "the restore is seen";
    for (int from = 0; from < moments; ++from) {
      for (const int stay : kStays) {
        restore(archive, from, from + stay);
        SCOPED_TRACE("there from moment " + std::to_string(from) + " for " + std::to_string(stay));
        ASSERT_NO_FATAL_FAILURE(expect_nothing_was_reached());
      }
    }
  }
  void race_all(const char *archive, bool folder) {
    folder_ = folder;
    const auto begin = std::chrono::steady_clock::now();
    do {
      ASSERT_NO_FATAL_FAILURE(race_once(base + archive));
    } while (std::chrono::steady_clock::now() - begin < race());
    EXPECT_GT(failed_, 0);
    EXPECT_EQ(restored_ > 0, std::string(archive) == "/good.zip");
    RecordProperty("restored", restored_);
    RecordProperty("failed", failed_);
  }

  const std::string vault_ = base + "/vault";
  Tree untouched_;
  struct stat vault_status_ = {};
  bool folder_ = false;
  int restored_ = 0;
  int failed_ = 0;
};

TEST_F(RestoreRace, AFileThatIsAnothersForAMomentStaysAsItIs) { race_all("/good.zip", false); }

TEST_F(RestoreRace, NorIsItTouchedByARollback) { race_all("/broken.zip", false); }

TEST_F(RestoreRace, AFolderThatIsALinkForAMomentLeadsNowhere) { race_all("/good.zip", true); }

TEST_F(RestoreRace, NorInARollback) { race_all("/broken.zip", true); }

}  // namespace
