#include "state/state_file.h"

#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>
#include <thread>
#include <vector>

#include "device_fixture.h"
#include "state/alarms.h"
#include "state/values.h"

namespace {

using StateFile = DeviceTest;

TEST_F(StateFile, IsEmptyWhenItIsMissing) {
  const embedded::KeyFilePtr file = embedded::read_state(device(), "none.ini");
  ASSERT_NE(file, nullptr);
  EXPECT_EQ(embedded::text_of(file.get(), "group", "key"), "");
  EXPECT_EQ(embedded::number_of(file.get(), "group", "key", 7), 7);
}

TEST_F(StateFile, CannotBeReadWhenItIsSpoilt) {
  spoil("some.ini");
  EXPECT_EQ(embedded::read_state(device(), "some.ini"), nullptr);
  EXPECT_FALSE(embedded::edit_state(device(), "some.ini", [](GKeyFile *) { return true; }));
  EXPECT_EQ(read_text(dir_ / "state/some.ini"), "no key file\n");
}

TEST_F(StateFile, IsReplacedWholeAndLeavesNothingBeside) {
  ASSERT_TRUE(embedded::write_state_text(device(), "some.ini", "[a]\nb=1\n", 0640));
  struct stat before {};
  ASSERT_EQ(stat((dir_ / "state/some.ini").c_str(), &before), 0);
  EXPECT_EQ(before.st_mode & 07777U, 0640U);
  std::ifstream reader(dir_ / "state/some.ini");
  ASSERT_TRUE(embedded::write_state_text(device(), "some.ini", "[a]\nb=2\n", 0640));
  // Whoever had it open still reads the old one to its end.
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(reader), {}), "[a]\nb=1\n");
  EXPECT_EQ(read_text(dir_ / "state/some.ini"), "[a]\nb=2\n");
  EXPECT_TRUE(std::filesystem::is_empty(dir_ / "state/.tmp"));
}

TEST_F(StateFile, IsLeftAsItIsByAChangeThatDeclines) {
  ASSERT_TRUE(embedded::write_state_text(device(), "some.ini", "[a]\nb=1\n", 0644));
  EXPECT_FALSE(embedded::edit_state(device(), "some.ini", [](GKeyFile *file) {
    g_key_file_set_integer(file, "a", "b", 2);
    return false;
  }));
  EXPECT_EQ(read_text(dir_ / "state/some.ini"), "[a]\nb=1\n");
}

TEST_F(StateFile, CannotBeWrittenOverADirectory) {
  dir_.dir("state/some.ini/below");
  EXPECT_FALSE(embedded::write_state_text(device(), "some.ini", "[a]\n", 0644));
  EXPECT_TRUE(std::filesystem::is_empty(dir_ / "state/.tmp"));
}

TEST_F(StateFile, CannotBeWrittenWithoutADevice) {
  EXPECT_EQ(embedded::read_state("", "some.ini"), nullptr);
  EXPECT_FALSE(embedded::edit_state("", "some.ini", [](GKeyFile *) { return true; }));
  break_state();
  EXPECT_FALSE(embedded::edit_state(device(), "some.ini", [](GKeyFile *) { return true; }));
  EXPECT_FALSE(embedded::write_state_text(device(), "some.ini", "", 0644));
}

TEST_F(StateFile, IsNotLostToAnotherWriter) {
  constexpr int kWriters = 4;
  constexpr int kAlarms = 10;
  std::vector<std::thread> writers;
  std::vector<std::vector<int>> ids(kWriters);
  for (int i = 0; i < kWriters; ++i) {
    writers.emplace_back([this, &mine = ids[i]] {
      for (int n = 0; n < kAlarms; ++n) {
        mine.push_back(embedded::add_alarm(device(), {0, "owner", 1, 0}));
      }
    });
  }
  for (std::thread &writer : writers) writer.join();
  embedded::wait_for_state();
  std::set<int> all;
  for (const auto &mine : ids) all.insert(mine.begin(), mine.end());
  EXPECT_EQ(all.size(), static_cast<size_t>(kWriters * kAlarms));
  EXPECT_GT(*all.begin(), 0);
  std::vector<embedded::Alarm> alarms;
  ASSERT_TRUE(embedded::list_alarms(device(), &alarms));
  EXPECT_EQ(alarms.size(), all.size());
}

TEST(ValueKey, IsAPlainText) {
  EXPECT_TRUE(embedded::is_value_key("db/private/quarn/last_time"));
  for (const char *key : {"", " a", "a ", "a=b", "[a", "a]", "a\nb", "#a", "\xff"}) {
    EXPECT_FALSE(embedded::is_value_key(key)) << key;
  }
}

}  // namespace
