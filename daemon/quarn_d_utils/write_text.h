/**
 * @file write_text.h
 * @brief Writing a text of some megabytes without another copy of it. Any thread.
 */
#ifndef QUARN_D_UTILS_WRITE_TEXT_H
#define QUARN_D_UTILS_WRITE_TEXT_H

#include <string>
#include <string_view>

/**
 * Replace a file's content; failures are logged.
 * @return #QUARN_OK, #QUARN_BAD_ARGUMENT for empty data or path, #QUARN_REFUSED when writing failed
 */
[[nodiscard]] int write_text_to_file(std::string_view data, const std::string &path);

#endif
