/**
 * @file watch.h
 * @brief Tells on the main loop that a state file was replaced.
 *
 * A watch sleeps in the file monitor; nothing is polled. Main thread.
 */
#ifndef QUARN_EMBEDDED_WATCH_H
#define QUARN_EMBEDDED_WATCH_H

#include <gio/gio.h>

#include <functional>
#include <string>

namespace embedded {

/** Follows one state file from construction to destruction. */
class StateWatch {
 public:
  /** @param changed called on the default main context after each replacement */
  StateWatch(const std::string &device, const std::string &file, std::function<void()> changed);
  ~StateWatch();
  StateWatch(const StateWatch &) = delete;
  StateWatch &operator=(const StateWatch &) = delete;
  /** False when the file cannot be followed. */
  explicit operator bool() const { return monitor_ != nullptr; }

 private:
  static void on_event(GFileMonitor *, GFile *, GFile *, GFileMonitorEvent event, gpointer self);
  GFileMonitor *monitor_ = nullptr;
  std::function<void()> changed_;
};

}  // namespace embedded

#endif
