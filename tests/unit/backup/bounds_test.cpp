// What outlives a run has a bound in memory.
#include <gmock/gmock.h>

#include <algorithm>
#include <string>
#include <thread>

#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_backup/single_folders.h"
#include "run_fixture.h"

namespace {

using ::testing::IsEmpty;

TEST_F(Runs, FoldersOfSingleRequestsBeyondTheBoundKeepEveryFolder) {
  forget_single_uploads();
  for (std::size_t i = 0; i < kMostSingleFolders - 1; ++i) {
    note_single_upload(kSerial, "org.app", std::to_string(i));
  }
  EXPECT_FALSE(uploaded_by_single_request("/other/folder"));
  note_single_upload(kSerial, "org.app", "0");
  EXPECT_FALSE(uploaded_by_single_request("/other/folder")) << "none of it is new";
  note_single_upload(kSerial, "org.app", "beyond");
  EXPECT_TRUE(uploaded_by_single_request("/other/folder"));
  forget_single_uploads();
  EXPECT_FALSE(uploaded_by_single_request("/other/folder"));
  EXPECT_FALSE(uploaded_by_single_request(std::string("/") + kSerial + "/org.app"));
}

TEST_F(Runs, WhatIsOwedToRemovedPackagesIsForgottenBeforeItIsMuch) {
  const FakePackage &stays = install("org.stays");
  note_owed_archive(kSerial, stays.id, stays.root);
  std::size_t most = 0;
  for (int i = 0; i < 2000; ++i) {
    note_owed_archive(kSerial, "org.gone" + std::to_string(i), "");
    most = std::max(most, owed_packages(kSerial).size());
  }
  EXPECT_LT(most, 300U);
  EXPECT_EQ(owed_claim(kSerial, stays.id), archive_claim::whole);
  packages_.clear();
  forget_owed_of_removed_packages();
  EXPECT_THAT(owed_packages(kSerial), IsEmpty());
}

/** Wi-Fi that is lost in the middle of each run. */
int flaky_wifi() {
  static int asked = 0;
  return ++asked % 3 == 0 ? 0 : 1;
}

TEST_F(Runs, RunsThatAreNotAnsweredLeaveOneRequestBehind) {
  install("org.app");
  set_poll_hook(nullptr);
  set_wifi_hook(flaky_wifi);
  for (int run = 0; run < 4; ++run) {
    std::thread worker([this] { automatic(); });
    worker.join();
    EXPECT_EQ(cloud_.waiting(), 1U) << "later runs wait for it, and keep nothing";
  }
  set_wifi_hook(nullptr);
  cloud_.answer_all();
  set_poll_hook([this](int) { cloud_.answer_next(); });
  automatic();
  EXPECT_EQ(info("auto backup successful!"), 1);
}

}  // namespace
