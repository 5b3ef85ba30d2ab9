#include <sys/stat.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_backup/package_trouble.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_crc.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_d_utils/zip_archive.h"
#include "quarn_log.h"
#include "rules/rules_file.h"

namespace {

constexpr int kMaxBackupMegabytes = kMaxBackupSize >> 20;
constexpr char kIndexSeparator = '/';  // in no id and no version

std::string crc_index_key(const std::string &pkg_id, const std::string &version) {
  return pkg_id + kIndexSeparator + version;
}

/** What a package says of itself. */
struct package_values {
  CString id;
  CString version;
  CString type;
  CString root;
};

/** Read the values in order; false at the first that is missing. */
bool read_package_values(package_info_h info, package_values *values) {
  int ret = package_info_get_package(info, out(values->id));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_package() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->id) {
    LOGE("pkg_id is NULL");
    return false;
  }
  ret = package_info_get_version(info, out(values->version));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_version() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->version) {
    LOGE("pkg_version is NULL");
    return false;
  }
  ret = package_info_get_type(info, out(values->type));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_type() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->type) {
    LOGE("pkg_type is NULL");
    return false;
  }
  ret = package_info_get_root_path(info, out(values->root));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_root_path() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->root) {
    LOGE("pkg_root_path is NULL");
    return false;
  }
  return true;
}

void enter_current_package(backup_context *ctx) {
  if (!ctx->current_pkg_list.empty() && ctx->current_pkg_list.back().pkg_id == ctx->cur_pkg_id) {
    return;
  }
  ctx->current_pkg_list.push_back({ctx->serial_number, ctx->cur_pkg_id, ctx->cur_version, "", 0});
}

/** Undo what the current package's archive brought about: the package will not be listed. */
void withdraw_current_package(backup_context *ctx) {
  if (!ctx->upload_list.empty() && ctx->upload_list.back().pkg_id == ctx->cur_pkg_id) {
    delete_staged_file(staged_archive_path(ctx->cur_root_path, ctx->cur_pkg_id));
    release_staged_archive(ctx, ctx->cur_pkg_id);
    ctx->upload_list.pop_back();
  }
  if (!ctx->current_pkg_list.empty() && ctx->current_pkg_list.back().pkg_id == ctx->cur_pkg_id) {
    ctx->current_pkg_list.pop_back();
  }
}

/** A package that is installed but cannot be examined now: its backup stays as it is. */
void keep_unexamined(backup_context *ctx, const char *pkg_id) {
  if (pkg_id != nullptr && is_safe_path_component(pkg_id)) {
    ctx->unexamined_pkg_ids.emplace_back(pkg_id);
  } else if (pkg_id == nullptr) {
    ctx->package_walk_complete = false;
  }
}

/** True when a package that the walk did not see keeps its entries all the same. */
bool stays_unseen(const backup_context *ctx, const std::string &pkg_id) {
  return !ctx->package_walk_complete || notes_of(ctx).keep_all_listed ||
         std::binary_search(ctx->unexamined_pkg_ids.begin(), ctx->unexamined_pkg_ids.end(),
                            pkg_id) ||
         claim_on_archive(ctx->serial_number, pkg_id) != archive_claim::none ||
         (notes_of(ctx).packages_seen == 0 &&
          is_directory((std::string(kAppsDir) + pkg_id).c_str())) ||
         may_be_installed(pkg_id);
}

/** True when a package that is listed keeps the entries of its other versions. */
bool keeps_other_versions(const backup_context *ctx, const std::string &pkg_id) {
  return notes_of(ctx).keep_all_listed ||
         claim_on_archive(ctx->serial_number, pkg_id) != archive_claim::none;
}

/**
 * What stays in the cloud stays in the list: the last list's entries of
 * packages that could not be examined, and of those that are to come back.
 */
void list_kept_packages(backup_context *ctx) {
  std::vector<std::string> seen;
  seen.reserve(ctx->current_pkg_list.size());
  for (const pkg_information &package : ctx->current_pkg_list) seen.push_back(package.pkg_id);
  std::sort(seen.begin(), seen.end());
  std::sort(ctx->unexamined_pkg_ids.begin(), ctx->unexamined_pkg_ids.end());
  std::vector<std::string> kept;
  for (const pkg_information &previous : ctx->previous_pkg_list) {
    const std::string &pkg_id = previous.pkg_id;
    if (notes_of(ctx).listed.count(listed_key(pkg_id, previous.version)) != 0) continue;
    const bool was_seen = std::binary_search(seen.begin(), seen.end(), pkg_id);
    if (was_seen ? !keeps_other_versions(ctx, pkg_id) : !stays_unseen(ctx, pkg_id)) continue;
    add_pkg_info_to_app_list(ctx, pkg_id.c_str(), previous.version.c_str(), previous.crc);
    kept.push_back(pkg_id);
  }
  ctx->unexamined_pkg_ids.insert(ctx->unexamined_pkg_ids.end(), kept.begin(), kept.end());
}

