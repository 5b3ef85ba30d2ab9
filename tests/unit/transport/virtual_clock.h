/**
 * @file virtual_clock.h
 * @brief Time that passes when a test says so.
 */
#ifndef TRANSPORT_VIRTUAL_CLOCK_H
#define TRANSPORT_VIRTUAL_CLOCK_H

#include <chrono>
#include <functional>
#include <mutex>
#include <vector>

#include "core/retry.h"
#include "http/http.h"

/** The clock of retries and exchanges. Any thread. */
class VirtualClock : public transport::RetryClock {
 public:
  using milliseconds = std::chrono::milliseconds;

  Point now() override {
    const std::lock_guard<std::mutex> lock(mutex_);
    return now_;
  }

  bool pause(transport::Ticket &ticket, milliseconds duration) override {
    std::function<void()> hook;
    bool stands = false;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      pauses_.push_back(duration);
      stands = stands_;
      if (!stands) now_ += duration;
      hook = on_pause_;
    }
    if (stands) return ticket.pause(kForEver);
    if (hook) hook();
    return !ticket.cancelled();
  }

  double random() override { return 0; }

  /** Time passes while the transport thread waits. */
  void pass(milliseconds duration) {
    transport::wake_http();
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      now_ += duration;
    }
    transport::wake_http();
  }

  /** From now on a pause lasts until it is cancelled. */
  void stand() {
    const std::lock_guard<std::mutex> lock(mutex_);
    stands_ = true;
  }

  bool is_standing() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return stands_ && !pauses_.empty();
  }

  /** Called in each pause, once it is over. */
  void set_on_pause(std::function<void()> hook) {
    const std::lock_guard<std::mutex> lock(mutex_);
    on_pause_ = std::move(hook);
  }

  std::vector<milliseconds> pauses() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return pauses_;
  }

 private:
  static constexpr milliseconds kForEver{std::chrono::hours(1)};

  mutable std::mutex mutex_;
  bool stands_ = false;
  Point now_{std::chrono::hours(1)};
  std::vector<milliseconds> pauses_;
  std::function<void()> on_pause_;
};

#endif
