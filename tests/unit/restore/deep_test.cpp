// A tree that the writer packs is taken by the snapshot, the restore and the rollback.
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <functional>

#include "files/safe_path.h"
#include "files/tree_depth.h"
#include "quarn_common.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/settle.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/directory.h"
#include "quarn_printable.h"
#include "restore_fixture.h"

namespace {

std::function<void()> on_folder_read;

}  // namespace

extern "C" void rewinddir(DIR *dir) noexcept {
  if (on_folder_read) on_folder_read();
  reinterpret_cast<void (*)(DIR *)>(dlsym(RTLD_NEXT, "rewinddir"))(dir);
}

namespace {

class DeepTest : public RestoreTest {
 protected:
  /** Folders one in the other below "data", and a file in each of the last two. */
  void make_deep(int levels, const std::string &name, const std::string &content) {
    int at_fd = open(at("data").c_str(), O_PATH | O_DIRECTORY);
    for (int level = 0; level < levels; ++level) {
      if (level >= levels - 2) make_file(at_fd, content);
      ASSERT_EQ(mkdirat(at_fd, name.c_str(), 0755), 0);
      const int next = openat(at_fd, name.c_str(), O_RDONLY | O_DIRECTORY);
      ASSERT_EQ(fchown(next, kAppUid, kAppGid), 0);
      set_label("/proc/self/fd/" + std::to_string(next) + "/.", kDataLabel);
      close(at_fd);
      at_fd = next;
    }
    make_file(at_fd, content);
    close(at_fd);
  }
  /** Folders alone, one in the other, in the folder @p top. @return the path of the deepest */
  static std::string dig(const std::string &top, int levels) {
    std::string deepest = top;
    for (int level = 0; level < levels; ++level) {
      deepest += "/d";
      if (mkdir(deepest.c_str(), 0755) != 0 && errno != EEXIST) ADD_FAILURE() << deepest;
    }
    return deepest;
  }
  static void make_file(int dir, const std::string &content) {
    const int file = openat(dir, "file", O_WRONLY | O_CREAT | O_TRUNC, 0640);
    ASSERT_EQ(write(file, content.data(), content.size()), static_cast<ssize_t>(content.size()));
    ASSERT_EQ(fchown(file, kAppUid, kAppGid), 0);
    close(file);
    set_label("/proc/self/fd/" + std::to_string(dir) + "/file", kDataLabel);
  }
  /** What the deepest file holds, as far as there is one. */
  std::string deepest() const {
    UniqueFd here(open(at("data").c_str(), O_RDONLY | O_DIRECTORY));
    while (true) {
      const DirPtr dir = safe_opendir_at(here.get(), ".");
      UniqueFd next;
      while (const dirent *entry = readdir(dir.get())) {
        if (entry->d_type == DT_DIR && entry->d_name[0] != '.')
          next.reset(openat(here.get(), entry->d_name, O_RDONLY | O_DIRECTORY));
      }
      if (!next) break;
      here = std::move(next);
    }
    char text[64] = {};
    const UniqueFd file(openat(here.get(), "file", O_RDONLY));
    return file && read(file.get(), text, sizeof(text) - 1) > 0 ? text : "";
  }
  int restore(const std::string &archive) {
    const std::unique_ptr<pkg_restore_context> ctx(new_context());
    ctx->wait_for_result = true;
    restore_app_data("app", ctx.get());
    std::filesystem::copy_file(archive, download(),
                               std::filesystem::copy_options::overwrite_existing);
    answer();
    return ctx->result;
  }
};

TEST_F(DeepTest, WhatTheWriterPacksIsRestored) {
  make_deep(kMaxDirDepth - 1, "d", "saved");
  int error = 0;
  const std::string archive = base + "/deep.zip";
  make_zip_data(kPkg, root.c_str(), archive.c_str(), &error);
  ASSERT_EQ(error, 0);
  std::filesystem::remove_all(at("data/d"));
  make_deep(kMaxDirDepth - 1, "d", "present");
  EXPECT_EQ(restore(archive), 0);
  EXPECT_EQ(deepest(), "saved");
  EXPECT_FALSE(exists(snapshot()));
}

TEST_F(DeepTest, WhatTheWriterPacksIsRolledBack) {
  make_deep(kMaxDirDepth - 1, "d", "present");
  const Tree before = tree_of(root);
  make_archive(base + "/broken.zip", {{"data/d/d/file", "new"}, {"data/new", "new"}}, "not json");
  EXPECT_EQ(restore(base + "/broken.zip"), 36);
  EXPECT_EQ(tree_of(root) == before, true);
  EXPECT_EQ(deepest(), "present");
  EXPECT_FALSE(exists(snapshot()));
}

TEST_F(DeepTest, PathsThatAreTooLongInTheSnapshotAreRolledBack) {
  // With the snapshot's folder in front of it the path is longer than the kernel takes at once.
  const std::string name(99, 'n');
  const int levels = static_cast<int>((4090 - at("data").size() - 5) / 100);
  make_deep(levels, name, "present");
  EXPECT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  const Tree before = tree_of(at("data"));
  unpacked_file("data/new", "new");
  EXPECT_EQ(put_snapshot_back(kPkg, root.c_str()), rollback_result::whole);
  EXPECT_TRUE(tree_of(at("data")) == before);
  EXPECT_EQ(deepest(), "present");
  EXPECT_FALSE(exists(snapshot()));
}

TEST_F(DeepTest, ARollbackNeedsFewDescriptors) {
  make_deep(kMaxDirDepth - 1, "d", "present");
  rlimit before = {};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit few = {128, before.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &few), 0);
  EXPECT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  EXPECT_TRUE(delete_directory_util(at("data/d").c_str()));
  const rollback_result result = put_snapshot_back(kPkg, root.c_str());
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(result, rollback_result::whole);
  EXPECT_EQ(deepest(), "present");
}

