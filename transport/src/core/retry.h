/**
 * @file retry.h
 * @brief When a transient failure is tried again, and when no more.
 */
#ifndef BACKUP_TRANSPORT_RETRY_H
#define BACKUP_TRANSPORT_RETRY_H

#include <chrono>
#include <functional>

#include "core/outcome.h"
#include "core/ticket.h"

namespace transport {

/** Time as the retries see it; a test brings its own. Any thread. */
class RetryClock {
 public:
  using Point = std::chrono::steady_clock::time_point;

  RetryClock() = default;
  RetryClock(const RetryClock &) = delete;
  RetryClock &operator=(const RetryClock &) = delete;
  virtual ~RetryClock() = default;
  virtual Point now() = 0;
  /** @return false when the request was cancelled */
  virtual bool pause(Ticket &ticket, std::chrono::milliseconds duration) = 0;
  /** Evenly distributed in [0, 1). */
  virtual double random() = 0;

  /** The real one. */
  static RetryClock &system();
};

struct RetryLimits {
  std::chrono::milliseconds first_pause{500};
  std::chrono::milliseconds longest_pause{20000};
  /** Counted from the first failure, so that a long transfer still gets its second chance. */
  std::chrono::milliseconds total{std::chrono::seconds{BACKUP_TRANS_RETRY_TOTAL_SECONDS}};
};

/**
 * Run @p attempt, which gets its number counted from one, until it ends with
 * something else than a transient failure, or the next one would begin after
 * the total bound. The pause is drawn from the upper half of an exponentially
 * growing range; where the store asked for a longer one it gets that, plus a
 * little, so that a fleet that was sent away together does not return together.
 */
Outcome run_with_retries(Ticket &ticket, RetryClock &clock, const RetryLimits &limits,
                         const std::function<Outcome(int)> &attempt);

}  // namespace transport

#endif
