// The least that a bus-activated service can be: it owns a name and answers one method. The
// daemon's start is held against it.
#include <gio/gio.h>

namespace {

void answer(GDBusConnection *, const gchar *, const gchar *, const gchar *, const gchar *,
            GVariant *, GDBusMethodInvocation *invocation, gpointer) {
  g_dbus_method_invocation_return_value(invocation, g_variant_new("(t)", guint64{0}));
}

void serve(GDBusConnection *connection, const gchar *, gpointer node) {
  static const GDBusInterfaceVTable table = {answer, nullptr, nullptr, {nullptr}};
  g_dbus_connection_register_object(connection, "/org/orvane/Empty",
                                    static_cast<GDBusNodeInfo *>(node)->interfaces[0], &table,
                                    nullptr, nullptr, nullptr);
}

}  // namespace

int main() {
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(
      "<node><interface name='org.orvane.Empty'><method name='last_bu_time'>"
      "<arg type='t' direction='out'/></method></interface></node>",
      nullptr);
  g_bus_own_name(G_BUS_TYPE_SYSTEM, "org.orvane.Empty", G_BUS_NAME_OWNER_FLAGS_NONE, serve, nullptr,
                 nullptr, node, nullptr);
  g_main_loop_run(g_main_loop_new(nullptr, FALSE));
}
