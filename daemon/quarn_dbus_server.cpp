#include "quarn_dbus_server.h"

#include <gio/gio.h>
#include <gio/gunixfdlist.h>
#include <glib.h>
#include <malloc.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_end.h"
#include "quarn_d_gate.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/admission.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_dbus_calls.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_limits.h"
#include "quarn_log.h"

const char quarn_introspection_xml[] =
    "<node>"
    "\t<interface name='org.orvane.Quarn'>"
    "\t\t<method name='set_activation'>"
    "\t\t\t<arg type='i' name='activation' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='backup_enable'>"
    "\t\t\t<arg type='i' name='on' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='restore_enable'>"
    "\t\t\t<arg type='i' name='on' direction='in'/>"
    "\t\t\t<arg type='i' name='client' direction='in'/>"
    "\t\t\t<arg type='s' name='serial_num' direction='in'/>"
    "\t\t\t<arg type='s' name='pkg_list' direction='in'/>"
    "\t\t\t<arg type='u' name='req_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='last_bu_time'>"
    "\t\t\t<arg type='t' name='timestamp' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='get_app_list'>"
    "\t\t\t<arg type='i' name='client' direction='in'/>"
    "\t\t\t<arg type='u' name='req_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='auto_backup_start'>"
    "\t\t\t<arg type='s' name='param' direction='in'/>"
    "\t\t</method>"
    "\t\t<method name='manual_backup_start'>"
    "\t\t\t<arg type='u' name='req_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='manual_backup_cancel'>"
    "\t\t\t<arg type='u' name='req_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='app_data_backup_start'>"
    "\t\t\t<arg type='s' name='pkg_id' direction='in'/>"
    "\t\t\t<arg type='u' name='req_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='app_data_restore_start'>"
    "\t\t\t<arg type='s' name='pkg_id' direction='in'/>"
    "\t\t\t<arg type='u' name='req_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t\t<method name='make_app_data'>"
    "\t\t\t<arg type='s' name='pkg_id' direction='in'/>"
    "\t\t\t<arg type='i' name='ret' direction='out'/>"
    "\t\t</method>"
    "\t</interface>"
    "</node>";

namespace {

constexpr unsigned int kNoOwner = static_cast<unsigned int>(-1);
/** The reply to a call whose arguments are missing. */
constexpr int kArgumentsMissing = -1;
/** Milliseconds that the bus itself may take to answer. */
constexpr int kBusTimeout = 5000;

/** Milliseconds for the last answers to be written. */
constexpr unsigned int kFlushLimit = 500;

/** Milliseconds that the bus may take to answer when the process is about to be left. */
constexpr int kLastRelease = 50;

guint registration_id = 0;
guint filter_id = 0;
guint name_owner_id = 0;
/** The bus has answered the latest request for the name. */
bool name_settled = true;
gulong closed_handler = 0;
void (*bus_acquired_hook)(GDBusConnection *connection) = nullptr;

/** One call, and the way its one answer goes. */
class MethodCall {
 public:
  MethodCall(const char *sender, const char *interface_name, const char *method_name,
             guint32 serial, quarn_caller caller)
      : sender_(sender == nullptr ? "" : sender),
        interface_(interface_name == nullptr ? "" : interface_name),
        method_(method_name == nullptr ? "" : method_name),
        serial_(serial),
        caller_(std::move(caller)) {}
  MethodCall(const MethodCall &) = delete;
  MethodCall &operator=(const MethodCall &) = delete;
  virtual ~MethodCall() = default;

  /** @p value is a tuple, floating; null is the empty one. */
  virtual void reply(GVariant *value) = 0;
  virtual void refuse(int dbus_error, const std::string &text) = 0;

  void reply_int(int value) { reply(g_variant_new("(i)", value)); }
  bool is(const char *method) const { return g_strcmp0(method_.c_str(), method) == 0; }
  const std::string &sender() const { return sender_; }
  const std::string &interface_name() const { return interface_; }
  const std::string &method() const { return method_; }
  /** The number that the sender has given it. */
  guint32 serial() const { return serial_; }
  const quarn_caller &caller() const { return caller_; }

 private:
  std::string sender_;
  std::string interface_;
  std::string method_;
  guint32 serial_;
  quarn_caller caller_;
};

/** A call that GDBus handed over. */
class InvokedCall : public MethodCall {
 public:
  InvokedCall(const char *sender, const char *interface_name, const char *method_name,
              GDBusMethodInvocation *invocation, const quarn_caller &caller)
      : MethodCall(sender, interface_name, method_name,
                   g_dbus_message_get_serial(g_dbus_method_invocation_get_message(invocation)),
                   caller),
        invocation_(invocation) {}
  void reply(GVariant *value) override {
    g_dbus_method_invocation_return_value(invocation_, value);
  }
  void refuse(int dbus_error, const std::string &text) override {
    g_dbus_method_invocation_return_error(invocation_, G_DBUS_ERROR, dbus_error, "%s",
                                          text.c_str());
  }

