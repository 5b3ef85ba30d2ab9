#include <glib.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "backup_device.h"
#include "backup_transport.h"
#include "quarn_d_backup/archive_upload.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/cancel.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/power.h"

using ::testing::_;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Return;

namespace {

constexpr std::chrono::seconds kDeadline{20};
constexpr std::uintptr_t kHandle = 0x1234;

/** What a request found before there was a session. */
struct {
  std::vector<SentStatus> statuses;
  int logged = 0;
  bool backed_up = false;
} without_session;

/** Requests on the real worker; the test is the main loop. */
class Dispatch : public BackupDevice {
 protected:
  Dispatch() {
    ON_CALL(cloud_.transport, backup_trans_create_handle)
        .WillByDefault(Return(reinterpret_cast<backup_trans_handle_h>(kHandle)));
    ON_CALL(cloud_.transport, backup_trans_init)
        .WillByDefault([this](void *data, backup_trans_init_cb callback) {
          callback(session_ ? BACKUP_TRANS_ERROR_NONE : BACKUP_TRANS_ERROR_NOT_INITIALIZED, data);
          return 0;
        });
    static bool started = false;
    if (!std::exchange(started, true)) start_without_session();
  }
  ~Dispatch() override {
    held_ = false;
    finish();
    cloud_.answer_all();
  }

  void start_without_session() {
    session_ = false;
    init_backup_req_dispatch_thread();
    EXPECT_EQ(count_logged(DLOG_INFO, "init_backup_req_dispatch_thread"), 1);
    request_backup(new_client(1));
    finish();
    without_session.statuses = sent_statuses();
    without_session.logged = count_logged(DLOG_ERROR, "cloud couldn't be initialized.(wifi:1)");
    without_session.backed_up = !cloud_.requests().empty();
    session_ = true;
    clear_sent_statuses();
    clear_captured_log();
  }

  /** Run the main loop until it holds. */
  template <typename Condition>
  void run_until(Condition condition) {
    const auto deadline = std::chrono::steady_clock::now() + kDeadline;
    while (!condition()) {
      ASSERT_LT(std::chrono::steady_clock::now(), deadline);
      g_main_context_iteration(nullptr, FALSE);
      if (!held_) cloud_.answer_next();
      std::this_thread::yield();
    }
  }
  void finish() {
    run_until([] { return !backup_request_outstanding(); });
  }
  /** A manual backup that waits for its list. */
  void run_one(std::uint32_t request) {
    held_ = true;
    request_backup(new_client(request));
    run_until([this] { return cloud_.waiting() == 1; });
  }
  int info(const std::string &text) const { return count_logged(DLOG_INFO, text); }
  int error(const std::string &text) const { return count_logged(DLOG_ERROR, text); }

  std::atomic<bool> session_{true};
  bool held_ = false;
};

TEST_F(Dispatch, ManualRequestWithoutASessionFailsWith33) {
  EXPECT_THAT(without_session.statuses, ElementsAre(SentStatus{33, 5, 1}));
  EXPECT_EQ(without_session.logged, 1);
  EXPECT_FALSE(without_session.backed_up);
}

TEST_F(Dispatch, ManualRequestWithoutWifiFailsWith33) {
  fake_wifi = 0;
  request_backup(new_client(5));
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{33, 5, 5}));
  EXPECT_EQ(error("cloud couldn't be initialized.(wifi:0)"), 1);
  EXPECT_THAT(cloud_.requests(), IsEmpty());
}

TEST_F(Dispatch, AutomaticRequestWithoutWifiIsDroppedSilently) {
  fake_wifi = 0;
  request_backup(nullptr);
  finish();
  EXPECT_THAT(sent_statuses(), IsEmpty());
  EXPECT_EQ(error("cloud couldn't be initialized.(wifi:0)"), 1);
  fake_wifi = 1;
  request_backup(nullptr);
  finish();
  EXPECT_EQ(info("now auto backup start!"), 1) << "the worker still serves";
  EXPECT_EQ(info("auto backup successful!"), 1);
}

std::atomic<int> ends_seen{0};

