#include "session/check.h"

#include <glib.h>
#include <gmock/gmock.h>

#include <atomic>
#include <functional>
#include <future>
#include <map>
#include <thread>
#include <utility>

#include "harness.h"
#include "session/session.h"

using namespace harness;
using namespace transport;

namespace {

/** A store in memory whose steps can be made to fail. */
class StepStore : public Backend {
 public:
  Outcome list(Attempt &attempt, const std::string &, int, int, ListPage *) override {
    steps.emplace_back("list");
    if (on_list) on_list(attempt);
    return outcomes["list"];
  }
  Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *) override {
    steps.emplace_back("upload");
    if (cancel_in_upload != nullptr) {
      cancel_in_upload->cancel();
      if (attempt.ticket.cancelled()) return cancelled();
    }
    if (outcomes["upload"].ok()) object = upload.path;
    return outcomes["upload"];
  }
  Outcome download(Attempt &, const std::string &path, LocalTarget &target, Version *) override {
    steps.emplace_back("download");
    EXPECT_EQ(path, object);
    if (!outcomes["download"].ok()) return outcomes["download"];
    EXPECT_TRUE(target.begin());
    EXPECT_EQ(write(target.fd(), given_back.data(), given_back.size()),
              static_cast<ssize_t>(given_back.size()));
    EXPECT_TRUE(target.publish());
    return success();
  }
  Outcome remove_folder(Attempt &, const std::string &folder) override {
    steps.emplace_back("remove");
    EXPECT_EQ(object.empty() ? folder : object, object.empty() ? folder : folder + "/probe");
    return outcomes["remove"];
  }

  std::map<std::string, Outcome> outcomes;
  std::vector<std::string> steps;
  std::string object;
  std::string given_back = "this can be deleted\n";
  Ticket *cancel_in_upload = nullptr;
  std::function<void(Attempt &attempt)> on_list;
};

using Steps = std::vector<std::string>;

class CheckTest : public ::testing::Test {
 protected:
  Outcome check() { return check_store(ticket, store); }

  Ticket ticket;
  StepStore store;
};

TEST_F(CheckTest, PutsAnObjectReadsItBackAndRemovesIt) {
  EXPECT_TRUE(check().ok());
  EXPECT_EQ(store.steps, (Steps{"list", "upload", "download", "remove"}));
  EXPECT_THAT(store.object, ::testing::MatchesRegex("/quarn-check-[0-9a-f-]{36}/probe"));
}

TEST_F(CheckTest, EachCheckHasAFolderOfItsOwn) {
  ASSERT_TRUE(check().ok());
  const std::string first = store.object;
  ASSERT_TRUE(check().ok());
  EXPECT_NE(store.object, first);
}

