#include "session/session.h"

#include <atomic>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <mutex>

#include "harness.h"

using namespace harness;
using namespace transport;

namespace {

/** Answers what it is told to, in order; then success. */
class ScriptedBackend : public Backend {
 public:
  Outcome download(Attempt &attempt, const std::string &, LocalTarget &, Version *) override {
    return next(attempt);
  }
  Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *info) override {
    info->path = upload.path;
    return next(attempt);
  }
  Outcome list(Attempt &attempt, const std::string &folder, int, int, ListPage *page) override {
    ObjectInfo child;
    child.path = folder + "/child";
    page->children.push_back(child);
    return next(attempt);
  }
  Outcome remove_folder(Attempt &attempt, const std::string &) override { return next(attempt); }

  void script(std::deque<Outcome> outcomes) {
    const std::lock_guard<std::mutex> lock(mutex_);
    outcomes_ = std::move(outcomes);
  }
  /** Calls do not come back, whatever is cancelled. */
  void get_stuck() {
    const std::lock_guard<std::mutex> lock(mutex_);
    stuck_ = true;
  }
  void get_unstuck() {
    const std::lock_guard<std::mutex> lock(mutex_);
    stuck_ = false;
    changed_.notify_all();
  }
  std::atomic<int> calls{0};
  std::atomic<int> running{0};
  std::atomic<int> most_running{0};
  std::atomic<int> remembered{0};

 private:
  Outcome next(Attempt &attempt) {
    ++calls;
    const int now = ++running;
    int most = most_running;
    while (now > most && !most_running.compare_exchange_weak(most, now)) {
    }
    if (attempt.memory.has_value()) ++remembered;
    attempt.memory = attempt.number;
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return !stuck_; });
    --running;
    if (outcomes_.empty()) return success();
    Outcome outcome = outcomes_.front();
    outcomes_.pop_front();
    return outcome;
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  bool stuck_ = false;
  std::deque<Outcome> outcomes_;
};

Outcome transient_failure() {
  Outcome outcome = failure(BACKUP_TRANS_ERROR_NETWORK, "connection lost");
  outcome.transient = true;
  return outcome;
}

class NoPauseClock : public RetryClock {
 public:
  Point now() override { return Point{}; }
  bool pause(Ticket &ticket, milliseconds) override { return !ticket.cancelled(); }
  double random() override { return 0; }
};

class SessionTest : public ::testing::Test {
 protected:
  SessionTest() {
    set_backend_maker([this](const Config &, std::string *) { return backend; });
    set_retry_clock(&clock, {});
    cloud = std::make_unique<Cloud>("[cloud]\nurl=scripted\n");
  }
  ~SessionTest() override {
    backend->get_unstuck();
    cloud.reset();
    EXPECT_TRUE(run_until([] { return threads_named(kWorkerName) == 0; }));
    set_backend_maker(nullptr);
    set_retry_clock(nullptr, {});
  }
  NoPauseClock clock;
  std::shared_ptr<ScriptedBackend> backend = std::make_shared<ScriptedBackend>();
  std::unique_ptr<Cloud> cloud;
};

TEST_F(SessionTest, TransientFailuresAreRepeatedUntilOneAttemptSucceeds) {
  backend->script({transient_failure(), transient_failure(), success()});
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(backend->calls, 3);
  EXPECT_EQ(backend->remembered, 2);
}

TEST_F(SessionTest, EachKindOfRequestIsRepeated) {
  for (int i = 0; i < 4; ++i) {
    backend->script({transient_failure(), success()});
    backend->calls = 0;
    AnswerPtr answer;
    if (i == 0) answer = cloud->download("/a", cloud->place());
    if (i == 1) answer = cloud->list("/");
    if (i == 2) answer = cloud->remove("/a");
    if (i == 3) answer = cloud->upload(cloud->file("x"), "/a");
    ASSERT_TRUE(cloud->settle());
    EXPECT_EQ(answer->code, 0);
    EXPECT_EQ(backend->calls, 2);
    // What a failed attempt had collected is not told twice.
    EXPECT_EQ(answer->children.size(), i > 0 ? 1U : 0U);
  }
}

TEST_F(SessionTest, OtherFailuresAreNotRepeatedAndTheirTextIsTold) {
  backend->script({failure(BACKUP_TRANS_ERROR_CERTIFICATE, "expired yesterday")});
  const AnswerPtr answer = cloud->download("/a", cloud->place());
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_CERTIFICATE);
  EXPECT_EQ(answer->message, "expired yesterday");
  EXPECT_EQ(backend->calls, 1);
}

