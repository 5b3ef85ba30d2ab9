// A package that is removed, or installed anew, while its data is restored.
#include <sys/stat.h>

#include <cstring>
#include <filesystem>
#include <set>

#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/file.h"
#include "restore_fixture.h"

namespace {

class RemovalTest : public RestoreTest {
 protected:
  RemovalTest() {
    make_archive(good, new_data);
    make_archive(broken, new_data, "not json");
  }

  void install() {
    std::filesystem::remove_all(root);
    dir("data");
    dir("shared/data");
    dir("shared/trusted");
    make_old_data();
  }

  /** Restore @p archive and do @p act at the @p nth step. @return the step, empty: there is none */
  std::string restore_until(const std::string &archive, int nth, const std::function<void()> &act) {
    install();
    pkg_restore_context ctx;
    request_restore(&ctx);
    std::filesystem::copy_file(archive, download());
    std::string last;
    {
      const AtNthStep nth_step(nth, [&](const std::string &step) {
        last = step;
        act();
      });
      answer();
    }
    const bool was_over = last.empty() || last == "snapshot-released";
    EXPECT_TRUE(was_over || ctx.result != 0) << "removed at " << last;
    clear_captured_log();
    return last;
  }

  const std::vector<Entry> &new_data = new_app_data();
  std::string good = base + "/good.zip";
  std::string broken = base + "/broken.zip";
};

TEST_F(RemovalTest, LeavesNothingWhereverTheRestoreOrTheRollbackIs) {
  for (const std::string &archive : {good, broken}) {
    std::set<std::string> steps;
    for (int nth = 1;; ++nth) {
      const std::string step =
          restore_until(archive, nth, [this] { std::filesystem::remove_all(root); });
      if (step.empty()) break;
      steps.insert(step);
      EXPECT_FALSE(exists(root)) << step;
    }
    EXPECT_GT(steps.size(), 8U) << "steps of every stage";
  }
}

TEST_F(RemovalTest, WhatIsInstalledInItsPlaceIsNotWrittenInto) {
  for (const std::string &archive : {good, broken}) {
    for (int nth = 1;; ++nth) {
      Tree installed;
      const std::string step = restore_until(archive, nth, [&] {
        install();
        installed = tree_of(root);
      });
      if (step.empty()) break;
      EXPECT_EQ(tree_of(root), installed) << step;
    }
  }
}

TEST_F(RemovalTest, ARenamedPackageIsNotMadeAnew) {
  const std::string aside = base + "/aside";
  const std::string step = restore_until(good, 3, [&] { std::filesystem::rename(root, aside); });
  EXPECT_FALSE(step.empty());
  EXPECT_FALSE(exists(root));
  std::filesystem::remove_all(aside);
}

TEST_F(RemovalTest, IsTold) {
  install();
  std::set<std::string> seen;
  const AtStep removal("restored", [&] { std::filesystem::rename(root, base + "/aside"); });
  auto *ctx = new_context();
  ctx->wait_for_result = true;
  ASSERT_EQ(restore_app_data("app", ctx), 0);
  std::filesystem::copy_file(good, download());
  answer();
  expect_error("package (org.example.notes) was removed during its restore");
  EXPECT_EQ(ctx->result, QUARN_REFUSED);
  delete ctx;
}

TEST_F(RemovalTest, ACompanionsRestoreLeavesNothingEither) {
  current_restore_client = QUARN_CLIENT_COMPANION;
  install();
  std::filesystem::create_directories(kCompanionDir);
  const std::string archive =
      std::string(kCompanionDir) + "/" + kPkg + "_" + std::string(kVersion) + ".zip";
  make_archive(archive, new_data);
  for (const char *step : {"table", "labels", "relabel", "attributes"}) {
    install();
    const AtStep removal(step, [this] { std::filesystem::remove_all(root); });
    pkg_restore_context ctx;
    ctx.pkgid = kPkg;
    ctx.version = kVersion;
    ctx.root = root;
    ctx.wait_for_result = true;
    restore_app_data("app", &ctx);
    EXPECT_FALSE(exists(root)) << step;
    clear_captured_log();
  }
  unlink(archive.c_str());
}

}  // namespace
