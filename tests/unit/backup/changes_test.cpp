#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "backup_device.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/changes.h"
#include "quarn_d_backup/kept_packages.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/path_rules.h"

using ::testing::AllOf;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::IsEmpty;
using ::testing::StartsWith;

namespace {

constexpr int kFailure = -5;

class Changes : public BackupDevice {
 protected:
  Changes() : ctx_(new backup_context) {
    ctx_->serial_number = kSerial;
    ctx_->model_name = "Model One";
  }

  void examine(const FakePackage &package) {
    EXPECT_TRUE(foreach_package_info_callback(
        reinterpret_cast<package_info_h>(const_cast<FakePackage *>(&package)), ctx_.get()));
  }
  /** As if the package were the one under examination. */
  void make_current(const FakePackage &package) {
    ctx_->cur_pkg_id = package.id;
    ctx_->cur_version = package.version;
    ctx_->cur_pkg_type = package.type;
    ctx_->cur_root_path = package.root;
  }
  std::vector<std::string> to_upload() const {
    std::vector<std::string> ids;
    for (const auto &package : ctx_->upload_list) ids.push_back(package.pkg_id);
    return ids;
  }
  std::vector<std::string> current() const {
    std::vector<std::string> ids;
    for (const auto &package : ctx_->current_pkg_list) ids.push_back(package.pkg_id);
    return ids;
  }
  /** Walk all packages; what was listed as "id version crc". */
  std::vector<std::string> listed() {
    EXPECT_EQ(make_backup_items(ctx_.get()), 0);
    if (!exists(kLocalAppListPath)) return {"(no list)"};
    const AppList list(read_text(kLocalAppListPath));
    return list.packages(list.models() - 1);
  }
  std::vector<std::string> listed_ids() {
    std::vector<std::string> ids;
    for (const auto &package : listed()) ids.push_back(package.substr(0, package.find(' ')));
    return ids;
  }
  /** The last list named this. */
  void previously(const std::string &id, const std::string &version, int crc) {
    ctx_->previous_pkg_list.push_back({"", id, version, "", crc});
  }
  std::int32_t crc_of_archive(const FakePackage &package) {
    int error = 0;
    make_zip_data(package.id.c_str(), package.root.c_str(), package.staged().c_str(), &error);
    EXPECT_EQ(error, 0);
    const auto crc = static_cast<std::int32_t>(get_file_crc(package.staged().c_str()));
    std::filesystem::remove(package.staged());
    return crc;
  }
  int info(const std::string &text) const { return count_logged(DLOG_INFO, text); }
  int error(const std::string &text) const { return count_logged(DLOG_ERROR, text); }

