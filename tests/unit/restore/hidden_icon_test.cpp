// An icon that is hidden for a restore does not stay hidden when the daemon ends meanwhile.
#include "quarn_d_restore/hidden_icon.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/snapshot.h"
#include "restore_fixture.h"

using ::testing::_;
using ::testing::Return;
using ::testing::StrEq;

namespace {

class HiddenIconTest : public RestoreTest {
 protected:
  HiddenIconTest() {
    ON_CALL(platform, pkgmgr_client_new).WillByDefault(Return(&client));
    ON_CALL(platform, package_info_get_package).WillByDefault([](auto, char **id) {
      *id = strdup(kPkg);
      return 0;
    });
    ON_CALL(platform, package_info_get_root_path).WillByDefault([this](auto, char **path) {
      *path = strdup(root.c_str());
      return 0;
    });
    ON_CALL(platform, package_manager_foreach_package_info)
        .WillByDefault([](package_manager_package_info_cb callback, void *data) {
          EXPECT_TRUE(callback(nullptr, data));
          return 0;
        });
  }
  /** A daemon that hides the icon and is killed. */
  void hide_in_a_process_that_ends() {
    const pid_t child = fork();
    if (child == 0) _exit(note_hidden_icon(kPkg, root.c_str()) ? 0 : 1);
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_EQ(status, 0);
  }
  std::string note() const { return at("shared/data/quarn_tmp_rst_dir.icon"); }
  int client = 0;
};

TEST_F(HiddenIconTest, TheNextStartShowsWhatAnEndedDaemonHasHidden) {
  hide_in_a_process_that_ends();
  EXPECT_CALL(platform, pkgmgr_client_activate(_, _, StrEq(kPkg))).WillOnce(Return(0));
  recover_device();
  expect_info("success to appear icon of (org.example.notes)!");
  EXPECT_FALSE(exists(note()));
  recover_device();
}

TEST_F(HiddenIconTest, WhatCannotBeShownIsTriedAgain) {
  hide_in_a_process_that_ends();
  EXPECT_CALL(platform, pkgmgr_client_activate).WillOnce(Return(-3)).WillOnce(Return(0));
  recover_device();
  expect_error("fail to appear icon of (org.example.notes)... err:-3");
  EXPECT_TRUE(exists(note()));
  recover_device();
  EXPECT_FALSE(exists(note()));
}

TEST_F(HiddenIconTest, ThisProcessShowsItselfWhatItHides) {
  ASSERT_TRUE(note_hidden_icon(kPkg, root.c_str()));
  EXPECT_CALL(platform, pkgmgr_client_activate).Times(0);
  recover_device();
  EXPECT_TRUE(exists(note()));
  forget_hidden_icon(kPkg, root.c_str());
  EXPECT_FALSE(exists(note()));
}

TEST_F(HiddenIconTest, AnApplicationsOwnFileOfThatNameMeansNothing) {
  file("shared/data/quarn_tmp_rst_dir.icon", "its own");
  EXPECT_CALL(platform, pkgmgr_client_activate).Times(0);
  recover_device();
  EXPECT_TRUE(exists(note()));
}

TEST_F(HiddenIconTest, WhatCannotBeNotedIsToldAsSuch) {
  std::filesystem::create_directories(note() + "/in/the/way");
  EXPECT_FALSE(note_hidden_icon(kPkg, root.c_str()));
  forget_hidden_icon(kPkg, root.c_str());
}

TEST_F(HiddenIconTest, TheNoteIsNoPartOfTheData) {
  hide_in_a_process_that_ends();
  file("data/a", "x");
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  EXPECT_FALSE(exists(snapshot() + "/shared/data/quarn_tmp_rst_dir.icon"));
  rollback_to_initial_app_data(kPkg, root.c_str());
  EXPECT_TRUE(exists(note()));
}

}  // namespace
