#include "state/packages.h"

#include <cstdlib>
#include <filesystem>
#include <memory>

#include "device_fixture.h"
#include "platform_package_client.h"
#include "platform_package_info.h"
#include "platform_package_manager.h"

namespace {

constexpr char kNotes[] = "org.example.notes";

struct Free {
  void operator()(char *text) const { std::free(text); }
};
using Text = std::unique_ptr<char, Free>;

embedded::Package notes() {
  embedded::Package package;
  package.id = kNotes;
  package.version = "1.0.0";
  package.type = "tpk";
  package.applications = {{"org.example.notes.z", "4.0", {{"backup", "disable"}, {"other", ""}}},
                          {"org.example.notes.a", "", {}}};
  return package;
}

class Packages : public DeviceTest {
 protected:
  void install(const embedded::Package &package) const {
    ASSERT_TRUE(embedded::put_package(device(), package));
  }
  void send(const char *package, const char *action, const char *state) const {
    ASSERT_TRUE(embedded::add_event(device(), {0, package, "tpk", action, state}));
  }
};

bool parse(const std::string &text, embedded::Package *package, std::string *error) {
  const embedded::KeyFilePtr file(g_key_file_new());
  EXPECT_TRUE(
      g_key_file_load_from_data(file.get(), text.c_str(), text.size(), G_KEY_FILE_NONE, nullptr));
  return embedded::parse_package(file.get(), package, error);
}

TEST(Manifest, IsReadWithItsApplicationsInOrder) {
  embedded::Package package;
  std::string error;
  ASSERT_TRUE(
      parse("[package]\nid=org.example.notes\nversion=1.0.0\ntype=wgt\npreload=true\n"
            "storage=external\n[app b]\napi-version=4.0\nmetadata.backup=disable\n[app a]\n",
            &package, &error))
      << error;
  EXPECT_EQ(package.id, kNotes);
  EXPECT_EQ(package.version, "1.0.0");
  EXPECT_EQ(package.type, "wgt");
  EXPECT_TRUE(package.preload);
  EXPECT_TRUE(package.external);
  ASSERT_EQ(package.applications.size(), 2U);
  EXPECT_EQ(package.applications[0].id, "b");
  EXPECT_EQ(package.applications[0].api_version, "4.0");
  EXPECT_EQ(package.applications[0].metadata.at("backup"), "disable");
  EXPECT_EQ(package.applications[1].id, "a");
  EXPECT_EQ(package.applications[1].api_version, "");
}

TEST(Manifest, IsATpkOnInternalStorageByDefault) {
  embedded::Package package;
  std::string error;
  ASSERT_TRUE(parse("[package]\nid=a\nversion=1\n", &package, &error)) << error;
  EXPECT_EQ(package.type, "tpk");
  EXPECT_FALSE(package.preload);
  EXPECT_FALSE(package.external);
}

TEST(Manifest, IsRefusedWithWhatIsWrong) {
  const std::pair<const char *, const char *> cases[] = {
      {"id=../a\nversion=1\n", "bad package id \"../a\""},
      {"version=1\n", "bad package id \"\""},
      {"id=.\nversion=1\n", "bad package id \".\""},
      {"id=a b\nversion=1\n", "bad package id \"a b\""},
      {"id=a\n", "bad version \"\""},
      {"id=a\nversion=1/2\n", "bad version \"1/2\""},
      {"id=a\nversion=1\ntype=..\n", "bad type \"..\""},
      {"id=a\nversion=1\npreload=maybe\n", "preload is neither true nor false"},
      {"id=a\nversion=1\nstorage=floppy\n", "storage is neither internal nor external"},
      {"id=a\nversion=1\n[app a/b]\n", "bad application id \"a/b\""},
  };
  for (const auto &[text, expected] : cases) {
    embedded::Package package;
    std::string error;
    EXPECT_FALSE(parse(std::string("[package]\n") + text, &package, &error)) << text;
    EXPECT_EQ(error, expected);
  }
}

TEST_F(Packages, AreVisitedInTheOrderOfTheirIds) {
  for (const char *id : {"c", "a", "b"}) {
    embedded::Package package;
    package.id = id;
    package.version = "1";
    package.type = "tpk";
    install(package);
  }
  std::vector<std::string> ids;
  const auto collect = [](package_info_h info, void *all) {
    char *id = nullptr;
    EXPECT_EQ(package_info_get_package(info, &id), PACKAGE_MANAGER_ERROR_NONE);
    auto *seen = static_cast<std::vector<std::string> *>(all);
    seen->emplace_back(Text(id).get());
    return seen->size() != 4;
  };
  EXPECT_EQ(package_manager_foreach_package_info(collect, &ids), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_EQ(ids, (std::vector<std::string>{"a", "b", "c"}));
  // The visitor can stop the walk, here at the first of the second one.
  EXPECT_EQ(package_manager_foreach_package_info(collect, &ids), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_EQ(ids.size(), 4U);
}

TEST_F(Packages, TellAboutThemselves) {
  embedded::Package package = notes();
  package.preload = true;
  install(package);
  package_info_h info = nullptr;
  ASSERT_EQ(package_manager_get_package_info(kNotes, &info), PACKAGE_MANAGER_ERROR_NONE);
  char *text = nullptr;
  EXPECT_EQ(package_info_get_package(info, &text), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_STREQ(Text(text).get(), kNotes);
  EXPECT_EQ(package_info_get_version(info, &text), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_STREQ(Text(text).get(), "1.0.0");
  EXPECT_EQ(package_info_get_type(info, &text), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_STREQ(Text(text).get(), "tpk");
  EXPECT_EQ(package_info_get_root_path(info, &text), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_STREQ(Text(text).get(), "/opt/usr/apps/org.example.notes");
  bool preload = false;
  EXPECT_EQ(package_info_is_preload_package(info, &preload), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_TRUE(preload);
  EXPECT_EQ(package_info_destroy(info), PACKAGE_MANAGER_ERROR_NONE);
}

TEST_F(Packages, HaveTheirApplicationsInTheOrderOfTheManifest) {
  install(notes());
  package_info_h info = nullptr;
  ASSERT_EQ(package_manager_get_package_info(kNotes, &info), PACKAGE_MANAGER_ERROR_NONE);
  std::vector<std::string> ids;
  const auto collect = [](package_info_app_component_type_e type, const char *id, void *all) {
    EXPECT_EQ(type, PACKAGE_INFO_UIAPP);
    auto *seen = static_cast<std::vector<std::string> *>(all);
    seen->emplace_back(id);
    return seen->size() != 3;
  };
  for (const auto type : {PACKAGE_INFO_ALLAPP, PACKAGE_INFO_SERVICEAPP, PACKAGE_INFO_UIAPP}) {
    EXPECT_EQ(package_info_foreach_app_from_package(info, type, collect, &ids),
              PACKAGE_MANAGER_ERROR_NONE);
  }
  EXPECT_EQ(ids, (std::vector<std::string>{"org.example.notes.z", "org.example.notes.a",
                                           "org.example.notes.z"}));
  package_info_destroy(info);
}

TEST_F(Packages, ThatAreNotInstalledAreUnknown) {
  package_info_h info = nullptr;
  pkgmgrinfo_pkginfo_h record = nullptr;
  for (const char *id : {"org.example.none", "", "..", "../packages/x", "a/b"}) {
    EXPECT_EQ(package_manager_get_package_info(id, &info), PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE);
    EXPECT_EQ(pkgmgrinfo_pkginfo_get_pkginfo(id, &record), PMINFO_R_ENOENT);
    EXPECT_EQ(pkgmgrinfo_appinfo_get_appinfo(id, &record), PMINFO_R_ENOENT);
  }
}

TEST_F(Packages, WithASpoiltManifestAreLeftOut) {
  install(notes());
  spoil("packages/org.example.bad.ini");
  int count = 0;
  const auto visit = [](package_info_h, void *visited) {
    ++*static_cast<int *>(visited);
    return true;
  };
  EXPECT_EQ(package_manager_foreach_package_info(visit, &count), PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_EQ(count, 1);
}

TEST_F(Packages, AreForgottenWithTheirApplications) {
  install(notes());
  EXPECT_TRUE(embedded::drop_package(device(), kNotes));
  EXPECT_FALSE(embedded::drop_package(device(), kNotes));
  EXPECT_TRUE(std::filesystem::is_empty(dir_ / "state/packages"));
  EXPECT_TRUE(std::filesystem::is_empty(dir_ / "state/apps"));
}

TEST_F(Packages, LoseTheApplicationsThatAnotherVersionLacks) {
  install(notes());
  embedded::Package next = notes();
  next.version = "2.0.0";
  next.applications.pop_back();
  install(next);
  embedded::Package found;
  EXPECT_TRUE(embedded::get_package_of_app(device(), "org.example.notes.z", &found));
  EXPECT_EQ(found.version, "2.0.0");
  EXPECT_FALSE(embedded::get_package_of_app(device(), "org.example.notes.a", &found));
}

TEST_F(Packages, AreShownAndHidden) {
  install(notes());
  pkgmgr_client *client = pkgmgr_client_new(PC_REQUEST);
  ASSERT_NE(client, nullptr);
  embedded::Package found;
  EXPECT_EQ(pkgmgr_client_deactivate(client, nullptr, kNotes), PKGMGR_R_OK);
  EXPECT_EQ(pkgmgr_client_deactivate(client, nullptr, kNotes), PKGMGR_R_OK);
  EXPECT_TRUE(embedded::get_package(device(), kNotes, &found));
  EXPECT_TRUE(found.hidden);
  EXPECT_EQ(found.applications.size(), 2U);
  EXPECT_EQ(pkgmgr_client_activate(client, nullptr, kNotes), PKGMGR_R_OK);
  EXPECT_TRUE(embedded::get_package(device(), kNotes, &found));
  EXPECT_FALSE(found.hidden);
  EXPECT_EQ(pkgmgr_client_activate(client, nullptr, "org.example.none"), PKGMGR_R_ERROR);
  EXPECT_EQ(pkgmgr_client_deactivate(client, nullptr, nullptr), PKGMGR_R_EINVAL);
  EXPECT_EQ(pkgmgr_client_free(client), PKGMGR_R_OK);
  EXPECT_EQ(pkgmgr_client_activate(nullptr, nullptr, kNotes), PKGMGR_R_EINVAL);
  EXPECT_EQ(pkgmgr_client_deactivate(nullptr, nullptr, kNotes), PKGMGR_R_EINVAL);
  EXPECT_EQ(pkgmgr_client_free(nullptr), PKGMGR_R_EINVAL);
}

TEST_F(Packages, HaveARecordInTheDatabase) {
  embedded::Package package = notes();
  install(package);
  pkgmgrinfo_pkginfo_h record = nullptr;
  ASSERT_EQ(pkgmgrinfo_pkginfo_get_pkginfo(kNotes, &record), PMINFO_R_OK);
  char *version = nullptr;
  EXPECT_EQ(pkgmgrinfo_pkginfo_get_version(record, &version), PMINFO_R_OK);
  EXPECT_STREQ(version, "1.0.0");
  pkgmgrinfo_installed_storage storage{};
  EXPECT_EQ(pkgmgrinfo_pkginfo_get_installed_storage(record, &storage), PMINFO_R_OK);
  EXPECT_EQ(storage, PMINFO_INTERNAL_STORAGE);
  EXPECT_EQ(pkgmgrinfo_pkginfo_destroy_pkginfo(record), PMINFO_R_OK);

  package.external = true;
  install(package);
  ASSERT_EQ(pkgmgrinfo_pkginfo_get_pkginfo(kNotes, &record), PMINFO_R_OK);
  EXPECT_EQ(pkgmgrinfo_pkginfo_get_installed_storage(record, &storage), PMINFO_R_OK);
  EXPECT_EQ(storage, PMINFO_EXTERNAL_STORAGE);
  EXPECT_EQ(pkgmgrinfo_pkginfo_destroy_pkginfo(record), PMINFO_R_OK);
}

TEST_F(Packages, HaveARecordForEachApplication) {
  install(notes());
  pkgmgrinfo_appinfo_h record = nullptr;
  char *text = nullptr;
  ASSERT_EQ(pkgmgrinfo_appinfo_get_appinfo("org.example.notes.z", &record), PMINFO_R_OK);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_pkgid(record, &text), PMINFO_R_OK);
  EXPECT_STREQ(text, kNotes);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_api_version(record, &text), PMINFO_R_OK);
  EXPECT_STREQ(text, "4.0");
  EXPECT_EQ(pkgmgrinfo_appinfo_get_metadata_value(record, "backup", &text), PMINFO_R_OK);
  EXPECT_STREQ(text, "disable");
  EXPECT_EQ(pkgmgrinfo_appinfo_get_metadata_value(record, "other", &text), PMINFO_R_OK);
  EXPECT_STREQ(text, "");
  EXPECT_NE(pkgmgrinfo_appinfo_get_metadata_value(record, "none", &text), PMINFO_R_OK);
  EXPECT_EQ(pkgmgrinfo_appinfo_destroy_appinfo(record), PMINFO_R_OK);

  ASSERT_EQ(pkgmgrinfo_appinfo_get_appinfo("org.example.notes.a", &record), PMINFO_R_OK);
  EXPECT_NE(pkgmgrinfo_appinfo_get_api_version(record, &text), PMINFO_R_OK);
  EXPECT_EQ(pkgmgrinfo_appinfo_destroy_appinfo(record), PMINFO_R_OK);
  // A package's id is not an application's.
  EXPECT_EQ(pkgmgrinfo_appinfo_get_appinfo(kNotes, &record), PMINFO_R_ENOENT);
}

TEST_F(Packages, RefuseNulls) {
  install(notes());
  package_info_h info = nullptr;
  pkgmgrinfo_pkginfo_h package = nullptr;
  pkgmgrinfo_appinfo_h application = nullptr;
  char *text = nullptr;
  bool preload = false;
  pkgmgrinfo_installed_storage storage{};
  ASSERT_EQ(package_manager_get_package_info(kNotes, &info), PACKAGE_MANAGER_ERROR_NONE);
  constexpr int kBad = PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  EXPECT_EQ(package_manager_get_package_info(nullptr, &info), kBad);
  EXPECT_EQ(package_manager_get_package_info(kNotes, nullptr), kBad);
  EXPECT_EQ(package_manager_foreach_package_info(nullptr, nullptr), kBad);
  EXPECT_EQ(package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, nullptr, nullptr),
            kBad);
  for (const auto get : {package_info_get_package, package_info_get_version, package_info_get_type,
                         package_info_get_root_path}) {
    EXPECT_EQ(get(nullptr, &text), kBad);
    EXPECT_EQ(get(info, nullptr), kBad);
  }
  EXPECT_EQ(package_info_is_preload_package(nullptr, &preload), kBad);
  EXPECT_EQ(package_info_is_preload_package(info, nullptr), kBad);
  EXPECT_EQ(package_info_destroy(nullptr), kBad);
  package_info_destroy(info);

  EXPECT_EQ(pkgmgrinfo_pkginfo_get_pkginfo(nullptr, &package), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_pkginfo_get_pkginfo(kNotes, nullptr), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_pkginfo_get_version(nullptr, &text), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_pkginfo_get_installed_storage(nullptr, &storage), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_appinfo(nullptr, &application), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_appinfo(kNotes, nullptr), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_pkgid(nullptr, &text), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_api_version(nullptr, &text), PMINFO_R_EINVAL);
  EXPECT_EQ(pkgmgrinfo_appinfo_get_metadata_value(nullptr, "backup", &text), PMINFO_R_EINVAL);
}

TEST_F(Packages, CannotBeReadWithoutADevice) {
  const auto visit = [](package_info_h, void *) { return true; };
  leave_device();
  package_manager_h manager = nullptr;
  EXPECT_EQ(package_manager_foreach_package_info(visit, nullptr), PACKAGE_MANAGER_ERROR_IO_ERROR);
  EXPECT_EQ(package_manager_create(&manager), PACKAGE_MANAGER_ERROR_IO_ERROR);
  EXPECT_FALSE(embedded::put_package("", notes()));
  EXPECT_FALSE(embedded::set_hidden("", kNotes, true));
  EXPECT_FALSE(embedded::drop_package("", kNotes));
}

struct Seen {
  std::string type;
  std::string package;
  package_manager_event_type_e event;
  package_manager_event_state_e state;
  int progress;
  package_manager_error_e error;
};

class PackageEvents : public Packages {
 protected:
  void SetUp() override {
    ASSERT_EQ(package_manager_create(&manager_), PACKAGE_MANAGER_ERROR_NONE);
  }
  void TearDown() override {
    if (manager_ != nullptr) {
      EXPECT_EQ(package_manager_destroy(manager_), PACKAGE_MANAGER_ERROR_NONE);
    }
  }
  static void collect(const char *type, const char *package, package_manager_event_type_e event,
                      package_manager_event_state_e state, int progress,
                      package_manager_error_e error, void *self) {
    static_cast<PackageEvents *>(self)->seen_.push_back(
        {type, package, event, state, progress, error});
  }
  static void collect_one(const char *type, const char *package, package_manager_event_type_e event,
                          package_manager_event_state_e state, int progress,
                          package_manager_error_e error, void *self) {
    collect(type, package, event, state, progress, error, self);
    auto *test = static_cast<PackageEvents *>(self);
    package_manager_destroy(test->manager_);
    test->manager_ = nullptr;
  }
  void listen(package_manager_event_cb callback = collect) {
    ASSERT_EQ(package_manager_set_event_cb(manager_, callback, this), PACKAGE_MANAGER_ERROR_NONE);
  }

  package_manager_h manager_ = nullptr;
  std::vector<Seen> seen_;
};

TEST_F(PackageEvents, ArriveInTheirOrderWithWhatTheySay) {
  listen();
  send("a", embedded::kActionInstall, embedded::kStateStarted);
  send("a", embedded::kActionInstall, embedded::kStateCompleted);
  send("b", embedded::kActionUpdate, embedded::kStateFailed);
  send("c", embedded::kActionUninstall, embedded::kStateCompleted);
  ASSERT_TRUE(run_until([this] { return seen_.size() >= 4; }));
  drain();
  ASSERT_EQ(seen_.size(), 4U);
  EXPECT_EQ(seen_[0].type, "tpk");
  EXPECT_EQ(seen_[0].package, "a");
  EXPECT_EQ(seen_[0].event, PACKAGE_MANAGER_EVENT_TYPE_INSTALL);
  EXPECT_EQ(seen_[0].state, PACKAGE_MANAGER_EVENT_STATE_STARTED);
  EXPECT_EQ(seen_[0].progress, 0);
  EXPECT_EQ(seen_[1].state, PACKAGE_MANAGER_EVENT_STATE_COMPLETED);
  EXPECT_EQ(seen_[1].progress, 100);
  EXPECT_EQ(seen_[1].error, PACKAGE_MANAGER_ERROR_NONE);
  EXPECT_EQ(seen_[2].event, PACKAGE_MANAGER_EVENT_TYPE_UPDATE);
  EXPECT_EQ(seen_[2].state, PACKAGE_MANAGER_EVENT_STATE_FAILED);
  EXPECT_EQ(seen_[2].error, PACKAGE_MANAGER_ERROR_IO_ERROR);
  EXPECT_EQ(seen_[3].event, PACKAGE_MANAGER_EVENT_TYPE_UNINSTALL);
}

TEST_F(PackageEvents, FromBeforeTheSubscriptionDoNotArrive) {
  send("a", embedded::kActionInstall, embedded::kStateCompleted);
  listen();
  send("b", embedded::kActionInstall, embedded::kStateCompleted);
  ASSERT_TRUE(run_until([this] { return !seen_.empty(); }));
  drain();
  ASSERT_EQ(seen_.size(), 1U);
  EXPECT_EQ(seen_[0].package, "b");
}

TEST_F(PackageEvents, EndWithTheSubscription) {
  listen();
  ASSERT_EQ(package_manager_unset_event_cb(manager_), PACKAGE_MANAGER_ERROR_NONE);
  send("a", embedded::kActionInstall, embedded::kStateCompleted);
  drain();
  EXPECT_TRUE(seen_.empty());
}

TEST_F(PackageEvents, MayEndTheSubscriptionThatTheyArriveOn) {
  listen(collect_one);
  send("a", embedded::kActionInstall, embedded::kStateStarted);
  send("a", embedded::kActionInstall, embedded::kStateCompleted);
  drain();
  EXPECT_EQ(seen_.size(), 1U);
}

TEST_F(PackageEvents, RefuseNullsAndStateThatCannotBeWatched) {
  constexpr int kBad = PACKAGE_MANAGER_ERROR_INVALID_PARAMETER;
  EXPECT_EQ(package_manager_create(nullptr), kBad);
  EXPECT_EQ(package_manager_destroy(nullptr), kBad);
  EXPECT_EQ(package_manager_set_event_cb(nullptr, collect, nullptr), kBad);
  EXPECT_EQ(package_manager_set_event_cb(manager_, nullptr, nullptr), kBad);
  EXPECT_EQ(package_manager_unset_event_cb(nullptr), kBad);
  leave_device();
  EXPECT_EQ(package_manager_set_event_cb(manager_, collect, nullptr),
            PACKAGE_MANAGER_ERROR_IO_ERROR);
}

TEST_F(PackageEvents, AreKeptUpToTheLastThousandAndTwentyFour) {
  constexpr int kSent = 1030;
  ASSERT_TRUE(embedded::edit_state(device(), embedded::kEventsFile, [](GKeyFile *file) {
    const gchar *fields[] = {"install", "completed", "tpk", "a"};
    for (int i = 1; i < kSent; ++i) {
      g_key_file_set_string_list(file, "events", std::to_string(i).c_str(), fields, 4);
    }
    g_key_file_set_int64(file, "events", "next", kSent);
    return true;
  }));
  send("b", embedded::kActionInstall, embedded::kStateCompleted);
  EXPECT_EQ(embedded::next_event(device()), kSent + 1);
  const auto events = embedded::events_from(device(), 1);
  EXPECT_EQ(events.size(), 1024U);
  EXPECT_EQ(events.back().number, kSent);
  EXPECT_EQ(events.back().package, "b");
}

}  // namespace
