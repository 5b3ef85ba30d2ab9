#include "quarn_d_packages.h"

#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/handles.h"
#include "quarn_dbus_server.h"
#include "quarn_log.h"

const char kPackagesIntrospection[] =
    "<node>"
    "<interface name=\"org.orvane.Quarn.Packages\">"
    "<method name=\"CancelOwn\">"
    "<arg type=\"u\" name=\"requests\" direction=\"out\"/>"
    "</method>"
    "</interface>"
    "</node>";

namespace {

GDBusConnection *packages_connection = nullptr;
guint packages_registration = 0;

/** GDBus has compared name and arguments with the introspection data. */
void on_method(GDBusConnection *, const gchar *sender, const gchar *, const gchar *, const gchar *,
               GVariant *, GDBusMethodInvocation *invocation, gpointer) {
  cancel_quarn_terminate();
  const std::string caller = sender == nullptr ? "" : sender;
  // What it asked an earlier process for ends there, and is not counted here.
  if (tell_quarn_predecessor(caller, kWithdrawSignal)) LOGI("withdrawal passed on");
  const std::uint32_t count = quarnd_cancel_own(caller);
  g_dbus_method_invocation_return_value(invocation, g_variant_new("(u)", count));
}

constexpr GDBusInterfaceVTable kPackagesTable = {on_method, nullptr, nullptr, {}};

}  // namespace

void quarnd_packages_export(GDBusConnection *connection) {
  GErrorPtr error;
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(kPackagesIntrospection, out(error));
  if (node == nullptr) {
    LOGE("packages object is not available: %s", error->message);
    return;
  }
  const guint registration =
      g_dbus_connection_register_object(connection, kPackagesObjectPath, node->interfaces[0],
                                        &kPackagesTable, nullptr, nullptr, out(error));
  g_dbus_node_info_unref(node);
  if (registration == 0) {
    LOGE("packages object is not available: %s", error->message);
    return;
  }
  packages_registration = registration;
  packages_connection = connection;
}

void quarnd_packages_unexport() {
  if (packages_connection == nullptr) return;
  g_dbus_connection_unregister_object(packages_connection, packages_registration);
  packages_connection = nullptr;
  packages_registration = 0;
}