  BackupContextPtr ctx_;
};

TEST_F(Changes, ChangedPackageIsArchivedListedAndQueued) {
  const FakePackage &app = install("org.app");
  const auto crc = crc_of_archive(app);
  EXPECT_THAT(listed(), ElementsAre("org.app 1.0.0 " + std::to_string(crc)));
  ASSERT_EQ(ctx_->upload_list.size(), 1U);
  const pkg_information &queued = ctx_->upload_list[0];
  EXPECT_EQ(queued.serial, kSerial);
  EXPECT_EQ(queued.version, "1.0.0");
  EXPECT_EQ(queued.root_path, app.root);
  EXPECT_EQ(queued.crc, 0);
  EXPECT_TRUE(exists(app.staged()));
  EXPECT_EQ(info("backup enabled for (org.app)"), 1);
  EXPECT_EQ(info("app data of (org.app) was changed, so will be backed up"), 1);
  EXPECT_EQ(info("add (org.app) to package list"), 1);
  EXPECT_TRUE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, UnchangedPackageIsListedWithTheSameCrcAndNotUploaded) {
  const FakePackage &app = install("org.app");
  const auto crc = crc_of_archive(app);
  previously("org.app", "1.0.0", crc);
  EXPECT_THAT(listed(), ElementsAre("org.app 1.0.0 " + std::to_string(crc)));
  EXPECT_THAT(to_upload(), IsEmpty());
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_EQ(
      info("same backup for (org.app) already exist in cloud!(crc : " + std::to_string(crc) + ")"),
      1);
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, NewVersionWithIdenticalDataIsUploaded) {
  const FakePackage &app = install("org.app", "2.0.0");
  previously("org.app", "1.0.0", crc_of_archive(app));
  listed();
  EXPECT_THAT(to_upload(), ElementsAre("org.app"));
}

TEST_F(Changes, PreviousCrcIsTheFirstOfIdAndVersion) {
  make_current(install("org.app", "2"));
  EXPECT_EQ(get_previous_crc_value(ctx_.get()), 0);
  previously("org.app", "1", 11);
  previously("org.app2", "2", 12);
  previously("org.app", "2", 13);
  previously("org.app", "2", 14);
  EXPECT_EQ(get_previous_crc_value(ctx_.get()), 13);
  ctx_->cur_version = "1";
  EXPECT_EQ(get_previous_crc_value(ctx_.get()), 11);
  ctx_->cur_version = "3";
  EXPECT_EQ(get_previous_crc_value(ctx_.get()), 0);
}

TEST_F(Changes, PreloadedPackageIsNeitherListedNorBackedUp) {
  install("org.preload").preload = true;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_THAT(to_upload(), IsEmpty());
  EXPECT_THAT(current(), IsEmpty());
  EXPECT_EQ(error("package_info_is_preload_package fail, err = [-5]"), 0);
}

TEST_F(Changes, DisabledPackageIsListedWithCrcZeroWithoutAnArchive) {
  FakePackage &app = install("org.app");
  app.apps = {{"org.app.one"}, {"org.app.two", true}};
  EXPECT_THAT(listed(), ElementsAre("org.app 1.0.0 0"));
  EXPECT_EQ(info("backup disabled for (org.app)"), 1);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_THAT(to_upload(), IsEmpty());
  EXPECT_THAT(current(), ElementsAre("org.app")) << "its folder in the cloud stays";
}

TEST_F(Changes, PackageWithSeveralApplicationsGivesOneArchive) {
  FakePackage &app = install("org.app");
  app.apps = {{"org.app.one"}, {"org.app.two"}, {"org.app.three"}};
  EXPECT_THAT(listed(), ElementsAre(StartsWith("org.app 1.0.0 ")));
  EXPECT_THAT(to_upload(), ElementsAre("org.app"));
  EXPECT_THAT(current(), ElementsAre("org.app"));
}

TEST_F(Changes, PackageWithoutApplicationsIsListedWithCrcZero) {
  install("org.app").apps.clear();
  EXPECT_THAT(listed(), ElementsAre("org.app 1.0.0 0"));
  EXPECT_THAT(current(), ElementsAre("org.app"));
}

TEST_F(Changes, ExternalStorageIsSkippedAndListed) {
  const FakePackage &app = install("org.app");
  package("org.app").external = true;
  EXPECT_THAT(listed(), ElementsAre("org.app 1.0.0 0"));
  EXPECT_EQ(info("current storage of (org.app) is external, so will not be backed up"), 1);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, ExactlyTheCapIsArchived) {
  const FakePackage &app = install("org.app", "1.0.0", "");
  write_sparse(app.root + "/data/big", 26214400);
  make_current(app);
  EXPECT_EQ(get_app_backup_size(ctx_.get()), 26214400U);
  EXPECT_EQ(make_app_data_zip(ctx_.get(), "org.app"), 0);
  EXPECT_EQ(info("app backup size exceed 25MB, so will not backup data"), 0);
}

TEST_F(Changes, OneByteOverTheCapIsSkipped) {
  const FakePackage &app = install("org.app", "1.0.0", "x");
  write_sparse(app.root + "/shared/trusted/big", 26214400);
  make_current(app);
  EXPECT_EQ(make_app_data_zip(ctx_.get(), "org.app"), 34);
  EXPECT_EQ(info("app backup size exceed 25MB, so will not backup data"), 1);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, DataThatDoesNotFitTheFreeSpaceIsSkipped) {
  const FakePackage &app = install("org.app", "1.0.0", "");
  const std::uint64_t size = get_dir_available_size(app.root.c_str()) + (std::uint64_t{1} << 34);
  write_sparse(app.root + "/data/huge", size);
  make_current(app);
  EXPECT_EQ(make_app_data_zip(ctx_.get(), "org.app"), 34);
  EXPECT_THAT(captured_texts(),
              Contains(AllOf(StartsWith("app backup size(=" + std::to_string(size) +
                                        ") exceed available space size(="),
                             EndsWith("), so can not backup data"))));
  EXPECT_EQ(info("app backup size exceed 25MB, so will not backup data"), 0);
}

TEST_F(Changes, UnreadableDirectoryCountsAsTooLarge) {
  const FakePackage &app = install("org.app");
  std::filesystem::remove_all(app.root + "/shared/trusted");
  EXPECT_THAT(listed(), ElementsAre("org.app 1.0.0 0"));
  EXPECT_EQ(info("app backup size exceed 25MB, so will not backup data"), 1);
  EXPECT_THAT(to_upload(), IsEmpty());
}

TEST_F(Changes, ArchiveWithAnErrorIsDeletedAndNotQueued) {
  const FakePackage &app = install("org.app");
  // a label that cannot be read makes an archive incomplete
  ON_CALL(platform_, smack_getlabel).WillByDefault(::testing::Return(-1));
  make_current(app);
  EXPECT_EQ(make_app_data_zip(ctx_.get(), "org.app"), 36);
  EXPECT_EQ(error("fail to make zip data for org.app"), 1);
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_THAT(to_upload(), IsEmpty());
  EXPECT_EQ(ctx_->cur_crc, 0);
  EXPECT_THAT(current(), ElementsAre("org.app"));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, SinglePackageRunLeavesTheUploadToItsRequester) {
  const FakePackage &app = install("org.app");
  ctx_->single_package = true;
  make_current(app);
  EXPECT_EQ(make_app_data_zip(ctx_.get(), "org.app"), 0);
  EXPECT_THAT(to_upload(), IsEmpty());
  EXPECT_TRUE(exists(app.staged()));
  EXPECT_TRUE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, RulesThatCannotBeUsedLetNothingLeaveTheDevice) {
  const FakePackage &app = install("org.app");
  std::filesystem::create_directories(app.root + "/res");
  std::string large = "<backup><exclude path=\"data/\"/>";
  large.resize(300000, ' ');
  for (const std::string &rules :
       {std::string("<!DOCTYPE backup [<!ENTITY d \"data/\">]><backup><exclude path=\"&d;\"/>"
                    "</backup>"),
        large + "</backup>"}) {
    write_text(app.root + "/res/backup.path.xml", rules);
    make_current(app);
    clear_captured_log();
    EXPECT_EQ(make_app_data_zip(ctx_.get(), "org.app"), 36);
    EXPECT_EQ(error("rules file of (org.app) cannot be used, so will not backup data"), 1);
    EXPECT_FALSE(exists(app.staged()));
    EXPECT_THAT(to_upload(), IsEmpty());
    EXPECT_THAT(current(), ElementsAre("org.app")) << "what the cloud holds of it stays";
    // also where nobody looked at the rules
    int result = 0;
    make_zip_data("org.app", app.root.c_str(), app.staged().c_str(), &result);
    EXPECT_EQ(result, 36);
    EXPECT_FALSE(exists(app.staged()));
  }
}

TEST_F(Changes, RulesThatCannotBeUsedCostNoOtherPackage) {
  const FakePackage &first = install("org.a");
  std::filesystem::create_directories(first.root + "/res");
  write_text(first.root + "/res/backup.path.xml", "<!DOCTYPE backup [<!ENTITY d \"x\">]><backup/>");
  install("org.b");
  EXPECT_THAT(listed_ids(), ElementsAre("org.a", "org.b"));
  EXPECT_THAT(to_upload(), ElementsAre("org.b"));
}

TEST_F(Changes, RulesOfThePackageAreLoaded) {
  const FakePackage &app = install("org.app");
  std::filesystem::create_directories(app.root + "/res");
  write_text(app.root + "/res/backup.path.xml",
             "<backup><exclude path=\"/data/file.txt\"/></backup>");
  write_text(app.root + "/data/kept", "12345");
  make_current(app);
  EXPECT_EQ(check_current_backup_size(ctx_.get()), 0);
  EXPECT_EQ(get_app_backup_size(ctx_.get()), 5U);
  reset_backup_path_info();
}

TEST_F(Changes, PreloadQueryFailureSkipsThePackage) {
  install("org.app").preload_result = kFailure;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("package_info_is_preload_package fail, err = [-5]"), 1);
  EXPECT_FALSE(ctx_->package_walk_complete);
}

