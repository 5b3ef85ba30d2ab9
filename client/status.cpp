#include "status.h"

#include <map>

#include "glib_handles.h"
#include "json_read.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr char kUnknown[] = "not known";
constexpr std::int64_t kMsPerSecond = 1000;
constexpr std::size_t kNameColumns = 18;

struct Unit {
  std::int64_t seconds;
  const char *name;
};

constexpr Unit kUnits[] = {{86400, " d"}, {3600, " h"}, {60, " min"}, {1, " s"}};

GVariantPtr value_of(GVariant *properties, const char *name, const GVariantType *type) {
  return GVariantPtr(g_variant_lookup_value(properties, name, type));
}

std::optional<bool> flag_of(GVariant *properties, const char *name) {
  const GVariantPtr value = value_of(properties, name, G_VARIANT_TYPE_BOOLEAN);
  if (!value) return std::nullopt;
  return g_variant_get_boolean(value.get()) != FALSE;
}

std::optional<std::int64_t> time_of(GVariant *properties, const char *name) {
  const GVariantPtr value = value_of(properties, name, G_VARIANT_TYPE_INT64);
  if (!value) return std::nullopt;
  return g_variant_get_int64(value.get());
}

std::optional<std::int64_t> last_backup_of(GVariant *properties) {
  const GVariantPtr value = value_of(properties, "LastBackup", G_VARIANT_TYPE_UINT64);
  if (!value || g_variant_get_uint64(value.get()) > INT64_MAX) return std::nullopt;
  return static_cast<std::int64_t>(g_variant_get_uint64(value.get()));
}

std::string text_of(GVariant *properties, const char *name) {
  const GVariantPtr value = value_of(properties, name, G_VARIANT_TYPE_STRING);
  return value ? g_variant_get_string(value.get(), nullptr) : "";
}

std::vector<std::string> texts_of(GVariant *properties, const char *name) {
  const GVariantPtr value = value_of(properties, name, G_VARIANT_TYPE_STRING_ARRAY);
  std::vector<std::string> texts;
  const std::size_t count = value ? g_variant_n_children(value.get()) : 0;
  for (std::size_t i = 0; i < count; ++i) {
    const GVariantPtr child(g_variant_get_child_value(value.get(), i));
    texts.emplace_back(g_variant_get_string(child.get(), nullptr));
  }
  return texts;
}

std::string line(const char *name, const std::string &value) {
  std::string text = name;
  text.append(kNameColumns - text.size(), ' ');
  return text + value + "\n";
}

std::string choice(const std::optional<bool> &flag, const char *yes, const char *no) {
  if (!flag) return kUnknown;
  return *flag ? yes : no;
}

std::string alarm_text(const std::optional<std::int64_t> &due_ms, std::int64_t now_ms) {
  if (!due_ms) return kUnknown;
  if (*due_ms == 0) return "none";
  const std::string time = local_time(*due_ms);
  return *due_ms > now_ms ? time + ", in " + duration_text(*due_ms - now_ms) : time + ", due";
}

std::string last_backup_text(const DaemonStatus &status, std::int64_t now_ms) {
  if (!status.last_backup_ms) return kUnknown;
  if (*status.last_backup_ms == 0) return "never";
  const std::string time = local_time(*status.last_backup_ms) + ", ";
  // A clock that was set back; the daemon takes such a backup for none.
  if (*status.last_backup_ms > now_ms) {
    return time + duration_text(*status.last_backup_ms - now_ms) + " in the future";
  }
  return time + duration_text(now_ms - *status.last_backup_ms) + " ago";
}

std::string restore_text(const DaemonStatus &status) {
  std::string text = choice(status.restore_mode, "on", "off");
  if (!status.restore_candidates.empty()) {
    text += ", waiting for " + std::to_string(status.restore_candidates.size()) + " packages";
  }
  return text;
}

void add_flag(json_object *object, const char *name, const std::optional<bool> &flag) {
  json_object_object_add(object, name, flag ? json_object_new_boolean(*flag ? 1 : 0) : nullptr);
}

void add_time(json_object *object, const char *name, const std::optional<std::int64_t> &ms) {
  const bool known = ms && *ms != 0;
  json_object_object_add(object, name, known ? json_object_new_int64(*ms) : nullptr);
}

}  // namespace

std::string cloud_problem_words(const std::string &problem) {
  static const std::map<std::string, const char *> kWords = {
      {"address", "there is no such store at the cloud's address"},
      {"certificate", "the cloud's certificate is not to be trusted"},
      {"password", "the cloud refused the user name or password"},
      {"space", "the cloud is full"},
      {"network", "the cloud cannot be reached"},
      {"server", "the cloud answered with an error"}};
  const auto found = kWords.find(problem);
  return found == kWords.end() ? "" : found->second;
}

