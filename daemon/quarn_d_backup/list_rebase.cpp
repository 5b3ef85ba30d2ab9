#include "quarn_d_backup/list_rebase.h"

#include <json-c/json.h>

#include <cstdint>
#include <cstring>
#include <limits>
#include <utility>

#include "files/package_files.h"
#include "json_ptr.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/list_keys.h"
#include "quarn_d_backup/model_entries.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

// Entries that are only carried over may be deeper than what is read.
constexpr int kEntryDepth = 256;
constexpr int kPackageDepth = kEntryDepth - 2;  // an array of an object
// Each takes more memory than its text.
constexpr std::size_t kMaxDevices = 4096;

json_object *member(json_object *object, const char *key, json_type type) {
  json_object *value = nullptr;
  if (json_object_is_type(object, json_type_object) == 0 ||
      json_object_object_get_ex(object, key, &value) == 0 ||
      json_object_is_type(value, type) == 0) {
    return nullptr;
  }
  return value;
}

bool has_member(json_object *object, const char *key) {
  return json_object_is_type(object, json_type_object) != 0 &&
         json_object_object_get_ex(object, key, nullptr) != 0;
}

/** The text under @p key; null when there is none, or one that no C string can hold. */
const char *text_member(json_object *object, const char *key) {
  json_object *value = member(object, key, json_type_string);
  if (value == nullptr) return nullptr;
  const char *text = json_object_get_string(value);
  if (std::strlen(text) != static_cast<std::size_t>(json_object_get_string_len(value))) {
    return nullptr;
  }
  return text;
}

/** What of a list's text is this device's. */
struct own_entry {
  JsonPtr entry;                          /**< without its packages; null when there is none */
  std::size_t index = 0;                  /**< its place among the entries */
  std::vector<std::string_view> packages; /**< views into the list's text */
};

/** Parse a device's entry, its packages one by one. @return false when it is not JSON */
bool parse_entry(std::string_view text, own_entry *parsed, bool *beyond) {
  list_text parts = take_list_apart(text, kPkgList);
  parsed->entry.reset(parse_whole_json(parts.frame, kEntryDepth, beyond));
  // null is a value like any other, but has no object
  if (!parsed->entry && text != "null") return false;
  for (const std::string_view &package : parts.entries) {
    const JsonPtr value(parse_whole_json(package, kPackageDepth, beyond));
    if (!value && package != "null") return false;
  }
  parsed->packages = std::move(parts.entries);
  return true;
}

/**
 * Read every entry and keep the first of this device.
 * @return false when one of them is not JSON, or there is more than can be read
 */
bool find_own_entry(const list_text &list, const char *serial, own_entry *own, bool *beyond) {
  *beyond = list.entries.size() > kMaxDevices;
  if (*beyond) return false;
  for (std::size_t i = 0; i < list.entries.size(); ++i) {
    own_entry read;
    if (!parse_entry(list.entries[i], &read, beyond)) return false;
    if (own->entry) continue;
    const char *entry_serial =
        text_member(member(read.entry.get(), kBackupInfo, json_type_object), kSerialNumber);
    if (entry_serial == nullptr || std::strcmp(entry_serial, serial) != 0) continue;
    *own = std::move(read);
    own->index = i;
  }
  return true;
}

bool is_supported_format(json_object *root) {
  json_object *version = member(root, kFormatVersion, json_type_int);
  return version != nullptr && json_object_get_int64(version) == kSupportedFormat;
}

/** This device's entry goes on, with the time of this run and without its packages. */
void take_own_entry(backup_context *ctx, own_entry *own) {
  ctx->model_entry = own->entry.release();
  ctx->json_objects.push_back(ctx->model_entry);
  json_object_array_put_idx(ctx->model_list, own->index, ctx->model_entry);
  get_previous_package_list_info(ctx, own->packages);
  ctx->backup_info = member(ctx->model_entry, kBackupInfo, json_type_object);
  set_timestamp(ctx->backup_info);
  json_object_object_del(ctx->model_entry, kPkgList);
  ctx->pkg_list = generate_new_json_array(ctx);
  json_object_object_add(ctx->model_entry, kPkgList, ctx->pkg_list);
}

}  // namespace

int rebase_app_list_info(backup_context *ctx, const char *model_name, const char *serial) {
  const CString text = std::move(ctx->cloud_app_list_text);
  const list_text list = take_list_apart(text.get(), kModelList);

  ctx->app_list_root.reset(generate_new_json_tokener_parser(ctx, list.frame.c_str()));
  own_entry own;
  bool beyond = false;
  notes_of(ctx).list_understood = false;
  if (!ctx->app_list_root) {
    // Only for the reason.
    const JsonPtr refused(parse_whole_json(list.frame, JSON_TOKENER_DEFAULT_DEPTH, &beyond));
  } else if (!find_own_entry(list, serial, &own, &beyond)) {
    release_json_resource_of_app_list(ctx);
  }
  if (!ctx->app_list_root) {
    LOGI("json token error");
    ctx->keep_cloud_list = beyond;
    return QUARN_OK;
  }

  if (!is_supported_format(ctx->app_list_root.get())) {
    LOGI("format version in json changed");
    ctx->keep_cloud_list = has_member(ctx->app_list_root.get(), kFormatVersion) ||
                           has_member(ctx->app_list_root.get(), kModelList);
    release_json_resource_of_app_list(ctx);
    return QUARN_OK;
  }

  ctx->model_list = member(ctx->app_list_root.get(), kModelList, json_type_array);
  if (ctx->model_list == nullptr || json_object_array_length(ctx->model_list) == 0) {
    LOGI("model list is not in json");
    release_json_resource_of_app_list(ctx);
    return QUARN_OK;
  }

  notes_of(ctx).list_understood = true;
  notes_of(ctx).serial_listed = own.entry != nullptr;
  for (std::size_t i = 0; i < list.entries.size(); ++i) {
    if (own.entry && own.index == i) continue;
    json_object_array_put_idx(ctx->model_list, i, new_json_from_text(list.entries[i]));
  }
  if (!own.entry) {
    add_model_entry(ctx, model_name, serial);
    return QUARN_OK;
  }

  take_own_entry(ctx, &own);
  return QUARN_OK;
}

void get_previous_package_list_info(backup_context *ctx,
                                    const std::vector<std::string_view> &packages) {
  LOGI("get_previous_package_list_info");
  if (packages.empty()) {
    LOGI("no previous package list in old app list");
    return;
  }
  const LogScope lines("the previous package list");
  for (std::size_t i = 0; i < packages.size(); ++i) {
    const JsonPtr owned(parse_whole_json(packages[i], kPackageDepth, nullptr));
    json_object *element = owned.get();
    const char *pkg_id = text_member(element, kPkgId);
    const char *version = text_member(element, kVersion);
    if (pkg_id == nullptr || version == nullptr || !is_safe_path_component(pkg_id) ||
        !is_safe_path_component(version)) {
      LOGE("refused entry %zu of previous package list", i);
      continue;
    }
    pkg_information info;
    info.pkg_id = pkg_id;
    info.version = version;
    json_object *crc = member(element, kCrc, json_type_int);
    const std::int64_t value = crc != nullptr ? json_object_get_int64(crc) : 0;
    if (value >= std::numeric_limits<std::int32_t>::min() &&
        value <= std::numeric_limits<std::int32_t>::max()) {
      info.crc = static_cast<std::int32_t>(value);
    }
    ctx->previous_pkg_list.push_back(std::move(info));
  }
}
