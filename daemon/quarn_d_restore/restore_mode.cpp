#include "quarn_d_restore/restore_mode.h"

#include <glib.h>
#include <json-c/json.h>

#include <algorithm>
#include <set>
#include <utility>

#include "files/package_files.h"
#include "json_ptr.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_restore/archive_download.h"
#include "quarn_d_restore/install_monitor.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_progress.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/power.h"
#include "quarn_log.h"

std::vector<std::string> pkg_list_to_be_restored;
quarn_client_kind current_restore_client = QUARN_CLIENT_CLOUD;
std::string serial_num_user_select;
std::unique_ptr<client_cb_data> g_restore_cb_data;

namespace {

constexpr char kStopMessage[] = "restore_stop";

using RecordPtr = std::unique_ptr<client_cb_data>;

restore_mode mode = restore_mode::off;
/** Grows with every change of the mode, so that one that waited sees what happened meanwhile. */
unsigned int mode_changes = 0;
void (*mode_observer)() = nullptr;

/** How the mode's client hears of its end. */
struct mode_end {
  int outstanding = 0;   /**< restores of installed packages that have not ended yet */
  bool due = false;      /**< the mode is over; its client is told when nothing is outstanding */
  int result = QUARN_OK; /**< what the kept client's "restore_stop" carries */
  int to_send = 0;       /**< "restore_stop" messages on their way through the main loop */
};
mode_end ending;

void note_restore_mode_change() {
  if (mode_observer != nullptr) mode_observer();
}

/* ---- the candidates ---- */

/** The ids of a JSON array of texts, without those that cannot be a package's. */
std::vector<std::string> parse_package_list(const char *text) {
  LOGI("pkg_list_json : %s", text);
  std::vector<std::string> list;
  const JsonPtr parsed(json_tokener_parse(text));
  if (!json_object_is_type(parsed.get(), json_type_array)) return list;
  const std::size_t count = json_object_array_length(parsed.get());
  for (std::size_t i = 0; i < count; ++i) {
    json_object *element = json_object_array_get_idx(parsed.get(), i);
    if (!json_object_is_type(element, json_type_string)) return {};
    const std::string pkg_id(json_object_get_string(element),
                             static_cast<std::size_t>(json_object_get_string_len(element)));
    if (is_safe_path_component(pkg_id)) {
      list.push_back(pkg_id);
    } else {
      LOGE("refused : not a package id (%s)", pkg_id.c_str());
    }
  }
  return list;
}

/** From now on a backup leaves what is waited for in the cloud. */
void await_candidates() {
  std::set<std::string> installed;
  // what is not known to be installed counts as what is to come
  static_cast<void>(list_installed_packages(&installed));
  await_archives(serial_num_user_select, pkg_list_to_be_restored, installed);
  note_restore_mode_waits(serial_num_user_select);
}

/** What is waited for is neither there nor given up: only a backup by hand may remove it. */
void stop_waiting_unused() {
  await_no_archives();
  note_restore_mode_withdrawn();
}

gboolean _restore_disable_cb(gpointer /*data*/) {
  // The mode may have been switched on again with a new list meanwhile.
  if (!pkg_list_to_be_restored.empty()) return G_SOURCE_REMOVE;
  LOGI("installation of all restore candidate package was completed!");
  disable_restore_mode();
  return G_SOURCE_REMOVE;
}

/* ---- what its client is told ---- */

struct pending_stop {
  RecordPtr record;
  int result;
};

gboolean send_stop(gpointer data) {
  const std::unique_ptr<pending_stop> stop(static_cast<pending_stop *>(data));
  --ending.to_send;
  quarn_dbus_restore_enable_cb(stop->result, kStopMessage, stop->record.release());
  return G_SOURCE_REMOVE;
}

/** Never from inside a method call: the client may be waiting for that call's reply. */
void send_restore_stop(RecordPtr record, int result) {
  ++ending.to_send;
  g_idle_add(send_stop, new pending_stop{std::move(record), result});
}

void send_stop_when_due() {
  if (!ending.due || ending.outstanding > 0) return;
  ending.due = false;
  send_restore_stop(std::move(g_restore_cb_data), std::exchange(ending.result, QUARN_OK));
}

/* ---- on and off ---- */

void start_monitor(quarn_client_kind client, RecordPtr record) {
  if (start_install_monitor()) {
    LOGI("start install event monitoring. client:%d, serial_num:%s", client,
         serial_num_user_select.c_str());
    keep_restore_record(std::move(record));
  } else {
    LOGE("fail to start install event monitor");
  }
}

/** The answer to a request in whose place another came while it waited for the session. */
int superseded_result(RecordPtr record) {
  if (mode == restore_mode::companion) return QUARN_REFUSED;
  // It was accepted, so it has its end as well.
  send_restore_stop(std::move(record), QUARN_OK);
  return QUARN_OK;
}

int switch_on_for_companion(RecordPtr record) {
  stop_waiting_unused();
  ++mode_changes;
  start_monitor(QUARN_CLIENT_COMPANION, std::move(record));
  mode = restore_mode::companion;
  return QUARN_OK;
}

int switch_on_for_cloud(RecordPtr record) {
  await_candidates();
  const unsigned int this_change = ++mode_changes;
  request_power_lock(true);
  const bool session = cloud_initialized();
  // Other requests are served while the session starts; the latest of them counts.
  const bool superseded = this_change != mode_changes;
  const bool withdrawn = !session && waits_are_ended();
  if (session && !superseded) start_monitor(QUARN_CLIENT_CLOUD, std::move(record));
  request_power_lock(false);
  if (withdrawn) {
    if (!superseded) {
      pkg_list_to_be_restored.clear();
      stop_waiting_unused();
    }
    send_restore_stop(std::move(record), QUARN_CANCELLED);
    return QUARN_CANCELLED;
  }
  if (superseded) return superseded_result(std::move(record));
  mode = restore_mode::cloud;
  return QUARN_OK;
}

int switch_on(quarn_client_kind client, const std::string &serial_num, const char *pkg_list,
              RecordPtr record) {
  std::vector<std::string> list = parse_package_list(pkg_list);
  if (!list.empty() && client == QUARN_CLIENT_CLOUD && !is_safe_path_component(serial_num)) {
    LOGE("refused : not a serial number (%s)", serial_num.c_str());
    return QUARN_REFUSED;
  }
  run_on_thread_stack(recover_interrupted_restores);
  pkg_list_to_be_restored = std::move(list);
  if (pkg_list_to_be_restored.empty()) {
    await_no_archives();
    LOGI("there is no package should be restored");
    return QUARN_OK;
  }
  begin_restore_run(pkg_list_to_be_restored.size());
  init_install_complete_pkgs_list();
  init_icon_hide_delay_timer_list();
  current_restore_client = client;
  serial_num_user_select = serial_num;
  return client == QUARN_CLIENT_COMPANION ? switch_on_for_companion(std::move(record))
                                          : switch_on_for_cloud(std::move(record));
}

enum class mode_use { used, withdrawn };

void switch_off(mode_use use) {
  ++mode_changes;
  if (use == mode_use::used) {
    await_no_archives();
    if (mode == restore_mode::cloud) note_restore_mode_used();
  } else {
    stop_waiting_unused();
  }
  current_restore_client = QUARN_CLIENT_CLOUD;
  if (stop_install_monitor()) {
    LOGI("stop install event monitor");
  } else {
    LOGE("fail to start install event monitor");
  }
  mode = restore_mode::off;
  end_restore_report();
  note_restore_mode_change();
}

}  // namespace

