/**
 * @file printable.h
 * @brief Texts that hold names anybody may have chosen, as a log or a terminal may have them.
 */
#ifndef QUARN_PRINTABLE_H
#define QUARN_PRINTABLE_H

#include <string>
#include <string_view>

/**
 * @p text in one line that no terminal obeys: line ends and tabs become `\n`,
 * `\r` and `\t`, other bytes that are no printable UTF-8 `\x1b`, and characters
 * that are not printed `\u{85}`. Everything else stays as it is. Any thread.
 */
[[nodiscard]] std::string quarn_printable(std::string_view text);

/**
 * The first @p size bytes of @p text at the most, whole characters where it is
 * UTF-8. What was cut ends in "...", which is not counted.
 */
[[nodiscard]] std::string quarn_shortened(std::string_view text, std::size_t size);

#endif
