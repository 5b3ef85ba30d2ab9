#include "http/http_date.h"

#include <gtest/gtest.h>

using transport::parse_http_date;

namespace {

constexpr int64_t kExample = 784111777;

TEST(HttpDate, AllThreeForms) {
  EXPECT_EQ(parse_http_date("Sun, 06 Nov 1994 08:49:37 GMT"), kExample);
  EXPECT_EQ(parse_http_date("Sunday, 06-Nov-94 08:49:37 GMT"), kExample);
  EXPECT_EQ(parse_http_date("Sun Nov  6 08:49:37 1994"), kExample);
}

TEST(HttpDate, YearsOfTwoDigitsLieAfterTheEpoch) {
  EXPECT_EQ(parse_http_date("Thursday, 01-Jan-70 00:00:00 GMT"), 0);
  EXPECT_EQ(parse_http_date("Wednesday, 01-Jan-69 00:00:00 GMT"), 3124224000);
}

TEST(HttpDate, EdgesOfTheCalendar) {
  EXPECT_EQ(parse_http_date("Thu, 29 Feb 2024 23:59:59 GMT"), 1709251199);
  EXPECT_EQ(parse_http_date("Fri, 31 Dec 9999 23:59:59 GMT"), 253402300799);
  EXPECT_EQ(parse_http_date("Wed, 31 Dec 1969 23:59:59 GMT"), -1);
  EXPECT_EQ(parse_http_date("Thu, 29 Feb 2023 00:00:00 GMT"), std::nullopt);
  EXPECT_EQ(parse_http_date("Thu, 31 Apr 2023 00:00:00 GMT"), std::nullopt);
  EXPECT_EQ(parse_http_date("Thu, 01 Apr 2023 24:00:00 GMT"), std::nullopt);
}

TEST(HttpDate, WhatIsNoDate) {
  for (const char *text :
       {"", "soon", "120", "2024-02-29T23:59:59Z", "Sun, 06 Nov 1994", "Sun, 06 Nov 1994 08:49 GMT",
        "Sun, 06 Xxx 1994 08:49:37 GMT", "Sun, 00 Nov 1994 08:49:37 GMT",
        "Sun, 06 Nov 0000 08:61:37 GMT", "Sun, -6 Nov 1994 08:49:37 GMT"})
    EXPECT_EQ(parse_http_date(text), std::nullopt) << text;
}

}  // namespace
