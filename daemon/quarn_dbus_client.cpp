#include "quarn_dbus_client.h"

#include <atomic>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "quarn_common.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/pending_work.h"
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
/** Of each callback whose answer is waited for. */
std::set<GCancellable *> &awaited = *new std::set<GCancellable *>;

/** Milliseconds between the looks whether others have waited for long enough. */
constexpr guint kPatienceCheckMs = 1000;
std::atomic<callback_patience> patience{nullptr};
/** Guards the two that follow. */
std::mutex &time_mutex = *new std::mutex;
std::int64_t waited_us = 0;
std::int64_t waiting_since_us = 0; /**< of the wait that stands; 0: none */

std::thread::id main_thread;
/** By client, the fibers of the main thread that wait for its answer; of all in the other. */
std::map<std::string, std::size_t> &answers_of_client = *new std::map<std::string, std::size_t>;
std::size_t answers_of_all = 0;

using MessagePtr = Handle<GDBusMessage, &g_object_unref>;
using ContextPtr = Handle<GMainContext, &g_main_context_unref>;

using LoopPtr = Handle<GMainLoop, &g_main_loop_unref>;
using CancellablePtr = Handle<GCancellable, &g_object_unref>;
using ResultPtr = Handle<GAsyncResult, &g_object_unref>;
using SourcePtr = Handle<GSource, &g_source_unref>;

gboolean keep_looking(gpointer) { return G_SOURCE_CONTINUE; }

/** A callback that was sent, and its answer. */
class SentCall : public std::enable_shared_from_this<SentCall> {
 public:
  /** @param context where the answer arrives; null: the main thread's */
  explicit SentCall(GMainContext *context)
      : context_(context), cancellable_(g_cancellable_new()), loop_(new_wait_loop()) {}
  SentCall(const SentCall &) = delete;
  SentCall &operator=(const SentCall &) = delete;
  ~SentCall() {
    const std::lock_guard<std::mutex> lock(requests_mutex);
    awaited.erase(cancellable_.get());
  }

  /** @p message is on its way when this returns. Under requests_mutex. */
  void send(GDBusMessage *message) {
    awaited.insert(cancellable_.get());
    if (context_ != nullptr) g_main_context_push_thread_default(context_);
    g_dbus_connection_send_message_with_reply(
        quarn_dbus_connection, message, G_DBUS_SEND_MESSAGE_FLAGS_NONE, kClientTimeout, nullptr,
        cancellable_.get(), on_reply, new std::shared_ptr<SentCall>(shared_from_this()));
    if (context_ != nullptr) g_main_context_pop_thread_default(context_);
  }

  bool is_answered() const { return result_ != nullptr; }
  GMainLoop *loop() const { return loop_.get(); }
  void give_up() { g_cancellable_cancel(cancellable_.get()); }

  GVariantPtr take_answer(GErrorPtr *error) {
    if (!result_) {
      error->reset(g_error_new_literal(G_IO_ERROR, G_IO_ERROR_CANCELLED, "the process ends"));
      return nullptr;
    }
    const MessagePtr reply(g_dbus_connection_send_message_with_reply_finish(
        quarn_dbus_connection, result_.get(), out(*error)));
    if (!reply || g_dbus_message_to_gerror(reply.get(), out(*error)) != FALSE) return nullptr;
    GVariant *body = g_dbus_message_get_body(reply.get());
    return GVariantPtr(body == nullptr ? g_variant_ref_sink(g_variant_new_tuple(nullptr, 0))
                                       : g_variant_ref(body));
  }

 private:
  static void on_reply(GObject *, GAsyncResult *result, gpointer data) {
    const std::unique_ptr<std::shared_ptr<SentCall>> call(
        static_cast<std::shared_ptr<SentCall> *>(data));
    (*call)->result_.reset(G_ASYNC_RESULT(g_object_ref(result)));
    g_main_loop_quit((*call)->loop_.get());
  }

  GMainContext *context_;
  CancellablePtr cancellable_;
  LoopPtr loop_;
  ResultPtr result_;
};
using SentCallPtr = std::shared_ptr<SentCall>;

/** Counts the time of a wait that nothing else is done in. */
class TimedWait {
 public:
  TimedWait() : since_us_(g_get_monotonic_time()) {
    const std::lock_guard<std::mutex> lock(time_mutex);
    waiting_since_us = since_us_;
  }
  ~TimedWait() {
    const std::lock_guard<std::mutex> lock(time_mutex);
    waited_us += g_get_monotonic_time() - since_us_;
    waiting_since_us = 0;
  }
  TimedWait(const TimedWait &) = delete;
  TimedWait &operator=(const TimedWait &) = delete;

