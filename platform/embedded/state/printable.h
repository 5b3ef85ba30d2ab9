/**
 * @file printable.h
 * @brief Texts that hold names anybody may have chosen, as a log or a terminal may have them.
 */
#ifndef QUARN_EMBEDDED_PRINTABLE_H
#define QUARN_EMBEDDED_PRINTABLE_H

#include <string>

namespace embedded {

/**
 * @p text in one line that no terminal obeys: line ends and tabs become `\n`,
 * `\r` and `\t`, other bytes that are no printable UTF-8 `\x1b`, and characters
 * that are not printed `\u{85}`. Everything else stays as it is. Any thread.
 */
std::string printable(const std::string &text);

}  // namespace embedded

#endif
