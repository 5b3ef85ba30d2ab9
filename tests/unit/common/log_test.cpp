#include "quarn_log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <limits>
#include <thread>

#include "log_capture.h"
#include "log_scope.h"
#include "quarn_printable.h"

namespace {

using ::testing::ElementsAre;

class LogLines : public ::testing::Test {
 protected:
  void SetUp() override { clear_captured_log(); }
  static std::string last() {
    const auto texts = captured_texts();
    return texts.empty() ? "nothing" : texts.back();
  }
};

TEST_F(LogLines, HaveTheirPlaceLevelAndBuffer) {
  LOGE("failed %d times", 3);
  const int line = __LINE__ - 1;
  SLOGI("seen");
  const auto lines = captured_log();
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_EQ(lines[0].file, "log_test.cpp");
  EXPECT_EQ(lines[0].function, "TestBody");
  EXPECT_EQ(lines[0].line, line);
  EXPECT_EQ(lines[0].level, DLOG_ERROR);
  EXPECT_EQ(lines[0].buffer, LOG_ID_MAIN);
  EXPECT_EQ(lines[1].buffer, LOG_ID_SYSTEM);
  EXPECT_THAT(captured_texts(), ElementsAre("failed 3 times", "seen"));
}

TEST_F(LogLines, AnArgumentIsCutAt256Bytes) {
  const std::string fits(256, 'x');
  LOGI("app list : %s!", fits.c_str());
  EXPECT_EQ(last(), "app list : " + fits + "!");
  LOGI("app list : %s!", (fits + "y").c_str());
  EXPECT_EQ(last(), "app list : " + fits + "...!");
  const std::string endless(46U << 20, 'z');
  LOGI("%s and %s", endless.c_str(), endless.c_str());
  const std::string cut = std::string(256, 'z') + "...";
  EXPECT_EQ(last(), cut + " and " + cut);
}

TEST_F(LogLines, AMessageOfTheDaemonsOwnIsNotCut) {
  LOGI(
      "1 Long own text, whose length is nobody's but the daemon's. 2 Long own text, whose length "
      "is "
      "nobody's but the daemon's. 3 Long own text, whose length is nobody's but the daemon's. "
      "4 Long own text, whose length is nobody's but the daemon's. 5 Long own text, whose length "
      "is "
      "nobody's but the daemon's. %s",
      "end");
  EXPECT_GT(last().size(), 256U);
  EXPECT_EQ(last().substr(last().size() - 13), "daemon's. end");
}

TEST_F(LogLines, NoCharacterIsCutInTwo) {
  const std::string before(255, 'x');
  LOGI("%s", (before + "\xc3\xa9").c_str());
  EXPECT_EQ(last(), before + "...");
  LOGI("%s", (std::string(253, 'x') + "\xf0\x9f\x99\x82").c_str());
  EXPECT_EQ(last(), std::string(253, 'x') + "...");
  LOGI("%s", (std::string(252, 'x') + "\xf0\x9f\x99\x82").c_str());
  EXPECT_EQ(last(), std::string(252, 'x') + "\xf0\x9f\x99\x82");
  // no text at all
  LOGI("%s", std::string(300, '\x80').c_str());
  std::string bytes;
  for (int i = 0; i < 256; ++i) bytes += "\\x80";
  EXPECT_EQ(last(), bytes + "...");
}

TEST_F(LogLines, NoArgumentEndsTheLineOrSpeaksToATerminal) {
  LOGE("refused %s: why", "a\nE/QUARND(1): forged\r\t\x1b[2J\x7f\xc2\x9b");
  EXPECT_EQ(last(), R"(refused a\nE/QUARND(1): forged\r\t\x1b[2J\x7f\u{9b}: why)");
  LOGE("\033[0;31m(%s == key)\033[0;m", "NULL");
  EXPECT_EQ(last(), "\033[0;31m(NULL == key)\033[0;m");
}

TEST_F(LogLines, EveryConversionIsAsPrintfHasIt) {
  LOGI("%d %5d|%-5d|%05d %+d %i", -1, 2, 3, 4, 5, std::numeric_limits<int>::min());
  EXPECT_EQ(last(), "-1     2|3    |00004 +5 -2147483648");
  LOGI("%u %x 0x%08X %o %c%%", 4294967295U, 255U, 255U, 8U, 'c');
  EXPECT_EQ(last(), "4294967295 ff 0x000000FF 10 c%");
  LOGI("%ld %lu %lld %llu %zu %zd %jd %td", -1L, 2UL, -3LL, 18446744073709551615ULL,
       static_cast<std::size_t>(5), static_cast<ssize_t>(-6), static_cast<intmax_t>(-7),
       static_cast<ptrdiff_t>(-8));
  EXPECT_EQ(last(), "-1 2 -3 18446744073709551615 5 -6 -7 -8");
  LOGI("%hd %hhu %.3f %5.1f|%g %Lg", static_cast<short>(-1), static_cast<unsigned char>(200), 1.5,
       2.25, 0.5, 0.25L);
  EXPECT_EQ(last(), "-1 200 1.500   2.2|0.5 0.25");
  LOGI("%8s|%-8s|%.2s|%.*s|%*s", "abc", "abc", "abc", 1, "abc", 4, "d");
  EXPECT_EQ(last(), "     abc|abc     |ab|a|   d");
}

TEST_F(LogLines, ATextWithoutAnEndIsReadAsFarAsItIsShown) {
  const char unended[3] = {'a', 'b', 'c'};
  LOGI("%.*s", 3, unended);
  EXPECT_EQ(last(), "abc");
  const char *volatile none = nullptr;
  LOGI("[%s]", static_cast<const char *>(none));
  EXPECT_EQ(last(), "[(null)]");
}

TEST_F(LogLines, TheErrorOfTheCallerStays) {
  errno = ENOSPC;
  LOGE("%s", std::string(1000, '\n').c_str());
  EXPECT_EQ(errno, ENOSPC);
}

void write_lines(int count) {
  for (int i = 0; i < count; ++i) {
    LOGE("here %d", i);
    LOGI("there %d", i);
  }
}

TEST(LogScopes, EachPlaceWritesAHundredLinesAndTheRestIsCounted) {
  clear_captured_log();
  {
    const LogScope scope("a tree");
    write_lines(1000);
    LOGE("something else");
  }
  EXPECT_EQ(captured_log().size(), 202U);
  EXPECT_EQ(count_logged(DLOG_ERROR, "here 99"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "here 100"), 0);
  EXPECT_EQ(count_logged(DLOG_INFO, "there 99"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "something else"), 1);
  EXPECT_EQ(captured_log().back().text, "1800 more such lines on a tree are left out");
  clear_captured_log();
  write_lines(1000);
  EXPECT_EQ(captured_log().size(), 2000U) << "afterwards everything is told";
}

TEST(LogScopes, AnInnerOneIsPartOfTheOuterOneAndOfNoOtherThread) {
  clear_captured_log();
  const LogScope other("another thread's");
  std::thread([] {
    const LogScope outer("outer");
    for (int i = 0; i < 3; ++i) {
      const LogScope inner("inner");
      write_lines(100);
    }
  }).join();
  EXPECT_EQ(captured_log().size(), 201U);
  EXPECT_EQ(captured_log().back().text, "400 more such lines on outer are left out");
}

}  // namespace
