/**
 * @file quarn_dbus_server.h
 * @brief The bus name, the introspection data and the one method dispatcher.
 *
 * Main thread only.
 */
#ifndef QUARN_DBUS_SERVER_H
#define QUARN_DBUS_SERVER_H

/** Own the bus name and serve the object. @return owner id, or (unsigned) -1 */
unsigned int quarnd_dbus_init();

/** Give the bus name up. */
void quarnd_dbus_deinit(unsigned int owner_id);

#endif
