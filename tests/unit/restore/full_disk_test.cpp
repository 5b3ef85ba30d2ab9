// A restore and its rollback on a file system that is full to the last byte and the last inode.
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <set>

#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/file.h"
#include "restore_fixture.h"

namespace {

constexpr int kFiles = 42;

enum class Kind { kMemory, kExt4 };

/** A small file system of the test's own; where none may be mounted the test fails. */
class SmallDisk {
 public:
  SmallDisk(Kind kind, std::string place) : place_(std::move(place)), image_(place_ + ".img") {
    std::filesystem::create_directories(place_);
    if (kind == Kind::kMemory) {
      mounted_ = mount("quarn", place_.c_str(), "tmpfs", 0, "size=3m,nr_inodes=900") == 0;
      EXPECT_TRUE(mounted_) << "a file system of memory cannot be mounted: " << strerror(errno);
      return;
    }
    const std::string make = "truncate -s 6M " + image_ + " && mkfs.ext4 -q -F -m 0 -N 900 " +
                             image_ + " && mount -o loop " + image_ + " " + place_;
    mounted_ = std::system(make.c_str()) == 0;
    EXPECT_TRUE(mounted_) << "a small ext4 cannot be made and mounted";
  }
  ~SmallDisk() {
    if (mounted_) umount2(place_.c_str(), MNT_DETACH);
    unlink(image_.c_str());
  }
  SmallDisk(const SmallDisk &) = delete;
  SmallDisk &operator=(const SmallDisk &) = delete;

  /** Take every block and every inode that is left, or has become free. */
  void fill() const {
    const std::string folder = place_ + "/filler";
    mkdir(folder.c_str(), 0700);
    const int file = open((place_ + "/filler/blocks").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
    const std::string block(4096, 'f');
    for (std::size_t size = block.size(); file >= 0 && size > 0; size /= 2) {
      while (write(file, block.data(), size) > 0) {
      }
    }
    if (file >= 0) close(file);
    for (;; ++inodes_) {
      const int one = open((folder + "/" + std::to_string(inodes_)).c_str(), O_WRONLY | O_CREAT, 0);
      if (one < 0) break;
      close(one);
    }
  }
  void expect_full() const {
    struct statfs status = {};
    ASSERT_EQ(statfs(place_.c_str(), &status), 0);
    EXPECT_EQ(status.f_bavail, 0U);
  }
  void empty() const { std::filesystem::remove_all(place_ + "/filler"); }

 private:
  std::string place_;
  std::string image_;
  bool mounted_ = false;
  mutable int inodes_ = 0;
};

class FullDiskTest : public RestoreTest, public ::testing::WithParamInterface<Kind> {
 protected:
  FullDiskTest() : disk(GetParam(), base + "/disk") {
    root = base + "/disk/" + kPkg;
    for (const char *name : {"data", "shared/data", "shared/trusted"}) dir(name);
    for (int i = 0; i < kFiles; ++i) {
      new_data.push_back({name_of(i), std::string(static_cast<std::size_t>(2000 + 10 * i), 'n')});
      if (i % 3 == 0) new_data.push_back({name_of(i) + ".new", std::string(3000, 'a'), 0600});
    }
    make_data();
    old_tree = data();
    make_archive(base + "/good.zip", new_data);
    make_archive(base + "/broken.zip", new_data, "not json");
    const auto ctx = restore_here(base + "/good.zip");
    EXPECT_EQ(ctx->result, 0);
    new_tree = data();
    EXPECT_NE(old_tree, new_tree);
    reset();
  }

  static std::string name_of(int i) {
    const char *const tops[] = {"data", "shared/data", "shared/trusted"};
    return std::string(tops[i % 3]) + "/folder" + std::to_string(i % 7) + "/deep/file" +
           std::to_string(i);
  }
  void make_data() {
    for (int i = 0; i < kFiles; ++i) {
      const std::string name = name_of(i);
      const std::string deep = name.substr(0, name.rfind('/'));
      dir(deep.substr(0, deep.rfind('/')), 0755);
      dir(deep, 0711, i % 2 == 0 ? kDataLabel : "a.folders.label");
      file(name, std::string(static_cast<std::size_t>(3000 + i), 'o'), 0600 + i % 8,
           i % 5 == 0 ? "wrt::db_origin" : kDataLabel);
      if (i % 11 == 0) {
        EXPECT_EQ(chown(at(name).c_str(), 5001, 100), 0);
      }
    }
  }
  void reset() {
    disk.empty();
    std::filesystem::remove_all(root);
    for (const char *name : {"data", "shared/data", "shared/trusted"}) dir(name);
    make_data();
    ASSERT_EQ(data(), old_tree);
  }
  std::unique_ptr<pkg_restore_context> restore_here(const std::string &archive) {
    std::unique_ptr<pkg_restore_context> ctx(new_context());
    ctx->wait_for_result = true;
    restore_app_data("app", ctx.get());
    std::filesystem::copy_file(archive, download(),
                               std::filesystem::copy_options::overwrite_existing);
    answer();
    return ctx;
  }
  /** Everything of the application: without the daemon's files. */
  Tree data() const {
    Tree all = tree_of(root);
    for (auto at = all.begin(); at != all.end();) {
      const bool ours = at->first.find("quarn_tmp_rst_dir") != std::string::npos ||
                        at->first.find("_download.zip") != std::string::npos;
      at = ours ? all.erase(at) : std::next(at);
    }
    return all;
  }
  /** What is not as it is in @p wanted, in short. */
  std::string difference(const Tree &wanted) const {
    const Tree now = data();
    std::string text;
    for (const auto &[name, object] : wanted) {
      const auto found = now.find(name);
      if (found == now.end()) text += "missing " + name + "\n";
      if (found != now.end() && found->second != object) {
        text += name + " is " + found->second.substr(0, 60) + " not " + object.substr(0, 60) + "\n";
      }
    }
    for (const auto &[name, object] : now) {
      if (wanted.count(name) == 0) text += "too much: " + name + "\n";
    }
    return text;
  }
  /** Run @p work in a process that ends at its @p nth step, there once the disk is full. */
  bool killed_at(int nth, const std::string &full_from, const std::function<void()> &work) {
    return is_killed_in([&] {
      static int left;
      static bool full;
      static const SmallDisk *small;
      static std::string from;
      left = nth;
      full = false;
      small = &disk;
      from = full_from;
      restore_step_hook = [](const char *step) {
        if (from == step) full = true;
        if (!full) return;
        small->fill();  // whatever a step frees is taken by somebody else at once
        if (--left == 0) raise(SIGKILL);
      };
      work();
    });
  }