/** Whether the backup in the cloud is this device's own, as far as it knows. */
void look_for_unknown_backup(backup_context *ctx) {
  run_notes &notes = notes_of(ctx);
  const std::string &serial = ctx->serial_number;
  if (!notes.list_understood) return;
  if (!notes.serial_listed) {
    note_own_backup(serial);
  } else if (!ctx->is_manual && !knows_own_backup(serial)) {
    LOGI("backup in cloud is older than what this device knows of, so all of it is kept");
    note_found_backup();
    notes.keep_all_listed = true;
  }
}

void report_package(backup_context *ctx, backup_outcome outcome, std::uint64_t size = 0,
                    std::uint64_t limit = 0) {
  report_progress(ctx, backup_stage::archiving, ctx->cur_pkg_id.c_str(), outcome, size, limit);
}

void begin_package(backup_context *ctx, const package_values &values) {
  ++ctx->packages_examined;
  ctx->zip_made = false;
  ctx->cur_pkg_id = values.id.get();
  ctx->cur_version = values.version.get();
  ctx->cur_pkg_type = values.type.get();
  ctx->cur_root_path = values.root.get();
  ctx->cur_backup_enabled = true;
  ctx->cur_crc = 0;
}

/** Nothing is owed of what the cloud does not list. */
void settle_owed_archive(backup_context *ctx) {
  const std::string &serial = ctx->serial_number;
  if (look_for_owed_archive(serial, ctx->cur_pkg_id, ctx->cur_root_path) == archive_claim::none) {
    return;
  }
  bool this_version = false;
  bool others = false;
  for (const pkg_information &previous : ctx->previous_pkg_list) {
    if (previous.pkg_id != ctx->cur_pkg_id || previous.crc == 0) continue;
    (previous.version == ctx->cur_version ? this_version : others) = true;
  }
  if (this_version && owed_claim(serial, ctx->cur_pkg_id) == archive_claim::whole) return;
  if (others) {
    owe_other_versions(serial, ctx->cur_pkg_id, ctx->cur_root_path);
  } else {
    forget_owed_archive(serial, ctx->cur_pkg_id, ctx->cur_root_path);
  }
}

/** A package whose archive a restore is still to have is not backed up over it. */
bool leave_to_restore(backup_context *ctx) {
  if (ctx->for_pellix) return false;
  settle_owed_archive(ctx);
  if (claim_on_archive(ctx->serial_number, ctx->cur_pkg_id) != archive_claim::whole) {
    return false;
  }
  LOGI("backup of (%s) waits for its restore", ctx->cur_pkg_id.c_str());
  report_package(ctx, backup_outcome::restoring);
  keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
  return true;
}

/** A size that is too large may be that of a folder that cannot be measured. */
void report_oversize(backup_context *ctx, backup_outcome outcome, std::uint64_t size,
                     std::uint64_t limit) {
  const backup_outcome trouble =
      size < kUnmeasurableSize ? backup_outcome::none : find_package_trouble(ctx->cur_root_path);
  if (trouble == backup_outcome::none) {
    report_package(ctx, outcome, size, limit);
  } else {
    report_package(ctx, trouble);
  }
}

/** What a package is told to be whose archive failed. */
backup_outcome outcome_of(archive_bound bound) {
  switch (bound) {
    case archive_bound::none:
      break;
    case archive_bound::content:
      return backup_outcome::too_large;
    case archive_bound::members:
      return backup_outcome::too_many_files;
    case archive_bound::names:
      return backup_outcome::names_too_long;
    case archive_bound::table:
      return backup_outcome::table_too_large;
    case archive_bound::depth:
      return backup_outcome::too_deep;
  }
  return backup_outcome::unreadable;
}