TEST_F(Dispatch, TheEndOfARequestIsToldWhenNothingOfItIsLeft) {
  ends_seen = 0;
  set_backup_end_observer([] {
    if (!backup_request_outstanding()) ++ends_seen;
  });
  request_backup(nullptr);
  finish();
  run_until([] { return ends_seen == 1; });
  run_one(1);
  request_backup(new_client(2));
  cancel_backup(nullptr);
  held_ = false;
  finish();
  run_until([] { return ends_seen == 2; });
  set_backup_end_observer(nullptr);
  EXPECT_EQ(sent_statuses().size(), 2U);
}

TEST_F(Dispatch, TwoManualRequestsRunOneAfterTheOther) {
  install("org.a");
  run_one(1);
  request_backup(new_client(2));
  EXPECT_EQ(info("now manual backup start!"), 1);
  held_ = false;
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{0, 4, 1}, SentStatus{0, 4, 2}));
  EXPECT_EQ(info("now manual backup start!"), 2);
}

TEST_F(Dispatch, RequestsAreServedInTheirOrder) {
  run_one(1);
  request_backup(new_client(2));
  request_backup(nullptr);
  request_backup(new_client(3));
  request_backup(new_client(2));
  held_ = false;
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{0, 4, 1}, SentStatus{0, 4, 2},
                                           SentStatus{0, 4, 3}, SentStatus{0, 4, 2}));
  EXPECT_EQ(info("auto backup successful!"), 1);
}

TEST_F(Dispatch, OneAutomaticBackupAtATimeIsEnough) {
  run_one(1);
  request_backup(nullptr);
  request_backup(nullptr);
  EXPECT_EQ(info("auto backup is requested already"), 1);
  held_ = false;
  finish();
  EXPECT_EQ(info("auto backup successful!"), 1);
  request_backup(nullptr);
  finish();
  EXPECT_EQ(info("auto backup successful!"), 2);
}

TEST_F(Dispatch, CancelStopsTheRunningBackupAndDropsTheQueuedOne) {
  run_one(1);
  request_backup(new_client(2));
  manual_backup_canceled = true;
  cancel_backup(nullptr);
  EXPECT_EQ(info("request cancel to handler(0x1234)"), 1);
  EXPECT_EQ(cloud_.cancels, 1);
  EXPECT_EQ(info("reservation for manual backup is canceled"), 1);
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}, SentStatus{17, 6, 2}));
  EXPECT_EQ(info("now manual backup start!"), 1);
}

TEST_F(Dispatch, CancelDropsEveryManualReservation) {
  run_one(1);
  for (std::uint32_t request = 2; request < 6; ++request) request_backup(new_client(request));
  cancel_backup(nullptr);
  EXPECT_EQ(info("reservation for manual backup is canceled"), 4);
  held_ = false;
  finish();
  EXPECT_EQ(sent_statuses().size(), 5U);
  EXPECT_EQ(info("now manual backup start!"), 1);
}

TEST_F(Dispatch, CancelLeavesAutomaticReservations) {
  run_one(1);
  request_backup(nullptr);
  cancel_backup(nullptr);
  EXPECT_EQ(info("reservation for manual backup is canceled"), 0);
  held_ = false;
  finish();
  EXPECT_EQ(info("now auto backup start!"), 1);
}

TEST_F(Dispatch, CancelWithNothingToCancelIsHarmless) {
  cancel_backup(nullptr);
  EXPECT_EQ(cloud_.cancels, 1);
  EXPECT_FALSE(backup_request_outstanding());
  EXPECT_THAT(sent_statuses(), IsEmpty());
}

TEST_F(Dispatch, NewRequestClearsACancellation) {
  manual_backup_canceled = true;
  request_backup(new_client(1));
  finish();
  EXPECT_EQ(error("manual backup was cancelled"), 1);
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}));
  manual_backup_canceled = false;
  request_backup(new_client(2));
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}, SentStatus{0, 4, 2}));
}

/** What the handlers do, without the calls to the clients. */
void start(std::uint32_t request, const std::string &sender = ":1.7") {
  manual_backup_canceled = false;
  request_backup(new_client(request, sender));
}
void cancel() {
  manual_backup_canceled = true;
  cancel_backup(nullptr);
}

