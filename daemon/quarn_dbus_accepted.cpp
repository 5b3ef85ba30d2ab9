#include "quarn_dbus_accepted.h"

#include <map>
#include <string>

#include "gio_handles.h"
#include "quarn_common.h"
#include "quarn_dbus_callback.h"
#include "quarn_dbus_client.h"

// Never destroyed: threads live as long as the process.
Mutex &requests_mutex = *new Mutex;

namespace {

constexpr char kFailed[] = "failed";

/** One accepted request; a copy, for its record belongs to others. */
struct accepted_request {
  quarn_request kind;
  std::string text;
  client_cb_data client;
  bool told = false; /**< has had its last callback */
};

/** By record, which is compared and never looked into. */
struct request_table {
  std::map<const client_cb_data *, accepted_request> requests QUARN_GUARDED_BY(requests_mutex);
};
request_table &accepted = *new request_table;

/** The last callback of a request that is cut short. */
MessagePtr make_cancelled(const accepted_request &request) {
  const client_cb_data &client = request.client;
  const auto with_text = [&](const char *method, const char *text) {
    return make_callback(client, method,
                         g_variant_new("(isu)", QUARN_CANCELLED, text, client.req_id));
  };
  switch (request.kind) {
    case quarn_request::restore_mode:
      return with_text("restore_enable_cb", kRestoreStop);
    case quarn_request::app_list:
      return with_text("get_app_list_cb", kFailed);
    case quarn_request::app_backup:
      return with_text("app_data_backup_complete", as_bus_text(request.text.c_str()).get());
    case quarn_request::app_restore:
      return with_text("app_data_restore_complete", as_bus_text(request.text.c_str()).get());
    case quarn_request::manual_backup:
      return make_callback(
          client, "manual_backup_status",
          g_variant_new("(iiu)", QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, client.req_id));
    case quarn_request::cancel:
      break;
  }
  return make_callback(client, "manual_backup_cancel_result",
                       g_variant_new("(iu)", QUARN_CANCELLED, client.req_id));
}

}  // namespace

bool take_turn(const client_cb_data *record, bool is_last) {
  const auto found = accepted.requests.find(record);
  if (found == accepted.requests.end()) return true;
  const bool may = !found->second.told;
  if (is_last) accepted.requests.erase(found);
  return may;
}

void quarn_dbus_accept_request(quarn_request kind, const std::string &text,
                               const client_cb_data *record) {
  const MutexLock lock(requests_mutex);
  // The copy does not count among those that wait.
  accepted.requests[record] = {kind, text, {record->req_id, record->sender}};
}

void quarn_dbus_end_requests() {
  const MutexLock lock(requests_mutex);
  for (auto &[record, request] : accepted.requests) {
    if (request.told) continue;
    request.told = true;
    if (can_be_called(request.client)) send_only(make_cancelled(request).get());
  }
}
