/**
 * @file quarn_dbus_callback.h
 * @brief The message of a callback: a call of a method that clients export. Any thread.
 */
#ifndef QUARN_DBUS_CALLBACK_H
#define QUARN_DBUS_CALLBACK_H

#include <gio/gio.h>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_dbus_client.h"

/** The message that ends the stream of one restore-enable request. */
inline constexpr char kRestoreStop[] = "restore_stop";

/** A text that a D-Bus message can carry; null is the empty one. */
[[nodiscard]] GText as_bus_text(const char *text);

/** Whether there is a connection, and the record names a client. */
[[nodiscard]] bool can_be_called(const client_cb_data &client);

/** A call of @p method; consumes floating @p arguments. */
[[nodiscard]] MessagePtr make_callback(const client_cb_data &client, const char *method,
                                       GVariant *arguments);

/** Send a callback whose answer nobody waits for. A failure is logged. */
void send_only(GDBusMessage *message);

#endif
