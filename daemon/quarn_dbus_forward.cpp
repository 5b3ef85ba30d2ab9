#include "quarn_dbus_forward.h"

#include <memory>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_dbus_method_call.h"

namespace {

/** Milliseconds that the bus itself may take to answer. */
constexpr int kBusTimeout = 5000;

/** Calls that the bus library answers and that have no answer yet. */
unsigned int forwarded_calls = 0;

struct Forwarded {
  MessagePtr call;
  PendingWork pending = {};
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
    GText name(g_dbus_error_get_remote_error(error.get()));
    if (!name) name.reset(g_dbus_error_encode_gerror(error.get()));
    g_dbus_error_strip_remote_error(error.get());
    answer.reset(
        g_dbus_message_new_method_error_literal(forwarded->call.get(), name.get(), error->message));
  }
  g_dbus_connection_send_message(G_DBUS_CONNECTION(bus), answer.get(),
                                 G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr, nullptr);
}

}  // namespace

void forward_to_library(GDBusConnection *connection, GDBusMessage *call) {
  const MessagePtr message(g_dbus_message_new_method_call(
      g_dbus_connection_get_unique_name(connection), g_dbus_message_get_path(call),
      g_dbus_message_get_interface(call), g_dbus_message_get_member(call)));
  g_dbus_message_set_body(message.get(), g_dbus_message_get_body(call));
  ++forwarded_calls;
  auto forwarded = std::make_unique<Forwarded>();
  forwarded->call.reset(G_DBUS_MESSAGE(g_object_ref(call)));
  g_dbus_connection_send_message_with_reply(connection, message.get(),
                                            G_DBUS_SEND_MESSAGE_FLAGS_NONE, kBusTimeout, nullptr,
                                            nullptr, on_library_answer, forwarded.release());
}

bool library_owes_answers() { return forwarded_calls != 0; }
