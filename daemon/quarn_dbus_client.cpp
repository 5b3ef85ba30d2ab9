#include "quarn_dbus_client.h"

#include <cstring>
#include <memory>
#include <utility>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_dbus_accepted.h"
#include "quarn_dbus_answer.h"
#include "quarn_dbus_callback.h"
#include "quarn_log.h"

GDBusConnection *quarn_dbus_connection = nullptr;

namespace {

/** How a callback came to leave. */
struct Departure {
  std::shared_ptr<SentCall> call; /**< null: its answer is not waited for */
  bool tried = false;
};

/** Send a callback. @p context: where its answer is waited for. */
Departure depart(const client_cb_data &record, const char *method, GVariant *arguments,
                 bool is_last, bool to_be_awaited, GMainContext *context) {
  const MutexLock lock(requests_mutex);
  if (!take_turn(&record, is_last)) return {};
  if (!can_be_called(record)) return {nullptr, true};
  const MessagePtr message = make_callback(record, method, arguments);
  if (quarn_dbus_waiting_stopped() || !to_be_awaited) {
    send_only(message.get());
    return {};
  }
  auto call = std::make_shared<SentCall>(context);
  call->send(message.get());
  return {std::move(call), true};
}

int failed_departure(const Departure &departure) {
  if (departure.tried) LOGE("g_dbus_connection_call_sync 'Launch' error");
  return QUARN_FAILED;
}

int call_in_place(const client_cb_data &record, const char *method, GVariant *arguments,
                  bool is_last) {
  const ContextPtr context(g_main_context_new());
  const std::string sender = record.sender;
  const Departure left = depart(record, method, arguments, is_last, true, context.get());
  if (!left.call) return failed_departure(left);
  wait_in_place(left.call.get(), context.get(), sender);
  return result_of(left.call.get());
}

/** Takes @p owned, the record when this is its last callback, until the client has answered. */
int call_on_main_thread(const client_cb_data &record, const char *method, GVariant *arguments,
                        bool is_last, std::unique_ptr<client_cb_data> owned) {
  const std::string sender = record.sender;
  const bool room = AwaitedAnswer::may_begin(sender);
  if (!room) LOGE("(%s) has too many callbacks to answer : not waited for", sender.c_str());
  const Departure left = depart(record, method, arguments, is_last, room, nullptr);
  if (!left.call) return failed_departure(left);
  const bool of_request = current_fiber() != nullptr;
  const auto wait = [call = left.call, sender, of_request] {
    const AwaitedAnswer counted(sender, of_request);
    wait_for_answer(call->loop());
    return result_of(call.get());
  };
  if (of_request) return wait();
  // Nobody here may wait: whatever called this serves everybody.
  const std::shared_ptr<client_cb_data> kept(std::move(owned));
  run_on_fiber([wait, kept] { wait(); });
  return QUARN_FAILED;
}

/**
 * Call @p method of the client that @p record names; consumes a floating @p payload, and the
 * record when this is its last callback.
 */
int call_client(client_cb_data *record, const char *method, GVariant *payload, bool is_last) {
  std::unique_ptr<client_cb_data> owned(is_last ? record : nullptr);
  const GVariantPtr arguments(g_variant_ref_sink(payload));
  if (!is_main_thread()) {
    return call_in_place(*record, method, arguments.get(), is_last);
  }
  return call_on_main_thread(*record, method, arguments.get(), is_last, std::move(owned));
}

/** The record behind an opaque pointer; null is logged. */
client_cb_data *as_record(void *record) {
  if (record == nullptr) LOGE("client_cb_data is NULL");
  return static_cast<client_cb_data *>(record);
}

/** A callback of "(isu)" err, msg, req_id. */
int send_message_callback(const char *method, int err, const char *msg, client_cb_data *record,
                          bool is_last) {
  GText made;
  const char *text = msg;
  if (text == nullptr || g_utf8_validate(text, -1, nullptr) == FALSE) {
    made = as_bus_text(msg);
    text = made.get();
  }
  // Borrowed for the length of the call: a list of some megabytes is there once, and in the
  // message.
  GVariant *borrowed = g_variant_new_from_data(G_VARIANT_TYPE_STRING, text, std::strlen(text) + 1,
                                               TRUE, nullptr, nullptr);
  return call_client(record, method, g_variant_new("(i@su)", err, borrowed, record->req_id),
                     is_last);
}

gboolean set_flag(gpointer flag) {
  *static_cast<bool *>(flag) = true;
  return G_SOURCE_REMOVE;
}

void on_flushed(GObject *connection, GAsyncResult *result, gpointer data) {
  const std::unique_ptr<std::shared_ptr<bool>> done(static_cast<std::shared_ptr<bool> *>(data));
  GErrorPtr error;
  if (g_dbus_connection_flush_finish(G_DBUS_CONNECTION(connection), result, out(error)) == FALSE) {
    LOGE("g_dbus_connection_flush() Fail(%s)", error->message);
  }
  **done = true;
}

}  // namespace