 private:
  GDBusMethodInvocation *invocation_;
};

using MessagePtr = Handle<GDBusMessage, &g_object_unref>;

/** A call that GDBus would have answered by itself, without telling anyone. */
class RawCall : public MethodCall {
 public:
  RawCall(GDBusConnection *connection, GDBusMessage *message, const quarn_caller &caller)
      : MethodCall(g_dbus_message_get_sender(message), g_dbus_message_get_interface(message),
                   g_dbus_message_get_member(message), g_dbus_message_get_serial(message), caller),
        connection_(connection),
        message_(message) {}
  void reply(GVariant *value) override {
    const MessagePtr answer(g_dbus_message_new_method_reply(message_));
    if (value != nullptr) g_dbus_message_set_body(answer.get(), value);
    send(answer.get());
  }
  void refuse(int dbus_error, const std::string &text) override {
    const GErrorPtr error(g_error_new_literal(G_DBUS_ERROR, dbus_error, text.c_str()));
    const GString_ name(g_dbus_error_encode_gerror(error.get()));
    const MessagePtr answer(
        g_dbus_message_new_method_error_literal(message_, name.get(), text.c_str()));
    send(answer.get());
  }

 private:
  void send(GDBusMessage *answer) {
    if ((g_dbus_message_get_flags(message_) & G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED) != 0) return;
    GErrorPtr error;
    if (g_dbus_connection_send_message(connection_, answer, G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr,
                                       out(error)) == FALSE) {
      LOGE("g_dbus_connection_send_message() Fail(%s)", error ? error->message : "");
    }
  }

