/**
 * @file fact_watch.h
 * @brief Tells on the main loop that one fact of the device changed. Main thread.
 */
#ifndef QUARN_EMBEDDED_FACT_WATCH_H
#define QUARN_EMBEDDED_FACT_WATCH_H

#include <functional>
#include <string>

#include "state/facts.h"
#include "state/state_file.h"
#include "state/watch.h"

namespace embedded {

/** Follows one fact of the current device from construction to destruction, also by a callback. */
class FactWatch {
 public:
  /** @param changed called with the new value after each change, also one taken back at once */
  FactWatch(const char *key, std::function<void(const std::string &)> changed)
      : key_(key),
        changed_(std::move(changed)),
        seen_(read().changes),
        watch_(current_device(), kFactsFile, [this] { look(); }) {}
  explicit operator bool() const { return static_cast<bool>(watch_); }

 private:
  Fact read() const {
    Fact fact;
    get_fact(current_device(), key_, &fact);
    return fact;
  }
  void look() {
    const Fact fact = read();
    if (fact.changes == seen_) return;
    seen_ = fact.changes;
    // Called as a copy: it may end this very watch.
    const auto changed = changed_;
    changed(fact.value);
  }

  const char *key_;
  std::function<void(const std::string &)> changed_;
  std::int64_t seen_;
  StateWatch watch_;
};

}  // namespace embedded

#endif
