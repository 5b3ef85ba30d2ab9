#include "quarn_dbus_calls.h"

#include <iterator>
#include <map>
#include <memory>
#include <mutex>
#include <utility>

#include "quarn_common.h"
#include "quarn_d_gate.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/handles.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_limits.h"
#include "quarn_log.h"

namespace {

/** The reply to a call whose arguments are missing. */
constexpr int kArgumentsMissing = -1;

using MessagePtr = Handle<GDBusMessage, &g_object_unref>;

struct delivered_call {
  MessagePtr message;
  quarn_call_form form;
  bool begun = false;
};

/** Who called, and the number of the call among that connection's. */
using call_key = std::pair<std::string, guint32>;

// Never destroyed: the bus thread lives as long as the process.
std::mutex &calls_mutex = *new std::mutex;
std::map<call_key, delivered_call> &calls = *new std::map<call_key, delivered_call>;
bool answered_all = false;

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

std::mutex &standing_mutex = *new std::mutex;
std::map<std::string, standing_calls> &standing = *new std::map<std::string, standing_calls>;
/** Of all but root. */
std::size_t standing_bytes = 0;

std::size_t bytes_of(GDBusMessage *message, quarn_call_form form) {
  GVariant *const body = g_dbus_message_get_body(message);
  const std::size_t size = body == nullptr ? 0 : g_variant_get_size(body);
  return kBytesOfCall + (form == quarn_call_form::right ? size : size * kBytesOfPiece);
}

void forget_standing(gpointer data) {
  const std::unique_ptr<standing_call> call(static_cast<standing_call *>(data));
  const std::lock_guard<std::mutex> lock(standing_mutex);
  const auto found = standing.find(call->sender);
  found->second.bytes -= call->bytes;
  if (!call->of_root) standing_bytes -= call->bytes;
  if (--found->second.count == 0) standing.erase(found);
}

/** Under standing_mutex. */
bool has_room(const standing_call &call) {
  if (call.of_root) return true;
  const auto found = standing.find(call.sender);
  const standing_calls own = found == standing.end() ? standing_calls{} : found->second;
  if (own.count < kCallsAlwaysTaken && call.bytes <= kSmallCall) return true;
  return own.bytes + call.bytes <= kMostBytesOfConnection &&
         standing_bytes + call.bytes <= kMostBytesOfConnections;
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
void accept(GDBusMessage *message, quarn_request kind) {
  GVariant *const arguments = g_dbus_message_get_body(message);
  const gsize count = g_variant_n_children(arguments);
  auto *record = new client_cb_data{0, text_or_empty(g_dbus_message_get_sender(message))};
  // The number is the last argument, and a package comes before it.
  g_variant_get_child(arguments, count - 1, "u", &record->req_id);
  const char *package = "";
  if (kind == quarn_request::app_backup || kind == quarn_request::app_restore) {
    g_variant_get_child(arguments, 0, "&s", &package);
  }
  quarn_dbus_accept_request(kind, package, record);
}

void accept_unlooked(GDBusMessage *message) {
  static constexpr std::pair<const char *, quarn_request> kRequests[] = {
      {"get_app_list", quarn_request::app_list},
      {"manual_backup_start", quarn_request::manual_backup},
      {"manual_backup_cancel", quarn_request::cancel},
      {"app_data_backup_start", quarn_request::app_backup},
      {"app_data_restore_start", quarn_request::app_restore}};
  for (const auto &[method, kind] : kRequests) {
    if (is(message, method)) accept(message, kind);
  }
}

/** The reply to a call of the right form whose work does not end, or does not begin. */
void answer_cancelled(GDBusMessage *message) {
  gint32 first = 0;
  if (is(message, "last_bu_time")) {
    unsigned long long timestamp = 0;
    quarnd_get_last_backed_up_time(&timestamp);
    reply(message, g_variant_new("(t)", static_cast<guint64>(timestamp)));
  } else if (is(message, "auto_backup_start")) {
    reply(message, nullptr);
  } else if (is(message, "restore_enable")) {
    g_variant_get_child(g_dbus_message_get_body(message), 0, "i", &first);
    // Without this process there is no restore mode.
    reply_int(message, first != 0 ? QUARN_REFUSED : QUARN_OK);
  } else if (is(message, "manual_backup_start") || is(message, "manual_backup_cancel") ||
             is(message, "app_data_backup_start") || is(message, "app_data_restore_start")) {
    reply_int(message, QUARN_OK);  // the callback tells
  } else {
    reply_int(message, QUARN_CANCELLED);
  }
}

void answer(GDBusMessage *message, quarn_call_form form) {
  switch (form) {
    case quarn_call_form::right:
      return answer_cancelled(message);
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
    const std::lock_guard<std::mutex> lock(standing_mutex);
    if (!has_room(*call)) return false;
    standing_calls &own = standing[sender];
    ++own.count;
    own.bytes += call->bytes;
    if (!call->of_root) standing_bytes += call->bytes;
  }
  static const GQuark kStanding = g_quark_from_static_string("quarn-standing-call");
  g_object_set_qdata_full(G_OBJECT(message), kStanding, call.release(), forget_standing);
  return true;
}

void refuse_untaken_call(GDBusConnection *connection, GDBusMessage *message) {
  const std::string sender = text_or_empty(g_dbus_message_get_sender(message));
  bool first = true;
  {
    const std::lock_guard<std::mutex> lock(standing_mutex);
    const auto found = standing.find(sender);
    if (found != standing.end()) first = !std::exchange(found->second.refused, true);
  }
  if (first && tells_of_refusal(known_caller(sender))) {
    LOGE("refused : too many calls of (%s) wait", sender.c_str());
  }
  if ((g_dbus_message_get_flags(message) & G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED) != 0) return;
  const MessagePtr answer(g_dbus_message_new_method_error_literal(
      message, "org.freedesktop.DBus.Error.LimitsExceeded", "Too many calls are waiting"));
  g_dbus_connection_send_message(connection, answer.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr,
                                 nullptr);
}

void note_quarn_call(GDBusMessage *message, quarn_call_form form) {
  if ((g_dbus_message_get_flags(message) & G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED) != 0) return;
  const call_key key(text_or_empty(g_dbus_message_get_sender(message)),
                     g_dbus_message_get_serial(message));
  MessagePtr held(G_DBUS_MESSAGE(g_object_ref(message)));
  const std::lock_guard<std::mutex> lock(calls_mutex);
  calls.insert_or_assign(key, delivered_call{std::move(held), form});
}

void note_quarn_answer(GDBusMessage *message) {
  const GDBusMessageType type = g_dbus_message_get_message_type(message);
  if (type != G_DBUS_MESSAGE_TYPE_METHOD_RETURN && type != G_DBUS_MESSAGE_TYPE_ERROR) return;
  const call_key key(text_or_empty(g_dbus_message_get_destination(message)),
                     g_dbus_message_get_reply_serial(message));
  const std::lock_guard<std::mutex> lock(calls_mutex);
  calls.erase(key);
}

bool begin_quarn_call(const std::string &sender, guint32 serial) {
  const std::lock_guard<std::mutex> lock(calls_mutex);
  if (answered_all) return false;
  const auto found = calls.find({sender, serial});
  if (found != calls.end()) found->second.begun = true;
  return true;
}

void answer_quarn_calls() {
  std::map<call_key, delivered_call> left;
  {
    const std::lock_guard<std::mutex> lock(calls_mutex);
    answered_all = true;
    left.swap(calls);
  }
  for (auto call = left.begin(); call != left.end();) {
    // What is begun has passed.
    const bool refused =
        !call->second.begun && refuse_unlooked(call->second.message.get(), call->second.form);
    call = refused ? left.erase(call) : std::next(call);
  }
  for (const auto &[key, call] : left) {
    if (!call.begun && call.form == quarn_call_form::right) accept_unlooked(call.message.get());
  }
  quarn_dbus_end_requests();
  for (const auto &[key, call] : left) answer(call.message.get(), call.form);
}

std::string unknown_method_text(const std::string &method, const std::string &interface_name) {
  return "Method " + method + " is not implemented on interface " + interface_name;
}