restore_mode current_restore_mode() { return mode; }
bool pellix_restore_running() { return mode == restore_mode::companion; }
bool cloud_restore_running() { return mode == restore_mode::cloud; }
bool restores_from_companion() { return current_restore_client == QUARN_CLIENT_COMPANION; }

std::vector<std::string> restore_candidates() {
  // The list outlives a mode that was switched off; nobody waits for it then.
  return mode == restore_mode::off ? std::vector<std::string>() : pkg_list_to_be_restored;
}

void set_restore_mode_observer(void (*observer)()) { mode_observer = observer; }

int enable_restore_mode(quarn_client_kind client, const std::string &serial_num,
                        const char *pkg_list, std::unique_ptr<client_cb_data> record) {
  if (mode == restore_mode::companion && client != QUARN_CLIENT_COMPANION) {
    LOGE("restore mode by pellix is already running");
    return QUARN_REFUSED;
  }
  const int result = switch_on(client, serial_num, pkg_list, std::move(record));
  note_restore_mode_change();
  return result;
}

void disable_restore_mode() { switch_off(mode_use::used); }

bool withdraw_restore_mode(const std::string &sender) {
  if (mode == restore_mode::off || !restore_record_is_of(sender)) return false;
  set_restore_stop_result(QUARN_CANCELLED);
  switch_off(mode_use::withdrawn);
  abort_monitored_downloads();
  return true;
}

int init_package_list_to_be_restored(const char *pkg_list_json) {
  pkg_list_to_be_restored = parse_package_list(pkg_list_json);
  return static_cast<int>(pkg_list_to_be_restored.size());
}

int package_to_be_restored(const char *pkgid) {
  if (pkg_list_to_be_restored.empty()) {
    g_idle_add(_restore_disable_cb, nullptr);
    return 0;
  }
  const auto found =
      std::find(pkg_list_to_be_restored.begin(), pkg_list_to_be_restored.end(), pkgid);
  const bool candidate = found != pkg_list_to_be_restored.end();
  if (candidate) {
    pkg_list_to_be_restored.erase(found);
    stop_awaiting_archive(pkgid);
    note_restore_mode_change();
  }
  if (pkg_list_to_be_restored.empty()) g_idle_add(_restore_disable_cb, nullptr);
  return candidate;
}

void keep_restore_record(std::unique_ptr<client_cb_data> record) {
  if (record != nullptr) quarn_dbus_accept_request(quarn_request::restore_mode, "", record.get());
  RecordPtr earlier = std::exchange(g_restore_cb_data, std::move(record));
  ending.due = false;
  const int result = std::exchange(ending.result, QUARN_OK);
  if (earlier != nullptr) send_restore_stop(std::move(earlier), result);
}

bool restore_record_is_of(const std::string &sender) {
  return g_restore_cb_data != nullptr && g_restore_cb_data->sender == sender;
}

void set_restore_stop_result(int result) { ending.result = result; }

void end_restore_report() {
  ending.due = g_restore_cb_data != nullptr;
  send_stop_when_due();
}

bool restore_report_pending() { return ending.to_send > 0; }

void count_outstanding_restore(int change) {
  ending.outstanding += change;
  send_stop_when_due();
}
