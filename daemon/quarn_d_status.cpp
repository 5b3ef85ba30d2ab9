#include "quarn_d_status.h"

#include <glib.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <set>
#include <string>

#include "backup_transport.h"
#include "platform_device.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_gate.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/request_cause.h"
#include "quarn_log.h"

const char kStatusIntrospection[] =
    "<node>"
    "<interface name=\"org.orvane.Quarn.Status\">"
    "<property name=\"AutoBackup\" type=\"b\" access=\"read\"/>"
    "<property name=\"ChargerConnected\" type=\"b\" access=\"read\">"
    "<annotation name=\"org.freedesktop.DBus.Property.EmitsChangedSignal\" value=\"false\"/>"
    "</property>"
    "<property name=\"WifiConnected\" type=\"b\" access=\"read\"/>"
    "<property name=\"ScreenOff\" type=\"b\" access=\"read\"/>"
    "<property name=\"ConditionAlarm\" type=\"x\" access=\"read\"/>"
    "<property name=\"NextAlarm\" type=\"x\" access=\"read\"/>"
    "<property name=\"LastBackup\" type=\"t\" access=\"read\"/>"
    "<property name=\"BackupRunning\" type=\"b\" access=\"read\"/>"
    "<property name=\"RestoreMode\" type=\"b\" access=\"read\"/>"
    "<property name=\"RestoreCandidates\" type=\"as\" access=\"read\"/>"
    "<property name=\"CloudProblem\" type=\"s\" access=\"read\">"
    "<annotation name=\"org.freedesktop.DBus.Property.EmitsChangedSignal\" value=\"false\"/>"
    "</property>"
    "<property name=\"SerialNumber\" type=\"s\" access=\"read\">"
    "<annotation name=\"org.freedesktop.DBus.Property.EmitsChangedSignal\" value=\"const\"/>"
    "</property>"
    "<property name=\"ModelName\" type=\"s\" access=\"read\">"
    "<annotation name=\"org.freedesktop.DBus.Property.EmitsChangedSignal\" value=\"const\"/>"
    "</property>"
    "</interface>"
    "<interface name=\"org.orvane.Quarn.CleanUp\">"
    "<property name=\"KeptPackages\" type=\"as\" access=\"read\">"
    "<annotation name=\"org.freedesktop.DBus.Property.EmitsChangedSignal\" value=\"false\"/>"
    "</property>"
    "</interface>"
    "</node>";

