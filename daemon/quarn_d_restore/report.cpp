#include <map>
#include <utility>

#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_dbus_client.h"

void *g_restore_cb_data = nullptr;

namespace {

constexpr char kStopMessage[] = "restore_stop";

restore_progress_sink progress_sink = nullptr;

struct restore_run {
  unsigned number = 0;
  int done = 0;
  int packages = 0;
};
unsigned last_run = 0;
restore_run mode_run;

/** Runs of one package each that somebody asked for. */
std::map<std::string, restore_run> &requested() {
  static std::map<std::string, restore_run> runs;
  return runs;
}

restore_run &run_of(const std::string &package) {
  const auto found = requested().find(package);
  return found == requested().end() ? mode_run : found->second;
}

void tell(const std::string &package, restore_stage stage, restore_outcome outcome, int result,
          std::uint64_t size) {
  if (progress_sink == nullptr) return;
  const restore_run &run = run_of(package);
  progress_sink(
      {run.number, run.done, run.packages, package.c_str(), stage, outcome, result, size});
}

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

void begin_restore_run(std::size_t packages) {
  mode_run = {++last_run, 0, static_cast<int>(packages)};
}

void begin_requested_restore(const std::string &package) {
  requested()[package] = {++last_run, 0, 1};
}

void report_restore_step(const std::string &package, restore_stage stage, std::uint64_t size) {
  tell(package, stage, restore_outcome::none, QUARN_OK, size);
}

void report_restore_end(const std::string &package, restore_outcome outcome, int result,
                        std::uint64_t size) {
  ++run_of(package).done;
  tell(package, restore_stage::finished, outcome, result, size);
  requested().erase(package);
}

void keep_restore_record(void *record) {
  if (record != nullptr) quarn_dbus_accept_request(quarn_request::restore_mode, "", record);
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