std::string device_problem_words(const std::string &problem) {
  static const std::map<std::string, const char *> kWords = {
      {"wifi", "Wi-Fi was lost"},
      {"device-full", "this device has no room left"},
      {"device-file", "a file on this device could not be read or written"},
      {"removed", "a package was removed while it was backed up"},
      {"list-foreign", "the cloud's application list is in a form that this device does not know"},
      {"list-too-large", "the application list is larger than what devices can read"},
      {"list-unreadable", "the application list could not be read"},
      {"list-changed", "another device changed the application list meanwhile"}};
  const auto found = kWords.find(problem);
  return found == kWords.end() ? "" : found->second;
}

DaemonStatus read_status(GVariant *answer) {
  const GVariantPtr properties(g_variant_get_child_value(answer, 0));
  GVariant *all = properties.get();
  DaemonStatus status;
  status.auto_backup = flag_of(all, "AutoBackup");
  status.charger = flag_of(all, "ChargerConnected");
  status.wifi = flag_of(all, "WifiConnected");
  status.screen_off = flag_of(all, "ScreenOff");
  status.backup_running = flag_of(all, "BackupRunning");
  status.restore_mode = flag_of(all, "RestoreMode");
  status.condition_alarm_ms = time_of(all, "ConditionAlarm");
  status.next_alarm_ms = time_of(all, "NextAlarm");
  status.last_backup_ms = last_backup_of(all);
  status.restore_candidates = texts_of(all, "RestoreCandidates");
  status.serial = text_of(all, "SerialNumber");
  status.model = text_of(all, "ModelName");
  status.cloud_problem = text_of(all, "CloudProblem");
  return status;
}

std::string duration_text(std::int64_t ms) {
  std::int64_t seconds = ms > 0 ? ms / kMsPerSecond : 0;
  std::string text;
  int shown = 0;
  for (const Unit &unit : kUnits) {
    const std::int64_t amount = seconds / unit.seconds;
    if (amount == 0 && shown == 0 && unit.seconds > 1) continue;
    if (amount != 0 || shown == 0)
      text += (shown == 0 ? "" : " ") + std::to_string(amount) + unit.name;
    seconds %= unit.seconds;
    if (++shown == 2) break;
  }
  return text;
}

std::string status_text(const DaemonStatus &status, std::int64_t now_ms) {
  const bool both = !status.model.empty() && !status.serial.empty();
  std::string device = status.model + (both ? ", " : "") + status.serial;
  if (device.empty()) device = kUnknown;
  const std::string problem = cloud_problem_words(status.cloud_problem);
  const std::string own_problem = device_problem_words(status.cloud_problem);
  return line("device", printable(device)) +
         line("automatic backup", choice(status.auto_backup, "on", "off")) +
         line("charger", choice(status.charger, "connected", "not connected")) +
         line("Wi-Fi", choice(status.wifi, "connected", "not connected")) +
         line("screen", choice(status.screen_off, "off", "on")) +
         line("condition alarm", alarm_text(status.condition_alarm_ms, now_ms)) +
         line("next alarm", alarm_text(status.next_alarm_ms, now_ms)) +
         line("last backup", last_backup_text(status, now_ms)) +
         line("backup", choice(status.backup_running, "running", "not running")) +
         line("restore mode", restore_text(status)) +
         (problem.empty() ? "" : line("cloud", problem)) +
         (own_problem.empty() ? "" : line("last problem", own_problem));
}

void status_to_json(const DaemonStatus &status, std::int64_t now_ms, json_object *object) {
  json_add(object, "serial", status.serial);
  json_add(object, "model", status.model);
  add_flag(object, "auto_backup", status.auto_backup);
  add_flag(object, "charger_connected", status.charger);
  add_flag(object, "wifi_connected", status.wifi);
  add_flag(object, "screen_off", status.screen_off);
  add_time(object, "condition_alarm_ms", status.condition_alarm_ms);
  add_time(object, "next_alarm_ms", status.next_alarm_ms);
  add_time(object, "last_backup_ms", status.last_backup_ms);
  const bool known = status.last_backup_ms && *status.last_backup_ms != 0;
  json_object_object_add(object, "last_backup_age_ms",
                         known ? json_object_new_int64(now_ms - *status.last_backup_ms) : nullptr);
  json_object_object_add(object, "cloud_problem",
                         status.cloud_problem.empty()
                             ? nullptr
                             : json_object_new_string(status.cloud_problem.c_str()));
  add_flag(object, "backup_running", status.backup_running);
  add_flag(object, "restore_mode", status.restore_mode);
  json_object *candidates = json_object_new_array();
  for (const std::string &package : status.restore_candidates) {
    json_object_array_add(
        candidates, json_object_new_string_len(package.data(), static_cast<int>(package.size())));
  }
  json_object_object_add(object, "restore_candidates", candidates);
}

}  // namespace quarn_client
