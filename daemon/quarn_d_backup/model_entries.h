/**
 * @file model_entries.h
 * @brief Finding the device entries in the text of an application list, and the packages in theirs.
 *
 * A list is shared by all devices of an account. What other devices wrote is
 * carried over as text: numbers beyond 64 bits, doubled keys and the like
 * would not survive being read and written again. One package at a time is
 * parsed, because as parsed values a list takes ten times the memory of its text.
 */
#ifndef QUARN_D_BACKUP_MODEL_ENTRIES_H
#define QUARN_D_BACKUP_MODEL_ENTRIES_H

#include <json-c/json.h>

#include <string>
#include <string_view>
#include <vector>

inline constexpr char kModelList[] = "model_list"; /**< of the document: devices */
inline constexpr char kPkgList[] = "pkg_list";     /**< of a device: packages */

/** The text of an object with an array in it, taken apart. */
struct list_text {
  /** The text with null in place of each entry of the array. */
  std::string frame;
  /** The entries in order; views into the text that was taken apart. */
  std::vector<std::string_view> entries;
};

/**
 * Take the text of an object apart, at the array under @p key. Nothing is
 * checked beyond what tells one value from the next: parse the frame and the
 * entries afterwards. A text without entries, or with more than any device
 * could have written, is all frame.
 */
[[nodiscard]] list_text take_list_apart(std::string_view text, const char *key);

/**
 * Parse exactly one JSON value.
 * @param[out] beyond the value is nested deeper than @p depth, or has more values than the daemon's
 *   memory is for; may be null
 * @return null when the text is anything else
 */
[[nodiscard]] json_object *parse_whole_json(std::string_view text, int depth, bool *beyond);

/** A value that is written as @p text, which must be JSON; null when memory is out. */
[[nodiscard]] json_object *new_json_from_text(std::string_view text);

#endif