/** make_app_data_zip() between taking the staged archive and settling what becomes of it. */
int make_staged_archive(backup_context *ctx, const std::string &archive_path) {
  if (app_data_storage_is_external(ctx->cur_pkg_id.c_str())) {
    LOGI("current storage of (%s) is external, so will not be backed up", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::external);
    return QUARN_SKIPPED;
  }
  const int skipped = check_current_backup_size(ctx);
  if (skipped != QUARN_OK) return skipped;

  int error = QUARN_OK;
  archive_excess excess;
  // What is summed up, measured and sent is what was made, whatever its name leads to by then.
  const UniqueFd archive = make_archive(ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str(),
                                        archive_path.c_str(), &error, kBackupBounds, &excess);
  if (error != QUARN_OK) {
    LOGE("fail to make zip data for %s", ctx->cur_pkg_id.c_str());
    delete_staged_file(archive_path);
    if (excess.bound != archive_bound::none) {
      report_package(ctx, outcome_of(excess.bound), excess.size, excess.limit);
      return QUARN_SKIPPED;
    }
    const backup_outcome trouble = find_package_trouble(ctx->cur_root_path);
    report_package(ctx, trouble == backup_outcome::none ? backup_outcome::unreadable : trouble);
    return error;
  }

  struct stat made = {};
  fstat(archive.get(), &made);
  const auto size = static_cast<std::uint64_t>(made.st_size);
  note_working_file(archive_path, archive.get());
  ctx->cur_crc = static_cast<std::int32_t>(get_open_file_crc(archive.get()));
  // 0 is what an unreadable archive and an unknown one have in common
  if (ctx->cur_crc != 0 && ctx->cur_crc == get_previous_crc_value(ctx)) {
    LOGI("same backup for (%s) already exist in cloud!(crc : %d)", ctx->cur_pkg_id.c_str(),
         ctx->cur_crc);
    delete_staged_file(archive_path);
    report_package(ctx, backup_outcome::unchanged, size);
    return QUARN_UNCHANGED;
  }
  LOGI("app data of (%s) was changed, so will be backed up", ctx->cur_pkg_id.c_str());
  ctx->bytes_to_upload += size;
  if (!ctx->single_package) add_to_app_data_upload_list(ctx);
  report_package(ctx, backup_outcome::none);
  return QUARN_OK;
}

}  // namespace

int check_current_backup_size(backup_context *ctx) {
  parse_backup_path_xml(ctx->cur_pkg_id.c_str(), ctx->cur_pkg_type.c_str(),
                        ctx->cur_root_path.c_str());
  if (!backup_rules_usable()) {
    LOGE("rules file of (%s) cannot be used, so will not backup data", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::unusable_rules);
    return QUARN_REFUSED;
  }
  const std::uint64_t size = get_app_backup_size(ctx);
  const std::uint64_t available = get_dir_available_size(ctx->cur_root_path.c_str());
  LOGI("app backup size : %llu, available space size : %llu", static_cast<unsigned long long>(size),
       static_cast<unsigned long long>(available));
  if (size > available) {
    LOGE("app backup size(=%llu) exceed available space size(=%llu), so can not backup data",
         static_cast<unsigned long long>(size), static_cast<unsigned long long>(available));
    report_oversize(ctx, backup_outcome::no_space, size, available);
    return QUARN_SKIPPED;
  }
  if (size > kMaxBackupSize) {
    LOGI("app backup size exceed %dMB, so will not backup data", kMaxBackupMegabytes);
    report_oversize(ctx, backup_outcome::too_large, size, kMaxBackupSize);
    return QUARN_SKIPPED;
  }
  return QUARN_OK;
}

int make_backup_items(backup_context *ctx) {
  forget_single_uploads();
  if (!create_app_list_info(ctx)) return QUARN_FAILED;
  look_for_unknown_backup(ctx);
  forget_owed_of_removed_packages();
  const int ret = package_manager_foreach_package_info(foreach_package_info_callback, ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
    ctx->package_walk_complete = false;
  }
  list_kept_packages(ctx);
  save_app_list_to_file(ctx);
  return notes_of(ctx).list_too_large ? QUARN_FAILED : QUARN_OK;
}

bool may_be_installed(const std::string &pkg_id) {
  PackageInfoPtr info;
  const int ret = package_manager_get_package_info(pkg_id.c_str(), out(info));
  if (ret == PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE) return false;
  if (ret != PACKAGE_MANAGER_ERROR_NONE) return true;
  bool preload = false;
  // a preloaded one is not backed up, so it is not missed either
  return info != nullptr &&
         !(package_info_is_preload_package(info.get(), &preload) == PACKAGE_MANAGER_ERROR_NONE &&
           preload);
}

