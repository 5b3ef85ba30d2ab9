#include <cmath>
#include <limits>

#include "backup_device.h"

namespace {

constexpr std::uint64_t kAllOnes = std::numeric_limits<std::uint64_t>::max();

class LastTime : public BackupDevice {};

TEST_F(LastTime, MissingKeyReadsAsAllOnesAndLogsTheError) {
  EXPECT_EQ(get_last_backup_time(), kAllOnes);
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot read last backup time from vconf"), 1);
}

TEST_F(LastTime, InitialisedTimeReadsBackAsZero) {
  init_last_backup_time();
  EXPECT_EQ(count_logged(DLOG_INFO, "last backup time setted to 0"), 1);
  EXPECT_EQ(get_last_backup_time(), 0U);
  EXPECT_EQ(count_logged(DLOG_INFO, "last backup time is 0"), 1);
}

TEST_F(LastTime, StoresThePresentTimeInMilliseconds) {
  const std::uint64_t before = static_cast<std::uint64_t>(std::time(nullptr)) * 1000;
  set_last_backup_time();
  const std::uint64_t stored = get_last_backup_time();
  EXPECT_GE(stored, before);
  EXPECT_LE(stored, before + 60000);
  EXPECT_EQ(settings_.count("db/private/quarn/last_time"), 1U);
  EXPECT_EQ(count_logged(DLOG_INFO, "last backup time setted to " + std::to_string(stored)), 1);
}

TEST_F(LastTime, UnwritableStoreIsLoggedAndNothingElse) {
  settings_work_ = false;
  set_last_backup_time();
  init_last_backup_time();
  EXPECT_EQ(count_logged(DLOG_ERROR, "cannot set last backup time to vconf"), 2);
  EXPECT_TRUE(settings_.empty());
}

TEST_F(LastTime, ValuesThatAreNoTimeReadAsAllOnes) {
  for (const double value : {-1.0, std::nan(""), 1e300, 18446744073709551616.0}) {
    settings_[kLastTimeKey] = value;
    EXPECT_EQ(get_last_backup_time(), kAllOnes) << value;
    std::uint64_t time = 7;
    EXPECT_FALSE(read_last_backup_time(&time)) << value;
    EXPECT_EQ(time, 7U);
  }
}

}  // namespace
