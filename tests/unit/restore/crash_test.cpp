// A daemon that is killed in a restore, and the next one: old or new, never a mixture.
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstring>
#include <filesystem>
#include <set>

#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/file.h"
#include "restore_fixture.h"

namespace {

class CrashTest : public RestoreTest {
 protected:
  CrashTest() {
    make_data();
    old_tree = tree_of(root);
    make_archive(base + "/archive.zip", new_data);
    // what a whole restore makes of it
    restore_here();
    new_tree = tree_of(root);
    EXPECT_NE(old_tree, new_tree);
  }

  void reset_data() {
    for (const char *name : {"data", "shared/data", "shared/trusted"}) {
      for (const auto &item : std::filesystem::directory_iterator(at(name))) {
        std::filesystem::remove_all(item);
      }
    }
    make_data();
    ASSERT_EQ(tree_of(root), old_tree);
  }
  void make_data() {
    make_old_data();
    file("shared/data/org.example.notes_upload.zip", "staged", 0600);
    dir("shared/data/quarn_tmp_rst_dir2");
    file("shared/data/quarn_tmp_rst_dir2/inner", "skipped for its name");
  }

  void restore_here() {
    pkg_restore_context ctx;
    ctx.serial = kSerial;
    ctx.pkgid = kPkg;
    ctx.version = kVersion;
    ctx.root = root;
    ctx.wait_for_result = true;
    restore_app_data("app", &ctx);
    std::filesystem::copy_file(archive, download(),
                               std::filesystem::copy_options::overwrite_existing);
    answer();
  }

  /** Run @p work in a process that is killed at its @p step th step. @return false: it ended */
  bool killed_at(int step, const std::function<void()> &work) {
    return is_killed_in([&] {
      const AtNthStep kill(step, [](const std::string &) { raise(SIGKILL); });
      work();
    });
  }

  /** What the next daemon does. */
  void recover_here() { recover_interrupted_restore(kPkg, root.c_str()); }

  /** The data now, without what a killed daemon may leave for the sweep of archives. */
  Tree tree() const {
    Tree tree = tree_of(root);
    tree.erase("shared/data/org.example.notes_download.zip");
    return tree;
  }