  GDBusConnection *connection_;
  GDBusMessage *message_;
};

/**
 * Whose bounds a call counts against, beside its connection's, of which one caller may have many.
 * Applications are one user, and callers by their labels.
 */
waiting_parties parties_of(const MethodCall &call) {
  const quarn_caller &caller = call.caller();
  if (!caller.known || caller.uid == 0) return {};
  const std::string user = "user " + std::to_string(caller.uid);
  if (caller.uid != kAppUid) return {user, false};
  return {user + ", label " + caller.label, true};
}

client_cb_data *make_record(const MethodCall &call, guint32 req_id) {
  return new client_cb_data{req_id, call.sender(), count_waiting(call.sender(), parties_of(call))};
}

/** A request that ends what others wait for is accepted however many wait. */
client_cb_data *make_uncounted_record(const MethodCall &call, guint32 req_id) {
  return new client_cb_data{req_id, call.sender(), nullptr};
}

void refuse_for_number(MethodCall &call, const char *which, const std::string &text) {
  if (tells_of_refusal(call.caller())) {
    LOGE("refused : too many requests of (%s) %s", call.sender().c_str(), which);
  }
  call.refuse(G_DBUS_ERROR_LIMITS_EXCEEDED, text);
}

/** Refuse a request that may wait where too many do. */
bool refuse_beyond_places(MethodCall &call) {
  if (may_wait(call.sender(), parties_of(call))) return false;
  refuse_for_number(call, "wait", "Too many requests are waiting");
  return true;
}

/** Refuse a request beyond what its caller may have waiting or may ask for in a minute. */
bool refuse_beyond_bounds(MethodCall &call) {
  if (refuse_beyond_places(call)) return true;
  if (count_request(call.caller())) return false;
  refuse_for_number(call, "within a minute", "Too many requests within a minute");
  return true;
}

/** The record of a request that ends with a last callback, whatever happens. */
client_cb_data *accept(const MethodCall &call, guint32 req_id, quarn_request kind,
                       const char *text = "") {
  client_cb_data *const record = kind == quarn_request::cancel ? make_uncounted_record(call, req_id)
                                                               : make_record(call, req_id);
  quarn_dbus_accept_request(kind, text, record);
  return record;
}

/** Do a request's work, unless the process ends: then it has its last callback here. */
template <typename Work>
void serve(MethodCall &call, client_cb_data *record, int reply_at_end, Work work) {
  if (!quarn_dbus_waiting_stopped()) {
    call.reply_int(work(record));
    return;
  }
  quarn_dbus_end_requests();
  delete record;
  call.reply_int(reply_at_end);
}

void on_set_activation(MethodCall &call, GVariant *parameters) {
  gint32 activation = 0;
  g_variant_get(parameters, "(i)", &activation);
  if (activation == 0) {
    LOGI("try to terminate quarn");
    init_last_backup_time();
    request_quarn_terminate(0.0, false);
  } else {
    LOGI("quarn activated successfully!");
  }
  call.reply_int(QUARN_OK);
}

void on_backup_enable(MethodCall &call, GVariant *parameters) {
  gint32 on = 0;
  g_variant_get(parameters, "(i)", &on);
  call.reply_int(quarnd_backup_enable(on));
}

void on_restore_enable(MethodCall &call, GVariant *parameters) {
  gint32 on = 0;
  gint32 client = 0;
  const char *serial_num = nullptr;
  const char *pkg_list = nullptr;
  guint32 req_id = 0;
  g_variant_get(parameters, "(ii&s&su)", &on, &client, &serial_num, &pkg_list, &req_id);
  if (on != 0 && quarn_dbus_waiting_stopped()) {
    call.reply_int(QUARN_REFUSED);
    return;
  }
  if (on != 0 && waits_are_ended()) {
    call.reply_int(QUARN_CANCELLED);
    return;
  }
  if (on != 0 && refuse_beyond_bounds(call)) return;
  client_cb_data *const record =
      on != 0 ? make_record(call, req_id) : make_uncounted_record(call, req_id);
  call.reply_int(quarnd_restore_enable(on, client, serial_num, pkg_list, record));
}

void on_last_bu_time(MethodCall &call) {
  unsigned long long timestamp = 0;
  quarnd_get_last_backed_up_time(&timestamp);
  call.reply(g_variant_new("(t)", static_cast<guint64>(timestamp)));
}

void on_get_app_list(MethodCall &call, GVariant *parameters) {
  gint32 client = 0;
  guint32 req_id = 0;
  g_variant_get(parameters, "(iu)", &client, &req_id);
  if (refuse_beyond_bounds(call)) return;
  serve(call, accept(call, req_id, quarn_request::app_list), QUARN_CANCELLED,
        [client](void *record) { return quarnd_get_app_list(client, record); });
}

void on_manual_backup_start(MethodCall &call, GVariant *parameters) {
  guint32 req_id = 0;
  g_variant_get(parameters, "(u)", &req_id);
  if (refuse_beyond_bounds(call)) return;
  call.reply_int(quarnd_manual_backup(accept(call, req_id, quarn_request::manual_backup)));
}

void on_manual_backup_cancel(MethodCall &call, GVariant *parameters) {
  guint32 req_id = 0;
  g_variant_get(parameters, "(u)", &req_id);
  // What runs may be an earlier process's.
  if (signal_quarn_predecessor(kCancelSignal)) LOGI("cancel passed on");
  call.reply_int(quarnd_manual_backup_cancel(accept(call, req_id, quarn_request::cancel)));
}

void on_app_data_backup_start(MethodCall &call, GVariant *parameters) {
  const char *pkg_id = nullptr;
  guint32 req_id = 0;
  g_variant_get(parameters, "(&su)", &pkg_id, &req_id);
  if (refuse_beyond_bounds(call)) return;
  serve(call, accept(call, req_id, quarn_request::app_backup, pkg_id), QUARN_OK,
        [pkg_id](void *record) { return quarnd_backup_app_data(pkg_id, record); });
}

void on_app_data_restore_start(MethodCall &call, GVariant *parameters) {
  const char *pkg_id = nullptr;
  guint32 req_id = 0;
  g_variant_get(parameters, "(&su)", &pkg_id, &req_id);
  if (refuse_beyond_bounds(call)) return;
  serve(call, accept(call, req_id, quarn_request::app_restore, pkg_id), QUARN_OK,
        [pkg_id](void *record) { return quarnd_restore_app_data(pkg_id, record); });
}

void on_make_app_data(MethodCall &call, GVariant *parameters) {
  const char *pkg_id = nullptr;
  g_variant_get(parameters, "(&s)", &pkg_id);
  if (quarn_dbus_waiting_stopped() || waits_are_ended()) {
    call.reply_int(QUARN_CANCELLED);
    return;
  }
  if (refuse_beyond_bounds(call)) return;
  const auto counted = count_waiting(call.sender(), parties_of(call));
  const quarn_caller &caller = call.caller();
  const bool trusted =
      caller.uid == 0 || kind_of_caller(caller, client_group()) == caller_kind::trusted;
  // All applications have one user, and what an application asks for is for it alone.
  call.reply_int(quarnd_make_app_data(pkg_id, caller.uid, trusted ? "" : caller.label));
}

/** The one dispatcher; @p given is null when the call has no arguments. */
void dispatch(MethodCall &call, GVariant *given) {
  if (!begin_quarn_call(call.sender(), call.serial())) return;
  cancel_quarn_terminate();

  // A reference of our own: those of the call go with its answer.
  const GVariantPtr owned(given == nullptr ? nullptr : g_variant_ref(given));
  GVariant *const parameters = owned.get();
  const auto with_parameters = [&call, parameters](auto &&handler) {
    if (parameters == nullptr) {
      call.reply_int(kArgumentsMissing);
    } else {
      handler();
    }
  };

  if (call.is("set_activation")) {
    with_parameters([&] { on_set_activation(call, parameters); });
  } else if (call.is("backup_enable")) {
    with_parameters([&] { on_backup_enable(call, parameters); });
  } else if (call.is("restore_enable")) {
    with_parameters([&] { on_restore_enable(call, parameters); });
  } else if (call.is("last_bu_time")) {
    on_last_bu_time(call);
  } else if (call.is("get_app_list")) {
    with_parameters([&] { on_get_app_list(call, parameters); });
  } else if (call.is("auto_backup_start")) {
    call.reply(nullptr);  // accepted and ignored
  } else if (call.is("manual_backup_start")) {
    with_parameters([&] { on_manual_backup_start(call, parameters); });
  } else if (call.is("manual_backup_cancel")) {
    with_parameters([&] { on_manual_backup_cancel(call, parameters); });
  } else if (call.is("app_data_backup_start")) {
    with_parameters([&] { on_app_data_backup_start(call, parameters); });
  } else if (call.is("app_data_restore_start")) {
    with_parameters([&] { on_app_data_restore_start(call, parameters); });
  } else if (call.is("make_app_data")) {
    with_parameters([&] { on_make_app_data(call, parameters); });
  } else {
    call.refuse(G_DBUS_ERROR_UNKNOWN_METHOD,
                unknown_method_text(call.method(), call.interface_name()));
  }
}

/* ---- calls that wait for an earlier process ------------------------------------ */

using LoopPtr = Handle<GMainLoop, &g_main_loop_unref>;

/** What calls wait for that touch what the earlier process may be writing. */
std::vector<GMainLoop *> waits_for_turn;

/** Whether the call has to wait until the earlier process has ended. */
bool must_wait(const MethodCall &call, GVariant *parameters) {
  if (is_quarn_turn() || parameters == nullptr || quarn_dbus_waiting_stopped()) return false;
  if (call.is("restore_enable")) {
    gint32 on = 0;
    g_variant_get_child(parameters, 0, "i", &on);
    return on != 0;
  }
  return call.is("get_app_list") || call.is("app_data_backup_start") ||
         call.is("app_data_restore_start") || call.is("make_app_data");
}

/** @return false when the call was refused or is not wanted any more, and is answered */
bool wait_for_turn(MethodCall &call) {
  cancel_quarn_terminate();
  if (refuse_beyond_places(call)) return false;
  const auto counted = count_waiting(call.sender(), parties_of(call));
  const LoopPtr loop(new_wait_loop());
  waits_for_turn.push_back(loop.get());
  run_nested_loop(loop.get());
  waits_for_turn.erase(std::find(waits_for_turn.begin(), waits_for_turn.end(), loop.get()));
  return true;
}

void tell_excess(const MethodCall &call, const std::string &excess) {
  if (!tells_of_refusal(call.caller())) return;
  LOGE("refused : %s of (%s) : %s", call.method().c_str(), call.sender().c_str(), excess.c_str());
}

/**
 * Whether the caller may have what it asks for; else it is refused here, and nothing but the
 * pending end is touched.
 */
bool admit(MethodCall &call, GVariant *parameters) {
  const quarn_subject subject = subject_of_call(call.interface_name(), call.method(), parameters);
  const caller_verdict verdict =
      judge_call(call.caller(), call.sender(), subject, cloud_restore_running());
  const std::string excess =
      verdict.allowed ? excess_of_arguments(call.method(), parameters) : std::string();
  if (verdict.allowed && excess.empty()) return true;
  if (call.interface_name() == kQuarnInterface) cancel_quarn_terminate();
  if (!verdict.allowed) {
    call.refuse(G_DBUS_ERROR_ACCESS_DENIED, refusal_text(subject, verdict));
    return false;
  }
  tell_excess(call, excess);
  call.refuse(G_DBUS_ERROR_INVALID_ARGS, excess);
  return false;
}

void serve_invoked(const quarn_caller &caller, GDBusMethodInvocation *invocation) {
  // The invocation, ours until it is answered, owns all of these.
  InvokedCall call(g_dbus_method_invocation_get_sender(invocation),
                   g_dbus_method_invocation_get_interface_name(invocation),
                   g_dbus_method_invocation_get_method_name(invocation), invocation, caller);
  GVariant *const parameters = g_dbus_method_invocation_get_parameters(invocation);
  if (!admit(call, parameters)) return;
  if (must_wait(call, parameters) && !wait_for_turn(call)) return;
  dispatch(call, parameters);
}

void _dbus_handle_method_call(GDBusConnection *connection, const gchar *sender, const gchar *,
                              const gchar *, const gchar *, GVariant *,
                              GDBusMethodInvocation *invocation, gpointer) {
  with_caller(connection, sender == nullptr ? "" : sender,
              [invocation](const quarn_caller &caller) {
                run_on_fiber([caller, invocation] { serve_invoked(caller, invocation); });
              });
}

constexpr GDBusInterfaceVTable kMethodTable = {_dbus_handle_method_call, nullptr, nullptr, {}};

/* ---- calls that GDBus does not hand over ------------------------------------- */

using ConnectionPtr = Handle<GDBusConnection, &g_object_unref>;

/** A message on its way from the bus thread to the main thread. */
struct Passed {
  ConnectionPtr connection;
  MessagePtr message;
  quarn_call_form form;
  std::atomic<bool> complete{false}; /**< hands all of it to the main thread */
};

/** Calls that the bus library answers and that have no answer yet. */
unsigned int forwarded_calls = 0;

bool wants_no_reply(GDBusMessage *call) {
  return (g_dbus_message_get_flags(call) & G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED) != 0;
}

struct Forwarded {
  MessagePtr call;
};

void on_library_answer(GObject *bus, GAsyncResult *result, gpointer data) {
  const std::unique_ptr<Forwarded> forwarded(static_cast<Forwarded *>(data));
  --forwarded_calls;
  if (wants_no_reply(forwarded->call.get())) return;
  GErrorPtr error;
  const MessagePtr reply(
      g_dbus_connection_send_message_with_reply_finish(G_DBUS_CONNECTION(bus), result, out(error)));
  MessagePtr answer;
  if (reply && g_dbus_message_to_gerror(reply.get(), out(error)) == FALSE) {
    answer.reset(g_dbus_message_new_method_reply(forwarded->call.get()));
    g_dbus_message_set_body(answer.get(), g_dbus_message_get_body(reply.get()));
  } else {
    GString_ name(g_dbus_error_get_remote_error(error.get()));
    if (!name) name.reset(g_dbus_error_encode_gerror(error.get()));
    g_dbus_error_strip_remote_error(error.get());
    answer.reset(
        g_dbus_message_new_method_error_literal(forwarded->call.get(), name.get(), error->message));
  }
  g_dbus_connection_send_message(G_DBUS_CONNECTION(bus), answer.get(),
                                 G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr, nullptr);
}

/**
 * Let the bus library answer a call that is none of ours: it does so only for what
 * comes from the bus, so that it is sent to this connection itself.
 */
void forward_to_library(GDBusConnection *connection, GDBusMessage *call) {
  const MessagePtr message(g_dbus_message_new_method_call(
      g_dbus_connection_get_unique_name(connection), g_dbus_message_get_path(call),
      g_dbus_message_get_interface(call), g_dbus_message_get_member(call)));
  g_dbus_message_set_body(message.get(), g_dbus_message_get_body(call));
  ++forwarded_calls;
  g_dbus_connection_send_message_with_reply(
      connection, message.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE, kBusTimeout, nullptr, nullptr,
      on_library_answer, new Forwarded{MessagePtr(G_DBUS_MESSAGE(g_object_ref(call)))});
}

std::string type_text(const char *signature) { return std::string("(") + signature + ")"; }

/** A call of an admitted caller that GDBus was not given, or has not the words for. */
void serve_raw(RawCall &call, GDBusConnection *connection, GDBusMessage *message,
               quarn_call_form form) {
  if (form == quarn_call_form::of_other_object) return forward_to_library(connection, message);
  if (form == quarn_call_form::too_large) {
    cancel_quarn_terminate();
    tell_excess(call, kArgumentsTooLarge);
    return call.refuse(G_DBUS_ERROR_INVALID_ARGS, kArgumentsTooLarge);
  }
  if (form == quarn_call_form::other_arguments) {
    cancel_quarn_terminate();
    return call.refuse(G_DBUS_ERROR_INVALID_ARGS,
                       "Arguments of type " + type_text(g_dbus_message_get_signature(message)) +
                           " are not those of " + call.method());
  }
  dispatch(call, nullptr);
}

using SharedMessage = std::shared_ptr<GDBusMessage>;

gboolean on_passed(gpointer data) {
  auto *passed = static_cast<Passed *>(data);
  if (!passed->complete.load(std::memory_order_acquire)) return G_SOURCE_REMOVE;
  const quarn_call_form form = passed->form;
  GDBusConnection *const connection = passed->connection.get();
  const SharedMessage message(passed->message.release(), &g_object_unref);
  const char *const sender = g_dbus_message_get_sender(message.get());
  with_caller(connection, sender == nullptr ? "" : sender,
              [connection, message, form](const quarn_caller &caller) {
                RawCall call(connection, message.get(), caller);
                if (admit(call, nullptr)) serve_raw(call, connection, message.get(), form);
              });
  return G_SOURCE_REMOVE;
}

void delete_passed(gpointer data) { delete static_cast<Passed *>(data); }

/** Takes @p message. */
void pass_to_main_thread(GDBusConnection *connection, MessagePtr message, quarn_call_form form) {
  auto passed = std::make_unique<Passed>();
  passed->connection.reset(G_DBUS_CONNECTION(g_object_ref(connection)));
  passed->message = std::move(message);
  passed->form = form;
  passed->complete.store(true, std::memory_order_release);
  // The priority of GDBus' own calls, so that all keep the order in which they came.
  g_idle_add_full(G_PRIORITY_DEFAULT, on_passed, passed.release(), delete_passed);
}

std::string signature_of(const GDBusMethodInfo *method) {
  std::string signature;
  for (GDBusArgInfo **arg = method->in_args; arg != nullptr && *arg != nullptr; ++arg) {
    signature += (*arg)->signature;
  }
  return signature;
}

quarn_call_form form_of(const GDBusMethodInfo *method, const std::string &given) {
  if (method == nullptr) return quarn_call_form::unknown_method;
  if (given == signature_of(method)) return quarn_call_form::right;
  return given.empty() ? quarn_call_form::without_arguments : quarn_call_form::other_arguments;
}

/** Whether a call of another object or interface has a handler that asks who calls. */
bool has_own_handler(GDBusMessage *message) {
  struct entry {
    const char *path, *interface_name, *member, *signature;
  };
  static constexpr entry kHandled[] = {
      {"/org/orvane/Quarn/Packages", "org.orvane.Quarn.Packages", "CancelOwn", ""},
      {"/org/orvane/Quarn/Status", "org.freedesktop.DBus.Properties", "Get", "ss"},
      {"/org/orvane/Quarn/Status", "org.freedesktop.DBus.Properties", "GetAll", "s"}};
  return std::any_of(std::begin(kHandled), std::end(kHandled), [message](const entry &handled) {
    return g_strcmp0(g_dbus_message_get_path(message), handled.path) == 0 &&
           g_strcmp0(g_dbus_message_get_interface(message), handled.interface_name) == 0 &&
           g_strcmp0(g_dbus_message_get_member(message), handled.member) == 0 &&
           g_strcmp0(g_dbus_message_get_signature(message), handled.signature) == 0;
  });
}

bool is_own_message(GDBusConnection *connection, GDBusMessage *message) {
  return g_strcmp0(g_dbus_message_get_sender(message),
                   g_dbus_connection_get_unique_name(connection)) == 0;
}

/** Bytes of what the allocator gives back to the system as soon as it is free. */
constexpr int kGivenBackAtOnce = 131072;

/**
 * The same message without the arguments that nobody is to hold while it waits, and without
 * descriptors: no method of ours takes any, and who sends enough of them would leave the process
 * without.
 * @return null when there are too few descriptors to copy it
 */
MessagePtr lightened(GDBusMessage *message, bool too_large) {
  MessagePtr copy(g_dbus_message_copy(message, nullptr));
  if (!copy) return nullptr;
  g_dbus_message_set_unix_fd_list(copy.get(), nullptr);
  if (!too_large) return copy;
  // Else the allocator takes the size of what it is given back for the measure of what to keep.
  if (g_variant_get_size(g_dbus_message_get_body(message)) > kMostListArgumentBytes) {
    mallopt(M_MMAP_THRESHOLD, kGivenBackAtOnce);
  }
  g_dbus_message_set_body(copy.get(), nullptr);
  return copy;
}

bool has_descriptors(GDBusMessage *message) {
  return g_dbus_message_get_unix_fd_list(message) != nullptr;
}

/** The answer of a client to its callback. */
bool is_answer_of_client(GDBusMessage *message) {
  const GDBusMessageType type = g_dbus_message_get_message_type(message);
  if (type != G_DBUS_MESSAGE_TYPE_METHOD_RETURN && type != G_DBUS_MESSAGE_TYPE_ERROR) return false;
  const char *const sender = g_dbus_message_get_sender(message);
  const quarn_caller caller = known_caller(sender == nullptr ? "" : sender);
  // Root's services are asked for more than an integer.
  return caller.known && caller.uid != 0;
}

/** What is no call, without what nobody wants of a client. Takes @p message. */
GDBusMessage *without_burden(MessagePtr message) {
  GVariant *const body = g_dbus_message_get_body(message.get());
  const bool too_large = body != nullptr && g_variant_get_size(body) > kMostListArgumentBytes;
  const bool burdened = too_large || has_descriptors(message.get());
  if (!burdened || !is_answer_of_client(message.get())) return message.release();
  MessagePtr light = lightened(message.get(), too_large);
  return light ? light.release() : message.release();
}

quarn_call_form form_of_call(const GDBusNodeInfo *node, GDBusMessage *message) {
  GVariant *const body = g_dbus_message_get_body(message);
  if (body != nullptr &&
      g_variant_get_size(body) > most_argument_bytes(g_dbus_message_get_member(message))) {
    return quarn_call_form::too_large;
  }
  if (g_strcmp0(g_dbus_message_get_path(message), kQuarnObjectPath) != 0 ||
      g_strcmp0(g_dbus_message_get_interface(message), kQuarnInterface) != 0) {
    return quarn_call_form::of_other_object;
  }
  return form_of(
      g_dbus_interface_info_lookup_method(node->interfaces[0], g_dbus_message_get_member(message)),
      g_dbus_message_get_signature(message));
}

/**
 * GDBus answers much by itself: methods that are not in the introspection data,
 * calls with other arguments than those, objects that do not exist, what every
 * object has. Yet any call keeps the daemon alive, the answers are ours, and
 * nobody is told anything before it is known who asks. Runs on the bus thread.
 */
GDBusMessage *filter_calls(GDBusConnection *connection, GDBusMessage *message, gboolean incoming,
                           gpointer user_data) {
  if (incoming == FALSE) {
    note_quarn_answer(message);
    return message;
  }
  if (is_own_message(connection, message)) return message;
  MessagePtr owned(message);
  if (g_dbus_message_get_message_type(message) != G_DBUS_MESSAGE_TYPE_METHOD_CALL) {
    return without_burden(std::move(owned));
  }
  const quarn_call_form form = form_of_call(static_cast<const GDBusNodeInfo *>(user_data), message);
  const bool too_large = form == quarn_call_form::too_large;
  MessagePtr kept =
      too_large || has_descriptors(message) ? lightened(message, too_large) : std::move(owned);
  if (!kept || !take_quarn_call(kept.get(), form)) {
    refuse_untaken_call(connection, message);
    return nullptr;
  }
  note_quarn_call(kept.get(), form);
  const bool of_library = form == quarn_call_form::right ||
                          (form == quarn_call_form::of_other_object && has_own_handler(kept.get()));
  if (of_library) return kept.release();
  pass_to_main_thread(connection, std::move(kept), form);
  return nullptr;
}

void unref_node(gpointer node) { g_dbus_node_info_unref(static_cast<GDBusNodeInfo *>(node)); }

/* ---- the bus name -------------------------------------------------------------- */

void on_bus_closed(GDBusConnection *, gboolean, GError *error, gpointer) {
  LOGE("the bus is gone : %s", error == nullptr ? "" : error->message);
  // Nobody can ask for anything any more; what was asked for is finished.
  end_quarn_when_idle();
}

void _dbus_on_bus_acquired(GDBusConnection *connection, const gchar *, gpointer user_data) {
  SLOGI(">>>>>>>> called");
  g_set_object(&quarn_dbus_connection, connection);
  g_dbus_connection_set_exit_on_close(connection, FALSE);
  closed_handler = g_signal_connect(connection, "closed", G_CALLBACK(on_bus_closed), nullptr);
  auto *node = static_cast<GDBusNodeInfo *>(user_data);
  GErrorPtr error;
  registration_id =
      g_dbus_connection_register_object(connection, kQuarnObjectPath, node->interfaces[0],
                                        &kMethodTable, nullptr, nullptr, out(error));
  if (registration_id == 0) {
    LOGE("g_dbus_connection_register_object() Fail(%s)", error ? error->message : "");
  } else {
    filter_id = g_dbus_connection_add_filter(connection, filter_calls, g_dbus_node_info_ref(node),
                                             unref_node);
  }
  LOGI("g_dbus_connection_register_object() succeed");
  if (bus_acquired_hook != nullptr) bus_acquired_hook(connection);
}

void _dbus_on_name_acquired(GDBusConnection *, const gchar *name, gpointer) {
  LOGI("Acquired the name %s", name);
  name_settled = true;
  note_quarn_name(true);
  release_quarn_terminate();
}

void _dbus_on_name_lost(GDBusConnection *, const gchar *name, gpointer) {
  LOGI("Lost the name %s", name);
  name_settled = true;
  note_quarn_name(false);
  release_quarn_terminate();
}

gboolean set_flag(gpointer flag) {
  *static_cast<bool *>(flag) = true;
  return G_SOURCE_REMOVE;
}

/** GLib asks the bus and waits for its answer. */
void give_up_name() {
  if (name_owner_id != 0) g_bus_unown_name(std::exchange(name_owner_id, 0));
}

void take_name_back() {
  hold_quarn_terminate();
  const auto flags = static_cast<GBusNameOwnerFlags>(G_BUS_NAME_OWNER_FLAGS_REPLACE |
                                                     G_BUS_NAME_OWNER_FLAGS_DO_NOT_QUEUE);
  name_settled = false;
  name_owner_id =
      g_bus_own_name_on_connection(quarn_dbus_connection, kQuarnBusName, flags,
                                   _dbus_on_name_acquired, _dbus_on_name_lost, nullptr, nullptr);
}

}  // namespace

