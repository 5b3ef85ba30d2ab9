#include <map>
#include <memory>
#include <utility>

#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/restore_record.h"
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

/** What the kept client's "restore_stop" carries. */
int stop_result = QUARN_OK;

/** "restore_stop" messages that are on their way through the main loop. */
int stops_to_send = 0;

struct pending_stop {
  void *record;
  int result;
};

gboolean send_stop(gpointer data) {
  const std::unique_ptr<pending_stop> stop(static_cast<pending_stop *>(data));
  --stops_to_send;
  quarn_dbus_restore_enable_cb(stop->result, kStopMessage, stop->record);
  return G_SOURCE_REMOVE;
}

void send_stop_when_due() {
  if (!stop_due || outstanding_restores > 0) return;
  stop_due = false;
  send_restore_stop(std::exchange(g_restore_cb_data, nullptr),
                    std::exchange(stop_result, QUARN_OK));
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
  stop_due = false;
  const int result = std::exchange(stop_result, QUARN_OK);
  if (earlier != nullptr) send_restore_stop(earlier, result);
}

bool restore_record_is_of(const std::string &sender) {
  const auto *record = static_cast<const client_cb_data *>(g_restore_cb_data);
  return record != nullptr && record->sender == sender;
}

void set_restore_stop_result(int result) { stop_result = result; }

// Never from inside a method call: the client may be waiting for that call's reply.
void send_restore_stop(void *record, int result) {
  ++stops_to_send;
  g_idle_add(send_stop, new pending_stop{record, result});
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
