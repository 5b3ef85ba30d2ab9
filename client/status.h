/**
 * @file status.h
 * @brief What the daemon tells of itself, read from its status object and put into words.
 */
#ifndef QUARN_CLIENT_STATUS_H
#define QUARN_CLIENT_STATUS_H

#include <gio/gio.h>
#include <json-c/json.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace quarn_client {

/** The status object's properties; one that is missing or of another type has no value. */
struct DaemonStatus {
  std::optional<bool> auto_backup;
  std::optional<bool> charger;
  std::optional<bool> wifi;
  std::optional<bool> screen_off;
  std::optional<bool> backup_running;
  std::optional<bool> restore_mode;
  std::optional<std::int64_t> condition_alarm_ms; /**< since the epoch; 0 when none is pending */
  std::optional<std::int64_t> next_alarm_ms;      /**< likewise */
  std::optional<std::int64_t> last_backup_ms;     /**< likewise; 0 when there was none */
  std::vector<std::string> restore_candidates;
  std::string serial;
  std::string model;
  std::string cloud_problem; /**< one word; empty when there is none */
};

/** Reads the answer "(a{sv})" of the status object. */
DaemonStatus read_status(GVariant *answer);

/** Lines of name and value. @param now_ms the present time, for ages */
std::string status_text(const DaemonStatus &status, std::int64_t now_ms);

/** Adds the status to a JSON object: numbers in milliseconds, null for what is not known or none.
 */
void status_to_json(const DaemonStatus &status, std::int64_t now_ms, json_object *object);

/** What a word for the cloud's problem means; empty for none and for words of a later daemon. */
std::string cloud_problem_words(const std::string &problem);

/** The same for what is the device's own trouble, or the application list's. */
std::string device_problem_words(const std::string &problem);

/** A length of time in its largest two units: "3 d 4 h", "12 min 5 s". */
std::string duration_text(std::int64_t ms);

}  // namespace quarn_client

#endif
