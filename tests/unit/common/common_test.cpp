#include "quarn_common.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>

#include "log_capture.h"

namespace {

struct Free {
  void operator()(char *text) const { std::free(text); }
};

TEST(ParseKey, TurnsAKeyIntoAPath) {
  clear_captured_log();
  const std::unique_ptr<char, Free> path(quarn_utils_parse_key("abc"));
  EXPECT_STREQ(path.get(), "/abc");
  EXPECT_EQ(count_logged(DLOG_INFO, ">>>>>>>> called"), 1);
}

TEST(ParseKey, TurnsAnEmptyKeyIntoTheRoot) {
  const std::unique_ptr<char, Free> path(quarn_utils_parse_key(""));
  EXPECT_STREQ(path.get(), "/");
}

TEST(ParseKey, TurnsNullIntoNullWithARedLine) {
  clear_captured_log();
  EXPECT_EQ(quarn_utils_parse_key(nullptr), nullptr);
  EXPECT_EQ(count_logged(DLOG_ERROR, "\033[0;31m(NULL == key)\033[0;m"), 1);
}

TEST(ResultText, HasWordsForEveryCode) {
  for (const int code : {0, 1, 12, 13, 14, 17, 19, 27, 31, 32, 33, 34, 36, 41, 42}) {
    EXPECT_STRNE(quarn_result_text(code), "unknown result") << code;
  }
  EXPECT_STREQ(quarn_result_text(99), "unknown result");
}

}  // namespace
