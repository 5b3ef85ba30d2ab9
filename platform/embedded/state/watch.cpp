#include "state/watch.h"

#include "state/state_file.h"

namespace embedded {

StateWatch::StateWatch(const std::string &device, const std::string &file,
                       std::function<void()> changed)
    : changed_(std::move(changed)) {
  if (device.empty()) return;
  GFile *path = g_file_new_for_path(state_path(device, file).c_str());
  monitor_ = g_file_monitor_file(path, G_FILE_MONITOR_WATCH_MOVES, nullptr, nullptr);
  g_object_unref(path);
  if (monitor_ == nullptr) return;
  // Only whole files appear here, so there is nothing to collect.
  g_file_monitor_set_rate_limit(monitor_, 0);
  g_signal_connect(monitor_, "changed", G_CALLBACK(on_event), this);
}

StateWatch::~StateWatch() {
  if (monitor_ == nullptr) return;
  g_signal_handlers_disconnect_by_data(monitor_, this);
  g_file_monitor_cancel(monitor_);
  g_object_unref(monitor_);
}

void StateWatch::on_event(GFileMonitor *, GFile *, GFile *, GFileMonitorEvent event,
                          gpointer self) {
  switch (event) {
    case G_FILE_MONITOR_EVENT_CREATED:
    case G_FILE_MONITOR_EVENT_MOVED_IN:
    case G_FILE_MONITOR_EVENT_RENAMED: {
      // Called as a copy: it may end this very watch.
      const auto changed = static_cast<StateWatch *>(self)->changed_;
      changed();
      break;
    }
    default:
      break;
  }
}

}  // namespace embedded
