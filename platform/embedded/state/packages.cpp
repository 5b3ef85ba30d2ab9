#include "state/packages.h"

#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <set>

namespace embedded {
namespace {

constexpr char kAppsRoot[] = "/opt/usr/apps/";
constexpr char kPackagesFolder[] = "packages";
constexpr char kAppsFolder[] = "apps";
constexpr char kSuffix[] = ".ini";
constexpr char kPackageGroup[] = "package";
constexpr char kStateGroup[] = "state";
constexpr char kHidden[] = "hidden";
constexpr char kAppPrefix[] = "app ";
constexpr char kMetadataPrefix[] = "metadata.";
constexpr char kApiVersion[] = "api-version";
constexpr char kDefaultType[] = "tpk";
constexpr char kExternal[] = "external";
constexpr char kInternal[] = "internal";
constexpr size_t kMaxName = 200;
constexpr unsigned char kFirstPrintable = 0x20;

constexpr char kEventsGroup[] = "events";
constexpr char kNext[] = "next";
constexpr std::int64_t kMaxEvents = 1024;
constexpr int kEventFields = 4;

std::string package_file(const std::string &id) {
  return std::string(kPackagesFolder) + "/" + id + kSuffix;
}
std::string app_link(const std::string &id) { return std::string(kAppsFolder) + "/" + id; }

bool parse_flag(const std::string &text, bool *flag) {
  if (text.empty() || text == "false" || text == "true") {
    *flag = text == "true";
    return true;
  }
  return false;
}

bool parse_application(GKeyFile *manifest, const char *group, Package *package,
                       std::string *error) {
  Application application;
  application.id = group + std::strlen(kAppPrefix);
  if (!is_plain_name(application.id)) {
    *error = "bad application id \"" + application.id + "\"";
    return false;
  }
  application.api_version = text_of(manifest, group, kApiVersion);
  const GTexts keys(g_key_file_get_keys(manifest, group, nullptr, nullptr));
  for (gchar **key = keys.get(); key != nullptr && *key != nullptr; ++key) {
    if (!g_str_has_prefix(*key, kMetadataPrefix)) continue;
    application.metadata[*key + std::strlen(kMetadataPrefix)] = text_of(manifest, group, *key);
  }
  package->applications.push_back(std::move(application));
  return true;
}

KeyFilePtr manifest_of(const Package &package) {
  KeyFilePtr file(g_key_file_new());
  g_key_file_set_string(file.get(), kPackageGroup, "id", package.id.c_str());
  g_key_file_set_string(file.get(), kPackageGroup, "version", package.version.c_str());
  g_key_file_set_string(file.get(), kPackageGroup, "type", package.type.c_str());
  g_key_file_set_boolean(file.get(), kPackageGroup, "preload", package.preload);
  g_key_file_set_string(file.get(), kPackageGroup, "storage",
                        package.external ? kExternal : kInternal);
  g_key_file_set_boolean(file.get(), kStateGroup, kHidden, package.hidden);
  for (const Application &application : package.applications) {
    const std::string group = kAppPrefix + application.id;
    g_key_file_set_string(file.get(), group.c_str(), kApiVersion, application.api_version.c_str());
    for (const auto &[key, value] : application.metadata) {
      g_key_file_set_string(file.get(), group.c_str(), (kMetadataPrefix + key).c_str(),
                            value.c_str());
    }
  }
  return file;
}

bool link_application(const std::string &device, const std::string &app_id,
                      const std::string &package_id) {
  const std::string target = "../" + package_file(package_id);
  const std::string temporary = state_path(device, ".tmp/" + app_id + ".link");
  if (unlink(temporary.c_str()) != 0 && errno != ENOENT) return false;
  return symlink(target.c_str(), temporary.c_str()) == 0 &&
         rename(temporary.c_str(), state_path(device, app_link(app_id)).c_str()) == 0;
}

bool unlink_applications(const std::string &device, const Package &package,
                         const std::set<std::string> &kept) {
  bool done = true;
  for (const Application &application : package.applications) {
    if (kept.count(application.id) != 0) continue;
    const std::string link = state_path(device, app_link(application.id));
    done = (unlink(link.c_str()) == 0 || errno == ENOENT) && done;
  }
  return done;
}

/** get_package() of a state file; false when the file is missing or none. */
bool load_package(const std::string &device, const std::string &file, Package *package) {
  if (device.empty() || access(state_path(device, file).c_str(), F_OK) != 0) return false;
  const KeyFilePtr manifest = read_state(device, file);
  std::string error;
  if (manifest == nullptr || !parse_package(manifest.get(), package, &error)) return false;
  package->hidden = g_key_file_get_boolean(manifest.get(), kStateGroup, kHidden, nullptr) != FALSE;
  return true;
}

}  // namespace

std::string package_root(const std::string &id) { return kAppsRoot + id; }

bool is_plain_name(const std::string &text) {
  return !text.empty() && text.size() <= kMaxName && text != "." && text != ".." &&
         text.find("..") == std::string::npos &&
         std::none_of(text.begin(), text.end(),
                      [](char c) {
                        return c == '/' || c == '[' || c == ']' || c == ';' ||
                               static_cast<unsigned char>(c) <= kFirstPrintable;
                      }) &&
         g_utf8_validate(text.c_str(), -1, nullptr);
}

bool parse_package(GKeyFile *manifest, Package *package, std::string *error) {
  package->id = text_of(manifest, kPackageGroup, "id");
  package->version = text_of(manifest, kPackageGroup, "version");
  package->type = text_of(manifest, kPackageGroup, "type");
  if (package->type.empty()) package->type = kDefaultType;
  if (!is_plain_name(package->id)) {
    *error = "bad package id \"" + package->id + "\"";
    return false;
  }
  if (!is_plain_name(package->version)) {
    *error = "bad version \"" + package->version + "\"";
    return false;
  }
  if (!is_plain_name(package->type)) {
    *error = "bad type \"" + package->type + "\"";
    return false;
  }
  if (!parse_flag(text_of(manifest, kPackageGroup, "preload"), &package->preload)) {
    *error = "preload is neither true nor false";
    return false;
  }
  const std::string storage = text_of(manifest, kPackageGroup, "storage");
  package->external = storage == kExternal;
  if (!package->external && !storage.empty() && storage != kInternal) {
    *error = "storage is neither internal nor external";
    return false;
  }
  const GTexts groups(g_key_file_get_groups(manifest, nullptr));
  for (gchar **group = groups.get(); *group != nullptr; ++group) {
    if (g_str_has_prefix(*group, kAppPrefix) &&
        !parse_application(manifest, *group, package, error)) {
      return false;
    }
  }
  return true;
}

bool get_package(const std::string &device, const std::string &id, Package *package) {
  return is_plain_name(id) && load_package(device, package_file(id), package);
}

bool get_package_of_app(const std::string &device, const std::string &app_id, Package *package) {
  return is_plain_name(app_id) && load_package(device, app_link(app_id), package);
}

bool list_packages(const std::string &device, std::vector<std::string> *ids) {
  ids->clear();
  if (device.empty()) return false;
  DIR *folder = opendir(state_path(device, kPackagesFolder).c_str());
  if (folder == nullptr) return false;
  while (const dirent *entry = readdir(folder)) {
    if (g_str_has_suffix(entry->d_name, kSuffix)) {
      ids->emplace_back(entry->d_name, std::strlen(entry->d_name) - std::strlen(kSuffix));
    }
  }
  closedir(folder);
  std::sort(ids->begin(), ids->end());
  return true;
}

bool put_package(const std::string &device, const Package &package) {
  const StateLock lock(device);
  if (!lock) return false;
  Package before;
  const bool known = get_package(device, package.id, &before);
  if (!write_state(device, package_file(package.id), manifest_of(package).get())) return false;
  std::set<std::string> applications;
  for (const Application &application : package.applications) {
    if (!link_application(device, application.id, package.id)) return false;
    applications.insert(application.id);
  }
  return !known || unlink_applications(device, before, applications);
}

bool drop_package(const std::string &device, const std::string &id) {
  const StateLock lock(device);
  Package package;
  if (!lock || !get_package(device, id, &package)) return false;
  return unlink_applications(device, package, {}) &&
         unlink(state_path(device, package_file(id)).c_str()) == 0;
}

bool set_hidden(const std::string &device, const std::string &id, bool hidden) {
  const StateLock lock(device);
  Package package;
  if (!lock || !get_package(device, id, &package)) return false;
  if (package.hidden == hidden) return true;
  package.hidden = hidden;
  return write_state(device, package_file(id), manifest_of(package).get());
}

bool add_event(const std::string &device, const PackageEvent &event) {
  return edit_state(device, kEventsFile, [&](GKeyFile *file) {
    const std::int64_t number = number_of(file, kEventsGroup, kNext, 1);
    const gchar *fields[] = {event.action.c_str(), event.state.c_str(), event.type.c_str(),
                             event.package.c_str()};
    g_key_file_set_int64(file, kEventsGroup, kNext, number + 1);
    g_key_file_set_string_list(file, kEventsGroup, std::to_string(number).c_str(), fields,
                               kEventFields);
    g_key_file_remove_key(file, kEventsGroup, std::to_string(number - kMaxEvents).c_str(), nullptr);
    return true;
  });
}

std::int64_t next_event(const std::string &device) {
  const KeyFilePtr file = read_state(device, kEventsFile);
  return file == nullptr ? 1 : number_of(file.get(), kEventsGroup, kNext, 1);
}

std::vector<PackageEvent> events_from(const std::string &device, std::int64_t first) {
  std::vector<PackageEvent> events;
  const KeyFilePtr file = read_state(device, kEventsFile);
  if (file == nullptr) return events;
  const std::int64_t next = number_of(file.get(), kEventsGroup, kNext, 1);
  for (std::int64_t number = std::max(first, next - kMaxEvents); number < next; ++number) {
    gsize count = 0;
    const GTexts fields(g_key_file_get_string_list(
        file.get(), kEventsGroup, std::to_string(number).c_str(), &count, nullptr));
    if (fields == nullptr || count != kEventFields) continue;
    gchar **field = fields.get();
    events.push_back({number, field[3], field[2], field[0], field[1]});
  }
  return events;
}

}  // namespace embedded
