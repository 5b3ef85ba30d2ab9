// A restore that cannot be finished leaves the application exactly as it was.
#include <linux/capability.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>

#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/snapshot.h"
#include "restore_fixture.h"

using ::testing::Return;

extern "C" {
int __real_fsync(int fd);
int __wrap_fsync(int fd);
int __real_syncfs(int fd);
int __wrap_syncfs(int fd);
}

namespace {

/** The disk takes nothing while this is set. */
std::atomic<bool> disk_fails{false};
std::atomic<int> file_system_syncs{0};

}  // namespace

int __wrap_fsync(int fd) {
  if (!disk_fails) return __real_fsync(fd);
  errno = EIO;
  return -1;
}

int __wrap_syncfs(int fd) {
  ++file_system_syncs;
  if (!disk_fails) return __real_syncfs(fd);
  errno = EIO;
  return -1;
}

namespace {

class FailureTest : public RestoreTest {
 protected:
  FailureTest() { make_old_data(); }

  /** Restore from the archive that @p prepare puts at the download's place. */
  int restore(const std::function<void()> &prepare) {
    before = tree_of(root);
    pkg_restore_context ctx;
    request_restore(&ctx);
    prepare();
    answer();
    EXPECT_EQ(ctx.pending, 0);
    return ctx.result;
  }
  int restore() {
    return restore([this] { make_archive(download(), new_data); });
  }
  void expect_untouched() const { EXPECT_EQ(tree_of(root), before); }

