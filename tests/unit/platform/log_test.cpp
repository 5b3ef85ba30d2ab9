#include "platform_log.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "device_fixture.h"

namespace {

bool has_form(const std::string &text, const std::string &form) {
  return g_regex_match_simple(("^" + form + "$").c_str(), text.c_str(), G_REGEX_DOLLAR_ENDONLY,
                              static_cast<GRegexMatchFlags>(0)) != FALSE;
}

class Log : public DeviceTest {
 protected:
  std::vector<std::string> lines() const {
    std::vector<std::string> all;
    std::ifstream file(dir_ / "log/quarnd.log");
    for (std::string line; std::getline(file, line);) all.push_back(line);
    return all;
  }
};

TEST_F(Log, WritesOneLineAMessageWithItsTimeLevelAndPlace) {
  testing::internal::CaptureStderr();
  EXPECT_GT(dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "%s: %s(%d) > %s", "file.cpp", "work", 12,
                       "hello"),
            0);
  const std::string shown = testing::internal::GetCapturedStderr();
  ASSERT_EQ(lines().size(), 1U);
  EXPECT_EQ(shown, lines()[0] + "\n");
  const std::string form = R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{3}Z I/QUARND\()" +
                           std::to_string(getpid()) + R"(\): file\.cpp: work\(12\) > hello)";
  EXPECT_TRUE(has_form(shown.substr(0, shown.size() - 1), form)) << shown;
}

TEST_F(Log, NamesEachLevelByItsLetter) {
  testing::internal::CaptureStderr();
  for (const auto level : {DLOG_DEBUG, DLOG_INFO, DLOG_WARN, DLOG_ERROR}) {
    dlog_print(LOG_ID_MAIN, level, "QUARND", "x");
  }
  testing::internal::GetCapturedStderr();
  std::string letters;
  for (const std::string &line : lines()) letters += line[line.find('/') - 1];
  EXPECT_EQ(letters, "DIWE");
}

TEST_F(Log, KeepsAMessageWithLineEndsOnOneLine) {
  testing::internal::CaptureStderr();
  dlog_print(LOG_ID_MAIN, DLOG_ERROR, "QUARND", "one\ntwo\rthree");
  EXPECT_NE(testing::internal::GetCapturedStderr().find("one\\ntwo\\rthree\n"), std::string::npos);
  EXPECT_EQ(lines().size(), 1U);
}

TEST_F(Log, LetsNoNameSpeakToATerminal) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"a\x1b[2Jb", "a\\x1b[2Jb"},
      {"\x1b]0;title\x07", "\\x1b]0;title\\x07"},
      {"a\tb\bc\x01", "a\\tb\\x08c\\x01"},
      {"del\x7f", "del\\x7f"},
      {"csi\xc2\x9b"
       "31m",
       "csi\\u{9b}31m"},
      {"next\xc2\x85line", "next\\u{85}line"},
      {"separated\xe2\x80\xa8line", "separated\\u{2028}line"},
      {"reversed\xe2\x80\xaetxt", "reversed\\u{202e}txt"},
      {"bare\x9b"
       "31m",
       "bare\\x9b31m"},
      {"cut\xe2\x80", "cut\\xe2\\x80"},
      {"overlong\xc0\x9b", "overlong\\xc0\\x9b"},
      {"surrogate\xed\xa0\x80", "surrogate\\xed\\xa0\\x80"},
      {"d\xc3\xa9j\xc3\xa0 vu \xe6\x97\xa5 \\ \"quoted\"",
       "d\xc3\xa9j\xc3\xa0 vu \xe6\x97\xa5 \\ \"quoted\""},
  };
  testing::internal::CaptureStderr();
  for (const auto &[name, shown] : cases) {
    dlog_print(LOG_ID_MAIN, DLOG_ERROR, "QUARND", "file.cpp: work(1) > %s", name.c_str());
  }
  const std::string told = testing::internal::GetCapturedStderr();
  const auto all = lines();
  ASSERT_EQ(all.size(), cases.size());
  std::string written;
  for (std::size_t i = 0; i < cases.size(); ++i) {
    EXPECT_EQ(all[i].substr(all[i].find(" > ") + 3), cases[i].second);
    written += all[i] + "\n";
  }
  EXPECT_EQ(told, written);
}

TEST_F(Log, DoesNotChangeErrno) {
  testing::internal::CaptureStderr();
  errno = ENOTTY;
  dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "x");
  EXPECT_EQ(errno, ENOTTY);
  testing::internal::GetCapturedStderr();
}

TEST_F(Log, OfSeveralThreadsIsNotMixed) {
  constexpr int kThreads = 4;
  constexpr size_t kMessages = 200;
  testing::internal::CaptureStderr();
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([i] {
      const std::string text(300, static_cast<char>('a' + i));
      for (size_t n = 0; n < kMessages; ++n) {
        dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "%s", text.c_str());
      }
    });
  }
  for (std::thread &thread : threads) thread.join();
  testing::internal::GetCapturedStderr();
  const auto all = lines();
  EXPECT_EQ(all.size(), kThreads * kMessages);
  const std::string form = R"([^ ]+ I/QUARND\(\d+\): (.)\1{299})";
  for (const std::string &line : all) EXPECT_TRUE(has_form(line, form)) << line;
}

TEST_F(Log, GoesToStandardErrorAloneOutsideADevice) {
  leave_device();
  testing::internal::CaptureStderr();
  EXPECT_GT(dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "outside"), 0);
  EXPECT_NE(testing::internal::GetCapturedStderr().find("outside"), std::string::npos);
  EXPECT_TRUE(lines().empty());
}

TEST_F(Log, IsLostWithoutHarmWhenItCannotBeWritten) {
  std::filesystem::remove_all(dir_ / "log");
  testing::internal::CaptureStderr();
  EXPECT_GT(dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "x"), 0);
  testing::internal::GetCapturedStderr();
  const char *none = nullptr;
  EXPECT_LT(dlog_print(LOG_ID_MAIN, DLOG_INFO, none, "x"), 0);
}

}  // namespace
