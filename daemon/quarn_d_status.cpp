#include "quarn_d_status.h"

#include <glib.h>

#include <atomic>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_d_gate.h"
#include "quarn_d_status_properties.h"
#include "quarn_log.h"

namespace {

GDBusConnection *status_connection = nullptr;
guint status_registration = 0;
guint clean_up_registration = 0;
std::atomic<bool> refresh_queued{false};
std::atomic<bool> served{false};

/** What was told of each property of kStatus; null: nothing yet. */
std::vector<GVariantPtr> &last_told() {
  static auto *values = new std::vector<GVariantPtr>(kStatus.count);
  return *values;
}

/** All of the properties of @p of that can be read. */
GVariant *read_properties(const status_interface &of) {
  GVariantBuilder builder;
  g_variant_builder_init(&builder, G_VARIANT_TYPE("a{sv}"));
  for (const status_property &property : of) {
    GVariant *value = property.read(nullptr);
    if (value != nullptr) g_variant_builder_add(&builder, "{sv}", property.name, value);
  }
  return g_variant_builder_end(&builder);
}

/** GDBus has made sure that interface and property are there. */
void answer_reading(InvocationPtr invocation, const status_interface &of) {
  GVariant *const parameters = g_dbus_method_invocation_get_parameters(invocation.get());
  const GDBusPropertyInfo *const one = g_dbus_method_invocation_get_property_info(invocation.get());
  if (one == nullptr || g_variant_n_children(parameters) == 1) {
    g_dbus_method_invocation_return_value(invocation.release(),
                                          g_variant_new("(@a{sv})", read_properties(of)));
    return;
  }
  GErrorPtr error;
  const status_property *const property = find_status_property(of, one->name);
  GVariant *const value = property == nullptr ? nullptr : property->read(out(error));
  if (value == nullptr) {
    g_dbus_method_invocation_return_gerror(invocation.release(), error.get());
  } else {
    g_dbus_method_invocation_return_value(invocation.release(), g_variant_new("(v)", value));
  }
}

/** Reads are calls here: GDBus itself would answer them without knowing who asks. */
void on_reading(GDBusConnection *connection, const gchar *sender, const gchar *, const gchar *,
                const gchar *, GVariant *, GDBusMethodInvocation *invocation, gpointer data) {
  const auto &of = *static_cast<const status_interface *>(data);
  const std::string caller = sender == nullptr ? "" : sender;
  const auto held = std::make_shared<InvocationPtr>(invocation);
  with_caller(connection, caller, [held, caller, &of](const quarn_caller &who) {
    InvocationPtr reading = std::move(*held);
    const quarn_subject subject =
        subject_of_call(g_dbus_method_invocation_get_interface_name(reading.get()),
                        g_dbus_method_invocation_get_method_name(reading.get()), nullptr);
    const caller_verdict verdict = judge_call(who, caller, subject, false);
    if (verdict.allowed) return answer_reading(std::move(reading), of);
    g_dbus_method_invocation_return_error_literal(reading.release(), G_DBUS_ERROR,
                                                  G_DBUS_ERROR_ACCESS_DENIED,
                                                  refusal_text(subject, verdict).c_str());
  });
}

const GDBusInterfaceVTable kReadTable = {on_reading, nullptr, nullptr, {nullptr}};

/** Serve one interface of @p node. @return its registration, 0 with @p error */
guint serve_interface(GDBusConnection *connection, GDBusNodeInfo *node, const status_interface &of,
                      GError **error) {
  return g_dbus_connection_register_object(
      connection, kStatusObjectPath, g_dbus_node_info_lookup_interface(node, of.name), &kReadTable,
      const_cast<status_interface *>(&of), nullptr, error);
}

void tell_changes() {
  GVariantBuilder changed;
  g_variant_builder_init(&changed, G_VARIANT_TYPE("a{sv}"));
  bool any = false;
  auto told = last_told().begin();
  for (const status_property &property : kStatus) {
    GVariantPtr &last = *told++;
    if (property.changes != change_signal::told) continue;
    GVariantPtr value(g_variant_ref_sink(property.read(nullptr)));
    if (last && g_variant_equal(last.get(), value.get()) != FALSE) continue;
    g_variant_builder_add(&changed, "{sv}", property.name, value.get());
    last = std::move(value);
    any = true;
  }
  const GVariantPtr dictionary(g_variant_ref_sink(g_variant_builder_end(&changed)));
  if (!any) return;
  const char *const none[] = {nullptr};
  g_dbus_connection_emit_signal(
      status_connection, nullptr, kStatusObjectPath, "org.freedesktop.DBus.Properties",
      "PropertiesChanged", g_variant_new("(s@a{sv}^as)", kStatusInterface, dictionary.get(), none),
      nullptr);
}

gboolean refresh(gpointer) {
  refresh_queued = false;
  if (status_connection != nullptr) tell_changes();
  return G_SOURCE_REMOVE;
}

}  // namespace

void quarnd_status_export(GDBusConnection *connection) {
  GErrorPtr error;
  const NodeInfoPtr node(g_dbus_node_info_new_for_xml(kStatusIntrospection, out(error)));
  if (!node) {
    LOGE("status object is not available: %s", error->message);
    return;
  }
  status_registration = serve_interface(connection, node.get(), kStatus, out(error));
  if (status_registration != 0) {
    clean_up_registration = serve_interface(connection, node.get(), kCleanUp, out(error));
  }
  if (status_registration == 0) {
    LOGE("status object is not available: %s", error->message);
    return;
  }
  status_connection = connection;
  served = true;
}

void quarnd_status_unexport() {
  served = false;
  if (status_connection == nullptr) return;
  g_dbus_connection_unregister_object(status_connection, status_registration);
  if (clean_up_registration != 0) {
    g_dbus_connection_unregister_object(status_connection, clean_up_registration);
  }
  clean_up_registration = 0;
  status_connection = nullptr;
  status_registration = 0;
  for (GVariantPtr &told : last_told()) told.reset();
}

void quarnd_status_refresh() {
  if (!served || refresh_queued.exchange(true)) return;
  g_idle_add(refresh, nullptr);
}
