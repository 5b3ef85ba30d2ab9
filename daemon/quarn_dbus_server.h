/**
 * @file quarn_dbus_server.h
 * @brief The bus name, and the object that is served under it.
 *
 * Main thread only, where not told otherwise.
 */
#ifndef QUARN_DBUS_SERVER_H
#define QUARN_DBUS_SERVER_H

#include <gio/gio.h>

/** Who is told of the connection once the object is served; set before quarnd_dbus_init(). */
void set_bus_acquired_hook(void (*hook)(GDBusConnection *connection));

/** Own the bus name and serve the object. @return owner id, or (unsigned) -1 */
[[nodiscard]] unsigned int quarnd_dbus_init();

/** True while calls wait for an earlier process to end. */
[[nodiscard]] bool quarnd_calls_deferred();
/** True while calls wait for what the bus has to tell of them. */
[[nodiscard]] bool quarnd_calls_unjudged();
/** The earlier process has ended: dispatch the calls that wait for it. */
void quarnd_dispatch_deferred();

/**
 * Give the bus name up and dispatch what has arrived until then. For an end
 * that is not begun by begin_quarn_end(), after quarn_dbus_stop_waiting().
 */
void quarnd_dbus_leave();

/**
 * The process leaves while the main thread is in the middle of something: give
 * the bus name up, and answer every call that was delivered and has no answer.
 * Any thread, after quarn_dbus_stop_waiting().
 */
void quarnd_dbus_answer_all();

/** Serve nothing any more and give the bus name up; returns when every answer has left. */
void quarnd_dbus_deinit(unsigned int owner_id);

#endif
