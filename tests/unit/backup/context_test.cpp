#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "backup_device.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package_lock.h"
#include "run_until.h"

namespace {

class Context : public BackupDevice {
 protected:
  Context() : holder_(new backup_context), other_(new backup_context) {
    EXPECT_TRUE(acquire_staged_archive(holder_.get(), "org.app"));
  }

  BackupContextPtr holder_;
  BackupContextPtr other_;
};

TEST_F(Context, IsFilledInFromTheDevice) {
  EXPECT_EQ(backup_context_init(other_.get()), 0);
  EXPECT_EQ(other_->serial_number, "350000000000001");
  EXPECT_EQ(other_->model_name, "Model One");
  EXPECT_EQ(other_->result, 0);
}

TEST_F(Context, MissingSerialGives36) {
  ON_CALL(platform_, tel_get_misc_me_imei_sync).WillByDefault(::testing::Return(nullptr));
  EXPECT_EQ(backup_context_init(other_.get()), 36);
  EXPECT_EQ(other_->result, 36);
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot get device info"), 1);
  EXPECT_EQ(other_->model_name, "");
}

TEST_F(Context, StagedArchiveHasOneHolder) {
  EXPECT_TRUE(holds_staged_archive(holder_.get(), "org.app"));
  EXPECT_TRUE(acquire_staged_archive(holder_.get(), "org.app")) << "again by its holder";
  EXPECT_FALSE(holds_staged_archive(other_.get(), "org.app"));
  EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.other"));
  release_staged_archive(other_.get(), "org.app");
  EXPECT_TRUE(holds_staged_archive(holder_.get(), "org.app")) << "only its holder gives it back";
}

TEST_F(Context, LastReferenceGivesEverythingBack) {
  EXPECT_TRUE(acquire_staged_archive(holder_.get(), "org.second"));
  BackupContextPtr shared = share_backup_context(holder_.get());
  backup_context *raw = holder_.get();
  holder_.reset();
  EXPECT_TRUE(holds_staged_archive(raw, "org.app"));
  shared.reset();
  EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.app"));
  EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.second"));
}

TEST_F(Context, WaitLoopThatNobodyTookIsReleased) {
  holder_->wait_loop = new_wait_loop();
  holder_.reset();
}

TEST_F(Context, WorkerWaitsUntilTheArchiveIsFree) {
  std::atomic<bool> released{false};
  bool waited = false;
  std::thread worker([&] {
    EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.app"));
    waited = released;
  });
  released = true;
  release_staged_archive(holder_.get(), "org.app");
  worker.join();
  EXPECT_TRUE(waited);
}

TEST_F(Context, MainThreadServesEventsWhileItWaits) {
  g_idle_add(
      [](gpointer holder) -> gboolean {
        release_staged_archive(static_cast<backup_context *>(holder), "org.app");
        return G_SOURCE_REMOVE;
      },
      holder_.get());
  EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.app"));
  EXPECT_TRUE(holds_staged_archive(other_.get(), "org.app"));
}

TEST_F(Context, MainThreadIsWokenByAnotherThread) {
  std::thread worker([&] { release_staged_archive(holder_.get(), "org.app"); });
  EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.app"));
  worker.join();
}

TEST_F(Context, ReleaseOfAnotherArchiveDoesNotEndTheWait) {
  EXPECT_TRUE(acquire_staged_archive(holder_.get(), "org.second"));
  static bool second_released;
  second_released = false;
  g_idle_add(
      [](gpointer holder) -> gboolean {
        auto *ctx = static_cast<backup_context *>(holder);
        release_staged_archive(ctx, second_released ? "org.app" : "org.second");
        return std::exchange(second_released, true) ? G_SOURCE_REMOVE : G_SOURCE_CONTINUE;
      },
      holder_.get());
  EXPECT_TRUE(acquire_staged_archive(other_.get(), "org.app"));
  EXPECT_TRUE(second_released);
}

// Who came first has the archive first, and nobody waits for another's end.
TEST_F(Context, RequestsOnFibersHaveTheArchiveInTheirOrder) {
  std::vector<std::string> order;
  std::list<BackupContextPtr> requests;
  for (const char *name : {"first", "second", "third"}) {
    requests.emplace_back(new backup_context);
    backup_context *const request = requests.back().get();
    run_on_fiber([&order, request, name] {
      EXPECT_TRUE(acquire_staged_archive(request, "org.app"));
      order.emplace_back(name);
    });
  }
  EXPECT_TRUE(order.empty());
  release_staged_archive(holder_.get(), "org.app");
  for (auto &request : requests) {
    ASSERT_TRUE(run_until([&] { return holds_staged_archive(request.get(), "org.app"); }));
    release_staged_archive(request.get(), "org.app");
  }
  EXPECT_THAT(order, ::testing::ElementsAre("first", "second", "third"));
}

TEST_F(Context, ARequestOnAFiberWaitsForAnothersPackingWhileTheLoopGoesOn) {
  std::optional<PackageDataLock> export_of_another;
  export_of_another.emplace("org.other", PackageUse::kPack);
  bool taken = false;
  run_on_fiber([&] { taken = acquire_staged_archive(other_.get(), "org.second"); });
  bool served = false;
  g_idle_add(
      [](gpointer seen) -> gboolean {
        *static_cast<bool *>(seen) = true;
        return G_SOURCE_REMOVE;
      },
      &served);
  ASSERT_TRUE(run_until([&] { return served; }));
  EXPECT_FALSE(taken);
  std::thread([&] { export_of_another.reset(); }).join();
  ASSERT_TRUE(run_until([&] { return taken; }));
  EXPECT_TRUE(holds_staged_archive(other_.get(), "org.second"));
}

TEST_F(Context, ARequestThatIsWithdrawnWhileAnotherIsPackedGivesItsPlaceBack) {
  const PackageDataLock export_of_another("org.other", PackageUse::kPack);
  std::uint64_t number = 0;
  bool taken = true;
  run_on_fiber([&] {
    number = fiber_id(current_fiber());
    taken = acquire_staged_archive(other_.get(), "org.second");
  });
  EXPECT_TRUE(withdraw_waits(number));
  ASSERT_TRUE(run_until([&] { return !taken; }));
  EXPECT_FALSE(holds_staged_archive(other_.get(), "org.second"));
}

TEST_F(Context, AWithdrawnRequestWaitsForNoArchive) {
  std::uint64_t number = 0;
  bool taken = true;
  run_on_fiber([&] {
    number = fiber_id(current_fiber());
    taken = acquire_staged_archive(other_.get(), "org.app");
  });
  EXPECT_TRUE(withdraw_waits(number));
  ASSERT_TRUE(run_until([&] { return !taken; }));
  EXPECT_EQ(count_logged(DLOG_ERROR, "gave up waiting for the archive of (org.app)"), 1);
  EXPECT_TRUE(holds_staged_archive(holder_.get(), "org.app"));
}

TEST_F(Context, EndOfTheProcessEndsTheWait) {
  GTEST_FLAG_SET(death_test_style, "fast");
  EXPECT_EXIT(
      {
        g_idle_add(
            [](gpointer) -> gboolean {
              quit_nested_loops();
              return G_SOURCE_REMOVE;
            },
            nullptr);
        const bool taken = acquire_staged_archive(other_.get(), "org.app");
        const bool logged =
            count_logged(DLOG_ERROR, "gave up waiting for the archive of (org.app)") == 1;
        other_->cur_pkg_id = "org.app";
        other_->cur_version = "1";
        const bool refused = make_app_data_zip(other_.get(), "org.app") == 36;
        _exit(!taken && logged && refused ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(Context, StagedFileIsDeletedOnlyWhereItIsOne) {
  write_text(path("file"), "x");
  std::filesystem::create_directory(path("directory"));
  delete_staged_file(path("file"));
  delete_staged_file(path("file"));
  delete_staged_file(path("directory"));
  EXPECT_FALSE(exists(path("file")));
  EXPECT_TRUE(exists(path("directory")));
  EXPECT_TRUE(captured_log().empty());
}

TEST_F(Context, SizeOfAStagedFile) {
  write_text(path("file"), "12345");
  EXPECT_EQ(staged_file_size(path("file")), 5U);
  EXPECT_EQ(staged_file_size(path("missing")), 0U);
}

}  // namespace
