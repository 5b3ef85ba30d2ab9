#include "core/retry.h"

#include "harness.h"

using namespace transport;
using std::chrono::milliseconds;
using std::chrono::seconds;

namespace {

class FakeClock : public RetryClock {
 public:
  Point now() override { return now_; }
  bool pause(Ticket &ticket, milliseconds duration) override {
    pauses.push_back(duration);
    now_ += duration;
    if (cancel_in_pause) ticket.cancel();
    return !ticket.cancelled();
  }
  double random() override { return share; }
  void pass(milliseconds duration) { now_ += duration; }

  std::vector<milliseconds> pauses;
  double share = 0;
  bool cancel_in_pause = false;

 private:
  Point now_{};
};

Outcome lost() {
  Outcome outcome = failure(BACKUP_TRANS_ERROR_NETWORK, "lost");
  outcome.transient = true;
  return outcome;
}

TEST(Retry, SuccessAndOtherFailuresEndAtOnce) {
  FakeClock clock;
  Ticket ticket;
  int attempts = 0;
  EXPECT_TRUE(run_with_retries(ticket, clock, {}, [&](int number) {
                EXPECT_EQ(number, ++attempts);
                return success();
              }).ok());
  EXPECT_EQ(run_with_retries(ticket, clock, {},
                             [&](int) {
                               ++attempts;
                               return failure(BACKUP_TRANS_ERROR_QUOTA, "full");
                             })
                .code,
            BACKUP_TRANS_ERROR_QUOTA);
  EXPECT_EQ(attempts, 2);
  EXPECT_TRUE(clock.pauses.empty());
}

TEST(Retry, PausesGrowExponentiallyUpToTheLongest) {
  FakeClock clock;
  Ticket ticket;
  const Outcome outcome = run_with_retries(ticket, clock, {}, [](int) { return lost(); });
  EXPECT_EQ(outcome.code, BACKUP_TRANS_ERROR_NETWORK);
  ASSERT_GT(clock.pauses.size(), 8U);
  const int expected[] = {250, 500, 1000, 2000, 4000, 8000, 10000, 10000};
  for (std::size_t i = 0; i < std::size(expected); ++i)
    EXPECT_EQ(clock.pauses[i], milliseconds(expected[i]));
}

TEST(Retry, JitterStaysInTheUpperHalf) {
  FakeClock clock;
  Ticket ticket;
  clock.share = 0.999;
  EXPECT_FALSE(run_with_retries(ticket, clock, {}, [](int) { return lost(); }).ok());
  EXPECT_EQ(clock.pauses[0], milliseconds(499));
  EXPECT_EQ(clock.pauses[1], milliseconds(999));
}

TEST(Retry, TotalBoundCountsFromTheFirstFailure) {
  FakeClock clock;
  Ticket ticket;
  int attempts = 0;
  const Outcome outcome = run_with_retries(ticket, clock, {}, [&](int) {
    ++attempts;
    clock.pass(seconds(100));  // a long transfer that is lost near its end
    return lost();
  });
  EXPECT_FALSE(outcome.ok());
  EXPECT_EQ(attempts, 3);
  milliseconds total{0};
  FakeClock quick;
  EXPECT_FALSE(run_with_retries(ticket, quick, {}, [](int) { return lost(); }).ok());
  for (const milliseconds pause : quick.pauses) total += pause;
  EXPECT_LT(total, seconds(BACKUP_TRANS_RETRY_TOTAL_SECONDS));
  EXPECT_GT(total, seconds(BACKUP_TRANS_RETRY_TOTAL_SECONDS) - milliseconds(20000));
}

TEST(Retry, StoreThatAsksForAPauseGetsIt) {
  FakeClock clock;
  Ticket ticket;
  clock.share = 0.5;
  const Outcome ended = run_with_retries(ticket, clock, {}, [](int number) {
    if (number == 2) return success();
    Outcome outcome = lost();
    outcome.retry_after = seconds(30);
    return outcome;
  });
  EXPECT_TRUE(ended.ok());
  ASSERT_EQ(clock.pauses.size(), 1U);
  EXPECT_EQ(clock.pauses[0], milliseconds(31500));
}

TEST(Retry, PauseBeyondTheBoundIsNotWaitedFor) {
  FakeClock clock;
  Ticket ticket;
  int attempts = 0;
  const Outcome outcome = run_with_retries(ticket, clock, {}, [&](int) {
    ++attempts;
    Outcome refused = lost();
    refused.retry_after = seconds(BACKUP_TRANS_RETRY_TOTAL_SECONDS);
    return refused;
  });
  EXPECT_EQ(outcome.code, BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(attempts, 1);
  EXPECT_TRUE(clock.pauses.empty());
}

TEST(Retry, CancelEndsThePauseAndTheAttempts) {
  FakeClock clock;
  clock.cancel_in_pause = true;
  Ticket ticket;
  int attempts = 0;
  const auto attempt = [&](int) {
    ++attempts;
    return lost();
  };
  EXPECT_EQ(run_with_retries(ticket, clock, {}, attempt).code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(run_with_retries(ticket, clock, {}, attempt).code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(attempts, 1);
}

TEST(Retry, RealPauseEndsWithTheCancellation) {
  Ticket ticket;
  std::thread canceller([&] { ticket.cancel(); });
  EXPECT_FALSE(RetryClock::system().pause(ticket, seconds(60)));
  canceller.join();
  const auto now = std::chrono::steady_clock::now();
  EXPECT_GE(RetryClock::system().now(), now);
  const double share = RetryClock::system().random();
  EXPECT_GE(share, 0);
  EXPECT_LT(share, 1);
}

TEST(TicketTest, CommitAndCancellationExcludeEachOther) {
  Ticket committed;
  EXPECT_TRUE(committed.begin_commit());
  EXPECT_FALSE(committed.cancel());
  EXPECT_FALSE(committed.cancelled());
  Ticket cancelled;
  int woken = 0;
  cancelled.set_waker([&] { ++woken; });
  EXPECT_TRUE(cancelled.cancel());
  EXPECT_EQ(woken, 1);
  EXPECT_FALSE(cancelled.begin_commit());
  EXPECT_TRUE(cancelled.cancelled());
}

}  // namespace
