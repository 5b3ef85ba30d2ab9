#include <fcntl.h>
#include <json-c/json.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/list_bound.h"
#include "quarn_d_backup/model_entries.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/write_text.h"
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
// Each takes more memory than its text.
constexpr std::size_t kMaxDevices = 4096;

constexpr mode_t kPrivateFile = 0600;

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

/** Create the file where it is for us alone, or see that it is a plain one of ours. */
bool prepare_file(const std::string &path) {
  const UniqueFd fd = safe_open(path.c_str(), O_WRONLY | O_CREAT | O_NONBLOCK, kPrivateFile);
  struct stat status = {};
  return fd && fstat(fd.get(), &status) == 0 && S_ISREG(status.st_mode) && status.st_nlink == 1 &&
         fchmod(fd.get(), kPrivateFile) == 0;
}

/** Whether the list's text may be written: what is written must be readable again. */
bool fits_bound(backup_context *ctx, std::uint64_t size) {
  run_notes &notes = notes_of(ctx);
  notes.list_size = size;
  notes.list_too_large = size > kMaxAppListSize;
  if (notes.list_too_large) {
    LOGE("app list would have %llu bytes, but at the most %llu can be read again",
         static_cast<unsigned long long>(size), static_cast<unsigned long long>(kMaxAppListSize));
    note_cause(ctx, request_cause::list_too_large);
    return false;
  }
  if (size >= kNearlyFullAppListSize) {
    LOGW("app list is nearly full : %llu of %llu bytes", static_cast<unsigned long long>(size),
         static_cast<unsigned long long>(kMaxAppListSize));
    report_notice(ctx, "list-nearly-full", size, kMaxAppListSize);
  }
  return true;
}

/** Write the document's text. @return true when the file is whole */
bool write_document(backup_context *ctx, const std::string &path) {
  const char *text = json_object_get_string(ctx->app_list_root.get());
  if (text == nullptr || !fits_bound(ctx, std::strlen(text))) return false;
  if (!prepare_file(path)) {
    LOGE("cannot create app list file %s", path.c_str());
    return false;
  }
  return write_text_to_file(text, path) == QUARN_OK;
}

/**
 * Make the document of @p text anew, with what is claimed and not in it.
 * @return false when that is no list of ours
 */
bool amend_document(backup_context *ctx, CString text) {
  // a rebase reads the text's own entries as the previous ones
  std::vector<pkg_information> previous;
  previous.swap(ctx->previous_pkg_list);
  ctx->cloud_app_list_text = std::move(text);
  rebase_app_list_info(ctx, ctx->model_name.c_str(), ctx->serial_number.c_str());
  previous.swap(ctx->previous_pkg_list);
  if (!ctx->app_list_root) return false;
  notes_of(ctx).listed.clear();
  for (const pkg_information &entry : previous) {
    add_pkg_info_to_app_list(ctx, entry.pkg_id.c_str(), entry.version.c_str(), entry.crc);
  }
  return true;
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
  bool beyond = false;
  notes_of(ctx).list_understood = false;
  if (!ctx->app_list_root) {
    parse_whole_json(list.frame, JSON_TOKENER_DEFAULT_DEPTH, &beyond);
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

void add_pkg_info_to_app_list(backup_context *ctx, const char *pkg_id, const char *version,
                              int crc) {
  if (ctx->pkg_list == nullptr) return;
  if (!ctx->for_pellix) notes_of(ctx).listed.insert(listed_key(pkg_id, version));
  JsonPtr package(json_object_new_object());
  json_object_object_add(package.get(), kPkgId, json_object_new_string(pkg_id));
  json_object_object_add(package.get(), kVersion, json_object_new_string(version));
  json_object_object_add(package.get(), kCrc, json_object_new_int(crc));
  // As text it takes a tenth of the memory until the run ends.
  json_object *text = new_json_from_text(json_object_get_string(package.get()));
  json_object_array_add(ctx->pkg_list, text != nullptr ? text : package.release());
}

bool save_app_list_to_file(backup_context *ctx) {
  const std::string path = ctx->for_pellix ? companion_list() : kLocalAppListPath;
  bool saved = false;
  if (!ctx->app_list_root) {
    note_cause(ctx, request_cause::list_foreign);
  } else if (ctx->for_pellix || prepare_staging_directory()) {
    saved = write_document(ctx, path);
  }
  // before what takes the room is deleted
  if (!saved) note_cause(ctx, cause_of_local_file(path));
  // half a list, or one of another run, must not be taken for this run's
  if (!saved) delete_staged_file(path);
  notes_of(ctx).list_staged = saved;
  release_json_resource_of_app_list(ctx);
  return saved;
}

std::string listed_key(const std::string &pkg_id, const std::string &version) {
  return pkg_id + '/' + version;
}

bool claimed_package_is_missing(backup_context *ctx) {
  const std::vector<std::string> claimed = claimed_packages(ctx->serial_number);
  if (claimed.empty()) return false;
  const std::set<std::string> &listed = notes_of(ctx).listed;
  return std::any_of(ctx->previous_pkg_list.begin(), ctx->previous_pkg_list.end(),
                     [&](const auto &previous) {
                       return std::binary_search(claimed.begin(), claimed.end(), previous.pkg_id) &&
                              listed.count(listed_key(previous.pkg_id, previous.version)) == 0;
                     });
}

bool add_claimed_packages_to_list(backup_context *ctx, CString text) {
  if (!amend_document(ctx, std::move(text))) return false;
  for (const pkg_information &previous : ctx->previous_pkg_list) {
    if (claim_on_archive(ctx->serial_number, previous.pkg_id) == archive_claim::none ||
        notes_of(ctx).listed.count(listed_key(previous.pkg_id, previous.version)) != 0) {
      continue;
    }
    LOGI("(%s) stays in the list : a restore is to have it", previous.pkg_id.c_str());
    add_pkg_info_to_app_list(ctx, previous.pkg_id.c_str(), previous.version.c_str(), previous.crc);
    ctx->unexamined_pkg_ids.push_back(previous.pkg_id);
  }
  return save_app_list_to_file(ctx);
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