TEST_F(SessionTest, StuckStoreDoesNotKeepACancelledCallerWaiting) {
  backend->get_stuck();
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < 2 * BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS; ++i)
    answers.push_back(cloud->list("/"));
  ASSERT_TRUE(run_until([&] { return backend->running == BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS; }));
  std::atomic<int> waited{-1};
  std::thread waiter([&] {
    waited = backup_trans_download_file_ors(cloud->handle, "/a", cloud->dir().path().c_str(), 0);
  });
  const auto start = std::chrono::steady_clock::now();
  backup_trans_cancel_request(cloud->handle);
  ASSERT_TRUE(cloud->settle());
  EXPECT_LT(std::chrono::steady_clock::now() - start, milliseconds(1000));
  for (const AnswerPtr &answer : answers) EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_CANCELLED);
  backup_trans_cancel_request(cloud->handle);
  run_until([&] {
    backup_trans_cancel_request(cloud->handle);
    return waited >= 0;
  });
  waiter.join();
  EXPECT_EQ(waited, BACKUP_TRANS_ERROR_CANCELLED);
  backend->get_unstuck();
  EXPECT_TRUE(run_until([] { return threads_named(kWorkerName) == 0; }));
  EXPECT_EQ(backend->most_running, BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS);
  EXPECT_EQ(backend->calls, BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS);
}

TEST_F(SessionTest, SynchronousDownloadLeavesAStuckStoreAlone) {
  backend->get_stuck();
  std::atomic<int> waited{-1};
  std::thread waiter([&] {
    waited = backup_trans_download_file_ors(cloud->handle, "/a", (cloud->dir() / "a").c_str(), 0);
  });
  ASSERT_TRUE(run_until([&] { return backend->running == 1; }));
  const auto start = std::chrono::steady_clock::now();
  backup_trans_cancel_request(cloud->handle);
  waiter.join();
  EXPECT_LT(std::chrono::steady_clock::now() - start, milliseconds(1000));
  EXPECT_EQ(waited, BACKUP_TRANS_ERROR_CANCELLED);
}

TEST_F(SessionTest, InitAnsweredAfterTheEndIsCancelled) {
  int code = -1;
  ASSERT_EQ(backup_trans_init(&code, [](backup_trans_error_code error,
                                        void *out) { *static_cast<int *>(out) = error; }),
            0);
  EXPECT_EQ(code, -1);
  backup_trans_deinit();
  ASSERT_TRUE(run_until([&] { return code >= 0; }));
  EXPECT_EQ(code, BACKUP_TRANS_ERROR_CANCELLED);
}

TEST_F(SessionTest, HandleOfAnEndedSessionStaysRefused) {
  backup_trans_handle_h old = cloud->handle;
  backup_trans_deinit();
  Cloud again("[cloud]\nurl=scripted\n");
  cloud->handle = old;
  EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_NOT_INITIALIZED);
  EXPECT_EQ(again.put("/a", "x"), 0);
}

TEST_F(SessionTest, PointerThatIsNoHandleIsRefused) {
  int something = 0;
  cloud->handle = reinterpret_cast<backup_trans_handle_h>(&something);
  EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_ARGUMENT);
  backup_trans_cancel_request(cloud->handle);
}

TEST_F(SessionTest, BasisFromAnotherStoreConflicts) {
  ASSERT_EQ(cloud->download("/a", cloud->place(), BACKUP_TRANS_OPTION_BASIS)->accepted, 0);
  ASSERT_TRUE(cloud->settle());
  backend = std::make_shared<ScriptedBackend>();
  cloud->configure("[cloud]\nurl=another\n");
  EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(backend->calls, 0);
}

TEST_F(SessionTest, SignalsAreNotForTheWorkers) {
  backend->get_stuck();
  cloud->list("/");
  ASSERT_TRUE(run_until([&] { return backend->running == 1; }));
  std::string masks;
  for (const auto &thread : std::filesystem::directory_iterator("/proc/self/task")) {
    const std::string text = read_file((thread.path() / "status").string());
    if (text.find(std::string("Name:\t") + kWorkerName) != std::string::npos)
      masks += text.substr(text.find("SigBlk:"), 24);
  }
  EXPECT_EQ(masks, "SigBlk:\t" + std::string("fffffffe7ffbfeff"));
}

TEST(SessionWithoutConfiguration, InitTellsAndNothingStarts) {
  for (const char *text : {"", "[cloud]\nurl=unknown://x\n"}) {
    const TempDir dir;
    write_file(dir / "c", text);
    setenv("QUARN_CLOUD_CONFIG", (dir / "c").c_str(), 1);
    int code = -1;
    ASSERT_EQ(backup_trans_init(&code, [](backup_trans_error_code error,
                                          void *out) { *static_cast<int *>(out) = error; }),
              0);
    EXPECT_EQ(code, -1);
    ASSERT_TRUE(run_until([&] { return code >= 0; }));
    EXPECT_EQ(code, BACKUP_TRANS_ERROR_NOT_INITIALIZED);
    EXPECT_EQ(backup_trans_create_handle(), nullptr);
  }
  backup_trans_cancel_request(nullptr);
  backup_trans_deinit();
}

TEST(ErrorText, EachResultHasItsOwn) {
  std::map<std::string, int> texts;
  for (const int code : {0, 1, 2, 10, 11, 12, 13, 14, 15, 16, 17, 18})
    ++texts[backup_trans_error_text(static_cast<backup_trans_error_code>(code))];
  EXPECT_EQ(texts.size(), 12U);
  EXPECT_STREQ(backup_trans_error_text(static_cast<backup_trans_error_code>(9)), "unknown error");
}

}  // namespace
