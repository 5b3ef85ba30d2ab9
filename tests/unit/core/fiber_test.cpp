#include "quarn_d_utils/fiber.h"

#include <gtest/gtest.h>

#include <csignal>
#include <string>
#include <thread>
#include <vector>

#include "quarn_d_utils/admission.h"

namespace {

/** Text that grows; each part says whose turn it was. */
std::string turns;

TEST(Fiber, RunsAtOnceAndToItsEndWhenNothingSuspendsIt) {
  turns.clear();
  EXPECT_EQ(current_fiber(), nullptr);
  run_on_fiber([] {
    EXPECT_NE(current_fiber(), nullptr);
    turns += "fiber ";
  });
  turns += "caller";
  EXPECT_EQ(turns, "fiber caller");
  EXPECT_EQ(current_fiber(), nullptr);
}

TEST(Fiber, GoesOnWhereItWasSuspended) {
  turns.clear();
  quarn_fiber *fiber = nullptr;
  run_on_fiber([&fiber] {
    const std::string own = "kept ";
    fiber = current_fiber();
    turns += "a ";
    suspend_fiber();
    turns += own;
    suspend_fiber();
    turns += "c";
  });
  turns += "1 ";
  resume_fiber(fiber);
  turns += "2 ";
  resume_fiber(fiber);
  EXPECT_EQ(turns, "a 1 kept 2 c");
}

TEST(Fiber, OnesSuspendedInOneOrderGoOnInAnother) {
  turns.clear();
  std::vector<quarn_fiber *> fibers;
  for (const char *name : {"a", "b", "c"}) {
    run_on_fiber([&fibers, name] {
      fibers.push_back(current_fiber());
      suspend_fiber();
      turns += name;
    });
  }
  for (const std::size_t i : {1U, 2U, 0U}) resume_fiber(fibers[i]);
  EXPECT_EQ(turns, "bca");
}

TEST(Fiber, OneStartedOnAnotherGivesBackToThatOne) {
  turns.clear();
  quarn_fiber *inner = nullptr;
  run_on_fiber([&inner] {
    quarn_fiber *const outer = current_fiber();
    run_on_fiber([&inner] {
      inner = current_fiber();
      turns += "inner ";
      suspend_fiber();
      turns += "inner again";
    });
    EXPECT_EQ(current_fiber(), outer);
    turns += "outer ";
  });
  turns += "caller ";
  resume_fiber(inner);
  EXPECT_EQ(turns, "inner outer caller inner again");
}

TEST(Fiber, NumbersAreNeverUsedAgain) {
  std::vector<std::uint64_t> numbers{0};
  for (int i = 0; i < 5; ++i) {
    run_on_fiber([&numbers] { numbers.push_back(fiber_id(current_fiber())); });
    EXPECT_GT(numbers.back(), numbers[numbers.size() - 2]);
  }
  EXPECT_EQ(fiber_id(nullptr), 0U);
}

TEST(Fiber, AMarkStaysWithItsFiber) {
  EXPECT_FALSE(fiber_is_withdrawn(current_fiber()));
  run_on_fiber([] {
    EXPECT_FALSE(fiber_is_withdrawn(current_fiber()));
    withdraw_fiber(current_fiber());
    EXPECT_TRUE(fiber_is_withdrawn(current_fiber()));
  });
  run_on_fiber([] { EXPECT_FALSE(fiber_is_withdrawn(current_fiber())); });
}

/** Deeper than a fiber's stack. */
int descend(int levels) {
  volatile char room[4096];
  room[0] = static_cast<char>(levels);
  return levels == 0 ? 0 : 1 + descend(levels - 1) + (room[0] == levels ? 0 : 1000000);
}

TEST(Fiber, WorkThatNeedsMuchStackRunsOnTheThreadsOwn) {
  int reached = 0;
  run_on_fiber([&reached] {
    run_on_thread_stack([&reached] {
      EXPECT_EQ(current_fiber(), nullptr);
      reached = descend(100) == 100 ? 1 : 0;
    });
    EXPECT_NE(current_fiber(), nullptr);
    ++reached;
    run_on_fiber([&reached] { run_on_thread_stack([&reached] { ++reached; }); });
  });
  EXPECT_EQ(reached, 3);
  run_on_thread_stack([&reached] { ++reached; });
  EXPECT_EQ(reached, 4);
}

TEST(Fiber, OtherThreadsHaveTheirOwn) {
  run_on_fiber([] {
    std::thread([] {
      EXPECT_EQ(current_fiber(), nullptr);
      int steps = 0;
      quarn_fiber *fiber = nullptr;
      run_on_fiber([&] {
        fiber = current_fiber();
        suspend_fiber();
        ++steps;
      });
      resume_fiber(fiber);
      EXPECT_EQ(steps, 1);
    }).join();
  });
}

void overflow() {
  run_on_fiber([] { descend(static_cast<int>(kFiberStackSize / 4096) + 16); });
}

TEST(FiberDeathTest, AStackThatIsUsedUpEndsTheProcessAndNothingElse) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(overflow(), "");
}

