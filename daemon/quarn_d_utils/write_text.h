/**
 * @file write_text.h
 * @brief Writing a text of some megabytes without another copy of it. Any thread.
 */
#ifndef QUARN_D_UTILS_WRITE_TEXT_H
#define QUARN_D_UTILS_WRITE_TEXT_H

#include <string>
#include <string_view>

/** As write_string_to_file(), results and messages too. */
[[nodiscard]] int write_text_to_file(std::string_view data, const std::string &path);

#endif
