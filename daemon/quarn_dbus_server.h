/**
 * @file quarn_dbus_server.h
 * @brief The bus name, the introspection data and the one method dispatcher.
 *
 * Main thread only.
 */
#ifndef QUARN_DBUS_SERVER_H
#define QUARN_DBUS_SERVER_H

#include <gio/gio.h>

/** The introspection document: tabs between its elements. */
extern const char quarn_introspection_xml[];

/** Who is told of the connection once the object is served; set before quarnd_dbus_init(). */
void set_bus_acquired_hook(void (*hook)(GDBusConnection *connection));

/** Own the bus name and serve the object. @return owner id, or (unsigned) -1 */
unsigned int quarnd_dbus_init();

/** Give the bus name up, once every answer that was given is on its way. */
void quarnd_dbus_deinit(unsigned int owner_id);

#endif
