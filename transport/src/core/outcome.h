/**
 * @file outcome.h
 * @brief How one attempt at a request ended.
 */
#ifndef BACKUP_TRANSPORT_OUTCOME_H
#define BACKUP_TRANSPORT_OUTCOME_H

#include <chrono>
#include <optional>
#include <string>
#include <utility>

#include "backup_transport.h"

namespace transport {

struct [[nodiscard]] Outcome {
  backup_trans_error_code code = BACKUP_TRANS_ERROR_NONE;
  /** For people; holds no credentials. */
  std::string message;
  /** What the server itself said, made printable; empty when it said nothing. */
  std::string said;
  /** There is nothing at the address that such a store would be. */
  bool wrong_address = false;
  /** Worth another attempt. */
  bool transient = false;
  /** How long the store asked to be left alone. */
  std::optional<std::chrono::milliseconds> retry_after;

  bool ok() const { return code == BACKUP_TRANS_ERROR_NONE; }
};

inline Outcome success() { return {}; }

inline Outcome failure(backup_trans_error_code code, std::string message) {
  Outcome outcome;
  outcome.code = code;
  outcome.message = std::move(message);
  return outcome;
}

inline Outcome cancelled() { return failure(BACKUP_TRANS_ERROR_CANCELLED, "cancelled"); }

}  // namespace transport

#endif
