/**
 * @file ticket.h
 * @brief The state of one running request that its canceller and its worker share.
 */
#ifndef BACKUP_TRANSPORT_TICKET_H
#define BACKUP_TRANSPORT_TICKET_H

#include <chrono>
#include <condition_variable>
#include <functional>

#include "thread_annotations.h"

namespace transport {

/**
 * A request ends in one of two ways that exclude each other: it is cancelled,
 * or it commits. Any thread.
 */
class Ticket {
 public:
  /** The request was cancelled; its worker leaves no trace and returns. */
  bool cancelled() const {
    const MutexLock lock(mutex_);
    return state_ == State::cancelled;
  }

  /**
   * The worker is about to make its result visible. A cancellation that comes
   * after this is too late.
   * @return false when the request was cancelled before
   */
  [[nodiscard]] bool begin_commit() {
    const MutexLock lock(mutex_);
    if (state_ == State::cancelled) return false;
    state_ = State::committing;
    return true;
  }

  /** @return whether the request is cancelled now; false when it commits */
  bool cancel() {
    std::function<void()> waker;
    {
      const MutexLock lock(mutex_);
      if (state_ == State::committing) return false;
      state_ = State::cancelled;
      waker = waker_;
    }
    changed_.notify_all();
    if (waker) waker();
    return true;
  }

  /** Wait. @return false when the request was cancelled before the end */
  bool pause(std::chrono::milliseconds duration) {
    MutexLock lock(mutex_);
    return !changed_.wait_for(lock.waiting(), duration, [this]() QUARN_REQUIRES(mutex_) {
      return state_ == State::cancelled;
    });
  }

  /**
   * Have @p waker called by a cancellation, on the canceller's thread; an empty
   * function ends that. Not called for a cancellation that came before. A
   * cancellation that is under way may still call it after the end, so it must
   * own what it uses.
   */
  void set_waker(std::function<void()> waker) {
    const MutexLock lock(mutex_);
    waker_ = std::move(waker);
  }

 private:
  enum class State { running, committing, cancelled };

  mutable Mutex mutex_;
  std::condition_variable changed_;
  State state_ QUARN_GUARDED_BY(mutex_) = State::running;
  std::function<void()> waker_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace transport

#endif
