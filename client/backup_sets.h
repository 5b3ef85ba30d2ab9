/**
 * @file backup_sets.h
 * @brief The cloud's application list, read without trusting it.
 *
 * The text comes from a store that other devices and programs write to: any
 * member may be missing or of another type. What cannot be read is left out
 * and counted.
 */
#ifndef QUARN_CLIENT_BACKUP_SETS_H
#define QUARN_CLIENT_BACKUP_SETS_H

#include <json-c/json.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace quarn_client {

/** One package of a device's backup set. */
struct SetPackage {
  std::string id;
  std::string version;
  std::int64_t crc = 0; /**< 0 when the run that wrote the set made no archive */
};

/** What one device of the account has in the cloud. */
struct BackupSet {
  std::string serial;
  std::string model;
  std::optional<std::int64_t>
      time_ms; /**< time of the run, since the epoch; none when unreadable */
  std::vector<SetPackage> packages;
};

/** The whole list. */
struct BackupSets {
  std::vector<BackupSet> sets;
  std::size_t left_out = 0; /**< entries that were not readable */
};

/**
 * Reads the application list.
 * @param[out] error what is wrong with the text, when nothing is returned
 */
std::optional<BackupSets> parse_backup_sets(const std::string &text, std::string &error);

/** The set of a device; null when it is not in the list. */
const BackupSet *find_set(const BackupSets &sets, const std::string &serial);

/** A package of a set; null when it is not there. */
const SetPackage *find_package(const BackupSet &set, const std::string &id);

/** The crc as 8 hexadecimal digits, "-" when there is none. */
std::string crc_text(std::int64_t crc);

/** The sets as a JSON array; the caller owns it. */
json_object *sets_to_json(const BackupSets &sets);

}  // namespace quarn_client

#endif
