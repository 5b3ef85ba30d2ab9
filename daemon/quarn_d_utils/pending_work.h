/**
 * @file pending_work.h
 * @brief What stands that has not taken the CPU lock yet, and keeps the daemon from being idle.
 *
 * A call whose caller is not known yet, a request in a queue, an answer that is waited for: who has
 * such work counts it here, so that idleness is decided in one place. Any thread.
 */
#ifndef QUARN_D_UTILS_PENDING_WORK_H
#define QUARN_D_UTILS_PENDING_WORK_H

#include <atomic>

/** One piece of work, for as long as this lives. */
class PendingWork {
 public:
  PendingWork() { begin(); }
  ~PendingWork() { end(); }
  PendingWork(const PendingWork &) = delete;
  PendingWork &operator=(const PendingWork &) = delete;

  /** For work that no object stands for from its beginning to its end: each begin() has its end().
   */
  static void begin() { ++standing_; }
  static void end() { --standing_; }
  /** Whether any stands. */
  [[nodiscard]] static bool any() { return standing_ != 0; }

 private:
  inline static std::atomic<unsigned int> standing_{0};
};

#endif
