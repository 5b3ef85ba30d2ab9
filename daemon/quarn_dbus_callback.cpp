#include "quarn_dbus_callback.h"

#include "quarn_common.h"
#include "quarn_log.h"

GText as_bus_text(const char *text) {
  return GText(g_utf8_make_valid(text == nullptr ? "" : text, -1));
}

bool can_be_called(const client_cb_data &client) {
  return quarn_dbus_connection != nullptr && g_dbus_is_name(client.sender.c_str()) != FALSE;
}

MessagePtr make_callback(const client_cb_data &client, const char *method, GVariant *arguments) {
  MessagePtr message(g_dbus_message_new_method_call(client.sender.c_str(), kQuarnObjectPath,
                                                    kQuarnInterface, method));
  g_dbus_message_set_body(message.get(), arguments);
  return message;
}

void send_only(GDBusMessage *message) {
  GErrorPtr error;
  if (g_dbus_connection_send_message(quarn_dbus_connection, message, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                     nullptr, out(error)) == FALSE) {
    LOGE("g_dbus_connection_send_message() Fail(%s)", error->message);
  }
}