/* ---- how many may wait ---- */

TEST(Admission, OneCallerHasSixtyFourAndOthersHaveTheirs) {
  std::vector<std::shared_ptr<const void>> waiting;
  for (std::size_t i = 0; i < kMaxWaitingOfCaller; ++i) {
    ASSERT_TRUE(may_wait(":1.1")) << i;
    waiting.push_back(count_waiting(":1.1"));
  }
  EXPECT_FALSE(may_wait(":1.1"));
  EXPECT_TRUE(may_wait(":1.2"));
  waiting.pop_back();
  EXPECT_TRUE(may_wait(":1.1"));
  waiting.clear();
  EXPECT_EQ(waiting_requests(), 0U);
}

TEST(Admission, AllTogetherHaveFiveHundredAndTwelve) {
  std::vector<std::shared_ptr<const void>> waiting;
  for (std::size_t i = 0; i < kMaxWaiting; ++i) {
    const std::string caller = ":1." + std::to_string(i % 16);
    ASSERT_TRUE(may_wait(caller)) << i;
    waiting.push_back(count_waiting(caller));
  }
  EXPECT_FALSE(may_wait(":1.1000"));
  EXPECT_EQ(waiting_requests(), kMaxWaiting);
  std::thread([&] { waiting.pop_back(); }).join();
  EXPECT_TRUE(may_wait(":1.1000"));
}

/** Requests of parties, each from a connection of its own. */
class Waiting {
 public:
  bool take(const waiting_parties &parties) {
    const std::string connection = ":1." + std::to_string(waiting_.size());
    if (!may_wait(connection, parties)) return false;
    waiting_.push_back(count_waiting(connection, parties));
    return true;
  }
  /** @return how many were accepted */
  std::size_t take_all(const waiting_parties &parties) {
    std::size_t count = 0;
    while (take(parties)) ++count;
    return count;
  }
  std::size_t size() const { return waiting_.size(); }

 private:
  std::vector<std::shared_ptr<const void>> waiting_;
};

TEST(Admission, ACallerHasSixtyFourOverAllItsConnections) {
  Waiting waiting;
  EXPECT_EQ(waiting.take_all({"user", false}), kMaxWaitingOfCaller);
  EXPECT_EQ(waiting.take_all({"application", true}), kMaxWaitingOfCaller);
  EXPECT_EQ(waiting.take_all({"other user", false}), kMaxWaitingOfCaller);
}

TEST(Admission, ApplicationsLeavePlacesForUsersAndUsersForRoot) {
  Waiting waiting;
  for (int i = 0; waiting.take_all({"application " + std::to_string(i), true}) != 0; ++i) {
  }
  EXPECT_EQ(waiting.size(), kMaxWaitingOfApplications);
  for (int i = 0; waiting.take_all({"user " + std::to_string(i), false}) != 0; ++i) {
  }
  EXPECT_EQ(waiting.size(), kMaxWaitingOfOthers);
  EXPECT_EQ(waiting.take_all({}), kMaxWaiting - kMaxWaitingOfOthers) << "root's";
  EXPECT_EQ(kMaxWaiting - kMaxWaitingOfOthers, kMaxWaitingOfCaller);
}

TEST(Admission, WhatRootLetsWaitLeavesTheOthersAsManyPlacesAsThereAre) {
  Waiting waiting;
  for (std::size_t i = 0; i < kMaxWaitingOfOthers; ++i) ASSERT_TRUE(waiting.take({})) << i;
  EXPECT_EQ(waiting.take_all({"user", false}), kMaxWaiting - kMaxWaitingOfOthers);
}

TEST(Admission, AllPlacesAreGivenBack) {
  {
    Waiting waiting;
    for (const bool is_application : {false, true}) {
      for (int i = 0; i < 8; ++i) waiting.take_all({std::to_string(i), is_application});
    }
  }
  EXPECT_EQ(waiting_requests(), 0U);
  Waiting waiting;
  for (int i = 0; waiting.take_all({"application " + std::to_string(i), true}) != 0; ++i) {
  }
  EXPECT_EQ(waiting.size(), kMaxWaitingOfApplications);
  EXPECT_TRUE(waiting.take({"user", false}));
}

TEST(Admission, KnowsTheFibersOfACaller) {
  std::shared_ptr<const void> waiting;
  std::uint64_t number = 0;
  run_on_fiber([&] {
    number = fiber_id(current_fiber());
    waiting = count_waiting(":1.3");
  });
  EXPECT_EQ(fibers_of_caller(":1.3"), std::vector<std::uint64_t>{number});
  EXPECT_TRUE(fibers_of_caller(":1.4").empty());
  waiting.reset();
  EXPECT_TRUE(fibers_of_caller(":1.3").empty());
}

}  // namespace
