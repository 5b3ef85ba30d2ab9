/**
 * @file quarn_dbus_filter.h
 * @brief What becomes of each message before GDBus looks at it.
 */
#ifndef QUARN_DBUS_FILTER_H
#define QUARN_DBUS_FILTER_H

#include <gio/gio.h>

/**
 * GDBus answers much by itself: methods that are not in the introspection data,
 * calls with other arguments than those, objects that do not exist, what every
 * object has. Yet any call keeps the daemon alive, the answers are ours, and
 * nobody is told anything before it is known who asks. Runs on the bus thread.
 * @return the message, or a lighter one in its place, for GDBus; null when it is served elsewhere
 */
[[nodiscard]] GDBusMessage *filter_calls(GDBusConnection *connection, GDBusMessage *message,
                                         gboolean incoming, gpointer user_data);

#endif