TEST_F(Dispatch, AStartAfterACancelDoesNotCallTheCancelOff) {
  install("org.a");
  run_one(1);
  cancel();
  start(2);
  EXPECT_FALSE(manual_backup_canceled) << "cleared by the start";
  held_ = false;
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}, SentStatus{0, 4, 2}));
  EXPECT_EQ(info("manual backup cancelled"), 1);
  EXPECT_EQ(info("manual backup successful!"), 1);
}

// However the run stands when they come: none is reported as done that was cancelled.
TEST_F(Dispatch, CancelAndStartAtAnyMomentLeaveOneOfEach) {
  for (int i = 0; i < 4; ++i) install("org.package" + std::to_string(i));
  constexpr int kLastAnswer = 12;
  for (int answers = 0; answers < kLastAnswer; ++answers) {
    clear_sent_statuses();
    held_ = true;
    start(1);
    int given = 0;
    run_until([&] {
      if (given < answers && cloud_.answer_next()) ++given;
      return given == answers ? cloud_.waiting() > 0 || !sent_statuses().empty()
                              : !sent_statuses().empty();
    });
    const bool ended = !sent_statuses().empty();
    cancel();
    start(2);
    held_ = false;
    finish();
    const SentStatus first = ended ? SentStatus{0, 4, 1} : SentStatus{17, 6, 1};
    EXPECT_THAT(sent_statuses(), ElementsAre(first, SentStatus{0, 4, 2})) << answers;
    cloud_.objects.clear();
  }
}

TEST_F(Dispatch, ACancelledRequestThatFindsNoWifiIsReportedAsCancelled) {
  static std::atomic<bool> cancelled;
  cancelled = false;
  set_wifi_hook([] {
    if (!cancelled.exchange(true)) cancel();
    return 0;
  });
  start(1);
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}));
  start(2);
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}, SentStatus{33, 5, 2}));
}

TEST_F(Dispatch, OneClientsCancelMeetsItsOwnRequestsOnly) {
  run_one(1);
  start(2, ":1.8");
  start(3, ":1.9");
  start(4, ":1.8");
  EXPECT_EQ(cancel_backups_of(":1.8"), 2U);
  EXPECT_EQ(cancel_backups_of(":1.8"), 0U);
  EXPECT_EQ(cancel_backups_of(":1.1"), 0U);
  EXPECT_EQ(cloud_.cancels, 0) << "the run is another's";
  EXPECT_FALSE(manual_backup_canceled);
  held_ = false;
  finish();
  EXPECT_THAT(sent_statuses(),
              ::testing::UnorderedElementsAre(SentStatus{0, 4, 1}, SentStatus{17, 6, 2},
                                              SentStatus{0, 4, 3}, SentStatus{17, 6, 4}));
  EXPECT_EQ(info("reservation for manual backup is canceled"), 2);
}

TEST_F(Dispatch, OneClientsCancelStopsItsRunningBackupAndOthersGoOn) {
  install("org.a");
  run_one(1);
  start(2, ":1.8");
  EXPECT_EQ(cancel_backups_of(":1.7"), 1U);
  EXPECT_EQ(cancel_backups_of(":1.7"), 0U) << "it is withdrawn already";
  EXPECT_EQ(cloud_.cancels, 1);
  held_ = false;
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}, SentStatus{0, 4, 2}));
}

TEST_F(Dispatch, ABackupWhoseOutcomeIsSettledIsNotWithdrawn) {
  std::atomic<std::uint32_t> met{99};
  set_status_hook([&met](int, int) { met = cancel_backups_of(":1.7"); });
  start(1);
  finish();
  EXPECT_EQ(met, 0U);
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{0, 4, 1}));
}

/** In a name's place: another package is packed, by an export say. */
constexpr char kPacking[] = "packing";

/** A request that holds an archive for as long as it likes. */
class HeldArchive {
 public:
  explicit HeldArchive(const std::string &name) : holder_(new backup_context) {
    if (name == kPacking) {
      packing_.emplace("org.other", PackageUse::kPack);
    } else {
      EXPECT_TRUE(acquire_staged_archive(holder_.get(), name));
    }
  }

