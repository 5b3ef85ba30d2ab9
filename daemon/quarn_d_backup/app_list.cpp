#include <fcntl.h>
#include <sys/stat.h>

#include <cstring>
#include <limits>

#include "quarn_common.h"
#include "quarn_d_backup/model_entries.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr char kFormatVersion[] = "format_ver";
constexpr char kBackupInfo[] = "backup_info";
constexpr char kAppDataPath[] = "app_data_path";
constexpr char kTimestamp[] = "timestamp";
constexpr char kSerialNumber[] = "serial_number";
constexpr char kModelName[] = "model_name";
constexpr char kPkgId[] = "pkg_id";
constexpr char kVersion[] = "version";
constexpr char kCrc[] = "crc";

constexpr int kSupportedFormat = 1;
// Entries that are only carried over may be deeper than what is read.
constexpr int kEntryDepth = 256;
constexpr int kPackageDepth = kEntryDepth - 2;  // an array of an object

constexpr char kCompanionListName[] = "/shared/data/app_list.txt";
constexpr mode_t kPrivateFile = 0600;

std::string companion_list_path() {
  return std::string(kAppsDir) + kPellixPackage + kCompanionListName;
}

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

void set_timestamp(json_object *backup_info) {
  json_object_object_add(backup_info, kTimestamp, json_object_new_int64(_get_current_timestamp()));
}

void add_model_entry(backup_context *ctx, const char *model_name, const char *serial) {
  ctx->model_entry = generate_new_json_object(ctx);
  json_object_array_add(ctx->model_list, ctx->model_entry);
  ctx->backup_info = generate_new_json_object(ctx);
  json_object_object_add(ctx->model_entry, kBackupInfo, ctx->backup_info);
  ctx->pkg_list = generate_new_json_array(ctx);
  json_object_object_add(ctx->model_entry, kPkgList, ctx->pkg_list);
  set_timestamp(ctx->backup_info);
  json_object_object_add(ctx->backup_info, kSerialNumber, json_object_new_string(serial));
  json_object_object_add(ctx->backup_info, kModelName, json_object_new_string(model_name));
}

void create_fresh_document(backup_context *ctx) {
  LOGI("app list is made newly");
  ctx->app_list_root.reset(generate_new_json_object(ctx));
  json_object_object_add(ctx->app_list_root.get(), kFormatVersion,
                         json_object_new_int(kSupportedFormat));
  ctx->model_list = generate_new_json_array(ctx);
  json_object_object_add(ctx->app_list_root.get(), kModelList, ctx->model_list);
  add_model_entry(ctx, ctx->model_name.c_str(), ctx->serial_number.c_str());
  if (ctx->for_pellix) {
    ctx->app_data_path = generate_new_json_array(ctx);
    json_object_object_add(ctx->model_entry, kAppDataPath, ctx->app_data_path);
  }
}

/** What of a list's text is this device's. */
struct own_entry {
  JsonPtr entry;                          /**< without its packages; null when there is none */
  std::size_t index = 0;                  /**< its place among the entries */
  std::vector<std::string_view> packages; /**< views into the list's text */
};

/** Parse a device's entry, its packages one by one. @return false when it is not JSON */
bool parse_entry(std::string_view text, own_entry *parsed, bool *too_deep) {
  list_text parts = take_list_apart(text, kPkgList);
  parsed->entry.reset(parse_whole_json(parts.frame, kEntryDepth, too_deep));
  // null is a value like any other, but has no object
  if (!parsed->entry && text != "null") return false;
  for (const std::string_view &package : parts.entries) {
    const JsonPtr value(parse_whole_json(package, kPackageDepth, too_deep));
    if (!value && package != "null") return false;
  }
  parsed->packages = std::move(parts.entries);
  return true;
}

/**
 * Read every entry and keep the first of this device.
 * @return false when one of them is not JSON
 */
