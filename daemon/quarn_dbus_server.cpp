#include "quarn_dbus_server.h"

#include <gio/gio.h>

#include <utility>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_end.h"
#include "quarn_d_gate.h"
#include "quarn_d_lifecycle.h"
#include "quarn_dbus_calls.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_dispatch.h"
#include "quarn_dbus_filter.h"
#include "quarn_dbus_forward.h"
#include "quarn_dbus_introspection.h"
#include "quarn_log.h"

namespace {

constexpr unsigned int kNoOwner = static_cast<unsigned int>(-1);

/** Milliseconds for the last answers to be written. */
constexpr unsigned int kFlushLimit = 500;

/** Milliseconds that the bus may take to answer when the process is about to be left. */
constexpr int kLastRelease = 50;

guint registration_id = 0;
guint filter_id = 0;
guint name_owner_id = 0;
/** The bus has answered the latest request for the name. */
bool name_settled = true;
gulong closed_handler = 0;
void (*bus_acquired_hook)(GDBusConnection *connection) = nullptr;

void unref_node(gpointer node) { g_dbus_node_info_unref(static_cast<GDBusNodeInfo *>(node)); }

void on_bus_closed(GDBusConnection *, gboolean, GError *error, gpointer) {
  LOGE("the bus is gone : %s", error == nullptr ? "" : error->message);
  // Nobody can ask for anything any more; what was asked for is finished.
  end_quarn_when_idle();
}

void _dbus_on_bus_acquired(GDBusConnection *connection, const gchar *, gpointer user_data) {
  SLOGI(">>>>>>>> called");
  g_set_object(&quarn_dbus_connection, connection);
  g_dbus_connection_set_exit_on_close(connection, FALSE);
  closed_handler = g_signal_connect(connection, "closed", G_CALLBACK(on_bus_closed), nullptr);
  const auto *node = static_cast<const GDBusNodeInfo *>(user_data);
  GErrorPtr error;
  registration_id =
      g_dbus_connection_register_object(connection, kQuarnObjectPath, node->interfaces[0],
                                        &kQuarnMethodTable, nullptr, nullptr, out(error));
  if (registration_id == 0) {
    LOGE("g_dbus_connection_register_object() Fail(%s)", error ? error->message : "");
  } else {
    filter_id = g_dbus_connection_add_filter(connection, filter_calls, nullptr, nullptr);
  }
  LOGI("g_dbus_connection_register_object() succeed");
  if (bus_acquired_hook != nullptr) bus_acquired_hook(connection);
}

void _dbus_on_name_acquired(GDBusConnection *, const gchar *name, gpointer) {
  LOGI("Acquired the name %s", name);
  name_settled = true;
  note_quarn_name(true);
  release_quarn_terminate();
}

void _dbus_on_name_lost(GDBusConnection *, const gchar *name, gpointer) {
  LOGI("Lost the name %s", name);
  name_settled = true;
  note_quarn_name(false);
  release_quarn_terminate();
}

gboolean set_flag(gpointer flag) {
  *static_cast<bool *>(flag) = true;
  return G_SOURCE_REMOVE;
}

/** GLib asks the bus and waits for its answer. */
void give_up_name() {
  if (name_owner_id != 0) g_bus_unown_name(std::exchange(name_owner_id, 0));
}

void take_name_back() {
  hold_quarn_terminate();
  const auto flags = static_cast<GBusNameOwnerFlags>(G_BUS_NAME_OWNER_FLAGS_REPLACE |
                                                     G_BUS_NAME_OWNER_FLAGS_DO_NOT_QUEUE);
  name_settled = false;
  name_owner_id =
      g_bus_own_name_on_connection(quarn_dbus_connection, kQuarnBusName, flags,
                                   _dbus_on_name_acquired, _dbus_on_name_lost, nullptr, nullptr);
}

}  // namespace

void set_bus_acquired_hook(void (*hook)(GDBusConnection *connection)) { bus_acquired_hook = hook; }

unsigned int quarnd_dbus_init() {
  quarn_dbus_note_main_thread();
  GErrorPtr error;
  NodeInfoPtr node(g_dbus_node_info_new_for_xml(quarn_introspection_xml, out(error)));
  if (!node) {
    LOGE("g_dbus_node_info_new_for_xml() Fail(%s)", error ? error->message : "");
    return kNoOwner;
  }
  set_quarn_bus_name({give_up_name, take_name_back});
  hold_quarn_terminate();
  name_owner_id = g_bus_own_name(G_BUS_TYPE_SYSTEM, kQuarnBusName, G_BUS_NAME_OWNER_FLAGS_REPLACE,
                                 _dbus_on_bus_acquired, _dbus_on_name_acquired, _dbus_on_name_lost,
                                 node.get(), unref_node);
  if (name_owner_id != 0) {
    static_cast<void>(node.release());  // goes with the request for the name
  } else {
    release_quarn_terminate();
    LOGE("g_bus_own_name() Fail");
  }
  name_settled = name_owner_id == 0;
  return name_owner_id;
}

bool quarnd_calls_deferred() { return calls_wait_for_turn(); }

bool quarnd_calls_unjudged() { return callers_are_asked_for() || library_owes_answers(); }

void quarnd_dispatch_deferred() { end_waits_for_turn(); }

void quarnd_dbus_leave() {
  leave_quarn_for_good();
  // The bus keeps the calls for a process that it has started until that process has the name.
  while (!name_settled) g_main_context_iteration(nullptr, TRUE);
  give_up_name();
  quarnd_dispatch_deferred();
  // What arrived before the bus had answered has a higher priority than this mark.
  bool drained = false;
  g_idle_add_full(G_PRIORITY_LOW, set_flag, &drained, nullptr);
  // What waits to learn who called is served as well.
  while (!drained || quarnd_calls_unjudged()) g_main_context_iteration(nullptr, TRUE);
}

void quarnd_dbus_answer_all() {
  if (quarn_dbus_connection == nullptr) return;
  // Not by the owner's id, which is the main thread's. What comes before the bus' answer is noted.
  const GVariantPtr released(g_dbus_connection_call_sync(
      quarn_dbus_connection, "org.freedesktop.DBus", "/org/freedesktop/DBus",
      "org.freedesktop.DBus", "ReleaseName", g_variant_new("(s)", kQuarnBusName), nullptr,
      G_DBUS_CALL_FLAGS_NONE, kLastRelease, nullptr, nullptr));
  answer_quarn_calls();
}

void quarnd_dbus_deinit(unsigned int owner_id) {
  if (quarn_dbus_connection != nullptr) {
    if (filter_id != 0) g_dbus_connection_remove_filter(quarn_dbus_connection, filter_id);
    if (registration_id != 0) {
      g_dbus_connection_unregister_object(quarn_dbus_connection, registration_id);
    }
    if (closed_handler != 0) g_signal_handler_disconnect(quarn_dbus_connection, closed_handler);
    filter_id = 0;
    registration_id = 0;
    closed_handler = 0;
    forget_callers();
  }
  if (owner_id != 0 && owner_id != kNoOwner) give_up_name();
  // The process may end right after this; answers that were given must have left.
  quarn_dbus_flush(kFlushLimit);
}
