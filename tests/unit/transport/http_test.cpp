#include "http/http.h"
#include "http/url.h"

#include <glib.h>

#include "harness.h"
#include "s3/backend_s3.h"
#include "webdav/backend_webdav.h"

using namespace harness;
using namespace transport;
using std::chrono::hours;
using std::chrono::seconds;

namespace {

HttpAnswer answer(int status, std::map<std::string, std::string> headers = {}) {
  HttpAnswer made;
  made.status = status;
  made.headers = std::move(headers);
  return made;
}

TEST(HttpOutcome, EveryStatusHasItsCode) {
  struct Case {
    int status;
    backup_trans_error_code code;
    bool transient;
  };
  constexpr Case kCases[] = {
      {100, BACKUP_TRANS_ERROR_SERVER, false},
      {200, BACKUP_TRANS_ERROR_NONE, false},
      {201, BACKUP_TRANS_ERROR_NONE, false},
      {204, BACKUP_TRANS_ERROR_NONE, false},
      {207, BACKUP_TRANS_ERROR_NONE, false},
      {299, BACKUP_TRANS_ERROR_NONE, false},
      {301, BACKUP_TRANS_ERROR_SERVER, false},
      {302, BACKUP_TRANS_ERROR_SERVER, false},
      {304, BACKUP_TRANS_ERROR_SERVER, false},
      {400, BACKUP_TRANS_ERROR_SERVER, false},
      {401, BACKUP_TRANS_ERROR_AUTHENTICATION, false},
      {402, BACKUP_TRANS_ERROR_SERVER, false},
      {403, BACKUP_TRANS_ERROR_AUTHENTICATION, false},
      {404, BACKUP_TRANS_ERROR_NO_SUCH_OBJECT, false},
      {405, BACKUP_TRANS_ERROR_SERVER, false},
      {407, BACKUP_TRANS_ERROR_AUTHENTICATION, false},
      {408, BACKUP_TRANS_ERROR_NETWORK, true},
      {409, BACKUP_TRANS_ERROR_SERVER, false},
      {410, BACKUP_TRANS_ERROR_NO_SUCH_OBJECT, false},
      {411, BACKUP_TRANS_ERROR_SERVER, false},
      {412, BACKUP_TRANS_ERROR_CONFLICT, false},
      {413, BACKUP_TRANS_ERROR_QUOTA, false},
      {415, BACKUP_TRANS_ERROR_SERVER, false},
      {416, BACKUP_TRANS_ERROR_SERVER, false},
      {423, BACKUP_TRANS_ERROR_SERVER, false},
      {425, BACKUP_TRANS_ERROR_SERVER, true},
      {429, BACKUP_TRANS_ERROR_SERVER, true},
      {500, BACKUP_TRANS_ERROR_SERVER, true},
      {501, BACKUP_TRANS_ERROR_SERVER, false},
      {502, BACKUP_TRANS_ERROR_SERVER, true},
      {503, BACKUP_TRANS_ERROR_SERVER, true},
      {504, BACKUP_TRANS_ERROR_SERVER, true},
      {505, BACKUP_TRANS_ERROR_SERVER, false},
      {507, BACKUP_TRANS_ERROR_QUOTA, false},
      {599, BACKUP_TRANS_ERROR_SERVER, false},
  };
  for (const Case &expected : kCases) {
    const Outcome outcome = outcome_of(answer(expected.status), "upload");
    EXPECT_EQ(outcome.code, expected.code) << expected.status;
    EXPECT_EQ(outcome.transient, expected.transient) << expected.status;
    EXPECT_FALSE(outcome.retry_after) << expected.status;
    EXPECT_EQ(outcome.message,
              expected.code == BACKUP_TRANS_ERROR_NONE
                  ? ""
                  : "upload: the server answered " + std::to_string(expected.status));
  }
}

TEST(HttpOutcome, AnswerThatDidNotComeKeepsItsProblem) {
  HttpAnswer lost;
  lost.problem = failure(BACKUP_TRANS_ERROR_NETWORK, "Connection refused");
  lost.problem.transient = true;
  // A status that came before the connection broke says nothing.
  lost.status = 200;
  EXPECT_FALSE(lost.complete());
  EXPECT_FALSE(lost.good());
  const Outcome outcome = outcome_of(lost, "upload");
  EXPECT_EQ(outcome.code, BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(outcome.message, "Connection refused");
  EXPECT_TRUE(outcome.transient);
}

TEST(HttpOutcome, RetryAfterInSeconds) {
  const std::pair<const char *, seconds> cases[] = {
      {"0", seconds(0)},
      {"1", seconds(1)},
      {"120", seconds(120)},
      {"3600", seconds(3600)},
      {"3601", seconds(3600)},
      {"99999999999", seconds(3600)},
      {"9223372036854775808", seconds(3600)},
      {"99999999999999999999999999", seconds(3600)},
  };
  for (const auto &[text, expected] : cases)
    EXPECT_EQ(outcome_of(answer(503, {{"retry-after", text}}), "x").retry_after, expected) << text;
}

TEST(HttpOutcome, RetryAfterAsADate) {
  const auto date_in = [](int64_t offset) {
    GDateTime *now = g_date_time_new_now_utc();
    GDateTime *then = g_date_time_add_seconds(now, static_cast<double>(offset));
    // Names that depend on no locale.
    static const char *const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                          "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
    char *text = g_strdup_printf(
        "Mon, %02d %s %04d %02d:%02d:%02d GMT", g_date_time_get_day_of_month(then),
        kMonths[g_date_time_get_month(then) - 1], g_date_time_get_year(then),
        g_date_time_get_hour(then), g_date_time_get_minute(then), g_date_time_get_second(then));
    std::string date = text;
    g_free(text);
    g_date_time_unref(then);
    g_date_time_unref(now);
    return date;
  };
  const auto wait_for = [&](int64_t offset) {
    return outcome_of(answer(429, {{"retry-after", date_in(offset)}}), "x").retry_after.value();
  };
  EXPECT_EQ(wait_for(-100), seconds(0));
  // Both ends are read from the clock, which may go on in between.
  EXPECT_GT(wait_for(1000), seconds(900));
  EXPECT_LE(wait_for(1000), seconds(1000));
  EXPECT_EQ(wait_for(1000000), hours(1));
}

TEST(HttpOutcome, RetryAfterAsADateIsOfTheServersClock) {
  const char *const now = "Sun, 06 Nov 1994 08:49:37 GMT";
  const std::pair<const char *, seconds> cases[] = {
      {"Sun, 06 Nov 1994 08:51:17 GMT", seconds(100)},
      {"Sun, 06 Nov 1994 08:49:37 GMT", seconds(0)},
      {"Sun, 06 Nov 1994 08:49:00 GMT", seconds(0)},
      {"Mon, 07 Nov 1994 08:49:37 GMT", seconds(3600)},
  };
  for (const auto &[date, expected] : cases) {
    const Outcome outcome = outcome_of(answer(429, {{"date", now}, {"retry-after", date}}), "x");
    EXPECT_EQ(outcome.retry_after, expected) << date;
  }
}

TEST(HttpOutcome, RetryAfterThatIsNoneIsNotHonoured) {
  for (const char *text : {"", "soon", "-5", "1.5", "5 seconds", "Mon, 99 Jan 2024 00:00:00 GMT"})
    EXPECT_FALSE(outcome_of(answer(503, {{"retry-after", text}}), "x").retry_after) << text;
  // Nor where another attempt makes no sense.
  EXPECT_FALSE(outcome_of(answer(507, {{"retry-after", "5"}}), "x").retry_after);
}

TEST(HttpAnswerTest, HeadersByTheirNamesInLowerCase) {
  const HttpAnswer some = answer(200, {{"etag", "\"x\""}});
  EXPECT_EQ(some.header("etag"), "\"x\"");
  EXPECT_EQ(some.header("dav"), "");
}

TEST(HttpUrl, PathsAreEncoded) {
  EXPECT_EQ(encode_path(""), "");
  EXPECT_EQ(encode_path("/a-b._~/C9"), "/a-b._~/C9");
  EXPECT_EQ(encode_path("/a b%2F#?&+;=:@!$'()*,[]"),
            "/a%20b%252F%23%3F%26%2B%3B%3D%3A%40%21%24%27%28%29%2A%2C%5B%5D");
  EXPECT_EQ(encode_path("/\"<>\\^`{|}\x01\x7f"), "/%22%3C%3E%5C%5E%60%7B%7C%7D%01%7F");
  EXPECT_EQ(encode_path("/\xc3\xa4\xf0\x9f\x98\x80"), "/%C3%A4%F0%9F%98%80");
}

TEST(HttpUrl, LoopbackIsThisMachineOnly) {
  for (const char *host : {"localhost", "127.0.0.1", "127.1.2.3", "127.1", "::1"})
    EXPECT_TRUE(is_loopback(host)) << host;
  for (const char *host : {"", "localhost.example.org", "127.0.0.1.example.org", "127", "128.0.0.1",
                           "0.0.0.0", "::", "::2", "example.org", "127.example", "1127.0.0.1"})
    EXPECT_FALSE(is_loopback(host)) << host;
}

struct Parsed {
  bool good;
  std::string base, origin, host, path, problem;
};

Parsed parse(const std::string &url, const StoreScheme &scheme = kWebdavScheme) {
  StoreUrl parsed;
  std::string problem;
  const bool good = parse_store_url(url, scheme, &parsed, &problem);
  return {good, parsed.base, parsed.origin, parsed.host, parsed.path, problem};
}

TEST(HttpUrl, StoresAreTakenApart) {
  struct Case {
    const char *url, *base, *origin, *host, *path;
  };
  constexpr Case kCases[] = {
      {"webdav+https://h", "https://h", "https://h", "h", ""},
      {"webdav+https://h/", "https://h", "https://h", "h", ""},
      {"webdav+https://h/a/b//", "https://h/a/b", "https://h", "h", "/a/b"},
      {"webdav+https://h//a///b/", "https://h/a/b", "https://h", "h", "/a/b"},
      {"webdav+https://h:/a", "https://h/a", "https://h", "h", "/a"},
      {"webdav+https://a-b_c.h./x", "https://a-b_c.h./x", "https://a-b_c.h.", "a-b_c.h.", "/x"},
      {"webdav+https://b\xc3\xbc.h/x", "https://xn--b-eha.h/x", "https://xn--b-eha.h",
       "xn--b-eha.h", "/x"},
      {"webdav+https://[fe80::1%25eth0]/x", "https://[fe80::1%eth0]/x", "https://[fe80::1%eth0]",
       "fe80::1%eth0", "/x"},
      {"webdav+https://h:8443/a", "https://h:8443/a", "https://h:8443", "h", "/a"},
      {"webdav+https://h/a%20b%C3%a4", "https://h/a%20b%C3%A4", "https://h", "h", "/a b\xc3\xa4"},
      {"webdav+https://[fd00::1]:1/a", "https://[fd00::1]:1/a", "https://[fd00::1]:1", "fd00::1",
       "/a"},
      {"webdav+http://127.0.0.1:80/a", "http://127.0.0.1:80/a", "http://127.0.0.1:80", "127.0.0.1",
       "/a"},
      {"webdav+http://[::1]/a", "http://[::1]/a", "http://[::1]", "::1", "/a"},
      {"webdav+http://localhost/a", "http://localhost/a", "http://localhost", "localhost", "/a"},
  };
  for (const Case &expected : kCases) {
    const Parsed parsed = parse(expected.url);
    EXPECT_TRUE(parsed.good) << expected.url;
    EXPECT_EQ(parsed.base, expected.base);
    EXPECT_EQ(parsed.origin, expected.origin);
    EXPECT_EQ(parsed.host, expected.host);
    EXPECT_EQ(parsed.path, expected.path);
    EXPECT_EQ(parsed.problem, "");
  }
  EXPECT_TRUE(parse("s3+https://h/bucket", kS3Scheme).good);
}

TEST(HttpUrl, RefusalsSayWhy) {
  const std::pair<const char *, const char *> cases[] = {
      {"webdav+", "the url is not complete"},
      {"webdav+https", "the url is not complete"},
      {"webdav+https://", "the url is not complete"},
      {"webdav+https:///a", "the url is not complete"},
      {"webdav+https://:80/a", "the url is not complete"},
      {"webdav+https://h:99999/a", "the url is not complete"},
      {"webdav+https://h/%zz", "the url is not complete"},
      {"webdav+https://h:0/a", "the url's port cannot be 0"},
      {"webdav+https://h h/a", "the url's host is no name or address"},
      {"webdav+https://h%20h/a", "the url's host is no name or address"},
      {"webdav+https://h%2Fh/a", "the url's host is no name or address"},
      {"webdav+https://h%40h/a", "the url's host is no name or address"},
      {"webdav+https://h%3A80/a", "the url's host is no name or address"},
      {"webdav+https://h\nh/a", "the url's host is no name or address"},
      {"webdav+http://127.0.0.1%2F/a", "the url's host is no name or address"},
      {"webdav+https://u@h/a",
       "the url holds a user or password, which belong into keys of their own"},
      {"webdav+https://u:p@h/a",
       "the url holds a user or password, which belong into keys of their own"},
      {"webdav+https://h/a?b", "the url has a query or fragment"},
      {"webdav+https://h/a#b", "the url has a query or fragment"},
      {"webdav+http://h/a", "plain http is for this machine itself only"},
      {"webdav+http://127.0.0.1.example.org/a", "plain http is for this machine itself only"},
      {"webdav+ftp://h/a", "the url names no store that is known"},
      {"webdav+file://h/a", "the url names no store that is known"},
  };
  for (const auto &[url, problem] : cases) {
    const Parsed parsed = parse(url);
    EXPECT_FALSE(parsed.good) << url;
    EXPECT_EQ(parsed.problem, problem) << url;
  }
}

TEST(HttpUrl, OtherSchemesAreNotThisOnesProblem) {
  for (const char *url :
       {"", "webdav", "https://h/a", "s3+https://h/a", "file:///a", "Webdav+https://h"}) {
    const Parsed parsed = parse(url);
    EXPECT_FALSE(parsed.good) << url;
    EXPECT_EQ(parsed.problem, "") << url;
  }
}

}  // namespace
