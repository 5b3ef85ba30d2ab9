#include "quarn_d_status_properties.h"

#include <glib.h>

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <set>
#include <string>

#include "backup_transport.h"
#include "constant_text.h"
#include "platform_device.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_conditions/alarm.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_status.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/request_cause.h"

namespace {

GVariant *flag(bool value) { return g_variant_new_boolean(value ? TRUE : FALSE); }

GVariant *last_backup() {
  // The schedule's reader logs every call; a client that looks should not fill the log.
  std::uint64_t time = 0;
  static_cast<void>(read_last_backup_time(&time));  // what cannot be read is shown as never
  return g_variant_new_uint64(time);
}

GVariant *screen_off() {
  display_state_e state = DISPLAY_STATE_NORMAL;
  const bool known = device_display_get_state(&state) == DEVICE_ERROR_NONE;
  return flag(known && state == DISPLAY_STATE_SCREEN_OFF);
}

GVariant *candidates() {
  GVariantBuilder builder;
  g_variant_builder_init(&builder, G_VARIANT_TYPE("as"));
  for (const std::string &package : restore_candidates()) {
    g_variant_builder_add(&builder, "s", package.c_str());
  }
  return g_variant_builder_end(&builder);
}

GVariant *serial_number() {
  CString model;
  CString number;
  get_device_info(out(model), out(number));
  return g_variant_new_string(number ? number.get() : "");
}

GVariant *model_name() {
  CString model;
  CString number;
  get_device_info(out(model), out(number));
  return g_variant_new_string(model ? model.get() : "");
}

GVariant *cloud_problem() {
  // The last run's or request's own, whatever the transport has served since.
  const request_cause noted = last_request_cause();
  if (noted != request_cause::none) return g_variant_new_string(request_cause_word(noted));
  const backup_trans_cause cause = backup_trans_last_cause();
  return g_variant_new_string(cause == BACKUP_TRANS_CAUSE_NONE ? ""
                                                               : backup_trans_cause_word(cause));
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

constexpr status_property kStatusProperties[] = {
    {"AutoBackup", "b", change_signal::told,
     [](GError **) { return flag(auto_backup_enabled != 0); }},
    {"ChargerConnected", "b", change_signal::not_told,
     [](GError **) { return flag(charger_connected() != 0); }},
    {"WifiConnected", "b", change_signal::told,
     [](GError **) { return flag(wifi_connected() != 0); }},
    {"ScreenOff", "b", change_signal::told, [](GError **) { return screen_off(); }},
    {"ConditionAlarm", "x", change_signal::told,
     [](GError **) { return g_variant_new_int64(condition_alarm_due()); }},
    {"NextAlarm", "x", change_signal::told,
     [](GError **) { return g_variant_new_int64(next_alarm_due()); }},
    {"LastBackup", "t", change_signal::told, [](GError **) { return last_backup(); }},
    {"BackupRunning", "b", change_signal::told,
     [](GError **) { return flag(backup_request_outstanding()); }},
    {"RestoreMode", "b", change_signal::told,
     [](GError **) { return flag(current_restore_mode() != restore_mode::off); }},
    {"RestoreCandidates", "as", change_signal::told, [](GError **) { return candidates(); }},
    {"CloudProblem", "s", change_signal::not_told, [](GError **) { return cloud_problem(); }},
    {"SerialNumber", "s", change_signal::constant, [](GError **) { return serial_number(); }},
    {"ModelName", "s", change_signal::constant, [](GError **) { return model_name(); }},
};

constexpr status_property kCleanUpProperties[] = {
    {"KeptPackages", "as", change_signal::not_told, kept_packages},
};

constexpr void write_property(ConstantTextWriter &to, const status_property &property) {
  to.put("<property name=\"").put(property.name).put("\" type=\"").put(property.type);
  to.put("\" access=\"read\"");
  if (property.changes == change_signal::told) {
    to.put("/>");
    return;
  }
  to.put("><annotation name=\"org.freedesktop.DBus.Property.EmitsChangedSignal\" value=\"");
  to.put(property.changes == change_signal::constant ? "const" : "false");
  to.put("\"/></property>");
}

template <std::size_t Count>
constexpr void write_interface(ConstantTextWriter &to, const char *name,
                               const status_property (&properties)[Count]) {
  to.put("<interface name=\"").put(name).put("\">");
  for (const status_property &property : properties) write_property(to, property);
  to.put("</interface>");
}

constexpr void write_document(ConstantTextWriter &to) {
  to.put("<node>");
  write_interface(to, kStatusInterface, kStatusProperties);
  write_interface(to, kCleanUpInterface, kCleanUpProperties);
  to.put("</node>");
}

constexpr ConstantText<write_document> kDocument;

}  // namespace

const status_interface kStatus = {kStatusInterface, kStatusProperties,
                                  std::size(kStatusProperties)};
const status_interface kCleanUp = {kCleanUpInterface, kCleanUpProperties,
                                   std::size(kCleanUpProperties)};
const char *const kStatusIntrospection = kDocument.text();

const status_property *find_status_property(const status_interface &of, const std::string &name) {
  const auto *const found =
      std::find_if(of.begin(), of.end(),
                   [&name](const status_property &property) { return name == property.name; });
  return found == of.end() ? nullptr : found;
}
