#include "quarn_dbus_method_call.h"

#include <utility>

#include "glib_handles.h"
#include "quarn_log.h"

MethodCall::MethodCall(const char *sender, const char *interface_name, const char *method_name,
                       guint32 serial, quarn_caller caller)
    : sender_(sender == nullptr ? "" : sender),
      interface_(interface_name == nullptr ? "" : interface_name),
      method_(method_name == nullptr ? "" : method_name),
      serial_(serial),
      caller_(std::move(caller)) {}

InvokedCall::InvokedCall(InvocationPtr invocation, const quarn_caller &caller)
    : MethodCall(g_dbus_method_invocation_get_sender(invocation.get()),
                 g_dbus_method_invocation_get_interface_name(invocation.get()),
                 g_dbus_method_invocation_get_method_name(invocation.get()),
                 g_dbus_message_get_serial(g_dbus_method_invocation_get_message(invocation.get())),
                 caller),
      invocation_(std::move(invocation)) {}

GVariant *InvokedCall::parameters() const {
  return g_dbus_method_invocation_get_parameters(invocation_.get());
}

void InvokedCall::reply(GVariant *value) {
  g_dbus_method_invocation_return_value(invocation_.release(), value);
}

void InvokedCall::refuse(int dbus_error, const std::string &text) {
  g_dbus_method_invocation_return_error(invocation_.release(), G_DBUS_ERROR, dbus_error, "%s",
                                        text.c_str());
}

RawCall::RawCall(GDBusConnection *connection, GDBusMessage *message, const quarn_caller &caller)
    : MethodCall(g_dbus_message_get_sender(message), g_dbus_message_get_interface(message),
                 g_dbus_message_get_member(message), g_dbus_message_get_serial(message), caller),
      connection_(connection),
      message_(message) {}

void RawCall::reply(GVariant *value) {
  const MessagePtr answer(g_dbus_message_new_method_reply(message_));
  if (value != nullptr) g_dbus_message_set_body(answer.get(), value);
  send(answer.get());
}

void RawCall::refuse(int dbus_error, const std::string &text) {
  const GErrorPtr error(g_error_new_literal(G_DBUS_ERROR, dbus_error, text.c_str()));
  const GText name(g_dbus_error_encode_gerror(error.get()));
  const MessagePtr answer(
      g_dbus_message_new_method_error_literal(message_, name.get(), text.c_str()));
  send(answer.get());
}

void RawCall::send(GDBusMessage *answer) {
  if (wants_no_reply(message_)) return;
  GErrorPtr error;
  if (g_dbus_connection_send_message(connection_, answer, G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr,
                                     out(error)) == FALSE) {
    LOGE("g_dbus_connection_send_message() Fail(%s)", error ? error->message : "");
  }
}

bool wants_no_reply(GDBusMessage *message) {
  return (g_dbus_message_get_flags(message) & G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED) != 0;
}