 private:
  BackupContextPtr holder_;
  std::optional<PackageDataLock> packing_;
};

class LeaseWait : public Dispatch, public ::testing::WithParamInterface<const char *> {
 protected:
  /** A manual backup that waits for what another holds. */
  void wait_for_lease() {
    install("org.a");
    install("org.b");
    start(1);
    run_until([] { return g_is_backing_up.load(); });
    if (GetParam() == std::string(kStagedListLease)) {
      run_until([this] { return info("=== checking app list from cloud ===") == 1; });
    } else {
      run_until([this] { return info("backup enabled for (org.a)") == 1; });
    }
  }
  static constexpr std::chrono::seconds kSoon{3};
};

TEST_P(LeaseWait, IsEndedByACancel) {
  const HeldArchive held(GetParam());
  wait_for_lease();
  const auto begin = std::chrono::steady_clock::now();
  cancel();
  finish();
  EXPECT_LT(std::chrono::steady_clock::now() - begin, kSoon);
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{17, 6, 1}));
  EXPECT_EQ(info("manual backup cancelled"), 1);
  EXPECT_EQ(info("backup enabled for (org.b)"), 0) << "nothing more is packed";
}

TEST_P(LeaseWait, IsEndedByTheLossOfWifi) {
  const HeldArchive held(GetParam());
  wait_for_lease();
  const auto begin = std::chrono::steady_clock::now();
  fake_wifi = 0;
  finish();
  EXPECT_LT(std::chrono::steady_clock::now() - begin, kSoon);
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{12, 5, 1}));
  EXPECT_EQ(error("WIFI disconnected"), 1);
  EXPECT_GE(cloud_.cancels, 1);
}

INSTANTIATE_TEST_SUITE_P(OfArchiveAndList, LeaseWait,
                         ::testing::Values("org.a", kStagedListLease, kPacking));

TEST_F(Dispatch, ARunGoesOnWhenAnothersPackingHasEnded) {
  install("org.a");
  std::optional<HeldArchive> held(kPacking);
  start(1);
  run_until([this] { return info("backup enabled for (org.a)") == 1; });
  EXPECT_TRUE(sent_statuses().empty());
  held.reset();
  finish();
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{0, 4, 1}));
}

TEST_F(Dispatch, RequestIsOutstandingFromItsQueuingToItsEnd) {
  ::testing::InSequence in_order;
  EXPECT_CALL(platform_, device_power_request_lock(POWER_LOCK_CPU, 0)).WillOnce([](auto, auto) {
    EXPECT_TRUE(backup_request_outstanding());
    EXPECT_FALSE(g_is_backing_up);
    return 0;
  });
  EXPECT_CALL(platform_, device_power_release_lock(POWER_LOCK_CPU)).WillOnce([](auto) {
    EXPECT_TRUE(backup_request_outstanding());
    EXPECT_FALSE(g_is_backing_up);
    return 0;
  });
  set_status_hook([](int, int) {
    EXPECT_TRUE(backup_request_outstanding());
    EXPECT_TRUE(g_is_backing_up);
  });
  EXPECT_FALSE(backup_request_outstanding());
  EXPECT_TRUE(is_idle_status());
  request_backup(new_client(1));
  EXPECT_TRUE(backup_request_outstanding());
  EXPECT_FALSE(is_idle_status());
  finish();
  EXPECT_FALSE(g_is_backing_up);
  EXPECT_TRUE(is_idle_status());
}

TEST_F(Dispatch, NoRequestIsLostHoweverTheyArrive) {
  constexpr int kThreads = 4;
  constexpr int kRequests = 25;
  fake_wifi = 0;  // so that each ends at once
  std::vector<std::thread> clients;
  for (int i = 0; i < kThreads; ++i) {
    clients.emplace_back([] {
      for (int request = 0; request < kRequests; ++request) {
        request_backup(new_client(1));
        std::this_thread::yield();
      }
    });
  }
  for (auto &client : clients) client.join();
  finish();
  EXPECT_EQ(error("cloud couldn't be initialized.(wifi:0)"), kThreads * kRequests);
  EXPECT_EQ(sent_statuses().size(), std::size_t{kThreads} * kRequests);
}

