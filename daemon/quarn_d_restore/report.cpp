#include <utility>

#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_dbus_client.h"

void *g_restore_cb_data = nullptr;

namespace {

constexpr char kStopMessage[] = "restore_stop";

restore_progress_sink progress_sink = nullptr;
/** Restores of installed packages that have not ended yet. */
int outstanding_restores = 0;
/** Restore mode is over; the kept client is told when nothing is outstanding any more. */
bool stop_due = false;

/** "restore_stop" messages that are on their way through the main loop. */
int stops_to_send = 0;

gboolean send_stop(gpointer record) {
  --stops_to_send;
  quarn_dbus_restore_enable_cb(QUARN_OK, kStopMessage, record);
  return G_SOURCE_REMOVE;
}

/** Never from inside a method call: the client may be waiting for that call's reply. */
void send_stop_later(void *record) {
  ++stops_to_send;
  g_idle_add(send_stop, record);
}

void send_stop_when_due() {
  if (!stop_due || outstanding_restores > 0) return;
  stop_due = false;
  send_stop_later(std::exchange(g_restore_cb_data, nullptr));
}

}  // namespace

void set_restore_progress_sink(restore_progress_sink sink) { progress_sink = sink; }

void report_restore_step(const std::string &package, restore_stage stage) {
  if (progress_sink == nullptr) return;
  progress_sink({package.c_str(), stage, restore_outcome::none, QUARN_OK, 0});
}

void report_restore_end(const std::string &package, restore_outcome outcome, int result,
                        std::uint64_t size) {
  if (progress_sink == nullptr) return;
  progress_sink({package.c_str(), restore_stage::finished, outcome, result, size});
}

void keep_restore_record(void *record) {
  void *earlier = std::exchange(g_restore_cb_data, record);
  if (earlier == nullptr) return;
  if (std::exchange(stop_due, false)) {
    send_stop_later(earlier);
  } else {
    delete static_cast<client_cb_data *>(earlier);
  }
}

void end_restore_report() {
  stop_due = g_restore_cb_data != nullptr;
  send_stop_when_due();
}

bool restore_report_pending() { return stops_to_send > 0; }

void count_outstanding_restore(int change) {
  outstanding_restores += change;
  send_stop_when_due();
}