TEST_F(Changes, IdFailureSkipsThePackage) {
  install("org.app").id_result = kFailure;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("package_info_get_package() was failed, ret = [-5]"), 1);
  EXPECT_FALSE(ctx_->package_walk_complete);
}

TEST_F(Changes, MissingIdSkipsThePackage) {
  install("org.app").null_id = true;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("pkg_id is NULL"), 1);
  EXPECT_FALSE(ctx_->package_walk_complete);
}

TEST_F(Changes, VersionFailureSkipsThePackage) {
  install("org.app").version_result = kFailure;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("package_info_get_version() was failed, ret = [-5]"), 1);
  EXPECT_THAT(ctx_->unexamined_pkg_ids, ElementsAre("org.app"));
}

TEST_F(Changes, MissingVersionSkipsThePackage) {
  install("org.app").null_version = true;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("pkg_version is NULL"), 1);
}

TEST_F(Changes, TypeFailureSkipsThePackage) {
  install("org.app").type_result = kFailure;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("package_info_get_type() was failed, ret = [-5]"), 1);
}

TEST_F(Changes, MissingTypeSkipsThePackage) {
  install("org.app").null_type = true;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("pkg_type is NULL"), 1);
}

TEST_F(Changes, RootFailureSkipsThePackage) {
  install("org.app").root_result = kFailure;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("package_info_get_root_path() was failed, ret = [-5]"), 1);
}

