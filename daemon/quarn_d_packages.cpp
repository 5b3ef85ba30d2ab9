#include "quarn_d_packages.h"

#include <memory>
#include <utility>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_d_gate.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_turn.h"
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

void withdraw_own(const quarn_caller &who, InvocationPtr invocation) {
  const std::string sender = g_dbus_method_invocation_get_sender(invocation.get());
  const quarn_subject subject =
      subject_of_call(g_dbus_method_invocation_get_interface_name(invocation.get()),
                      g_dbus_method_invocation_get_method_name(invocation.get()), nullptr);
  const caller_verdict verdict = judge_call(who, sender, subject, false);
  if (!verdict.allowed) {
    g_dbus_method_invocation_return_error_literal(invocation.release(), G_DBUS_ERROR,
                                                  G_DBUS_ERROR_ACCESS_DENIED,
                                                  refusal_text(subject, verdict).c_str());
    return;
  }
  // What it asked an earlier process for ends there, and is not counted here.
  if (tell_quarn_predecessor(sender, kWithdrawSignal)) LOGI("withdrawal passed on");
  const std::uint32_t count = quarnd_cancel_own(sender);
  g_dbus_method_invocation_return_value(invocation.release(), g_variant_new("(u)", count));
}

/** GDBus has compared name and arguments with the introspection data. */
void on_method(GDBusConnection *connection, const gchar *sender, const gchar *, const gchar *,
               const gchar *, GVariant *, GDBusMethodInvocation *invocation, gpointer) {
  cancel_quarn_terminate();
  const auto held = std::make_shared<InvocationPtr>(invocation);
  with_caller(connection, sender == nullptr ? "" : sender,
              [held](const quarn_caller &caller) { withdraw_own(caller, std::move(*held)); });
}

constexpr GDBusInterfaceVTable kPackagesTable = {on_method, nullptr, nullptr, {}};

}  // namespace

void quarnd_packages_export(GDBusConnection *connection) {
  GErrorPtr error;
  const NodeInfoPtr node(g_dbus_node_info_new_for_xml(kPackagesIntrospection, out(error)));
  if (!node) {
    LOGE("packages object is not available: %s", error->message);
    return;
  }
  const guint registration =
      g_dbus_connection_register_object(connection, kPackagesObjectPath, node->interfaces[0],
                                        &kPackagesTable, nullptr, nullptr, out(error));
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
