#include "quarn_dbus_calls.h"

#include <iterator>
#include <map>
#include <memory>
#include <utility>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_d_gate.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_limits.h"
#include "quarn_dbus_method_call.h"
#include "quarn_dbus_methods.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

struct delivered_call {
  MessagePtr message;
  quarn_call_form form;
  bool begun = false;
  RecordPtr record = nullptr; /**< where it was accepted without being looked at */
};

/** Who called, and the number of the call among that connection's. */
using call_key = std::pair<std::string, guint32>;

struct call_table {
  Mutex mutex;
  std::map<call_key, delivered_call> calls QUARN_GUARDED_BY(mutex);
  bool answered_all QUARN_GUARDED_BY(mutex) = false;
};
// Never destroyed: the bus thread lives as long as the process.
call_table &delivered = *new call_table;

/** What a message takes beside its arguments. */
constexpr std::size_t kBytesOfCall = 2048;
/** Arguments of any type are kept in pieces, which take more than what came. */
constexpr std::size_t kBytesOfPiece = 16;
/** A call of so many bytes is small. */
constexpr std::size_t kSmallCall = 16384;

/** The calls of a connection that stand. */
struct standing_calls {
  std::size_t count = 0;
  std::size_t bytes = 0;
  bool refused = false;
};
struct standing_call {
  std::string sender;
  std::size_t bytes;
  bool of_root;
};

struct standing_table {
  Mutex mutex;
  std::map<std::string, standing_calls> senders QUARN_GUARDED_BY(mutex);
  /** Of all but root. */
  std::size_t bytes QUARN_GUARDED_BY(mutex) = 0;
};
standing_table &standing = *new standing_table;

std::size_t bytes_of(GDBusMessage *message, quarn_call_form form) {
  GVariant *const body = g_dbus_message_get_body(message);
  const std::size_t size = body == nullptr ? 0 : g_variant_get_size(body);
  return kBytesOfCall + (form == quarn_call_form::right ? size : size * kBytesOfPiece);
}

void forget_standing(gpointer data) {
  const std::unique_ptr<standing_call> call(static_cast<standing_call *>(data));
  const MutexLock lock(standing.mutex);
  const auto found = standing.senders.find(call->sender);
  found->second.bytes -= call->bytes;
  if (!call->of_root) standing.bytes -= call->bytes;
  if (--found->second.count == 0) standing.senders.erase(found);
}

bool has_room(const standing_call &call) QUARN_REQUIRES(standing.mutex) {
  if (call.of_root) return true;
  const auto found = standing.senders.find(call.sender);
  const standing_calls own = found == standing.senders.end() ? standing_calls{} : found->second;
  if (own.count < kCallsAlwaysTaken && call.bytes <= kSmallCall) return true;
  return own.bytes + call.bytes <= kMostBytesOfConnection &&
         standing.bytes + call.bytes <= kMostBytesOfConnections;
}

std::string text_or_empty(const char *text) { return text == nullptr ? "" : text; }

void send(GDBusMessage *answer) {
  GErrorPtr error;
  if (g_dbus_connection_send_message(quarn_dbus_connection, answer, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                     nullptr, out(error)) == FALSE) {
    LOGE("g_dbus_connection_send_message() Fail(%s)", error->message);
  }
}

void reply(GDBusMessage *message, GVariant *value) {
  const MessagePtr answer(g_dbus_message_new_method_reply(message));
  g_dbus_message_set_body(answer.get(), value);
  send(answer.get());
}

void reply_int(GDBusMessage *message, int value) { reply(message, g_variant_new("(i)", value)); }

void refuse(GDBusMessage *message, const char *name, const std::string &text) {
  const MessagePtr answer(g_dbus_message_new_method_error_literal(message, name, text.c_str()));
  send(answer.get());
}

bool is(GDBusMessage *message, const char *method) {
  return g_strcmp0(g_dbus_message_get_member(message), method) == 0;
}

/** Accept a request that nobody has looked at, so that it has its last callback. */
void accept_unlooked(delivered_call *call) {
  GDBusMessage *const message = call->message.get();
  const std::string member = text_or_empty(g_dbus_message_get_member(message));
  const served_method *const method = find_served_method(member);
  const auto arguments = read_quarn_arguments(member, g_dbus_message_get_body(message));
  if (method == nullptr || !arguments) return;
  const auto *const request = std::get_if<method_of_request>(&method->handler);
  if (request == nullptr) return;
  call->record.reset(
      new client_cb_data{arguments->req_id, text_or_empty(g_dbus_message_get_sender(message))});
  quarn_dbus_accept_request(request->kind, text_or_empty(arguments->pkg_id), call->record.get());
}

/** The reply to a call of the right form whose work does not end, or does not begin. */
void answer_unlooked(GDBusMessage *message) {
  const std::string member = text_or_empty(g_dbus_message_get_member(message));
  const served_method *const method = find_served_method(member);
  const auto arguments = read_quarn_arguments(member, g_dbus_message_get_body(message));
  if (method == nullptr) return;
  reply(message, method->reply_unlooked(arguments.value_or(quarn_arguments{})));
}