TEST_F(CheckTest, AStoreThatCannotBeListedIsNotWrittenTo) {
  store.outcomes["list"] = failure(BACKUP_TRANS_ERROR_AUTHENTICATION, "no");
  EXPECT_EQ(check().code, BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_EQ(store.steps, Steps{"list"});
}

TEST_F(CheckTest, WhatAFailedUploadMayHaveLeftIsRemoved) {
  store.outcomes["upload"] = failure(BACKUP_TRANS_ERROR_QUOTA, "full");
  EXPECT_EQ(check().message, "full");
  EXPECT_EQ(store.steps, (Steps{"list", "upload", "remove"}));
}

TEST_F(CheckTest, AFailedDownloadIsTheResultAndTheObjectGoes) {
  store.outcomes["download"] = failure(BACKUP_TRANS_ERROR_NETWORK, "lost");
  store.outcomes["remove"] = failure(BACKUP_TRANS_ERROR_SERVER, "later");
  EXPECT_EQ(check().message, "lost");
  EXPECT_EQ(store.steps, (Steps{"list", "upload", "download", "remove"}));
}

TEST_F(CheckTest, AnotherContentIsAFailureOfTheStore) {
  store.given_back = "something else\n";
  const Outcome outcome = check();
  EXPECT_EQ(outcome.code, BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(outcome.message, "the store gave back something else than was put there");
}

TEST_F(CheckTest, AnObjectThatCannotBeRemovedIsAFailure) {
  store.outcomes["remove"] = failure(BACKUP_TRANS_ERROR_AUTHENTICATION, "not yours");
  EXPECT_EQ(check().message, "not yours");
}

TEST_F(CheckTest, ACancelledCheckAsksForNothingMore) {
  ticket.cancel();
  EXPECT_EQ(check().code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(store.steps, Steps{});
}

TEST_F(CheckTest, ACancellationReachesTheStepThatRunsAndStillTidiesUp) {
  store.cancel_in_upload = &ticket;
  EXPECT_EQ(check().code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(store.steps, (Steps{"list", "upload", "remove"}));
}

/** Something that happens once. Any thread. */
class Event {
 public:
  void happen() { promise_.set_value(); }
  bool wait() const { return happened_.wait_for(kPatience) == std::future_status::ready; }

 private:
  static constexpr std::chrono::seconds kPatience{30};

  std::promise<void> promise_;
  std::shared_future<void> happened_{promise_.get_future()};
};

struct SlowCopy {
  Event begun;
  Event may_end;
  bool original_lives = false;
};

/** A waker that takes its time when a canceller copies it. */
class SlowlyCopiedWaker {
 public:
  explicit SlowlyCopiedWaker(SlowCopy *copy) : copy_(copy) {}
  SlowlyCopiedWaker(const SlowlyCopiedWaker &other) : copy_(other.copy_) {
    const std::weak_ptr<int> original = other.life_;
    copy_->begun.happen();
    EXPECT_TRUE(copy_->may_end.wait());
    copy_->original_lives = !original.expired();
  }
  SlowlyCopiedWaker(SlowlyCopiedWaker &&) = default;
  SlowlyCopiedWaker &operator=(const SlowlyCopiedWaker &) = delete;
  SlowlyCopiedWaker &operator=(SlowlyCopiedWaker &&) = delete;
  ~SlowlyCopiedWaker() = default;
  void operator()() const {}

 private:
  SlowCopy *copy_;
  std::shared_ptr<int> life_ = std::make_shared<int>();
};

TEST_F(CheckTest, ACancellationMayOutliveTheStepThatItEnds) {
  SlowCopy copy;
  std::thread canceller;
  store.outcomes["list"] = failure(BACKUP_TRANS_ERROR_NETWORK, "lost");
  store.on_list = [&](Attempt &attempt) {
    attempt.ticket.set_waker(SlowlyCopiedWaker(&copy));
    canceller = std::thread([&] { EXPECT_TRUE(ticket.cancel()); });
    EXPECT_TRUE(copy.begun.wait());
  };
  EXPECT_EQ(check().message, "lost");
  copy.may_end.happen();
  canceller.join();
  EXPECT_TRUE(copy.original_lives);
}

TEST(CauseTest, TellsWhatToLookAt) {
  const std::vector<std::pair<backup_trans_error_code, const char *>> expected = {
      {BACKUP_TRANS_ERROR_NONE, "ok"},
      {BACKUP_TRANS_ERROR_NO_SUCH_OBJECT, "address"},
      {BACKUP_TRANS_ERROR_CERTIFICATE, "certificate"},
      {BACKUP_TRANS_ERROR_AUTHENTICATION, "password"},
      {BACKUP_TRANS_ERROR_QUOTA, "space"},
      {BACKUP_TRANS_ERROR_NETWORK, "network"},
      {BACKUP_TRANS_ERROR_LOCAL_FILE, "device"},
      {BACKUP_TRANS_ERROR_SERVER, "server"},
      {BACKUP_TRANS_ERROR_CONFLICT, "server"}};
  for (const auto &[code, word] : expected)
    EXPECT_STREQ(backup_trans_cause_word(cause_of(failure(code, ""))), word) << code;
  EXPECT_STREQ(backup_trans_cause_word(static_cast<backup_trans_cause>(99)), "unknown");
}

TEST(CauseTest, ANetworkFailureOfAnUnknownHostIsTheAddress) {
  Outcome outcome = failure(BACKUP_TRANS_ERROR_NETWORK, "no such host");
  outcome.wrong_address = true;
  EXPECT_EQ(cause_of(outcome), BACKUP_TRANS_CAUSE_ADDRESS);
}

/* ---- through the library's interface ---- */

struct Told {
  int calls = 0;
  backup_trans_error_code error = BACKUP_TRANS_ERROR_ARGUMENT;
  backup_trans_cause cause = BACKUP_TRANS_CAUSE_NONE;
  std::string message;
};

void on_checked(backup_trans_error_code error, void *data, backup_trans_cause cause,
                const char *message) {
  auto &told = *static_cast<Told *>(data);
  ++told.calls;
  told.error = error;
  told.cause = cause;
  told.message = message;
}

class CheckRequestTest : public ::testing::Test {
 protected:
  CheckRequestTest() {
    set_backend_maker([this](const Config &, std::string *) { return store; });
    cloud = std::make_unique<Cloud>("[cloud]\nurl=scripted\n");
  }
  ~CheckRequestTest() override {
    cloud.reset();
    set_backend_maker(nullptr);
  }
  Told check() {
    Told told;
    EXPECT_EQ(backup_trans_check_async(cloud->handle, &told, on_checked), 0);
    EXPECT_EQ(told.calls, 0);
    EXPECT_TRUE(run_until([&] { return told.calls > 0; }));
    return told;
  }

  std::shared_ptr<StepStore> store = std::make_shared<StepStore>();
  std::unique_ptr<Cloud> cloud;
};

TEST_F(CheckRequestTest, AUsableStoreIsSaidToBeSo) {
  const Told told = check();
  EXPECT_EQ(told.calls, 1);
  EXPECT_EQ(told.error, BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(told.cause, BACKUP_TRANS_CAUSE_NONE);
  EXPECT_EQ(told.message, "objects can be put there, read and removed");
}

TEST_F(CheckRequestTest, WhatTheServerSaidIsToldAndNothingIsTriedTwice) {
  Outcome full = failure(BACKUP_TRANS_ERROR_QUOTA, "upload: the server answered 507");
  full.said = "Insufficient Storage";
  full.transient = true;
  store->outcomes["upload"] = full;
  const Told told = check();
  EXPECT_EQ(told.error, BACKUP_TRANS_ERROR_QUOTA);
  EXPECT_EQ(told.cause, BACKUP_TRANS_CAUSE_SPACE);
  EXPECT_EQ(told.message, "upload: the server answered 507 (Insufficient Storage)");
  EXPECT_EQ(store->steps, (Steps{"list", "upload", "remove"}));
}

TEST_F(CheckRequestTest, ARefusedCheckGetsNoCallback) {
  EXPECT_EQ(backup_trans_check_async(cloud->handle, nullptr, nullptr), BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(backup_trans_check_async(nullptr, nullptr, on_checked), BACKUP_TRANS_ERROR_ARGUMENT);
}

TEST_F(CheckRequestTest, TheLastCauseIsThatOfTheLastRequestThatTellsOfTheStore) {
  store->outcomes["list"] = failure(BACKUP_TRANS_ERROR_AUTHENTICATION, "no");
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_PASSWORD);
  store->outcomes["list"] = failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "no");
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_PASSWORD);
  store->outcomes["list"] = failure(BACKUP_TRANS_ERROR_CONFLICT, "changed");
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_NONE);
  store->outcomes["list"] = failure(BACKUP_TRANS_ERROR_CERTIFICATE, "no");
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_CERTIFICATE);
  store->outcomes["list"] = success();
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_NONE);
}

TEST_F(CheckRequestTest, WhatWasAcceptedBeforeAFailureDoesNotMakeItForgotten) {
  std::promise<void> go_on;
  std::shared_future<void> gate = go_on.get_future().share();
  std::promise<void> entered;
  std::atomic<int> checks{0};
  store->on_list = [&](Attempt &) {
    if (++checks != 1) return;
    entered.set_value();
    gate.wait();
  };
  std::atomic<int> answered{0};
  const auto count = [](backup_trans_error_code, void *user_data, backup_trans_cause,
                        const char *) { ++*static_cast<std::atomic<int> *>(user_data); };
  ASSERT_EQ(backup_trans_check_async(cloud->handle, &answered, count), BACKUP_TRANS_ERROR_NONE);
  entered.get_future().wait();
  store->outcomes["list"] = failure(BACKUP_TRANS_ERROR_QUOTA, "full");
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_SPACE);
  store->outcomes["list"] = success();
  go_on.set_value();
  ASSERT_TRUE(run_until([&] { return answered != 0; }));
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_SPACE) << "it began before the failure";
  check();
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_NONE);
}

}  // namespace