TEST_F(DeepTest, DataThatIsDeeperThanABackupsIsLeftAsItIs) {
  make_deep(kMaxDirDepth + 1, "d", "present");
  make_archive(base + "/saved.zip", {{"data/db", "saved"}}, "{}");
  EXPECT_EQ(restore(base + "/saved.zip"), 36);
  EXPECT_EQ(deepest(), "present");
  EXPECT_FALSE(exists(snapshot()));
  EXPECT_FALSE(exists(at("data/db")));
  EXPECT_EQ(count_logged(DLOG_ERROR, "fail to temp backup : " + at("data")), 1);
}

TEST_F(DeepTest, OneFolderBeyondWhatIsPackedIsNotCopiedAsideEither) {
  make_deep(kMaxDirDepth, "d", "present");
  int error = 0;
  make_zip_data(kPkg, root.c_str(), (base + "/deep.zip").c_str(), &error);
  EXPECT_EQ(error, 36);
  EXPECT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 36);
  EXPECT_FALSE(exists(snapshot()));
  EXPECT_EQ(deepest(), "present");
  EXPECT_TRUE(delete_directory_util(at("data/d").c_str())) << "there is no bound to a removal";
}

TEST_F(DeepTest, EachFolderOfADeepTreeIsLookedAtOnceForItsAttributes) {
  make_deep(kMaxDirDepth - 1, "d", "dug");
  int folders = 0;
  on_folder_read = [&] { ++folders; };
  EXPECT_EQ(parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), nullptr), 0);
  on_folder_read = nullptr;
  EXPECT_GE(folders, kMaxDirDepth);
  EXPECT_LT(folders, 2 * kMaxDirDepth);
}

