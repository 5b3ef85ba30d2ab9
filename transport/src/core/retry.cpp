#include "core/retry.h"

#include <glib.h>

#include <algorithm>
#include <optional>

namespace transport {
namespace {

using std::chrono::milliseconds;

constexpr double kGrowth = 2.0;
constexpr double kSureShare = 0.5;  // of a pause; the rest is drawn
constexpr double kRetryAfterSpread = 0.1;

class SystemClock : public RetryClock {
 public:
  Point now() override { return std::chrono::steady_clock::now(); }
  bool pause(Ticket &ticket, milliseconds duration) override { return ticket.pause(duration); }
  double random() override { return g_random_double(); }
};

milliseconds scaled(milliseconds duration, double factor) {
  return milliseconds(
      static_cast<milliseconds::rep>(static_cast<double>(duration.count()) * factor));
}

}  // namespace

RetryClock &RetryClock::system() {
  // Never destroyed: a worker may still look at it while the process exits.
  static SystemClock *const clock = new SystemClock;
  return *clock;
}

Outcome run_with_retries(Ticket &ticket, RetryClock &clock, const RetryLimits &limits,
                         const std::function<Outcome(int)> &attempt) {
  std::optional<RetryClock::Point> first_failure;
  milliseconds range = limits.first_pause;
  for (int number = 1;; ++number) {
    if (ticket.cancelled()) return cancelled();
    Outcome outcome = attempt(number);
    if (outcome.ok() || !outcome.transient) return outcome;
    const RetryClock::Point now = clock.now();
    if (!first_failure) first_failure = now;
    milliseconds pause = scaled(range, kSureShare + (1 - kSureShare) * clock.random());
    if (outcome.retry_after) {
      pause = std::max(pause, *outcome.retry_after +
                                  scaled(*outcome.retry_after, kRetryAfterSpread * clock.random()));
    }
    if (now - *first_failure + pause >= limits.total) return outcome;
    if (!clock.pause(ticket, pause)) return cancelled();
    range = std::min(scaled(range, kGrowth), limits.longest_pause);
  }
}

}  // namespace transport