TEST_F(Dispatch, BackupWithRealPausesUploadsEverything) {
  const FakePackage &a = install("org.a");
  const FakePackage &b = install("org.b");
  request_backup(new_client(1));
  finish();
  EXPECT_THAT(cloud_.paths(), ElementsAre(a.object(), b.object(), kAppListInCloud));
  EXPECT_THAT(sent_statuses(), ElementsAre(SentStatus{0, 4, 1}));
}

// The main thread asks for the very package whose archive the worker is uploading.
TEST_F(Dispatch, RequestForAPackageThatIsBeingUploadedWaitsForItsArchive) {
  const FakePackage &a = install("org.a");
  const std::string staged = a.staged();
  held_ = true;
  request_backup(nullptr);
  run_until([&] { return cloud_.waiting() == 1; });
  cloud_.answer_next();
  run_until([&] { return cloud_.count_requests("upload " + a.object()) == 1; });

  const BackupContextPtr request(new backup_context);
  request->single_package = true;
  request->serial_number = kSerial;
  request->cur_pkg_id = a.id;
  request->cur_version = a.version;
  request->cur_pkg_type = a.type;
  request->cur_root_path = a.root;
  g_timeout_add(
      1,
      [](gpointer cloud) -> gboolean {
        static_cast<FakeCloud *>(cloud)->answer_next();
        return G_SOURCE_REMOVE;
      },
      &cloud_);
  EXPECT_EQ(make_app_data_zip(request.get(), "org.a"), 0);
  EXPECT_EQ(cloud_.objects.count(a.object()), 1U) << "the first upload was through";
  EXPECT_TRUE(exists(staged));
  upload_app_data(request.get(), a.id.c_str(), a.root.c_str(), a.version.c_str());
  held_ = false;
  finish();
  run_until([&] { return request->upload_remain == 0; });
  EXPECT_EQ(request->result, 0);
  EXPECT_FALSE(exists(staged));
  EXPECT_EQ(info("auto backup successful!"), 1);
}

// The worker comes to a package that the main thread is uploading.
TEST_F(Dispatch, RunWaitsForAPackageThatARequestIsUploading) {
  const FakePackage &a = install("org.a");
  const BackupContextPtr request(new backup_context);
  request->single_package = true;
  request->serial_number = kSerial;
  request->cur_pkg_id = a.id;
  request->cur_version = a.version;
  request->cur_pkg_type = a.type;
  request->cur_root_path = a.root;
  EXPECT_EQ(make_app_data_zip(request.get(), "org.a"), 0);
  upload_app_data(request.get(), a.id.c_str(), a.root.c_str(), a.version.c_str());
  request_backup(nullptr);
  finish();
  EXPECT_EQ(request->result, 0);
  EXPECT_EQ(cloud_.count_requests("upload " + a.object()), 2);
  EXPECT_EQ(info("auto backup successful!"), 1);
}

TEST_F(Dispatch, ClientsThatDoNotAnswerHoldUpAnothersRunForAMinuteAllTogether) {
  constexpr std::int64_t kMinute = 60000000;
  time_waited_for_clients = kMinute / 2;
  run_one(1);
  EXPECT_FALSE(others_held_up(":1.9")) << "nobody else waits";
  request_backup(new_client(2, ":1.2"));
  time_waited_for_clients = kMinute / 2 + kMinute - 1;
  EXPECT_FALSE(others_held_up(":1.9"));
  time_waited_for_clients = kMinute / 2 + kMinute;
  EXPECT_TRUE(others_held_up(":1.9"));
  EXPECT_TRUE(others_held_up(":1.8")) << "the minute is that of all of them together";
  EXPECT_FALSE(others_held_up(":1.2")) << "who is held up by nobody else";
  // An automatic backup is held up by anybody.
  request_backup(nullptr);
  EXPECT_FALSE(others_held_up(":1.2"));
  time_waited_for_clients = kMinute / 2 + 2 * kMinute;
  EXPECT_TRUE(others_held_up(":1.2"));
  time_waited_for_clients = 0;
}

}  // namespace
