/**
 * @file answer.h
 * @brief What a server answered, and what that means.
 */
#ifndef BACKUP_TRANSPORT_ANSWER_H
#define BACKUP_TRANSPORT_ANSWER_H

#include <map>
#include <memory>
#include <string>

#include "core/outcome.h"

namespace transport {

struct HttpAnswer {
  int status = 0;                             /**< 0: there was no answer; problem tells why */
  std::string reason;                         /**< the status in the server's words; may be empty */
  std::map<std::string, std::string> headers; /**< names in lower case */
  std::string body;
  /** Counts a long body among those in memory, until the last copy has gone. */
  std::shared_ptr<void> room;
  /** Why there was no complete answer; its code is set then. */
  Outcome problem;

  bool complete() const { return problem.ok(); }
  bool good() const { return complete() && status >= 200 && status <= 299; }
  /** "" when absent */
  std::string header(const std::string &name) const;
};

/**
 * The outcome that an answer means for any store: transient where it is worth
 * another attempt, with the store's Retry-After.
 * @param what what was being done, for people
 */
Outcome outcome_of(const HttpAnswer &answer, const char *what);

}  // namespace transport

#endif