  std::vector<Entry> new_data = new_app_data();
  Tree before;
};

TEST_F(FailureTest, TheSameRestoreSucceedsWhenNothingIsWrong) {
  EXPECT_EQ(restore(), 0);
  EXPECT_NE(tree_of(root), before);
}

TEST_F(FailureTest, SnapshotOnAFullDisk) {
  file("shared/data/large", std::string(200000, 'l'));
  std::unique_ptr<DiskFullAfter> limit;
  const AtStep full("snapshot", [&] { limit = std::make_unique<DiskFullAfter>(100000); });
  const AtStep over("snapshot-released", [&] { limit.reset(); });
  EXPECT_EQ(restore(), 36);
  expect_error("fail to make backup for (org.example.notes) before restore. err : 36");
  expect_untouched();
}

TEST_F(FailureTest, SnapshotOfAnUnreadableFile) {
  ASSERT_EQ(chmod(at("shared/data").c_str(), 0777), 0);
  ASSERT_EQ(chmod(at("data").c_str(), 0777), 0);
  ASSERT_EQ(chmod(at("data/db").c_str(), 0777), 0);
  ASSERT_EQ(chmod(at("data/db/notes.db").c_str(), 0), 0);
  std::unique_ptr<WithoutCapabilities> none;
  const int result = restore([&] {
    make_archive(download(), new_data);
    none = std::make_unique<WithoutCapabilities>(
        std::initializer_list<int>{CAP_DAC_OVERRIDE, CAP_DAC_READ_SEARCH});
  });
  none.reset();
  EXPECT_EQ(result, 36);
  expect_error("fail to make backup for (org.example.notes) before restore. err : 36");
  expect_untouched();
}

TEST_F(FailureTest, SnapshotWhoseTableCannotBeWritten) {
  const AtStep step("snapshot-copied",
                    [&] { std::filesystem::create_directories(snapshot() + "/table/x"); });
  EXPECT_EQ(restore(), 36);
  expect_error("fail. temp_backup_initial_app_data : 36");
  expect_error("fail to make backup for (org.example.notes) before restore. err : 36");
  expect_untouched();
}

TEST_F(FailureTest, UnpackOfWhatIsNoArchive) {
  EXPECT_EQ(restore([this] { write_text(download(), "not an archive"); }), 31);
  expect_error("fail to restore app info for (org.example.notes) err : 31");
  expect_untouched();
}

TEST_F(FailureTest, UnpackOfAMissingArchive) {
  EXPECT_EQ(restore([] {}), 31);
  expect_error("fail to restore app info for (org.example.notes) err : 31");
  expect_untouched();
}

TEST_F(FailureTest, UnpackOfACorruptEntry) {
  const int result = restore([this] {
    auto entries = new_data;
    entries.push_back({"data/noise", std::string(3000, 'a') + "marker" + std::string(3000, 'b')});
    make_archive(download(), entries);
    // flip bytes in the middle of the first entries' data
    std::fstream archive(download(), std::ios::in | std::ios::out | std::ios::binary);
    archive.seekp(50);
    archive.write("\xff\xff\xff\xff\xff\xff", 6);
  });
  EXPECT_EQ(result, 31);
  expect_error("fail to restore app info for (org.example.notes) err : 31");
  expect_untouched();
}

TEST_F(FailureTest, UnpackOfAnEntryThatWouldLeaveTheApplication) {
  const int result = restore([this] {
    auto entries = new_data;
    entries.push_back({"../../escaped", "x"});
    make_archive(download(), entries);
  });
  EXPECT_EQ(result, 31);
  EXPECT_FALSE(exists(base + "/opt/usr/escaped"));
  EXPECT_FALSE(exists(base + "/opt/usr/apps/escaped"));
  expect_untouched();
}

TEST_F(FailureTest, UnpackOntoAFullDisk) {
  std::unique_ptr<DiskFullAfter> limit;
  const AtStep full("unpack", [&] { limit = std::make_unique<DiskFullAfter>(100000); });
  const AtStep over("rollback", [&] { limit.reset(); });
  const int result = restore([this] {
    auto entries = new_data;
    entries.push_back({"data/large", std::string(200000, 'l')});
    make_archive(download(), entries);
  });
  EXPECT_EQ(result, 31);
  expect_error("fail to restore app info for (org.example.notes) err : 31");
  expect_untouched();
}

TEST_F(FailureTest, DiskThatDoesNotTakeWhatWasRestored) {
  const AtStep fails("restored", [] { disk_fails = true; });
  const AtStep works("rollback", [] { disk_fails = false; });
  EXPECT_EQ(restore(), 36);
  expect_error("data of (org.example.notes) is not on the disk, so its snapshot is kept");
  expect_error("fail to restore for (org.example.notes)");
  expect_untouched();
}

TEST_F(FailureTest, DiskThatTakesNothingAnyMoreLeavesTheSnapshotToTheNextDaemon) {
  const AtStep fails("restored", [] { disk_fails = true; });
  EXPECT_EQ(restore(), 36);
  disk_fails = false;
  EXPECT_TRUE(exists(snapshot()));
  EXPECT_TRUE(recover_interrupted_restore(kPkg, root.c_str()));
  expect_untouched();
}

TEST_F(FailureTest, DiskThatDoesNotTakeTheSnapshot) {
  const AtStep fails("snapshot-copied", [] { disk_fails = true; });
  EXPECT_EQ(restore(), 36);
  disk_fails = false;
  expect_error("fail to make backup for (org.example.notes) before restore. err : 36");
  expect_untouched();
}

TEST_F(FailureTest, DiskThatDoesNotTakeManyFiles) {
  for (int i = 0; i < 200; ++i) {
    new_data.push_back({"data/many/" + std::to_string(i), std::to_string(i)});
  }
  file_system_syncs = 0;
  {
    const AtStep fails("restored", [] { disk_fails = true; });
    const AtStep works("rollback", [] { disk_fails = false; });
    EXPECT_EQ(restore(), 36);
  }
  expect_error("data of (org.example.notes) is not on the disk, so its snapshot is kept");
  expect_untouched();
  EXPECT_GT(file_system_syncs, 0);
}

TEST_F(FailureTest, AFewFilesAreSyncedWithoutWhatElseTheFileSystemHas) {
  file_system_syncs = 0;
  EXPECT_EQ(restore(), 0);
  EXPECT_EQ(file_system_syncs, 0);
}

TEST_F(FailureTest, TableThatIsMissing) {
  EXPECT_EQ(restore([this] { make_plain_archive(download(), new_data); }), 36);
  expect_error("there isn't file-info file...");
  expect_error("fail to restore for (org.example.notes)");
  expect_untouched();
}

TEST_F(FailureTest, TableThatIsNotJsonOrOfAWrongType) {
  for (const char *text : {"not json", "[]", "\"x\"", "{\"data/settings.ini\": 5}",
                           "{\"data/settings.ini\": {\"0\": \"x\"}}", "{}"}) {
    clear_captured_log();
    EXPECT_EQ(restore([&] { make_archive(download(), new_data, text); }), 36) << text;
    expect_error("fail to restore for (org.example.notes)");
    expect_untouched();
  }
}

TEST_F(FailureTest, TableWithMissingMembers) {
  for (const char *member : {"0", "1", "2", "3"}) {
    const JsonPtr whole = table(new_data);
    json_object_object_del(json_object_object_get(whole.get(), "data/db/notes.db"), member);
    EXPECT_EQ(
        restore([&] { make_archive(download(), new_data, json_object_get_string(whole.get())); }),
        36)
        << member;
    expect_untouched();
  }
}

TEST_F(FailureTest, LabelThatIsUnknown) {
  auto entries = new_data;
  entries[2].label = "somebody.else";
  EXPECT_EQ(restore([&] { make_archive(download(), entries); }), 36);
  expect_error("fail : unknown smack label...");
  expect_untouched();
}

TEST_F(FailureTest, LabelThatIsEmpty) {
  auto entries = new_data;
  entries[0].label = "";
  EXPECT_EQ(restore([&] { make_archive(download(), entries); }), 36);
  expect_untouched();
}

TEST_F(FailureTest, SecurityServerThatRefusesAtEachStep) {
  const struct {
    int *result;
    std::string message;
  } cases[] = {
      {&begin_result, "fail : security_server_perm_begin...(err=-2)"},
      {&setup_result, "error : security_server_perm_app_setup_path " + at("data") + " (err=-2)"},
      {&commit_result, "fail : security_server_perm_commit...(err=-2)"},
      {&label_result, "fail : security_server_label_access...(err=-2)"},
  };
  for (const auto &one : cases) {
    clear_captured_log();
    *one.result = -2;
    EXPECT_EQ(restore(), 36) << one.message;
    *one.result = 0;
    expect_error(one.message);
    expect_error("fail to restore for (org.example.notes)");
    expect_untouched();
    EXPECT_EQ(transactions, 0);
  }
}

TEST_F(FailureTest, WalkThatMeetsAFileWhichTheArchiveDoesNotKnow) {
  file("data/newer", "made since", 0600);
  EXPECT_EQ(restore(), 36);
  expect_error("fail to restore file info : " + at("data/newer"));
  expect_error("fail to restore directory : " + at("data") + "...");
  expect_error("fail to restore for (org.example.notes)");
  expect_untouched();
}

TEST_F(FailureTest, WalkThatMayNotChangeOwners) {
  std::unique_ptr<WithoutCapabilities> none;
  const AtStep without("unpacked", [&] {
    none = std::make_unique<WithoutCapabilities>(std::initializer_list<int>{CAP_CHOWN});
  });
  const AtStep with("rollback", [&] { none.reset(); });
  // the only thing in the data that is not the package's already
  ASSERT_EQ(chown(at("data/db").c_str(), 0, 0), 0);
  ASSERT_EQ(chmod(at("data/db").c_str(), 0755), 0);
  EXPECT_EQ(restore(), 36);
  expect_error("chown: error \n");
  expect_untouched();
}

}  // namespace