 private:
  const std::int64_t since_us_;
};

/** Off the main thread: nothing else is done here meanwhile. */
void wait_in_place(SentCall *call, GMainContext *context, const std::string &sender) {
  const TimedWait timed;
  const SourcePtr look(g_timeout_source_new(kPatienceCheckMs));
  g_source_set_callback(look.get(), keep_looking, nullptr, nullptr);
  g_source_attach(look.get(), context);
  g_main_context_push_thread_default(context);
  bool given_up = false;
  while (!call->is_answered()) {
    const callback_patience exhausted = patience;
    if (!given_up && exhausted != nullptr && exhausted(sender)) {
      LOGE("(%s) does not answer its callback : others go on", sender.c_str());
      given_up = true;
      call->give_up();
    }
    if (!call->is_answered()) g_main_context_iteration(context, TRUE);
  }
  g_main_context_pop_thread_default(context);
  g_source_destroy(look.get());
}

/** Counts a fiber that waits for a client's answer. Main thread. */
class AwaitedAnswer {
 public:
  AwaitedAnswer(std::string client, bool of_request) : client_(std::move(client)) {
    ++answers_of_client[client_];
    ++answers_of_all;
    if (of_request) pending_.emplace();
  }
  ~AwaitedAnswer() {
    const auto entry = answers_of_client.find(client_);
    if (--entry->second == 0) answers_of_client.erase(entry);
    --answers_of_all;
  }
  AwaitedAnswer(const AwaitedAnswer &) = delete;
  AwaitedAnswer &operator=(const AwaitedAnswer &) = delete;

  static bool may_begin(const std::string &client) {
    const auto entry = answers_of_client.find(client);
    return answers_of_all < kMostAnswersAwaited &&
           (entry == answers_of_client.end() || entry->second < kMostAnswersOfClient);
  }

 private:
  const std::string client_;
  std::optional<PendingWork> pending_;  // where a request's own fiber waits
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

/** The integer that a client has answered. */
int result_of(SentCall *call) {
  GErrorPtr error;
  const GVariantPtr reply = call->take_answer(&error);
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

/** How a callback came to leave. */
struct Departure {
  SentCallPtr call; /**< null: its answer is not waited for */
  bool tried = false;
};

/** Send a callback. @p context: where its answer is waited for. */
Departure depart(const client_cb_data &record, const char *method, GVariant *arguments,
                 bool is_last, bool to_be_awaited, GMainContext *context) {
  const std::lock_guard<std::mutex> lock(requests_mutex);
  if (!take_turn(&record, is_last)) return {};
  if (!can_be_called(record)) return {nullptr, true};
  const MessagePtr message = make_message(record, method, arguments);
  if (waiting_stopped || !to_be_awaited) {
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
  if (std::this_thread::get_id() != main_thread) {
    return call_in_place(*record, method, arguments.get(), is_last);
  }
  return call_on_main_thread(*record, method, arguments.get(), is_last, std::move(owned));
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

/** A callback of "(isu)" err, msg, req_id. */
int send_message_callback(const char *method, int err, const char *msg, client_cb_data *record,
                          bool is_last) {
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

void quarn_dbus_accept_request(quarn_request kind, const std::string &text, void *record) {
  const auto *data = static_cast<const client_cb_data *>(record);
  const std::lock_guard<std::mutex> lock(requests_mutex);
  // The copy does not count among those that wait.
  requests[record] = {kind, text, {data->req_id, data->sender}};
}

void quarn_dbus_stop_waiting() {
  std::vector<CancellablePtr> standing;
  {
    const std::lock_guard<std::mutex> lock(requests_mutex);
    waiting_stopped = true;
    for (GCancellable *call : awaited) standing.emplace_back(G_CANCELLABLE(g_object_ref(call)));
  }
  for (const CancellablePtr &call : standing) g_cancellable_cancel(call.get());
}

void quarn_dbus_note_main_thread() { main_thread = std::this_thread::get_id(); }

void quarn_dbus_set_patience(callback_patience exhausted) { patience = exhausted; }

std::int64_t quarn_dbus_time_waited() {
  const std::lock_guard<std::mutex> lock(time_mutex);
  return waited_us + (waiting_since_us == 0 ? 0 : g_get_monotonic_time() - waiting_since_us);
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