bool find_own_entry(const list_text &list, const char *serial, own_entry *own, bool *too_deep) {
  for (std::size_t i = 0; i < list.entries.size(); ++i) {
    own_entry read;
    if (!parse_entry(list.entries[i], &read, too_deep)) return false;
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

/** Create the file where it is for us alone, or see that it is a plain one of ours. */
bool prepare_file(const std::string &path) {
  const UniqueFd fd = safe_open(path.c_str(), O_WRONLY | O_CREAT | O_NONBLOCK, kPrivateFile);
  struct stat status = {};
  return fd && fstat(fd.get(), &status) == 0 && S_ISREG(status.st_mode) && status.st_nlink == 1 &&
         fchmod(fd.get(), kPrivateFile) == 0;
}

}  // namespace

json_object *generate_new_json_object(backup_context *ctx) {
  json_object *object = json_object_new_object();
  ctx->json_objects.push_back(object);
  return object;
}

json_object *generate_new_json_array(backup_context *ctx) {
  json_object *array = json_object_new_array();
  ctx->json_objects.push_back(array);
  return array;
}

json_object *generate_new_json_tokener_parser(backup_context *ctx, const char *text) {
  json_object *value = parse_whole_json(text, JSON_TOKENER_DEFAULT_DEPTH, nullptr);
  if (value != nullptr) ctx->json_objects.push_back(value);
  return value;
}

bool create_app_list_info(backup_context *ctx) {
  if (ctx->for_pellix || !ctx->cloud_app_list_text) {
    create_fresh_document(ctx);
    return true;
  }
  const int ret = rebase_app_list_info(ctx, ctx->model_name.c_str(), ctx->serial_number.c_str());
  if (ret != QUARN_OK) {
    LOGE("failed to remake app list");
    return false;
  }
  LOGI("app list was rebased from it of cloud");
  // a text in which nothing is anybody's loses nothing by being replaced
  if (!ctx->app_list_root && !ctx->keep_cloud_list) create_fresh_document(ctx);
  return true;
}

int rebase_app_list_info(backup_context *ctx, const char *model_name, const char *serial) {
  const CString text = std::move(ctx->cloud_app_list_text);
  const list_text list = take_list_apart(text.get(), kModelList);

  ctx->app_list_root.reset(generate_new_json_tokener_parser(ctx, list.frame.c_str()));
  own_entry own;
  bool too_deep = false;
  if (!ctx->app_list_root) {
    parse_whole_json(list.frame, JSON_TOKENER_DEFAULT_DEPTH, &too_deep);
  } else if (!find_own_entry(list, serial, &own, &too_deep)) {
    release_json_resource_of_app_list(ctx);
  }
  if (!ctx->app_list_root) {
    LOGI("json token error");
    ctx->keep_cloud_list = too_deep;
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

  for (std::size_t i = 0; i < list.entries.size(); ++i) {
    if (own.entry && own.index == i) continue;
    json_object_array_put_idx(ctx->model_list, i, new_json_from_text(list.entries[i]));
  }
  if (!own.entry) {
    add_model_entry(ctx, model_name, serial);
    return QUARN_OK;
  }

  ctx->model_entry = own.entry.release();
  ctx->json_objects.push_back(ctx->model_entry);
  json_object_array_put_idx(ctx->model_list, own.index, ctx->model_entry);
  get_previous_package_list_info(ctx, own.packages);
  ctx->backup_info = member(ctx->model_entry, kBackupInfo, json_type_object);
  set_timestamp(ctx->backup_info);
  json_object_object_del(ctx->model_entry, kPkgList);
  ctx->pkg_list = generate_new_json_array(ctx);
  json_object_object_add(ctx->model_entry, kPkgList, ctx->pkg_list);
  return QUARN_OK;
}

void get_previous_package_list_info(backup_context *ctx,
                                    const std::vector<std::string_view> &packages) {
  LOGI("get_previous_package_list_info");
  if (packages.empty()) {
    LOGI("no previous package list in old app list");
    return;
  }
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

void add_pkg_info_to_app_list(backup_context *ctx, const char *pkg_id, const char *version,
                              int crc) {
  if (ctx->pkg_list == nullptr) return;
  JsonPtr package(json_object_new_object());
  json_object_object_add(package.get(), kPkgId, json_object_new_string(pkg_id));
  json_object_object_add(package.get(), kVersion, json_object_new_string(version));
  json_object_object_add(package.get(), kCrc, json_object_new_int(crc));
  // As text it takes a tenth of the memory until the run ends.
  json_object *text = new_json_from_text(json_object_get_string(package.get()));
  json_object_array_add(ctx->pkg_list, text != nullptr ? text : package.release());
}

bool save_app_list_to_file(backup_context *ctx) {
  const std::string path = ctx->for_pellix ? companion_list_path() : kLocalAppListPath;
  bool saved = false;
  if (ctx->app_list_root && (ctx->for_pellix || prepare_staging_directory())) {
    if (!prepare_file(path)) {
      LOGE("cannot create app list file %s", path.c_str());
    } else {
      const char *text = json_object_get_string(ctx->app_list_root.get());
      saved = text != nullptr && write_string_to_file(text, path) == QUARN_OK;
    }
  }
  // half a list, or one of another run, must not be taken for this run's
  if (!saved) delete_staged_file(path);
  release_json_resource_of_app_list(ctx);
  return saved;
}

void release_json_resource_of_app_list(backup_context *ctx) {
  ctx->app_list_root.reset();
  ctx->model_list = nullptr;
  ctx->model_entry = nullptr;
  ctx->backup_info = nullptr;
  ctx->pkg_list = nullptr;
  ctx->app_data_path = nullptr;
  ctx->json_objects.clear();
  ctx->cloud_app_list_text.reset();
}
