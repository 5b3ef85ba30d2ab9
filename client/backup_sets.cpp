#include "backup_sets.h"

#include <algorithm>
#include <cstdio>

#include "json_ptr.h"
#include "json_read.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr std::int64_t kFormatVersion = 1;

std::optional<SetPackage> read_package(json_object *entry) {
  const auto id = json_string(entry, "pkg_id");
  const auto version = json_string(entry, "version");
  if (!id || id->empty() || !version) return std::nullopt;
  return SetPackage{*id, *version, json_integer(entry, "crc").value_or(0)};
}

std::optional<BackupSet> read_set(json_object *entry, std::size_t &left_out) {
  json_object *info = json_member(entry, "backup_info", json_type_object);
  const auto serial = json_string(info, "serial_number");
  if (!serial || serial->empty()) return std::nullopt;
  BackupSet set;
  set.serial = *serial;
  set.model = json_string(info, "model_name").value_or("");
  set.time_ms = json_integer(info, "timestamp");
  json_object *packages = json_member(entry, "pkg_list", json_type_array);
  const std::size_t count = packages == nullptr ? 0 : json_object_array_length(packages);
  for (std::size_t i = 0; i < count; ++i) {
    auto package = read_package(json_object_array_get_idx(packages, i));
    if (package) {
      set.packages.push_back(std::move(*package));
    } else {
      ++left_out;
    }
  }
  return set;
}

}  // namespace

std::optional<BackupSets> parse_backup_sets(const std::string &text, std::string &error) {
  const JsonPtr root = json_parse(text);
  if (!root || !json_object_is_type(root.get(), json_type_object)) {
    error = "the application list is not readable";
    return std::nullopt;
  }
  if (json_integer(root.get(), "format_ver") != kFormatVersion) {
    error = "the application list has a format that this program does not know";
    return std::nullopt;
  }
  json_object *models = json_member(root.get(), "model_list", json_type_array);
  if (models == nullptr) {
    error = "the application list names no devices";
    return std::nullopt;
  }
  BackupSets result;
  for (std::size_t i = 0; i < json_object_array_length(models); ++i) {
    auto set = read_set(json_object_array_get_idx(models, i), result.left_out);
    if (set) {
      result.sets.push_back(std::move(*set));
    } else {
      ++result.left_out;
    }
  }
  return result;
}

const BackupSet *find_set(const BackupSets &sets, const std::string &serial) {
  const auto found = std::find_if(sets.sets.begin(), sets.sets.end(),
                                  [&](const BackupSet &set) { return set.serial == serial; });
  return found == sets.sets.end() ? nullptr : &*found;
}

const SetPackage *find_package(const BackupSet &set, const std::string &id) {
  const auto found = std::find_if(set.packages.begin(), set.packages.end(),
                                  [&](const SetPackage &package) { return package.id == id; });
  return found == set.packages.end() ? nullptr : &*found;
}

std::string crc_text(std::int64_t crc) {
  if (crc == 0) return "-";
  char buffer[16];
  std::snprintf(buffer, sizeof buffer, "%08x", static_cast<unsigned>(crc));
  return buffer;
}

json_object *sets_to_json(const BackupSets &sets) {
  json_object *array = json_object_new_array();
  for (const BackupSet &set : sets.sets) {
    json_object *entry = json_object_new_object();
    json_add(entry, "serial", set.serial);
    json_add(entry, "model", set.model);
    json_object_object_add(entry, "time_ms",
                           set.time_ms ? json_object_new_int64(*set.time_ms) : nullptr);
    if (set.time_ms) {
      json_add(entry, "time", local_time(*set.time_ms));
    } else {
      json_object_object_add(entry, "time", nullptr);
    }
    json_object *packages = json_object_new_array();
    for (const SetPackage &package : set.packages) {
      json_object *item = json_object_new_object();
      json_add(item, "package", package.id);
      json_add(item, "version", package.version);
      json_object_object_add(item, "crc", json_object_new_int64(package.crc));
      json_object_array_add(packages, item);
    }
    json_object_object_add(entry, "packages", packages);
    json_object_array_add(array, entry);
  }
  return array;
}

}  // namespace quarn_client
