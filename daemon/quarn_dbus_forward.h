/**
 * @file quarn_dbus_forward.h
 * @brief Calls of other objects and interfaces, which the bus library answers once it is known who
 * asks. Main thread only.
 */
#ifndef QUARN_DBUS_FORWARD_H
#define QUARN_DBUS_FORWARD_H

#include <gio/gio.h>

/**
 * Let the bus library answer a call that is none of ours: it does so only for what
 * comes from the bus, so that it is sent to this connection itself.
 */
void forward_to_library(GDBusConnection *connection, GDBusMessage *call);

/** True while such calls have no answer yet. */
[[nodiscard]] bool library_owes_answers();

#endif
