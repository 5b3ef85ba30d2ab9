#include "http/http_date.h"

#include <glib.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <memory>

namespace transport {
namespace {

constexpr int kTextBytes = 4;  // three letters and their end
constexpr std::array<const char *, 12> kMonths = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                                  "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
constexpr int kCentury = 100;
constexpr int kThisCentury = 2000;
constexpr int kLastCentury = 1900;
constexpr int kFirstYearOfLastCentury = 70;  // two digits are no year before the epoch

struct Parts {
  int day = 0;
  std::array<char, kTextBytes> month{};
  int year = 0;
  int hour = 0;
  int minute = 0;
  int second = 0;
};

bool read_parts(const char *text, Parts *parts) {
  constexpr int kFields = 6;
  Parts &p = *parts;
  // "Sun, 06 Nov 1994 08:49:37 GMT"
  if (std::sscanf(text, "%*3[A-Za-z], %2d %3[A-Za-z] %4d %2d:%2d:%2d GMT", &p.day, p.month.data(),
                  &p.year, &p.hour, &p.minute, &p.second) == kFields)
    return true;
  // "Sunday, 06-Nov-94 08:49:37 GMT"
  if (std::sscanf(text, "%*9[A-Za-z], %2d-%3[A-Za-z]-%2d %2d:%2d:%2d GMT", &p.day, p.month.data(),
                  &p.year, &p.hour, &p.minute, &p.second) == kFields)
    return true;
  // "Sun Nov  6 08:49:37 1994"
  return std::sscanf(text, "%*3[A-Za-z] %3[A-Za-z] %2d %2d:%2d:%2d %4d", p.month.data(), &p.day,
                     &p.hour, &p.minute, &p.second, &p.year) == kFields;
}

struct DateTimeFree {
  void operator()(GDateTime *date) const { g_date_time_unref(date); }
};

}  // namespace

std::optional<int64_t> parse_http_date(const std::string &text) {
  Parts parts;
  if (!read_parts(text.c_str(), &parts)) return std::nullopt;
  const std::string month = parts.month.data();
  const auto *found = std::find(kMonths.begin(), kMonths.end(), month);
  if (found == kMonths.end()) return std::nullopt;
  if (parts.year < kCentury)
    parts.year += parts.year < kFirstYearOfLastCentury ? kThisCentury : kLastCentury;
  const std::unique_ptr<GDateTime, DateTimeFree> date(
      g_date_time_new_utc(parts.year, static_cast<int>(found - kMonths.begin()) + 1, parts.day,
                          parts.hour, parts.minute, parts.second));
  if (!date) return std::nullopt;
  return g_date_time_to_unix(date.get());
}

}  // namespace transport
