#include "http/least_rate.h"

#include <gtest/gtest.h>

using std::chrono::seconds;
using transport::LeastRate;

namespace {

const LeastRate::Point kStart{std::chrono::hours(1)};

// How many seconds an exchange of so many bytes a second goes on; an hour stands for ever.
int lasts(std::int64_t bytes_a_second, int every = 1) {
  LeastRate rate;
  rate.begin(kStart);
  for (int second = 1; second <= 3600; ++second) {
    const auto now = kStart + seconds(second);
    if (second % every == 0) rate.note(bytes_a_second * every, false, now);
    if (now >= rate.judged_at() && !rate.goes_on(now)) {
      EXPECT_FALSE(rate.is_kept());
      return second;
    }
  }
  EXPECT_TRUE(rate.is_kept());
  return 3600;
}

TEST(LeastRateTest, HalfAKilobyteASecondIsEnough) {
  EXPECT_EQ(lasts(1000), 3600);
  EXPECT_EQ(lasts(512), 3600);
  EXPECT_EQ(lasts(511), 60);
  EXPECT_EQ(lasts(1, 20), 60);
  EXPECT_EQ(lasts(0), 60);
}

TEST(LeastRateTest, ItMayComeInPieces) {
  EXPECT_EQ(lasts(600, 29), 3600);
  EXPECT_EQ(lasts(100000, 60), 3600);
}

TEST(LeastRateTest, NoPeriodLivesOnAnEarlierOne) {
  LeastRate rate;
  rate.begin(kStart);
  rate.note(std::int64_t{1} << 40, false, kStart);
  EXPECT_TRUE(rate.goes_on(rate.judged_at()));
  EXPECT_FALSE(rate.goes_on(rate.judged_at()));
}

TEST(LeastRateTest, WhileNothingHasToMoveNothingIsMissed) {
  LeastRate rate;
  rate.begin(kStart);
  rate.note(0, true, kStart + seconds(59));
  EXPECT_EQ(rate.judged_at(), kStart + seconds(119));
  rate.note(30720, false, kStart + seconds(100));
  EXPECT_TRUE(rate.goes_on(kStart + seconds(119)));
}

}  // namespace
