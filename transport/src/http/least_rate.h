/**
 * @file least_rate.h
 * @brief Whether an exchange moves fast enough to come to an end.
 */
#ifndef BACKUP_TRANSPORT_LEAST_RATE_H
#define BACKUP_TRANSPORT_LEAST_RATE_H

#include <chrono>
#include <cstdint>

#include "backup_transport.h"

namespace transport {

/**
 * Counts what moves in one period after the other, each of which has to bring
 * its share. With a limit of the size that bounds the time. One thread at a
 * time.
 */
class LeastRate {
 public:
  using Point = std::chrono::steady_clock::time_point;

  static constexpr std::chrono::seconds kPeriod{BACKUP_TRANS_LEAST_RATE_SECONDS};
  static constexpr std::int64_t kShare =
      std::int64_t{BACKUP_TRANS_LEAST_RATE} * BACKUP_TRANS_LEAST_RATE_SECONDS;

  void begin(Point now) { restart(now); }

  /** @param rests nothing has to move at present */
  void note(std::int64_t bytes, bool rests, Point now) {
    moved_ += bytes;
    if (rests) restart(now);
  }

  /** When the period that runs is over. */
  Point judged_at() const { return since_ + kPeriod; }

  /** It is over. @return whether it brought its share, with which the next begins */
  bool goes_on(Point now) {
    kept_ = moved_ >= kShare;
    if (kept_) restart(now);
    return kept_;
  }

  bool is_kept() const { return kept_; }

 private:
  void restart(Point now) {
    since_ = now;
    moved_ = 0;
  }

  Point since_;
  std::int64_t moved_ = 0;
  bool kept_ = true;
};

}  // namespace transport

#endif
