/**
 * @file device_bus.h
 * @brief The device's bus: starting it, and asking it.
 */
#ifndef QUARN_DEVICE_BUS_H
#define QUARN_DEVICE_BUS_H

#include <gio/gio.h>
#include <sys/types.h>

#include <memory>
#include <string>

struct Unref {
  void operator()(gpointer object) const { g_object_unref(object); }
};
using Connection = std::unique_ptr<GDBusConnection, Unref>;

/** Start the bus daemon; returns once it listens. */
pid_t start_bus(const std::string &device);
/** A connection of its own; fails when the bus does not answer. */
Connection connect_bus(const std::string &device);
/** One call of the bus's own, waited for. @return owned by the caller, null on an error */
GVariant *call_bus(GDBusConnection *connection, const char *method, GVariant *arguments,
                   GError **error);

#endif
