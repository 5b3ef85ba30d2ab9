/**
 * @file quarn_dbus_dispatch.h
 * @brief The way of a call from its caller's name to its method: who may, whose turn it is, and
 * that what it came for is done once. Main thread only.
 */
#ifndef QUARN_DBUS_DISPATCH_H
#define QUARN_DBUS_DISPATCH_H

#include <gio/gio.h>

#include <string>

#include "quarn_dbus_method_call.h"

/** Takes the calls that GDBus hands over, each to a fiber of its own. */
extern const GDBusInterfaceVTable kQuarnMethodTable;

/**
 * Whether the caller may have what it asks for; else it is refused here, and nothing but the
 * pending end is touched.
 */
[[nodiscard]] bool admit(MethodCall &call, GVariant *parameters);

/** The one dispatcher; @p given is null when the call has no arguments. */
void dispatch(MethodCall &call, GVariant *given);

/** Log that a call brings more than it may. */
void tell_excess(const MethodCall &call, const std::string &excess);

/** True while calls wait for an earlier process to end. */
[[nodiscard]] bool calls_wait_for_turn();
/** The earlier process has ended, or nobody waits for that any more: they go on. */
void end_waits_for_turn();

#endif
