// Whose files a restore makes, reads and changes.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <regex>

#include "quarn_common.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/package_identity.h"
#include "restore_fixture.h"

namespace {

class IdentityTest : public RestoreTest {
 protected:
  ~IdentityTest() override {
    // what is closed to its owner must not stop the removal
    static_cast<void>(chmod(at("data/closed").c_str(), 0755));
  }
  int restore(const std::string &archive) {
    pkg_restore_context ctx;
    request_restore(&ctx);
    std::filesystem::copy_file(archive, download(),
                               std::filesystem::copy_options::overwrite_existing);
    answer();
    return ctx.result;
  }
  struct stat status_of(const std::string &name) const {
    struct stat status = {};
    EXPECT_EQ(lstat(at(name).c_str(), &status), 0) << name;
    return status;
  }
  void chown_to(const std::string &name, uid_t uid, gid_t gid, mode_t mode) const {
    ASSERT_EQ(chown(at(name).c_str(), uid, gid), 0);
    ASSERT_EQ(chmod(at(name).c_str(), mode), 0);
  }
  /** What an application has closed to itself, and what others have put among its data. */
  void make_closed_data() {
    file("data/nothing", "0000", 0000);
    file("data/read", "0400", 0400);
    dir("data/closed");
    file("data/closed/a", "in a closed folder", 0000);
    dir("data/fixed");
    file("data/fixed/a", "in a fixed folder");
    chown_to("data/closed", kAppUid, kAppGid, 0000);
    chown_to("data/fixed", kAppUid, kAppGid, 0555);
    file("data/own", "its own", 0600);
    ASSERT_EQ(link(at("data/own").c_str(), at("data/own.too").c_str()), 0);
    dir("data/theirs");
    file("data/theirs/a", "another's, in another's folder");
    chown_to("data/theirs/a", 5001, 100, 0600);
    chown_to("data/theirs", 5001, 100, 0755);
    file("data/readable", "another's, to be read");
    chown_to("data/readable", 5001, 100, 0644);
    file("data/secret", "another's, not to be read");
    chown_to("data/secret", 0, 0, 0600);
  }
  std::vector<Entry> closed_entries() const {
    std::vector<Entry> entries;
    for (const char *name :
         {"data/nothing", "data/read", "data/closed/a", "data/fixed/a", "data/own", "data/own.too",
          "data/theirs/a", "data/readable", "data/secret"}) {
      entries.push_back({name, "new", 0640});
    }
    return entries;
  }
};

TEST_F(IdentityTest, WhatIsClosedOrAnothersIsPutBackAsItWas) {
  make_closed_data();
  const Tree before = tree_of(root);
  const struct stat secret = status_of("data/secret");
  make_archive(base + "/broken.zip", closed_entries(), "not json");
  EXPECT_EQ(restore(base + "/broken.zip"), QUARN_REFUSED);
  EXPECT_EQ(tree_of(root), before);
  EXPECT_EQ(status_of("data/secret").st_ino, secret.st_ino) << "not a copy of it";
  EXPECT_EQ(status_of("data/secret").st_nlink, 1U);
}

TEST_F(IdentityTest, WhatLiesInAnothersFolderThatTheApplicationMayWriteIsPutBack) {
  make_archive(base + "/broken.zip",
               {{"data/theirs/a", "new"}, {"data/theirs/b", "new"}, {"data/theirs/in/c", "new"}},
               "not json");
  for (const mode_t mode : {0777, 0775, 01777}) {
    dir("data/theirs");
    file("data/theirs/a", "another's");
    file("data/theirs/own", "its own");
    chown_to("data/theirs/a", 5001, kAppGid, 0644);
    chown_to("data/theirs", 5001, kAppGid, mode);
    const Tree before = tree_of(root);
    EXPECT_NE(restore(base + "/broken.zip"), 0);
    EXPECT_EQ(tree_of(root), before) << std::oct << mode;
    std::filesystem::remove_all(at("data/theirs"));
  }
}

TEST_F(IdentityTest, WhatIsClosedIsRestored) {
  make_closed_data();
  make_archive(base + "/good.zip", closed_entries());
  EXPECT_EQ(restore(base + "/good.zip"), 0);
  for (const Entry &entry : closed_entries()) {
    const struct stat status = status_of(entry.name);
    EXPECT_EQ(read_text(at(entry.name)), "new") << entry.name;
    EXPECT_EQ(status.st_mode & 07777, 0640U) << entry.name;
    EXPECT_EQ(status.st_uid, kAppUid) << entry.name;
    EXPECT_EQ(status.st_gid, kAppGid) << entry.name;
  }
}

TEST_F(IdentityTest, ALinkToAnothersFileIsReplacedAndTheFileStaysAsItIs) {
  const std::string secret = base + "/secret";
  write_text(secret, "secret");
  ASSERT_EQ(chmod(secret.c_str(), 0600), 0);
  set_label(secret, "secret");
  const std::string archives[] = {base + "/good.zip", base + "/broken.zip"};
  const std::vector<Entry> entries = {{"data/a", "new", 0666, "wrt::db_origin"}};
  make_archive(archives[0], entries);
  make_archive(archives[1], entries, "not json");
  for (const std::string &archive : archives) {
    std::filesystem::remove(at("data/a"));
    ASSERT_EQ(link(secret.c_str(), at("data/a").c_str()), 0);
    restore(archive);
    struct stat status = {};
    ASSERT_EQ(stat(secret.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0600U);
    EXPECT_EQ(status.st_uid, 0U);
    EXPECT_EQ(label_of(secret), "secret");
    EXPECT_EQ(read_text(secret), "secret");
  }
}

TEST_F(IdentityTest, WhatASnapshotKeepsByItsLastNameIsNotReadByAnotherNameOfTheSnapshot) {
  const std::string secret = base + "/secret";
  write_text(secret, "secret");
  ASSERT_EQ(chmod(secret.c_str(), 0600), 0);
  dir("data/folder");
  for (const char *name : {"data/a", "data/folder/a"}) {
    ASSERT_EQ(link(secret.c_str(), at(name).c_str()), 0);
  }
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  chown_to("shared/data", kAppUid, kAppGid, 0755);
  const std::string mine = "shared/data/mine";
  ASSERT_EQ(rename(snapshot().c_str(), at(mine).c_str()), 0);
  std::filesystem::remove(secret);
  std::filesystem::remove(at("data/a"));
  std::filesystem::remove(at("data/folder/a"));
  const UniqueFd package(open(root.c_str(), O_PATH | O_DIRECTORY));
  for (const char *name : {"/data/a", "/data/folder/a"}) {
    EXPECT_EQ(status_of(mine + name).st_uid, 0U);
    const UniqueFd file = open_below_as_package(package.get(), (mine + name).c_str(), O_RDONLY, 0,
                                                user_of_package(), nullptr);
    EXPECT_FALSE(file) << name;
    EXPECT_EQ(errno, EACCES) << name;
    std::filesystem::remove(at(mine + name));
  }
}

TEST_F(IdentityTest, AFolderOfRootsThatTheApplicationMayHaveMovedIsNotRemovedAsTheDaemonsOwn) {
  const restore_files files(kPkg, root);
  for (const std::string &place : {files.snapshot, files.aside, files.table_aside}) {
    ASSERT_EQ(mkdir(place.c_str(), 0777), 0);
    ASSERT_EQ(chmod(place.c_str(), 0777), 0);
    write_text(place + "/roots", "root's");
  }
  EXPECT_FALSE(remove_snapshot(files));
  forget_told_snapshot(files);
  put_own_table_back(files);
  for (const std::string &place : {files.snapshot, files.aside, files.table_aside}) {
    EXPECT_EQ(read_text(place + "/roots"), "root's") << place;
    std::filesystem::remove_all(place);
  }
  clear_captured_log();
}

TEST_F(IdentityTest, AnApplicationsOwnHardLinksAreNoReasonToRefuse) {
  file("data/a", "x", 0600);
  ASSERT_EQ(link(at("data/a").c_str(), at("data/b").c_str()), 0);
  const JsonPtr entries = table({{"data/a", "", 0640}, {"data/b", "", 0640}});
  EXPECT_EQ(parse_app_dir_for_restore(at("data").c_str(), kPkg, root.c_str(), entries.get()), 1);
  EXPECT_EQ(status_of("data/b").st_mode & 07777, 0640U);
}

TEST_F(IdentityTest, AnArchiveBringsSetIdBitsAndNeverAnOwner) {
  const std::vector<Entry> entries = {{"data/tool", "new", 06755}, {"data/dir/a", "new", 01777}};
  const std::string foreign = std::regex_replace(table_text(entries), std::regex("5000"), "0");
  ASSERT_NE(foreign, table_text(entries));
  make_archive(base + "/archive.zip", entries, foreign.c_str());
  EXPECT_EQ(restore(base + "/archive.zip"), 0);
  EXPECT_EQ(status_of("data/tool").st_mode & 07777, 06755U);
  EXPECT_EQ(status_of("data/dir/a").st_mode & 07777, 01777U);
  for (const char *name : {"data/tool", "data/dir", "data/dir/a"}) {
    EXPECT_EQ(status_of(name).st_uid, kAppUid) << name;
    EXPECT_EQ(status_of(name).st_gid, kAppGid) << name;
  }
}

TEST_F(IdentityTest, WhatIsUnpackedIsTheApplicationsBeforeItHasItsAttributes) {
  make_archive(base + "/archive.zip", {{"data/dir/a", "new"}});
  struct stat unpacked = {};
  struct stat folder = {};
  {
    const AtStep step("unpacked", [&] {
      unpacked = status_of("data/dir/a");
      folder = status_of("data/dir");
    });
    EXPECT_EQ(restore(base + "/archive.zip"), 0);
  }
  EXPECT_EQ(unpacked.st_uid, kAppUid);
  EXPECT_EQ(unpacked.st_mode & 07777, 01000U) << "nobody opens it yet";
  EXPECT_EQ(folder.st_uid, kAppUid);
}

TEST_F(IdentityTest, WhatWasPutIntoAFolderThatGoesBackToAnotherDoesNotStayInIt) {
  file("data/theirs/a", "theirs");
  chown_to("data/theirs/a", 5001, 100, 0600);
  chown_to("data/theirs", 5001, 100, 0755);
  const Tree before = tree_of(root);
  make_archive(base + "/broken.zip", {{"data/theirs/a", "new"}, {"data/theirs/b", "new"}},
               "no json");
  const std::string secret = base + "/secret";
  const AtStep given("unpacked", [this] { chown_to("data/theirs", kAppUid, kAppGid, 0755); });
  const AtStep planted("rollback-ready", [&] {
    for (const char *name : {"data/theirs/a", "data/theirs/planted"}) {
      write_text(secret, "secret");
      ASSERT_EQ(chmod(secret.c_str(), 0600), 0);
      ASSERT_EQ(rename(secret.c_str(), at(name).c_str()), 0);  // a link whose first name has gone
    }
  });
  EXPECT_EQ(restore(base + "/broken.zip"), QUARN_REFUSED);
  EXPECT_EQ(tree_of(root), before);
}

TEST_F(IdentityTest, NorWhatWasPutIntoOneOfWhichTheSnapshotHoldsNoFile) {
  const std::string secret = base + "/secret";
  write_text(secret, "root's");
  ASSERT_EQ(chmod(secret.c_str(), 0600), 0);
  dir("data/theirs");
  chown_to("data/theirs", 0, 0, 0755);
  make_archive(base + "/broken.zip", {{"data/new", "new", 0640}}, "not json");
  const AtStep planted("rollback-moved", [&] {
    ASSERT_FALSE(exists(at("data/theirs"))) << "it was empty";
    dir("data/theirs");
    ASSERT_EQ(link(secret.c_str(), at("data/theirs/planted").c_str()), 0);
    ASSERT_EQ(unlink(secret.c_str()), 0);
    chown_to("data/theirs", kAppUid, kAppGid, 0755);
  });
  EXPECT_EQ(restore(base + "/broken.zip"), QUARN_REFUSED);
  EXPECT_EQ(status_of("data/theirs").st_uid, 0U);
  EXPECT_EQ(status_of("data/theirs").st_mode & 07777U, 0755U);
  EXPECT_FALSE(exists(at("data/theirs/planted")));
}

TEST_F(IdentityTest, AnExchangedTableIsNotRead) {
  file("data/a", "old", 0600);
  const std::vector<Entry> entries = {{"data/a", "new", 0644}};
  make_archive(base + "/archive.zip", entries);
  const AtStep step("table", [&] {
    std::filesystem::remove(perm());
    file("shared/data/org.example.notes.perm", table_text({{"data/a", "", 0666}}), 0600);
  });
  EXPECT_EQ(restore(base + "/archive.zip"), QUARN_REFUSED);
  expect_error("cannot read file-info file...");
  EXPECT_EQ(read_text(at("data/a")), "old");
}

TEST_F(IdentityTest, WhatACompanionsFailedRestoreLeavesIsTheApplicationsToUse) {
  current_restore_client = QUARN_CLIENT_COMPANION;
  std::filesystem::create_directories(kCompanionDir);
  const std::string archive =
      std::string(kCompanionDir) + "/" + kPkg + "_" + std::string(kVersion) + ".zip";
  const std::vector<Entry> told = {{"data/dir/told", "new", 0640}};
  std::vector<Entry> all = told;
  all.push_back({"data/dir/untold", "new"});
  make_archive(archive, all, table_text(told).c_str());
  file("data/theirs", "looks like a file that is unpacked");
  chown_to("data/theirs", 5001, 100, 01000);
  set_label(at("data/theirs"), "theirs");
  for (const int refusal : {0, -2}) {
    begin_result = refusal;
    pkg_restore_context ctx;
    ctx.pkgid = kPkg;
    ctx.version = kVersion;
    ctx.root = root;
    ctx.wait_for_result = true;
    EXPECT_EQ(restore_app_data("app", &ctx), 0);
    expect_error("fail to restore for (org.example.notes)");
    clear_captured_log();
    EXPECT_EQ(status_of("data/dir/told").st_mode & 07777, refusal == 0 ? 0640U : 0600U);
    EXPECT_EQ(status_of("data/dir/untold").st_mode & 07777, 0600U);
    for (const char *name : {"data/dir", "data/dir/told", "data/dir/untold"}) {
      EXPECT_EQ(status_of(name).st_uid, kAppUid) << name;
    }
    EXPECT_EQ(label_of(at("data/dir/told")), kDataLabel);
    EXPECT_EQ(label_of(at("data/dir/untold")), kDataLabel);
    EXPECT_EQ(status_of("data/theirs").st_mode & 07777, 01000U);
    EXPECT_EQ(label_of(at("data/theirs")), "theirs");
  }
  std::filesystem::remove(archive);
}

TEST_F(IdentityTest, AnArchiveThatWasExchangedIsNotUnpacked) {
  file("data/a", "old");
  const Tree before = tree_of(root);
  auto *ctx = new_context();
  ctx->wait_for_result = true;
  ASSERT_EQ(restore_app_data("app", ctx), 0);
  make_archive(download(), {{"data/a", "its own"}});
  ASSERT_EQ(chown(download().c_str(), kAppUid, kAppGid), 0);
  answer();
  EXPECT_EQ(ctx->result, QUARN_UNREADABLE);
  expect_error("archive of (org.example.notes) was exchanged");
  std::filesystem::remove(download());
  EXPECT_EQ(tree_of(root), before);
  delete ctx;
}

TEST_F(IdentityTest, AnArchiveThatIsExchangedAfterItsOpeningDoesNotMatter) {
  file("data/a", "old");
  make_archive(base + "/archive.zip", {{"data/a", "new"}});
  make_archive(base + "/other.zip", {{"data/a", "its own"}});
  const AtStep step("unpack",
                    [this] { rename((base + "/other.zip").c_str(), download().c_str()); });
  EXPECT_EQ(restore(base + "/archive.zip"), 0);
  EXPECT_EQ(read_text(at("data/a")), "new");
}

}  // namespace