namespace {

constexpr char kKeptPackages[] = "KeptPackages";

GDBusConnection *status_connection = nullptr;
guint status_registration = 0;
guint clean_up_registration = 0;
std::atomic<bool> refresh_queued{false};
std::atomic<bool> served{false};

std::map<std::string, GVariantPtr> &last_told() {
  static auto *values = new std::map<std::string, GVariantPtr>;
  return *values;
}

GVariant *last_backup() {
  // The schedule's reader logs every call; a client that looks should not fill the log.
  std::uint64_t time = 0;
  read_last_backup_time(&time);
  return g_variant_new_uint64(time);
}

GVariant *screen_off() {
  display_state_e state = DISPLAY_STATE_NORMAL;
  const bool known = device_display_get_state(&state) == DEVICE_ERROR_NONE;
  return g_variant_new_boolean(known && state == DISPLAY_STATE_SCREEN_OFF ? TRUE : FALSE);
}

GVariant *candidates() {
  GVariantBuilder builder;
  g_variant_builder_init(&builder, G_VARIANT_TYPE("as"));
  for (const std::string &package : restore_candidates()) {
    g_variant_builder_add(&builder, "s", package.c_str());
  }
  return g_variant_builder_end(&builder);
}

GVariant *device_text(bool serial) {
  CString model;
  CString number;
  get_device_info(out(model), out(number));
  const CString &text = serial ? number : model;
  return g_variant_new_string(text ? text.get() : "");
}

GVariant *cloud_problem() {
  // The last run's or request's own, whatever the transport has served since.
  const request_cause noted = last_request_cause();
  if (noted != request_cause::none) return g_variant_new_string(request_cause_word(noted));
  const backup_trans_cause cause = backup_trans_last_cause();
  return g_variant_new_string(cause == BACKUP_TRANS_CAUSE_NONE ? ""
                                                               : backup_trans_cause_word(cause));
}

GVariant *flag(bool value) { return g_variant_new_boolean(value ? TRUE : FALSE); }

GVariant *value_of(const std::string &property) {
  if (property == "AutoBackup") return flag(auto_backup_enabled != 0);
  if (property == "ChargerConnected") return flag(charger_connected() != 0);
  if (property == "WifiConnected") return flag(wifi_connected() != 0);
  if (property == "ScreenOff") return screen_off();
  if (property == "ConditionAlarm") return g_variant_new_int64(condition_alarm_due());
  if (property == "NextAlarm") return g_variant_new_int64(next_alarm_due());
  if (property == "LastBackup") return last_backup();
  if (property == "BackupRunning") return flag(backup_request_outstanding());
  if (property == "RestoreMode") return flag(current_restore_mode() != restore_mode::off);
  if (property == "RestoreCandidates") return candidates();
  if (property == "CloudProblem") return cloud_problem();
  if (property == "SerialNumber") return device_text(true);
  if (property == "ModelName") return device_text(false);
  return nullptr;
}

GVariant *kept_packages(GError **error) {
  std::set<std::string> kept;
  if (!packages_kept_by_backup(&kept)) {
    g_set_error_literal(error, G_DBUS_ERROR, G_DBUS_ERROR_FAILED,
                        "the installed packages are not all known");
    return nullptr;
  }
  GVariantBuilder builder;
  g_variant_builder_init(&builder, G_VARIANT_TYPE("as"));
  for (const std::string &package : kept) g_variant_builder_add(&builder, "s", package.c_str());
  return g_variant_builder_end(&builder);
}

/** A property of either interface, floating; null with @p error. */
GVariant *read_property(const std::string &property, GError **error) {
  return property == kKeptPackages ? kept_packages(error) : value_of(property);
}

/** All of the properties of @p interface_info that can be read. */
GVariant *read_properties(const GDBusInterfaceInfo *interface_info) {
  GVariantBuilder builder;
  g_variant_builder_init(&builder, G_VARIANT_TYPE("a{sv}"));
  for (GDBusPropertyInfo **info = interface_info->properties; *info != nullptr; ++info) {
    GVariant *value = read_property((*info)->name, nullptr);
    if (value != nullptr) g_variant_builder_add(&builder, "{sv}", (*info)->name, value);
  }
  return g_variant_builder_end(&builder);
}

/** GDBus has made sure that interface and property are there. */
void answer_reading(GDBusMethodInvocation *invocation, const GDBusInterfaceInfo *interface_info) {
  GVariant *const parameters = g_dbus_method_invocation_get_parameters(invocation);
  const GDBusPropertyInfo *const one = g_dbus_method_invocation_get_property_info(invocation);
  if (one == nullptr || g_variant_n_children(parameters) == 1) {
    g_dbus_method_invocation_return_value(
        invocation, g_variant_new("(@a{sv})", read_properties(interface_info)));
    return;
  }
  GErrorPtr error;
  GVariant *const value = read_property(one->name, out(error));
  if (value == nullptr) {
    g_dbus_method_invocation_return_gerror(invocation, error.get());
  } else {
    g_dbus_method_invocation_return_value(invocation, g_variant_new("(v)", value));
  }
}

/** Reads are calls here: GDBus itself would answer them without knowing who asks. */
void on_reading(GDBusConnection *connection, const gchar *sender, const gchar *, const gchar *,
                const gchar *, GVariant *, GDBusMethodInvocation *invocation, gpointer data) {
  const auto *interface_info = static_cast<const GDBusInterfaceInfo *>(data);
  const std::string caller = sender == nullptr ? "" : sender;
  with_caller(connection, caller, [=](const quarn_caller &who) {
    const quarn_subject subject =
        subject_of_call(g_dbus_method_invocation_get_interface_name(invocation),
                        g_dbus_method_invocation_get_method_name(invocation), nullptr);
    const caller_verdict verdict = judge_call(who, caller, subject, false);
    if (verdict.allowed) return answer_reading(invocation, interface_info);
    g_dbus_method_invocation_return_error_literal(invocation, G_DBUS_ERROR,
                                                  G_DBUS_ERROR_ACCESS_DENIED,
                                                  refusal_text(subject, verdict).c_str());
  });
}

const GDBusInterfaceVTable kReadTable = {on_reading, nullptr, nullptr, {nullptr}};

/** Serve one interface of @p node. @return its registration, 0 with @p error */
guint serve_interface(GDBusConnection *connection, GDBusInterfaceInfo *interface_info,
                      GError **error) {
  return g_dbus_connection_register_object(
      connection, kStatusObjectPath, interface_info, &kReadTable,
      g_dbus_interface_info_ref(interface_info),
      [](gpointer held) { g_dbus_interface_info_unref(static_cast<GDBusInterfaceInfo *>(held)); },
      error);
}

constexpr const char *kChanging[] = {"AutoBackup",     "WifiConnected", "ScreenOff",
                                     "ConditionAlarm", "NextAlarm",     "LastBackup",
                                     "BackupRunning",  "RestoreMode",   "RestoreCandidates"};

void tell_changes() {
  GVariantBuilder changed;
  g_variant_builder_init(&changed, G_VARIANT_TYPE("a{sv}"));
  bool any = false;
  for (const char *property : kChanging) {
    GVariantPtr value(g_variant_ref_sink(value_of(property)));
    GVariantPtr &told = last_told()[property];
    if (told && g_variant_equal(told.get(), value.get()) != FALSE) continue;
    g_variant_builder_add(&changed, "{sv}", property, value.get());
    told = std::move(value);
    any = true;
  }
  GVariant *dictionary = g_variant_builder_end(&changed);
  if (!any) {
    g_variant_unref(g_variant_ref_sink(dictionary));
    return;
  }
  const char *const none[] = {nullptr};
  g_dbus_connection_emit_signal(status_connection, nullptr, kStatusObjectPath,
                                "org.freedesktop.DBus.Properties", "PropertiesChanged",
                                g_variant_new("(s@a{sv}^as)", kStatusInterface, dictionary, none),
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
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(kStatusIntrospection, out(error));
  if (node == nullptr) {
    LOGE("status object is not available: %s", error->message);
    return;
  }
  status_registration = serve_interface(connection, node->interfaces[0], out(error));
  if (status_registration != 0) {
    clean_up_registration = serve_interface(connection, node->interfaces[1], out(error));
  }
  g_dbus_node_info_unref(node);
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
  last_told().clear();
}

void quarnd_status_refresh() {
  if (!served || refresh_queued.exchange(true)) return;
  g_idle_add(refresh, nullptr);
}