void set_bus_acquired_hook(void (*hook)(GDBusConnection *connection)) { bus_acquired_hook = hook; }

unsigned int quarnd_dbus_init() {
  quarn_dbus_note_main_thread();
  GErrorPtr error;
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(quarn_introspection_xml, out(error));
  if (node == nullptr) {
    LOGE("g_dbus_node_info_new_for_xml() Fail(%s)", error ? error->message : "");
    return kNoOwner;
  }
  set_quarn_bus_name({give_up_name, take_name_back});
  hold_quarn_terminate();
  name_owner_id = g_bus_own_name(G_BUS_TYPE_SYSTEM, kQuarnBusName, G_BUS_NAME_OWNER_FLAGS_REPLACE,
                                 _dbus_on_bus_acquired, _dbus_on_name_acquired, _dbus_on_name_lost,
                                 node, unref_node);
  if (name_owner_id == 0) {
    g_dbus_node_info_unref(node);
    release_quarn_terminate();
    LOGE("g_bus_own_name() Fail");
  }
  name_settled = name_owner_id == 0;
  return name_owner_id;
}

bool quarnd_calls_deferred() { return !waits_for_turn.empty(); }

bool quarnd_calls_unjudged() { return callers_are_asked_for() || forwarded_calls != 0; }

void quarnd_dispatch_deferred() {
  for (GMainLoop *loop : waits_for_turn) g_main_loop_quit(loop);
}

