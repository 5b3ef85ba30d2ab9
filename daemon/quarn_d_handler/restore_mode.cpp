#include <memory>
#include <set>
#include <utility>

#include "files/package_files.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_record.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

char pellix_restore_running = 0;
char cloud_restore_running = 0;

namespace {

constexpr int kCloudClient = 0;
constexpr int kPellixClient = 1;

using RecordPtr = std::unique_ptr<client_cb_data>;

/** Grows with every change of the mode, so that one that waited sees what happened meanwhile. */
unsigned int mode_changes = 0;

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

void start_monitor(int client, const std::string &serial_num, RecordPtr record) {
  if (start_install_monitor()) {
    LOGI("start install event monitoring. client:%d, serial_num:%s", client, serial_num.c_str());
    keep_restore_record(record.release());
  } else {
    LOGE("fail to start install event monitor");
  }
}

/** From now on a backup leaves what is waited for in the cloud. */
void await_candidates() {
  std::set<std::string> installed;
  // what is not known to be installed counts as what is to come
  list_installed_packages(&installed);
  await_archives(serial_num_user_select, pkg_list_to_be_restored, installed);
  note_restore_mode_waits(serial_num_user_select);
}

/** What is waited for is neither there nor given up: only a backup by hand may remove it. */
void stop_waiting_unused() {
  await_no_archives();
  note_restore_mode_withdrawn();
}

/** The answer to a request in whose place another came while it waited for the session. */
int superseded_result(RecordPtr record) {
  if (pellix_restore_running) return QUARN_REFUSED;
  // It was accepted, so it has its end as well.
  send_restore_stop(record.release(), QUARN_OK);
  return QUARN_OK;
}

int switch_on(int client, const std::string &serial_num, const char *pkg_list, RecordPtr record) {
  std::vector<std::string> list = parse_package_list(pkg_list);
  if (!list.empty() && client == kCloudClient && !is_safe_path_component(serial_num)) {
    LOGE("refused : not a serial number (%s)", serial_num.c_str());
    return QUARN_REFUSED;
  }
  run_on_thread_stack(recover_interrupted_restores);
  pkg_list_to_be_restored = std::move(list);
  if (pkg_list_to_be_restored.empty()) await_no_archives();
  if (pkg_list_to_be_restored.empty()) {
    LOGI("there is no package should be restored");
    return QUARN_OK;
  }
  begin_restore_run(pkg_list_to_be_restored.size());
  init_install_complete_pkgs_list();
  init_icon_hide_delay_timer_list();
  current_restore_client = client;
  serial_num_user_select = serial_num;
  if (client == kCloudClient) {
    await_candidates();
  } else {
    stop_waiting_unused();
  }
  const unsigned int this_change = ++mode_changes;
  if (client == kPellixClient) {
    start_monitor(client, serial_num, std::move(record));
    pellix_restore_running = 1;
    cloud_restore_running = 0;
    return QUARN_OK;
  }
  request_power_lock(true);
  const bool session = cloud_initialized();
  // Other requests are served while the session starts; the latest of them counts.
  const bool superseded = this_change != mode_changes;
  const bool withdrawn = !session && waits_are_ended();
  if (session && !superseded) start_monitor(client, serial_num, std::move(record));
  request_power_lock(false);
  if (withdrawn) {
    if (!superseded) {
      pkg_list_to_be_restored.clear();
      stop_waiting_unused();
    }
    send_restore_stop(record.release(), QUARN_CANCELLED);
    return QUARN_CANCELLED;
  }
  if (superseded) return superseded_result(std::move(record));
  cloud_restore_running = 1;
  pellix_restore_running = 0;
  return QUARN_OK;
}

int switch_off(bool used) {
  ++mode_changes;
  if (used) {
    await_no_archives();
    if (cloud_restore_running) note_restore_mode_used();
  } else {
    stop_waiting_unused();
  }
  current_restore_client = kCloudClient;
  if (stop_install_monitor()) {
    LOGI("stop install event monitor");
  } else {
    LOGE("fail to start install event monitor");
  }
  pellix_restore_running = 0;
  cloud_restore_running = 0;
  end_restore_report();
  return QUARN_OK;
}

}  // namespace

int init_package_list_to_be_restored(const char *pkg_list_json) {
  pkg_list_to_be_restored = parse_package_list(pkg_list_json);
  return static_cast<int>(pkg_list_to_be_restored.size());
}

int quarnd_restore_enable(int on, int client, const char *serial_num, const char *pkg_list,
                          void *record) {
  RecordPtr owned(static_cast<client_cb_data *>(record));
  if (client != kCloudClient && client != kPellixClient) return QUARN_BAD_ARGUMENT;
  if (pellix_restore_running && on != 0 && client != kPellixClient) {
    LOGE("restore mode by pellix is already running");
    return QUARN_REFUSED;
  }
  const int result = on == 0 ? switch_off(true)
                             : switch_on(client, serial_num == nullptr ? "" : serial_num,
                                         pkg_list == nullptr ? "" : pkg_list, std::move(owned));
  note_restore_mode_change();
  return result;
}

void quarnd_withdraw_restore_mode() {
  switch_off(false);
  note_restore_mode_change();
}
