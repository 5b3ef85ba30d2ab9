/**
 * @file http_date.h
 * @brief Points in time as HTTP writes them (RFC 9110, 5.6.7).
 */
#ifndef BACKUP_TRANSPORT_HTTP_DATE_H
#define BACKUP_TRANSPORT_HTTP_DATE_H

#include <cstdint>
#include <optional>
#include <string>

namespace transport {

/**
 * @param text any of the three forms that a server may send
 * @return seconds since the Unix epoch; none when it is no date. Whatever the locale is.
 */
[[nodiscard]] std::optional<int64_t> parse_http_date(const std::string &text);

}  // namespace transport

#endif
