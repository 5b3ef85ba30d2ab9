#include "quarn_log.h"

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <string>

#include "log_scope.h"
#include "quarn_printable.h"

namespace {

constexpr char kTag[] = "QUARND";

thread_local LogScope *scope = nullptr;

/** One conversion of a format: "%-5.3ld" has the flags "-", width 5, precision 3, size "l". */
struct Conversion {
  std::string flags;
  int width = 0;
  int precision = -1;
  std::string size;
  char kind = '\0';

  /** The same for snprintf(), which is given width and precision. */
  std::string text() const { return "%" + flags + "*.*" + size + kind; }
};

/** The arguments, passed on from function to function. */
struct Arguments {
  va_list list;
};

int take_number(const char **at, Arguments *arguments) {
  if (**at == '*') {
    ++*at;
    return va_arg(arguments->list, int);
  }
  constexpr int kTen = 10;
  int number = 0;
  for (; **at >= '0' && **at <= '9'; ++*at) number = number * kTen + (**at - '0');
  return number;
}

/** Take what follows a percent sign. */
Conversion take_conversion(const char **at, Arguments *arguments) {
  Conversion taken;
  for (; **at != '\0' && std::strchr("-+ #0", **at) != nullptr; ++*at) taken.flags += **at;
  taken.width = take_number(at, arguments);
  if (**at == '.') {
    ++*at;
    taken.precision = take_number(at, arguments);
  }
  for (; **at != '\0' && std::strchr("hlLqjzt", **at) != nullptr; ++*at) taken.size += **at;
  taken.kind = **at;
  if (**at != '\0') ++*at;
  return taken;
}

template <typename Value>
std::string formatted(const Conversion &how, Value value) {
  constexpr std::size_t kLongest = 512;
  char text[kLongest];
  // The format is the caller's literal, taken apart and put together again.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#pragma GCC diagnostic ignored "-Wformat-security"
  const int length =
      std::snprintf(text, sizeof text, how.text().c_str(), how.width, how.precision, value);
#pragma GCC diagnostic pop
  if (length < 0) return {};
  return {text, std::min(static_cast<std::size_t>(length), sizeof text - 1)};
}

/** A text of the caller's, of which no more is looked at than appears. */
std::string shown_text(const Conversion &how, const char *text) {
  std::size_t wanted = kMaxLoggedArgument + 1;
  if (how.precision >= 0) wanted = std::min(wanted, static_cast<std::size_t>(how.precision));
  const char *const given = text == nullptr ? "(null)" : text;
  const std::string_view taken(given, strnlen(given, wanted));
  std::string shown = quarn_printable(quarn_shortened(taken, kMaxLoggedArgument));
  const auto width = static_cast<std::size_t>(std::max(how.width, 0));
  if (shown.size() < width) {
    const bool left = how.flags.find('-') != std::string::npos;
    shown.insert(left ? shown.size() : 0, width - shown.size(), ' ');
  }
  return shown;
}

/** A whole number, as wide as its size says. */
std::string shown_number(const Conversion &how, Arguments *arguments) {
  if (how.size == "l") return formatted(how, va_arg(arguments->list, long));
  if (how.size == "ll" || how.size == "q")
    return formatted(how, va_arg(arguments->list, long long));
  if (how.size == "j") return formatted(how, va_arg(arguments->list, std::intmax_t));
  if (how.size == "z" || how.size == "t") {
    return formatted(how, va_arg(arguments->list, std::ptrdiff_t));
  }
  return formatted(how, va_arg(arguments->list, int));
}

std::string shown_value(const Conversion &how, Arguments *arguments) {
  switch (how.kind) {
    case 's':
      return shown_text(how, va_arg(arguments->list, const char *));
    case '%':
      return "%";
    case 'p':
      return formatted(how, va_arg(arguments->list, void *));
    case 'a':
    case 'A':
    case 'e':
    case 'E':
    case 'f':
    case 'F':
    case 'g':
    case 'G':
      return how.size == "L" ? formatted(how, va_arg(arguments->list, long double))
                             : formatted(how, va_arg(arguments->list, double));
    default:
      return shown_number(how, arguments);
  }
}

}  // namespace

LogScope::LogScope(std::string subject) : subject_(std::move(subject)) {
  if (scope == nullptr) scope = this;
}

LogScope::~LogScope() {
  if (scope != this) return;
  scope = nullptr;
  if (left_out_ > 0) LOGW("%u more such lines on %s are left out", left_out_, subject_.c_str());
}

bool LogScope::admits(const quarn_log_place &place) {
  return scope == nullptr || scope->take(place);
}

bool LogScope::take(const quarn_log_place &place) {
  auto known = std::find_if(written_.begin(), written_.end(), [&](const Written &written) {
    return written.line == place.line && written.file == place.file;
  });
  if (known == written_.end()) {
    known = written_.insert(known, {place.file, place.line, 0});
  }
  const bool admitted = known->count < kMaxLinesOfAPlace;
  ++(admitted ? known->count : left_out_);
  return admitted;
}

void quarn_log(log_id_t buffer, log_priority level, const quarn_log_place &place, const char *fmt,
               ...) {
  const int saved_errno = errno;
  if (!LogScope::admits(place)) return;
  Arguments arguments;
  va_start(arguments.list, fmt);
  std::string message;
  for (const char *at = fmt; *at != '\0';) {
    if (*at != '%') {
      const std::size_t own = std::strcspn(at, "%");
      message.append(at, own);
      at += own;
      continue;
    }
    ++at;
    const Conversion how = take_conversion(&at, &arguments);
    message += shown_value(how, &arguments);
  }
  va_end(arguments.list);
  dlog_print(buffer, level, kTag, "%s: %s(%d) > %s", place.file, place.function, place.line,
             message.c_str());
  errno = saved_errno;
}
