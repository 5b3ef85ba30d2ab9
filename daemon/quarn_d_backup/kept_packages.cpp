#include "quarn_d_backup/kept_packages.h"

#include <algorithm>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"

namespace {

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

}  // namespace

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

void keep_unexamined(backup_context *ctx, const char *pkg_id) {
  if (pkg_id != nullptr && is_safe_path_component(pkg_id)) {
    ctx->unexamined_pkg_ids.emplace_back(pkg_id);
  } else if (pkg_id == nullptr) {
    ctx->package_walk_complete = false;
  }
}

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
