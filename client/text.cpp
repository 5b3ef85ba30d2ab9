#include "text.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>

#include "glib_handles.h"
#include "quarn_handles.h"

namespace quarn_client {

namespace {

constexpr std::size_t kMaxCellColumns = 60;
constexpr char kEllipsis[] = "...";
constexpr std::size_t kEllipsisColumns = sizeof(kEllipsis) - 1;
constexpr std::int64_t kMsPerSecond = 1000;
constexpr std::uint64_t kUnitStep = 1024;
constexpr gunichar kFirstSupplementary = 0x10000;
constexpr gunichar kHighSurrogate = 0xd800;
constexpr gunichar kLowSurrogate = 0xdc00;
constexpr unsigned kSurrogateBits = 10;
constexpr gunichar kSurrogateMask = 0x3ff;

struct Character {
  gunichar code;      /**< the code point, or the byte itself when it is not UTF-8 */
  std::size_t length; /**< bytes it takes */
  bool valid;
};

Character character_at(const std::string &text, std::size_t at) {
  const gunichar code =
      g_utf8_get_char_validated(text.data() + at, static_cast<gssize>(text.size() - at));
  // A NUL is answered as malformed when a length is given.
  if (text[at] == '\0' || code == static_cast<gunichar>(-1) || code == static_cast<gunichar>(-2)) {
    return {static_cast<unsigned char>(text[at]), 1, false};
  }
  return {code, static_cast<std::size_t>(g_unichar_to_utf8(code, nullptr)), true};
}

std::string formatted(const char *format, unsigned value) {
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, format, value);
  return buffer;
}

std::size_t columns_of(gunichar code) {
  if (g_unichar_iszerowidth(code)) return 0;
  return g_unichar_iswide(code) ? 2 : 1;
}

}  // namespace

std::string printable(const std::string &text) {
  std::string result;
  for (std::size_t at = 0; at < text.size();) {
    const Character c = character_at(text, at);
    if (c.valid && g_unichar_isprint(c.code)) {
      result.append(text, at, c.length);
    } else if (!c.valid || c.code < 0x80) {
      result += formatted("\\x%02x", c.code);
    } else {
      result += formatted("\\u{%x}", c.code);
    }
    at += c.length;
  }
  return result;
}

std::size_t display_width(const std::string &text) {
  std::size_t columns = 0;
  for (std::size_t at = 0; at < text.size();) {
    const Character c = character_at(text, at);
    columns += columns_of(c.code);
    at += c.length;
  }
  return columns;
}

std::string clipped(const std::string &text, std::size_t columns) {
  std::string shown = printable(text);
  if (display_width(shown) <= columns) return shown;
  if (columns < kEllipsisColumns) return std::string(kEllipsis, columns);
  const std::size_t room = columns - kEllipsisColumns;
  std::size_t used = 0;
  std::size_t at = 0;
  while (at < shown.size()) {
    const Character c = character_at(shown, at);
    if (used + columns_of(c.code) > room) break;
    used += columns_of(c.code);
    at += c.length;
  }
  shown.resize(at);
  return shown + kEllipsis;
}

std::string local_time(std::int64_t ms) {
  using DateTime = Handle<GDateTime, &g_date_time_unref>;
  const DateTime time(g_date_time_new_from_unix_local(ms / kMsPerSecond));
  if (!time) return "-";
  const GText text(g_date_time_format(time.get(), "%Y-%m-%dT%H:%M:%S%:z"));
  return text ? text.get() : "-";
}

std::string size_text(std::uint64_t bytes) {
  if (bytes < kUnitStep) return std::to_string(bytes) + " B";
  const char *const units[] = {"KiB", "MiB", "GiB", "TiB", "PiB", "EiB"};
  double value = static_cast<double>(bytes) / kUnitStep;
  std::size_t unit = 0;
  while (value >= kUnitStep && unit + 1 < std::size(units)) {
    value /= kUnitStep;
    ++unit;
  }
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, "%.1f %s", value, units[unit]);
  return buffer;
}

std::string json_text(json_object *root) {
  const std::string plain =
      json_object_to_json_string_ext(root, JSON_C_TO_STRING_PLAIN | JSON_C_TO_STRING_NOSLASHESCAPE);
  // The library escapes what is below a space; the rest can only stand inside strings.
  std::string result;
  for (std::size_t at = 0; at < plain.size();) {
    const Character c = character_at(plain, at);
    if (c.valid && g_unichar_isprint(c.code)) {
      result.append(plain, at, c.length);
    } else if (!c.valid) {
      result += formatted("\\u%04x", 0xfffd);
    } else if (c.code < kFirstSupplementary) {
      result += formatted("\\u%04x", c.code);
    } else {
      const gunichar rest = c.code - kFirstSupplementary;
      result += formatted("\\u%04x", kHighSurrogate + (rest >> kSurrogateBits));
      result += formatted("\\u%04x", kLowSurrogate + (rest & kSurrogateMask));
    }
    at += c.length;
  }
  return result;
}

std::string table_text(const std::vector<std::string> &heading,
                       const std::vector<std::vector<std::string>> &rows) {
  std::vector<std::vector<std::string>> lines{heading};
  for (const auto &row : rows) {
    lines.emplace_back();
    for (const auto &cell : row) lines.back().push_back(clipped(cell, kMaxCellColumns));
  }
  std::vector<std::size_t> widths(heading.size(), 0);
  for (const auto &line : lines) {
    for (std::size_t i = 0; i < line.size(); ++i) {
      widths[i] = std::max(widths[i], display_width(line[i]));
    }
  }
  std::string result;
  for (const auto &line : lines) {
    std::string text;
    for (std::size_t i = 0; i < line.size(); ++i) {
      text += line[i];
      text.append(widths[i] - display_width(line[i]) + 2, ' ');
    }
    text.erase(text.find_last_not_of(' ') + 1);
    result += text + "\n";
  }
  return result;
}

}  // namespace quarn_client