void quarnd_dbus_leave() {
  leave_quarn_for_good();
  // The bus keeps the calls for a process that it has started until that process has the name.
  while (!name_settled) g_main_context_iteration(nullptr, TRUE);
  give_up_name();
  quarnd_dispatch_deferred();
  // What arrived before the bus had answered has a higher priority than this mark.
  bool drained = false;
  g_idle_add_full(G_PRIORITY_LOW, set_flag, &drained, nullptr);
  // What waits to learn who called is served as well.
  while (!drained || quarnd_calls_unjudged()) g_main_context_iteration(nullptr, TRUE);
}

void quarnd_dbus_answer_all() {
  if (quarn_dbus_connection == nullptr) return;
  // Not by the owner's id, which is the main thread's. What comes before the bus' answer is noted.
  const GVariantPtr released(g_dbus_connection_call_sync(
      quarn_dbus_connection, "org.freedesktop.DBus", "/org/freedesktop/DBus",
      "org.freedesktop.DBus", "ReleaseName", g_variant_new("(s)", kQuarnBusName), nullptr,
      G_DBUS_CALL_FLAGS_NONE, kLastRelease, nullptr, nullptr));
  answer_quarn_calls();
}

void quarnd_dbus_deinit(unsigned int owner_id) {
  if (quarn_dbus_connection != nullptr) {
    if (filter_id != 0) g_dbus_connection_remove_filter(quarn_dbus_connection, filter_id);
    if (registration_id != 0) {
      g_dbus_connection_unregister_object(quarn_dbus_connection, registration_id);
    }
    if (closed_handler != 0) g_signal_handler_disconnect(quarn_dbus_connection, closed_handler);
    filter_id = 0;
    registration_id = 0;
    closed_handler = 0;
    forget_callers();
  }
  if (owner_id != 0 && owner_id != kNoOwner) give_up_name();
  // The process may end right after this; answers that were given must have left.
  quarn_dbus_flush(kFlushLimit);
}
