// Writes that fail although they take effect, as a Swift cluster without its majority makes them.
#include <condition_variable>
#include <mutex>

#include "s3_service.h"
#include "session/session.h"

using namespace harness;

namespace {

// Stops after the first failure of a request until it is told to go on.
class StoppingClock : public transport::RetryClock {
 public:
  Point now() override { return {}; }
  bool pause(transport::Ticket &ticket, milliseconds duration) override {
    std::unique_lock<std::mutex> lock(mutex_);
    stopped_ = true;
    if (!changed_.wait_for(lock, std::chrono::minutes(2), [this] { return going_on_; }))
      return false;
    lock.unlock();
    return ticket.pause(duration);
  }
  double random() override { return 0; }
  bool has_stopped() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return stopped_;
  }
  void go_on() {
    const std::lock_guard<std::mutex> lock(mutex_);
    going_on_ = true;
    changed_.notify_all();
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool stopped_ = false;
  bool going_on_ = false;
};

TEST_F(S3ServiceTest, WritesThatFailWithoutTwoOfThreeServersAreMadeGood) {
  ASSERT_EQ(cloud.put("/f/a", "x"), 0);
  ASSERT_EQ(cloud.put("/list", "one"), 0);
  ASSERT_EQ(cloud.get("/list", BACKUP_TRANS_OPTION_BASIS), "one");
  for (const bool deletes : {true, false}) {
    StoppingClock clock;
    transport::set_retry_clock(&clock, {});
    server.kill_nodes(2);
    const AnswerPtr answer =
        deletes ? cloud.remove("/f") : cloud.upload(cloud.file("two"), "/list");
    EXPECT_TRUE(
        run_until([&] { return clock.has_stopped() || answer->calls > 0; }, milliseconds(60000)));
    EXPECT_EQ(answer->calls, 0) << answer->code;
    server.restart_nodes();
    clock.go_on();
    EXPECT_TRUE(cloud.settle(milliseconds(120000)));
    EXPECT_EQ(answer->code, 0);
    EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
    transport::set_retry_clock(nullptr, {});
  }
  EXPECT_EQ(cloud.get("/f/a"), "<12>");
  EXPECT_EQ(cloud.get("/list"), "two");
}

}  // namespace