// as an application can dig while it is restored
TEST_F(DeepTest, WhatIsDugDeeperThanAnArchiveGoesIsNotLookedAtForItsAttributes) {
  make_deep(3000, "d", "dug");
  int folders = 0;
  on_folder_read = [&] { ++folders; };
  EXPECT_EQ(parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), nullptr), 0);
  on_folder_read = nullptr;
  EXPECT_EQ(folders, kMaxDirDepth);
  std::string last = at("data");
  for (int level = 1; level < kMaxDirDepth; ++level) last += "/d";
  expect_error("data at " + quarn_shortened(last, 256) + " is deeper than an archive can hold");
  EXPECT_TRUE(delete_directory_util(at("data/d").c_str()));
}

TEST_F(DeepTest, WhatIsDugDeeperThanAnArchiveGoesWhileItIsRestoredUndoesTheRestore) {
  file("data/db", "present");
  const Tree before = tree_of(root);
  make_archive(base + "/saved.zip", {{"data/db", "saved"}});
  {
    const AtStep digging("labels", [this] { dig(at("data"), kMaxDirDepth); });
    EXPECT_EQ(restore(base + "/saved.zip"), 36);
  }
  EXPECT_TRUE(tree_of(root) == before);
  const AtStep digging("labels", [this] { dig(at("data"), kMaxDirDepth - 1); });
  EXPECT_EQ(restore(base + "/saved.zip"), 0);
  EXPECT_EQ(read_text(at("data/db")), "saved");
}

TEST_F(DeepTest, WhatIsDugDeeperThanABackupGoesCountsAsWritten) {
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  std::string written;
  dig(at("data"), kMaxDirDepth - 1);
  EXPECT_FALSE(application_has_written(restore_files(kPkg, root.c_str()), &written)) << written;
  const std::string dug = dig(at("data"), kMaxDirDepth);
  EXPECT_TRUE(application_has_written(restore_files(kPkg, root.c_str()), &written));
  EXPECT_EQ(written, dug);
  EXPECT_TRUE(note_unpacked_files(kPkg, root.c_str())) << "which is none of a restore's";
}

TEST_F(DeepTest, WhatIsDugDeeperThanAnArchiveGoesIsNotSettled) {
  const std::string top = dig(at("data"), kMaxDirDepth);
  const std::string above = top.substr(0, top.size() - 2);
  const std::string moved = unpacked_file(top.substr(root.size() + 1) + "/moved", "new");
  const std::string left = unpacked_file(above.substr(root.size() + 1) + "/left", "new");
  settle_unpacked_files(kPkg, root.c_str());
  struct stat status = {};
  ASSERT_EQ(stat(left.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & ALLPERMS, 0600U);
  ASSERT_EQ(stat(moved.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & ALLPERMS, static_cast<mode_t>(S_ISVTX));
}

// No snapshot is made so deep; one of which somebody says so all the same is not walked further.
TEST_F(DeepTest, WhatIsTooDeepInASnapshotGoesBackWholeOrNotAtAll) {
  ASSERT_EQ(mkdir(snapshot().c_str(), 0700), 0);
  ASSERT_EQ(mkdir((snapshot() + "/data").c_str(), 0755), 0);
  const std::string deep = dig(snapshot() + "/data", kMaxDirDepth + 1);
  const std::string file_name = deep.substr(snapshot().size()) + "/file";
  write_text(snapshot() + file_name, "before");
  const std::string place_of_it = dig(at("data"), kMaxDirDepth + 1);
  EXPECT_EQ(parse_dir_for_rollback(snapshot().c_str(), kPkg, root.c_str()), 0);
  EXPECT_EQ(read_text(snapshot() + file_name), "before");
  expect_error("fail copy : from " + quarn_shortened(deep, 256) + " to " +
               quarn_shortened(place_of_it, 256));
  ASSERT_EQ(rmdir(place_of_it.c_str()), 0);
  EXPECT_EQ(parse_dir_for_rollback(snapshot().c_str(), kPkg, root.c_str()), 1);
  EXPECT_EQ(read_text(root + file_name), "before");
}

}  // namespace