bool foreach_package_info_callback(package_info_h info, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  ++notes_of(ctx).packages_seen;
  bool preload = false;
  int ret = package_info_is_preload_package(info, &preload);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_is_preload_package fail, err = [%d]", ret);
    keep_unexamined(ctx, nullptr);
    return true;
  }
  if (preload) return true;

  package_values values;
  if (!read_package_values(info, &values)) {
    keep_unexamined(ctx, values.id.get());
    return true;
  }
  if (!is_safe_path_component(values.id.get()) || !is_safe_path_component(values.version.get())) {
    LOGE("refused package with unsafe id or version : (%s), (%s)", values.id.get(),
         values.version.get());
    keep_unexamined(ctx, values.id.get());
    return true;
  }

  begin_package(ctx, values);
  if (leave_to_restore(ctx)) return true;

  ret = package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, check_backup_enabled, ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", ret);
    keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
    return true;
  }
  if (ctx->cur_backup_enabled) {
    LOGI("backup enabled for (%s)", ctx->cur_pkg_id.c_str());
  } else {
    LOGI("backup disabled for (%s)", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::disabled);
  }

  ret = package_info_foreach_app_from_package(
      info, PACKAGE_INFO_ALLAPP, ctx->for_pellix ? pellix_app_info_foreach_cb : app_info_foreach_cb,
      ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", ret);
    withdraw_current_package(ctx);
    keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
    return true;
  }
  if (ctx->abandoned) return false;
  enter_current_package(ctx);
  LOGI("add (%s) to package list", ctx->cur_pkg_id.c_str());
  add_pkg_info_to_app_list(ctx, ctx->cur_pkg_id.c_str(), ctx->cur_version.c_str(), ctx->cur_crc);
  return true;
}

bool check_backup_enabled(package_info_app_component_type_e, const char *app_id, void *user_data) {
  if (!backup_enabled_app(app_id)) {
    static_cast<backup_context *>(user_data)->cur_backup_enabled = false;
  }
  return true;
}

bool app_info_foreach_cb(package_info_app_component_type_e, const char *app_id, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  if (!ctx->cur_backup_enabled || ctx->zip_made) return true;
  ctx->zip_made = true;
  make_app_data_zip(ctx, app_id);
  return true;
}

int make_app_data_zip(backup_context *ctx, const char *) {
  if (!is_safe_path_component(ctx->cur_pkg_id) || !is_safe_path_component(ctx->cur_version)) {
    LOGE("refused package with unsafe id or version : (%s), (%s)", ctx->cur_pkg_id.c_str(),
         ctx->cur_version.c_str());
    return QUARN_REFUSED;
  }
  const std::string archive_path = staged_archive_path(ctx->cur_root_path, ctx->cur_pkg_id);
  enter_current_package(ctx);
  if (!acquire_staged_archive(ctx, ctx->cur_pkg_id)) return QUARN_REFUSED;
  int ret = QUARN_FAILED;
  run_on_thread_stack([&] { ret = make_staged_archive(ctx, archive_path); });
  if (ret != QUARN_OK) release_staged_archive(ctx, ctx->cur_pkg_id);
  return ret;
}

std::uint64_t get_app_backup_size(backup_context *ctx) {
  std::uint64_t size = 0;
  for (const std::string &dir : package_files(ctx->cur_pkg_id, ctx->cur_root_path).data_dirs()) {
    size += get_dir_backup_size(dir.c_str(), ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str());
  }
  return size;
}

int get_previous_crc_value(backup_context *ctx) {
  for (; ctx->previous_crc_indexed < ctx->previous_pkg_list.size(); ++ctx->previous_crc_indexed) {
    const pkg_information &previous = ctx->previous_pkg_list[ctx->previous_crc_indexed];
    ctx->previous_crc_index.emplace(crc_index_key(previous.pkg_id, previous.version), previous.crc);
  }
  const auto known = ctx->previous_crc_index.find(crc_index_key(ctx->cur_pkg_id, ctx->cur_version));
  return known != ctx->previous_crc_index.end() ? known->second : 0;
}

void add_to_app_data_upload_list(backup_context *ctx) {
  ctx->upload_list.push_back(
      {ctx->serial_number, ctx->cur_pkg_id, ctx->cur_version, ctx->cur_root_path, 0});
}