void quarn_dbus_flush(unsigned int ms) {
  if (quarn_dbus_connection == nullptr) return;
  const ContextPtr context(g_main_context_new());
  const SourcePtr limit(g_timeout_source_new(ms));
  bool late = false;
  g_source_set_callback(limit.get(), set_flag, &late, nullptr);
  g_source_attach(limit.get(), context.get());
  // Shared: a flush cannot be called off, and may end when nobody waits for it any more.
  const auto done = std::make_shared<bool>(false);
  g_main_context_push_thread_default(context.get());
  g_dbus_connection_flush(quarn_dbus_connection, nullptr, on_flushed,
                          new std::shared_ptr<bool>(done));
  while (!*done && !late) g_main_context_iteration(context.get(), TRUE);
  g_main_context_pop_thread_default(context.get());
  g_source_destroy(limit.get());
}

int quarn_dbus_restore_enable_cb(int err, const char *msg, void *record) {
  LOGI("in quarn_dbus_restore_enable_cb. err:%d, msg:%s", err, msg == nullptr ? "" : msg);
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  return send_message_callback("restore_enable_cb", err, msg, data,
                               g_strcmp0(msg, kRestoreStop) == 0);
}

int quarn_dbus_get_app_list_cb(int err, const char *msg, void *record) {
  LOGI("in quarn_dbus_get_app_list_cb");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  return send_message_callback("get_app_list_cb", err, msg, data, true);
}

int quarn_dbus_manual_backup_status(int err, int status, void *record) {
  LOGI("in quarn_dbus_manual_backup_status");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  const bool is_last = status != QUARN_BACKUP_RUNNING;
  return call_client(data, "manual_backup_status",
                     g_variant_new("(iiu)", err, status, data->req_id), is_last);
}

int quarn_dbus_manual_backup_cancel_result(int err, void *record) {
  LOGI("in quarn_dbus_manual_backup_cancel_result");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  return call_client(data, "manual_backup_cancel_result", g_variant_new("(iu)", err, data->req_id),
                     true);
}

int quarn_dbus_app_backup_complete(int err, const char *msg, void *record) {
  LOGI("in quarn_dbus_app_backup_complete");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  return send_message_callback("app_data_backup_complete", err, msg, data, true);
}

int quarn_dbus_app_restore_complete(int err, const char *msg, void *record) {
  LOGI("in quarn_dbus_app_restore_complete");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  return send_message_callback("app_data_restore_complete", err, msg, data, true);
}

int quarnd_dbus_publish(const char *signal_name, const char *value) {
  const CString key(quarn_utils_parse_key(signal_name));
  LOGI("quarnd_dbus_publish:quarn_utils_parse_key called");
  const char *const path = key && *key != '\0' ? key.get() : "/";

  // GDBus treats these as programming errors and sets no GError.
  if (quarn_dbus_connection == nullptr) {
    LOGE("g_dbus_connection_emit_signal() Fail(%s)", "not connected");
    return -1;
  }
  if (signal_name == nullptr || g_dbus_is_member_name(signal_name) == FALSE ||
      g_variant_is_object_path(path) == FALSE) {
    LOGE("g_dbus_connection_emit_signal() Fail(%s)", "not a signal name");
    return -1;
  }

  GErrorPtr error;
  const GText text = as_bus_text(value);
  if (g_dbus_connection_emit_signal(quarn_dbus_connection, nullptr, path, kQuarnInterface,
                                    signal_name, g_variant_new("(s)", text.get()),
                                    out(error)) == FALSE) {
    LOGE("g_dbus_connection_emit_signal() Fail(%s)", error ? error->message : "");
    return -1;
  }
  if (g_dbus_connection_flush_sync(quarn_dbus_connection, nullptr, out(error)) == FALSE) {
    LOGE("g_dbus_connection_flush_sync() Fail(%s)", error ? error->message : "");
  }
  return 0;
}
