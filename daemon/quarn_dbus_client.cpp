#include "quarn_dbus_client.h"

#include <cstring>
#include <memory>

#include "quarn_common.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

GDBusConnection *quarn_dbus_connection = nullptr;

namespace {

/** Milliseconds that a client may take to answer. */
constexpr int kClientTimeout = 3000000;
/** The message that ends the stream of one restore-enable request. */
constexpr char kRestoreStop[] = "restore_stop";
constexpr char kReplyFormat[] = "(i)";

/** A text that a D-Bus message can carry. */
GString_ as_bus_text(const char *text) {
  return GString_(g_utf8_make_valid(text == nullptr ? "" : text, -1));
}

/** Call @p method of the client that @p record names; consumes a floating @p payload. */
int call_client(const client_cb_data &record, const char *method, GVariant *payload) {
  const GVariantPtr arguments(g_variant_ref_sink(payload));
  GErrorPtr error;
  GVariantPtr reply;
  if (quarn_dbus_connection != nullptr && g_dbus_is_name(record.sender.c_str()) != FALSE) {
    reply.reset(g_dbus_connection_call_sync(
        quarn_dbus_connection, record.sender.c_str(), kQuarnObjectPath, kQuarnInterface, method,
        arguments.get(), nullptr, G_DBUS_CALL_FLAGS_NONE, kClientTimeout, nullptr, out(error)));
  }
  if (error) {
    LOGE("g_dbus_connection_call_sync() Fail(%s)", error->message);
    return QUARN_FAILED;
  }
  if (!reply || g_variant_is_of_type(reply.get(), G_VARIANT_TYPE(kReplyFormat)) == FALSE) {
    LOGE("g_dbus_connection_call_sync 'Launch' error");
    return QUARN_FAILED;
  }
  gint32 result = QUARN_FAILED;
  g_variant_get(reply.get(), kReplyFormat, &result);
  return result;
}

/** The record behind an opaque pointer; null is logged. */
client_cb_data *as_record(void *record) {
  if (record == nullptr) LOGE("client_cb_data is NULL");
  return static_cast<client_cb_data *>(record);
}

/** Deletes the record of a request that has received its last callback. */
class LastCallback {
 public:
  LastCallback(client_cb_data *record, bool is_last) : record_(is_last ? record : nullptr) {}

 private:
  std::unique_ptr<client_cb_data> record_;
};

/** A callback of "(isu)" err, msg, req_id. */
int send_message_callback(const char *method, int err, const char *msg, client_cb_data *record,
                          bool is_last) {
  const LastCallback last(record, is_last);
  GString_ made;
  const char *text = msg;
  if (text == nullptr || g_utf8_validate(text, -1, nullptr) == FALSE) {
    made = as_bus_text(msg);
    text = made.get();
  }
  // Borrowed for the length of the call: a list of some megabytes is there once, and in the
  // message.
  GVariant *borrowed = g_variant_new_from_data(G_VARIANT_TYPE_STRING, text, std::strlen(text) + 1,
                                               TRUE, nullptr, nullptr);
  return call_client(*record, method, g_variant_new("(i@su)", err, borrowed, record->req_id));
}

}  // namespace

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
  const LastCallback last(data, status != QUARN_BACKUP_RUNNING);
  return call_client(*data, "manual_backup_status",
                     g_variant_new("(iiu)", err, status, data->req_id));
}

int quarn_dbus_manual_backup_cancel_result(int err, void *record) {
  LOGI("in quarn_dbus_manual_backup_cancel_result");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  const LastCallback last(data, true);
  return call_client(*data, "manual_backup_cancel_result",
                     g_variant_new("(iu)", err, data->req_id));
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
  const GString_ text = as_bus_text(value);
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
