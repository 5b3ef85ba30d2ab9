/**
 * @file values.h
 * @brief The key-value settings of an embedded device, as texts: settings.ini.
 *
 * Every write is counted, also one of the same value. Any thread.
 */
#ifndef QUARN_EMBEDDED_VALUES_H
#define QUARN_EMBEDDED_VALUES_H

#include <cstdint>
#include <string>

namespace embedded {

inline constexpr char kValuesFile[] = "settings.ini";

/** True for a text that can be a key: not empty, no '=', '[', ']' or control character. */
bool is_value_key(const std::string &key);

/** Read a value; false when there is none. */
bool get_value(const std::string &device, const std::string &key, std::string *value);

/** Write a value. */
bool set_value(const std::string &device, const std::string &key, const std::string &value);

/** How often a value was written. */
std::int64_t value_writes(const std::string &device, const std::string &key);

}  // namespace embedded

#endif