  const std::vector<Entry> &new_data = new_app_data();
  std::string archive = base + "/archive.zip";
  Tree old_tree;
  Tree new_tree;
};

TEST_F(CrashTest, KilledAtEveryStepOfARestore) {
  std::set<bool> seen;
  int step = 1;
  for (;; ++step) {
    reset_data();
    if (!killed_at(step, [this] { restore_here(); })) break;
    recover_here();
    const Tree now = tree();
    EXPECT_TRUE(now == old_tree || now == new_tree) << "killed at step " << step;
    seen.insert(now == new_tree);
  }
  EXPECT_GT(step, 25) << "steps of every stage";
  EXPECT_EQ(seen.size(), 2U) << "killed early the data is the old, killed late the new";
}

TEST_F(CrashTest, KilledAtEveryStepOfARollback) {
  archive = base + "/broken.zip";
  make_archive(archive, new_data, "not json");
  int step = 1;
  for (;; ++step) {
    reset_data();
    if (!killed_at(step, [this] { restore_here(); })) break;
    recover_here();
    EXPECT_EQ(tree(), old_tree) << "killed at step " << step;
  }
  EXPECT_GT(step, 30);
}

TEST_F(CrashTest, KilledAtEveryStepOfTheRecovery) {
  int step = 1;
  for (;; ++step) {
    reset_data();
    ASSERT_TRUE(is_killed_in([this] {
      const AtStep unpacked("unpacked", [] { raise(SIGKILL); });
      restore_here();
    }));
    if (!killed_at(step, [this] { recover_here(); })) break;
    recover_here();
    EXPECT_EQ(tree(), old_tree) << "killed at step " << step;
  }
  EXPECT_GT(step, 10);
}

TEST_F(CrashTest, KilledInTheMiddleOfTheUnpacking) {
  std::vector<Entry> many = new_data;
  for (int i = 0; i < 400; ++i) {
    many.push_back({"data/many/" + std::to_string(i), std::string(2000, 'm')});
  }
  make_archive(archive, many);
  for (int round = 0; round < 5; ++round) {
    reset_data();
    const int events = inotify_init1(IN_CLOEXEC);
    ASSERT_GE(inotify_add_watch(events, at("data").c_str(), IN_CREATE), 0);
    const pid_t child = fork();
    if (child == 0) {
      restore_here();
      _exit(0);
    }
    // the first new name below "data" is the unpacking's
    char event[1024];
    EXPECT_GT(read(events, event, sizeof(event)), 0);
    close(events);
    kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    recover_here();
    const Tree now = tree();
    if (WIFSIGNALED(status) && now.count("data/many/399") == 0) {
      EXPECT_EQ(now, old_tree);
    } else {
      EXPECT_EQ(now.count("data/many/0"), 1U) << "it was faster than the kill: all of the new";
      EXPECT_EQ(now.at("data/settings.ini"), new_tree.at("data/settings.ini"));
    }
  }
}

/* ---- from the companion, without a snapshot ---- */

class KilledCompanionTest : public CrashTest {
 protected:
  KilledCompanionTest() {
    current_restore_client = QUARN_CLIENT_COMPANION;
    std::filesystem::create_directories(kCompanionDir);
    std::filesystem::copy_file(
        archive, std::string(kCompanionDir) + "/" + kPkg + "_" + std::string(kVersion) + ".zip");
    ON_CALL(platform, package_manager_foreach_package_info)
        .WillByDefault([](package_manager_package_info_cb callback, void *data) {
          EXPECT_TRUE(callback(nullptr, data));
          return 0;
        });
    ON_CALL(platform, package_info_get_package).WillByDefault([](auto, char **id) {
      *id = strdup(kPkg);
      return 0;
    });
    ON_CALL(platform, package_info_get_root_path).WillByDefault([this](auto, char **path) {
      *path = strdup(root.c_str());
      return 0;
    });
  }
  ~KilledCompanionTest() override {
    std::filesystem::remove_all("/opt/usr/apps/com.velmor.pellix-efl");
  }
  void restore_from_companion() const {
    pkg_restore_context ctx;
    ctx.pkgid = kPkg;
    ctx.version = kVersion;
    ctx.root = root;
    ctx.wait_for_result = true;
    restore_app_data("app", &ctx);
  }
  int mode_of(const char *name) const {
    struct stat status = {};
    EXPECT_EQ(lstat(at(name).c_str(), &status), 0) << name;
    return static_cast<int>(status.st_mode & 07777);
  }
};

TEST_F(KilledCompanionTest, WhatWasUnpackedIsTheApplicationsToUse) {
  int step = 1;
  for (;; ++step) {
    reset_data();
    if (!killed_at(step, [this] { restore_from_companion(); })) break;
    recover_device();
    for (const auto &entry : new_data) {
      EXPECT_EQ(read_text(at(entry.name)), entry.content) << "killed at step " << step;
      const int mode = mode_of(entry.name.c_str());
      EXPECT_TRUE(mode == 0600 || mode == static_cast<int>(entry.mode))
          << entry.name << " killed at step " << step << ": " << std::oct << mode;
    }
    EXPECT_FALSE(exists(perm())) << "killed at step " << step;
    EXPECT_FALSE(exists(snapshot() + ".unpacking")) << "killed at step " << step;
  }
  EXPECT_GT(step, 5) << "steps of the attributes";
  EXPECT_FALSE(exists(snapshot() + ".unpacking")) << "nor after one that has ended";
}

TEST_F(KilledCompanionTest, AnApplicationsOwnFileOfTheNotesNameStaysAndHindersNothing) {
  const std::string note = file("shared/data/quarn_tmp_rst_dir.unpacking", "its own");
  const std::string odd = file("data/odd", "its own", 01000);
  recover_device();
  EXPECT_EQ(mode_of("data/odd"), 01000);
  restore_from_companion();
  EXPECT_EQ(read_text(at("data/settings.ini")), "new settings");
  EXPECT_EQ(read_text(note), "its own");
  expect_error("that data is unpacked cannot be noted : " + note);
}

}  // namespace
