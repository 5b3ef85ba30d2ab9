#include "quarn_printable.h"

#include <glib.h>

#include <algorithm>
#include <cstdio>

namespace {

constexpr unsigned char kFirstPrintable = 0x20;
constexpr unsigned char kDelete = 0x7f;
/** What a failed look at a character is answered with. */
constexpr gunichar kMalformed = static_cast<gunichar>(-2);

bool is_plain(char c) {
  const auto byte = static_cast<unsigned char>(c);
  return byte >= kFirstPrintable && byte < kDelete;
}

/** What ends a line is counted among what is printed. */
bool is_shown(gunichar code) {
  const GUnicodeType type = g_unichar_type(code);
  return g_unichar_isprint(code) != FALSE && type != G_UNICODE_LINE_SEPARATOR &&
         type != G_UNICODE_PARAGRAPH_SEPARATOR;
}

std::string formatted(const char *format, unsigned value) {
  char buffer[16];
  std::snprintf(buffer, sizeof buffer, format, value);
  return buffer;
}

std::string escaped(gunichar code) {
  switch (code) {
    case '\n':
      return "\\n";
    case '\r':
      return "\\r";
    case '\t':
      return "\\t";
    default:
      return code <= kDelete ? formatted("\\x%02x", code) : formatted("\\u{%x}", code);
  }
}

}  // namespace

std::string quarn_printable(std::string_view text) {
  if (std::all_of(text.begin(), text.end(), is_plain)) return std::string(text);
  std::string result;
  for (std::size_t at = 0; at < text.size();) {
    const auto byte = static_cast<unsigned char>(text[at]);
    const gunichar code = byte == 0 ? 0
                                    : g_utf8_get_char_validated(
                                          text.data() + at, static_cast<gssize>(text.size() - at));
    if (code >= kMalformed) {
      result += formatted("\\x%02x", byte);
      ++at;
      continue;
    }
    const auto length = static_cast<std::size_t>(g_unichar_to_utf8(code, nullptr));
    if (is_shown(code)) {
      result.append(text, at, length);
    } else {
      result += escaped(code);
    }
    at += length;
  }
  return result;
}

std::string quarn_shortened(std::string_view text, std::size_t size) {
  constexpr unsigned char kContinuationMask = 0xc0;
  constexpr unsigned char kContinuation = 0x80;
  constexpr std::size_t kLongestTail = 3;  // continuation bytes of one character
  if (text.size() <= size) return std::string(text);
  std::size_t end = size;
  while (end > 0 && size - end < kLongestTail &&
         (static_cast<unsigned char>(text[end]) & kContinuationMask) == kContinuation) {
    --end;
  }
  const bool starts_character =
      (static_cast<unsigned char>(text[end]) & kContinuationMask) != kContinuation;
  return std::string(text.substr(0, starts_character ? end : size)) + "...";
}
