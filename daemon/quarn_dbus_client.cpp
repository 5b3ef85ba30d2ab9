#include "quarn_dbus_client.h"

#include <atomic>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>

#include "quarn_common.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

GDBusConnection *quarn_dbus_connection = nullptr;

namespace {

/** Milliseconds that a client may take to answer. */
constexpr int kClientTimeout = 3000000;
/** The message that ends the stream of one restore-enable request. */
constexpr char kRestoreStop[] = "restore_stop";
constexpr char kFailed[] = "failed";
constexpr char kReplyFormat[] = "(i)";

/** A text that a D-Bus message can carry. */
GString_ as_bus_text(const char *text) {
  return GString_(g_utf8_make_valid(text == nullptr ? "" : text, -1));
}

/** One accepted request; a copy, for its record belongs to others. */
struct accepted_request {
  quarn_request kind;
  std::string text;
  client_cb_data client;
  bool told = false; /**< has had its last callback */
};

// Held while a callback is handed to the connection, so that no request has two last ones and
// none has a first one after it. Never destroyed: threads live as long as the process.
std::mutex &requests_mutex = *new std::mutex;
std::map<const void *, accepted_request> &requests = *new std::map<const void *, accepted_request>;
std::atomic<bool> waiting_stopped{false};
GCancellable *const waiting = g_cancellable_new();

using MessagePtr = Handle<GDBusMessage, &g_object_unref>;
using ContextPtr = Handle<GMainContext, &g_main_context_unref>;

/** A callback that was sent, and its answer. */
class SentCall {
 public:
  SentCall() : context_(g_main_context_new()) {}
  SentCall(const SentCall &) = delete;
  SentCall &operator=(const SentCall &) = delete;
  ~SentCall() { g_clear_object(&result_); }

  /** @p message is on its way when this returns. */
  void send(GDBusMessage *message) {
    g_main_context_push_thread_default(context_.get());
    g_dbus_connection_send_message_with_reply(quarn_dbus_connection, message,
                                              G_DBUS_SEND_MESSAGE_FLAGS_NONE, kClientTimeout,
                                              nullptr, waiting, on_reply, this);
    g_main_context_pop_thread_default(context_.get());
  }

  GVariantPtr wait(GErrorPtr *error) {
    g_main_context_push_thread_default(context_.get());
    while (result_ == nullptr) g_main_context_iteration(context_.get(), TRUE);
    g_main_context_pop_thread_default(context_.get());
    const MessagePtr reply(g_dbus_connection_send_message_with_reply_finish(quarn_dbus_connection,
                                                                            result_, out(*error)));
    if (!reply || g_dbus_message_to_gerror(reply.get(), out(*error)) != FALSE) return nullptr;
    GVariant *body = g_dbus_message_get_body(reply.get());
    return GVariantPtr(body == nullptr ? g_variant_ref_sink(g_variant_new_tuple(nullptr, 0))
                                       : g_variant_ref(body));
  }

 private:
  static void on_reply(GObject *, GAsyncResult *result, gpointer self) {
    static_cast<SentCall *>(self)->result_ = G_ASYNC_RESULT(g_object_ref(result));
  }

  ContextPtr context_;
  GAsyncResult *result_ = nullptr;
};

MessagePtr make_message(const client_cb_data &client, const char *method, GVariant *arguments) {
  MessagePtr message(g_dbus_message_new_method_call(client.sender.c_str(), kQuarnObjectPath,
                                                    kQuarnInterface, method));
  g_dbus_message_set_body(message.get(), arguments);
  return message;
}

bool can_be_called(const client_cb_data &client) {
  return quarn_dbus_connection != nullptr && g_dbus_is_name(client.sender.c_str()) != FALSE;
}

/** Under requests_mutex: whether the record's client may still be called. */
bool take_turn(const void *record, bool is_last) {
  const auto found = requests.find(record);
  if (found == requests.end()) return true;
  const bool may = !found->second.told;
  if (is_last) requests.erase(found);
  return may;
}

/** Send a callback whose answer nobody waits for. */
void send_only(GDBusMessage *message) {
  GErrorPtr error;
  if (g_dbus_connection_send_message(quarn_dbus_connection, message, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                     nullptr, out(error)) == FALSE) {
    LOGE("g_dbus_connection_send_message() Fail(%s)", error->message);
  }
}

/** Call @p method of the client that @p record names; consumes a floating @p payload. */
int call_client(const client_cb_data &record, const char *method, GVariant *payload, bool is_last) {
  const GVariantPtr arguments(g_variant_ref_sink(payload));
  GErrorPtr error;
  GVariantPtr reply;
  std::unique_lock<std::mutex> lock(requests_mutex);
  if (!take_turn(&record, is_last)) return QUARN_FAILED;
  if (can_be_called(record)) {
    const MessagePtr message = make_message(record, method, arguments.get());
    if (waiting_stopped) {
      send_only(message.get());
      return QUARN_FAILED;
    }
    SentCall call;
    call.send(message.get());
    lock.unlock();
    reply = call.wait(&error);
  } else {
    lock.unlock();
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

/** The last callback of a request that is cut short. */
MessagePtr make_cancelled(const accepted_request &request) {
  const client_cb_data &client = request.client;
  const auto with_text = [&](const char *method, const char *text) {
    return make_message(client, method,
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
      return make_message(
          client, "manual_backup_status",
          g_variant_new("(iiu)", QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, client.req_id));
    case quarn_request::cancel:
      break;
  }
  return make_message(client, "manual_backup_cancel_result",
                      g_variant_new("(iu)", QUARN_CANCELLED, client.req_id));
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
  return call_client(*record, method, g_variant_new("(i@su)", err, borrowed, record->req_id),
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

void quarn_dbus_accept_request(quarn_request kind, const std::string &text, void *record) {
  const auto *data = static_cast<const client_cb_data *>(record);
  const std::lock_guard<std::mutex> lock(requests_mutex);
  // The copy does not count among those that wait.
  requests[record] = {kind, text, {data->req_id, data->sender}};
}

void quarn_dbus_stop_waiting() {
  {
    const std::lock_guard<std::mutex> lock(requests_mutex);
    waiting_stopped = true;
  }
  g_cancellable_cancel(waiting);
}

bool quarn_dbus_waiting_stopped() { return waiting_stopped; }

void quarn_dbus_end_requests() {
  const std::lock_guard<std::mutex> lock(requests_mutex);
  for (auto &[record, request] : requests) {
    if (request.told) continue;
    request.told = true;
    if (can_be_called(request.client)) send_only(make_cancelled(request).get());
  }
}

void quarn_dbus_flush(unsigned int ms) {
  if (quarn_dbus_connection == nullptr) return;
  const ContextPtr context(g_main_context_new());
  const Handle<GSource, &g_source_unref> limit(g_timeout_source_new(ms));
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
  const LastCallback last(data, is_last);
  return call_client(*data, "manual_backup_status",
                     g_variant_new("(iiu)", err, status, data->req_id), is_last);
}

int quarn_dbus_manual_backup_cancel_result(int err, void *record) {
  LOGI("in quarn_dbus_manual_backup_cancel_result");
  client_cb_data *const data = as_record(record);
  if (data == nullptr) return QUARN_FAILED;
  const LastCallback last(data, true);
  return call_client(*data, "manual_backup_cancel_result", g_variant_new("(iu)", err, data->req_id),
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
