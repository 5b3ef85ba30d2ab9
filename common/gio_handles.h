/**
 * @file gio_handles.h
 * @brief Owners for what GIO has of the bus, used as those of quarn_handles.h.
 */
#ifndef GIO_HANDLES_H
#define GIO_HANDLES_H

#include <gio/gio.h>

#include "quarn_handles.h"

using MessagePtr = Handle<GDBusMessage, &g_object_unref>;
using NodeInfoPtr = Handle<GDBusNodeInfo, &g_dbus_node_info_unref>;
/** A call that nobody has answered yet: answering it takes it. */
using InvocationPtr = Handle<GDBusMethodInvocation, &g_object_unref>;

#endif