TEST_F(Changes, MissingRootSkipsThePackage) {
  install("org.app").null_root = true;
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("pkg_root_path is NULL"), 1);
}

TEST_F(Changes, FailedFirstWalkOverApplicationsSkipsThePackage) {
  install("org.app").walk_results = {kFailure};
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("package_info_foreach_app_from_package() fail, err = [-5]"), 1);
  EXPECT_THAT(to_upload(), IsEmpty());
}

TEST_F(Changes, FailedSecondWalkOverApplicationsTakesTheArchiveBack) {
  const FakePackage &app = install("org.app");
  package("org.app").walk_results = {0, kFailure};
  previously("org.app", "0.9", 5);
  EXPECT_THAT(listed(), ElementsAre("org.app 0.9 5")) << "the last backup is still to be found";
  EXPECT_EQ(error("package_info_foreach_app_from_package() fail, err = [-5]"), 1);
  EXPECT_THAT(to_upload(), IsEmpty());
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_FALSE(holds_staged_archive(ctx_.get(), "org.app"));
}

TEST_F(Changes, SkippedPackageDoesNotDisturbTheOthers) {
  install("org.a");
  install("org.b").version_result = kFailure;
  install("org.c");
  EXPECT_THAT(listed_ids(), ElementsAre("org.a", "org.c"));
  EXPECT_THAT(to_upload(), ElementsAre("org.a", "org.c"));
}

TEST_F(Changes, UnsafeIdOrVersionNeverFormsAPath) {
  install("org.app").version = "../../other";
  packages_.emplace_back(packages_.front());
  packages_.back().id = "..";
  packages_.back().version = "1";
  packages_.emplace_back(packages_.back());
  packages_.back().id = "a/b";
  EXPECT_THAT(listed(), IsEmpty());
  EXPECT_EQ(error("refused package with unsafe id or version : (org.app), (../../other)"), 1);
  EXPECT_EQ(error("refused package with unsafe id or version : (..), (1)"), 1);
  EXPECT_EQ(error("refused package with unsafe id or version : (a/b), (1)"), 1);
  EXPECT_THAT(ctx_->unexamined_pkg_ids, ElementsAre("org.app"));
  ctx_->cur_pkg_id = "a/../b";
  EXPECT_EQ(make_app_data_zip(ctx_.get(), "app"), 36);
}

TEST_F(Changes, FailedPackageWalkGoesOnWithWhatWasCollected) {
  install("org.a");
  package_walk_result_ = kFailure;
  previously("org.a", "1.0.0", 3);
  previously("org.b", "2", 7);
  const auto packages = listed();
  EXPECT_EQ(error("package_manager_foreach_package_info() failed -5"), 1);
  ASSERT_EQ(packages.size(), 2U);
  EXPECT_THAT(packages[0], StartsWith("org.a 1.0.0 "));
  EXPECT_EQ(packages[1], "org.b 2 7") << "not seen, so still listed";
  EXPECT_FALSE(ctx_->package_walk_complete);
}

TEST_F(Changes, UninstalledPackageLeavesTheList) {
  install("org.a");
  previously("org.gone", "2", 7);
  EXPECT_THAT(listed_ids(), ElementsAre("org.a"));
}

TEST_F(Changes, ApplicationCallbackDoesNothingForADisabledOrFinishedPackage) {
  make_current(install("org.app"));
  ctx_->cur_backup_enabled = false;
  EXPECT_TRUE(app_info_foreach_cb(PACKAGE_INFO_UIAPP, "org.app", ctx_.get()));
  EXPECT_FALSE(ctx_->zip_made);
  ctx_->cur_backup_enabled = true;
  ctx_->zip_made = true;
  EXPECT_TRUE(app_info_foreach_cb(PACKAGE_INFO_UIAPP, "org.app", ctx_.get()));
  EXPECT_THAT(current(), IsEmpty());
}

TEST_F(Changes, SizesAreLoggedWithTheFreeSpace) {
  make_current(install("org.app", "1", "12345678"));
  EXPECT_EQ(check_current_backup_size(ctx_.get()), QUARN_OK);
  EXPECT_THAT(captured_texts(),
              Contains(StartsWith("app backup size : 8, available space size : ")));
}

}  // namespace
