/**
 * @file text.h
 * @brief Text as a person's terminal or a program may be shown it.
 */
#ifndef QUARN_CLIENT_TEXT_H
#define QUARN_CLIENT_TEXT_H

#include <json-c/json.h>

#include <cstdint>
#include <string>
#include <vector>

namespace quarn_client {

/**
 * @p text with everything that is not a printable character (terminal
 * escapes, other controls, direction marks, bytes that are not UTF-8)
 * written as a visible escape such as \x1b or \u{202e}.
 */
std::string printable(const std::string &text);

/** The printable form, shortened to @p columns columns with "..." when it is wider. */
std::string clipped(const std::string &text, std::size_t columns);

/** Columns that printable text takes on a terminal. */
std::size_t display_width(const std::string &text);

/** Milliseconds since the epoch as local time, 2024-02-29T13:05:00+01:00; "-" when out of range. */
std::string local_time(std::int64_t ms);

/** Bytes in a unit that is easy to read: "734 B", "12.5 KiB", "8.0 MiB". */
std::string size_text(std::uint64_t bytes);

/** JSON text on one line, with every character that is not printable as a \u escape. */
std::string json_text(json_object *root);

/**
 * Lines of a table: a heading and its rows, columns aligned, every cell made
 * printable and clipped. No row may be longer than the heading.
 */
std::string table_text(const std::vector<std::string> &heading,
                       const std::vector<std::vector<std::string>> &rows);

}  // namespace quarn_client

#endif