  SmallDisk disk;
  std::vector<Entry> new_data;
  Tree old_tree;
  Tree new_tree;
};

/** Fills the disk at each step from the named one on. */
class FullFrom {
 public:
  FullFrom(const SmallDisk &disk, std::string step) {
    small = &disk;
    from = std::move(step);
    full = false;
    restore_step_hook = [](const char *name) {
      full = full || from == name;
      if (full) small->fill();
    };
  }
  ~FullFrom() { restore_step_hook = nullptr; }
  FullFrom(const FullFrom &) = delete;
  FullFrom &operator=(const FullFrom &) = delete;

 private:
  static const SmallDisk *small;
  static std::string from;
  static bool full;
};
const SmallDisk *FullFrom::small = nullptr;
std::string FullFrom::from;
bool FullFrom::full = false;

TEST_P(FullDiskTest, AFailedRestoreLeavesTheDataAsItWasFromWhicheverStepOnTheDiskIsFull) {
  std::vector<restore_progress> progress;
  for (const char *step : {"snapshot", "snapshot-copied", "snapshot-table-written",
                           "snapshot-complete", "unpack", "unpacked", "table", "labels", "rollback",
                           "rollback-clear", "rollback-cleared", "rollback-attributes",
                           "rollback-ready", "rollback-entry", "rollback-moved", "rollback-done"}) {
    reset();
    {
      const FullFrom full(disk, step);
      const auto ctx = restore_here(base + "/broken.zip");
      EXPECT_NE(ctx->result, 0) << step;
      disk.fill();
      disk.expect_full();
    }
    EXPECT_EQ(difference(old_tree), "") << step;
    EXPECT_FALSE(exists(snapshot())) << step;
  }
}

TEST_P(FullDiskTest, WhatIsReportedIsTrue) {
  static restore_outcome outcome;
  set_restore_progress_sink([](const restore_progress &step) { outcome = step.outcome; });
  {
    const FullFrom full(disk, "unpack");
    restore_here(base + "/good.zip");
  }
  EXPECT_EQ(outcome, restore_outcome::rolled_back);
  EXPECT_EQ(difference(old_tree), "");
}

TEST_P(FullDiskTest, AGoodRestoreOnAFullDiskEndsWithTheOldOrTheNew) {
  for (const char *step : {"snapshot", "unpack", "unpacked", "labels", "attributes", "restored"}) {
    reset();
    int result = 0;
    {
      const FullFrom full(disk, step);
      result = restore_here(base + "/good.zip")->result;
    }
    EXPECT_EQ(difference(result == 0 ? new_tree : old_tree), "") << step << ": " << result;
    EXPECT_FALSE(exists(snapshot())) << step;
  }
}

TEST_P(FullDiskTest, KilledAtEachStepOfARollbackAndRecoveredWhileTheDiskIsFull) {
  // every step is visited in turn, a few of the many alike
  std::set<int> nths;
  for (int i = 1; i < 24; ++i) nths.insert(i * i);
  int killed = 0;
  for (const int nth : nths) {
    reset();
    if (!killed_at(nth, "rollback", [this] { restore_here(base + "/broken.zip"); })) break;
    ++killed;
    {
      const FullFrom full(disk, "rollback");
      disk.fill();
      recover_interrupted_restore(kPkg, root.c_str());
    }
    EXPECT_EQ(difference(old_tree), "") << "killed at step " << nth;
    EXPECT_FALSE(exists(snapshot())) << "killed at step " << nth;
  }
  EXPECT_GT(killed, 12);
}

TEST_P(FullDiskTest, KilledInTheRecoveryAsWell) {
  int killed = 0;
  for (int nth = 1; nth < 600; nth = nth * 2 + 1) {
    reset();
    ASSERT_TRUE(killed_at(5, "rollback", [this] { restore_here(base + "/broken.zip"); }));
    if (killed_at(nth, "rollback", [this] { recover_interrupted_restore(kPkg, root.c_str()); })) {
      ++killed;
    }
    disk.fill();
    recover_interrupted_restore(kPkg, root.c_str());
    EXPECT_EQ(difference(old_tree), "") << "killed at step " << nth;
    EXPECT_FALSE(exists(snapshot())) << "killed at step " << nth;
  }
  EXPECT_GT(killed, 6);
}

INSTANTIATE_TEST_SUITE_P(Disks, FullDiskTest, ::testing::Values(Kind::kMemory, Kind::kExt4),
                         [](const auto &info) {
                           return info.param == Kind::kMemory ? "Memory" : "Ext4";
                         });

}  // namespace