void answer(GDBusMessage *message, quarn_call_form form) {
  switch (form) {
    case quarn_call_form::right:
      return answer_unlooked(message);
    case quarn_call_form::without_arguments:
      return reply_int(message, kArgumentsMissing);
    case quarn_call_form::other_arguments:
      return refuse(message, "org.freedesktop.DBus.Error.InvalidArgs",
                    "Other arguments are wanted");
    case quarn_call_form::unknown_method:
      return refuse(message, "org.freedesktop.DBus.Error.UnknownMethod",
                    unknown_method_text(text_or_empty(g_dbus_message_get_member(message)),
                                        text_or_empty(g_dbus_message_get_interface(message))));
    case quarn_call_form::too_large:
      return refuse(message, "org.freedesktop.DBus.Error.InvalidArgs", kArgumentsTooLarge);
    case quarn_call_form::of_other_object:
      // What its caller has asked for ends all the same.
      if (is(message, "CancelOwn")) return reply(message, g_variant_new("(u)", 0U));
      return refuse(message, "org.freedesktop.DBus.Error.Failed", "The daemon ends");
  }
}

/** Milliseconds that the bus may take to tell of a caller when the process is about to be left. */
constexpr int kLastQuestion = 50;

/** Refuses what its caller may not ask for, or what nobody would do. @return whether it did */
bool refuse_unlooked(GDBusMessage *message, quarn_call_form form) {
  const std::string sender = text_or_empty(g_dbus_message_get_sender(message));
  GVariant *const arguments =
      form == quarn_call_form::right ? g_dbus_message_get_body(message) : nullptr;
  const quarn_subject subject =
      subject_of_call(text_or_empty(g_dbus_message_get_interface(message)),
                      text_or_empty(g_dbus_message_get_member(message)), arguments);
  const caller_verdict verdict =
      judge_call(ask_caller_now(quarn_dbus_connection, sender, kLastQuestion), sender, subject,
                 cloud_restore_running());
  if (!verdict.allowed) {
    refuse(message, "org.freedesktop.DBus.Error.AccessDenied", refusal_text(subject, verdict));
    return true;
  }
  const std::string excess = excess_of_arguments(subject.member, arguments);
  if (excess.empty()) return false;
  refuse(message, "org.freedesktop.DBus.Error.InvalidArgs", excess);
  return true;
}

}  // namespace

bool take_quarn_call(GDBusMessage *message, quarn_call_form form) {
  const std::string sender = text_or_empty(g_dbus_message_get_sender(message));
  const quarn_caller caller = known_caller(sender);
  auto call = std::make_unique<standing_call>(
      standing_call{sender, bytes_of(message, form), caller.known && caller.uid == 0});
  {
    const MutexLock lock(standing.mutex);
    if (!has_room(*call)) return false;
    standing_calls &own = standing.senders[sender];
    ++own.count;
    own.bytes += call->bytes;
    if (!call->of_root) standing.bytes += call->bytes;
  }
  static const GQuark kStanding = g_quark_from_static_string("quarn-standing-call");
  g_object_set_qdata_full(G_OBJECT(message), kStanding, call.release(), forget_standing);
  return true;
}

void refuse_untaken_call(GDBusConnection *connection, GDBusMessage *message) {
  const std::string sender = text_or_empty(g_dbus_message_get_sender(message));
  bool first = true;
  {
    const MutexLock lock(standing.mutex);
    const auto found = standing.senders.find(sender);
    if (found != standing.senders.end()) first = !std::exchange(found->second.refused, true);
  }
  if (first && tells_of_refusal(known_caller(sender))) {
    LOGE("refused : too many calls of (%s) wait", sender.c_str());
  }
  if (wants_no_reply(message)) return;
  const MessagePtr answer(g_dbus_message_new_method_error_literal(
      message, "org.freedesktop.DBus.Error.LimitsExceeded", "Too many calls are waiting"));
  g_dbus_connection_send_message(connection, answer.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr,
                                 nullptr);
}

void note_quarn_call(GDBusMessage *message, quarn_call_form form) {
  if (wants_no_reply(message)) return;
  const call_key key(text_or_empty(g_dbus_message_get_sender(message)),
                     g_dbus_message_get_serial(message));
  MessagePtr held(G_DBUS_MESSAGE(g_object_ref(message)));
  const MutexLock lock(delivered.mutex);
  delivered.calls.insert_or_assign(key, delivered_call{std::move(held), form});
}

void note_quarn_answer(GDBusMessage *message) {
  const GDBusMessageType type = g_dbus_message_get_message_type(message);
  if (type != G_DBUS_MESSAGE_TYPE_METHOD_RETURN && type != G_DBUS_MESSAGE_TYPE_ERROR) return;
  const call_key key(text_or_empty(g_dbus_message_get_destination(message)),
                     g_dbus_message_get_reply_serial(message));
  const MutexLock lock(delivered.mutex);
  delivered.calls.erase(key);
}

bool begin_quarn_call(const std::string &sender, guint32 serial) {
  const MutexLock lock(delivered.mutex);
  if (delivered.answered_all) return false;
  const auto found = delivered.calls.find({sender, serial});
  if (found != delivered.calls.end()) found->second.begun = true;
  return true;
}

void answer_quarn_calls() {
  std::map<call_key, delivered_call> left;
  {
    const MutexLock lock(delivered.mutex);
    delivered.answered_all = true;
    left.swap(delivered.calls);
  }
  for (auto call = left.begin(); call != left.end();) {
    // What is begun has passed.
    const bool refused =
        !call->second.begun && refuse_unlooked(call->second.message.get(), call->second.form);
    call = refused ? left.erase(call) : std::next(call);
  }
  for (auto &[key, call] : left) {
    if (!call.begun && call.form == quarn_call_form::right) accept_unlooked(&call);
  }
  quarn_dbus_end_requests();
  for (const auto &[key, call] : left) answer(call.message.get(), call.form);
}

std::string unknown_method_text(const std::string &method, const std::string &interface_name) {
  return "Method " + method + " is not implemented on interface " + interface_name;
}
