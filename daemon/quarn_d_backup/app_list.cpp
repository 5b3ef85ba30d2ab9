#include "quarn_d_backup/app_list.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "json_ptr.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/list_bound.h"
#include "quarn_d_backup/list_keys.h"
#include "quarn_d_backup/list_rebase.h"
#include "quarn_d_backup/model_entries.h"
#include "quarn_d_backup/progress_report.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/write_text.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kPrivateFile = 0600;

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
