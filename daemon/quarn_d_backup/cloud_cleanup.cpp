#include "quarn_d_backup/cloud_cleanup.h"

#include <atomic>
#include <cassert>
#include <cstdint>
#include <memory>
#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

#include "backup_transport.h"
#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/kept_packages.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/single_folders.h"
#include "quarn_d_backup/transport_record.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_log.h"

namespace {

/**
 * Folders that one run deletes, and children that it takes from one listing: no device leaves more
 * behind between two runs, but a server may say so, and each request has its memory and time.
 */
constexpr unsigned int kMaxDeletions = 500;
constexpr std::size_t kMaxChildren = 10000;
/** Packages whose versions are listed at a time: each listing has its memory until it is answered.
 */
constexpr int kMaxListings = 64;

struct folder_child {
  std::string path;
  bool is_file;
};

/** One clean-up: the listing of a folder, and what of it stays. */
struct cleanup_listing {
  BackupContextPtr ctx;
  std::string folder;   // ends with "/"
  std::string package;  // whose versions these are; empty for a clean-up of packages
  std::unordered_set<std::string> keep;
  std::vector<folder_child> children;  // of the pages so far
};

using ListingPtr = std::unique_ptr<cleanup_listing>;

/** What differs between the clean-up of packages and that of versions. */
struct cleanup_kind {
  std::atomic<std::int32_t> backup_context::*listings_pending;
  std::atomic<std::int32_t> backup_context::*deletions_pending;
  backup_trans_child_list_cb list_callback;
  backup_trans_delete_cb delete_callback;
};

// The callbacks' own names are in their messages, so each is spelled out.

void log_removed(const backup_trans_file_info_s *info) {
  if (info != nullptr && info->path != nullptr) LOGI("[%s] was removed from cloud", info->path);
}

void log_not_removed(const backup_trans_file_info_s *info) {
  if (info != nullptr && info->path != nullptr) LOGE("fail to remove [%s] from cloud", info->path);
}

void __backup_trans_delete_pgk_cb(backup_trans_error_code error, void *user_data,
                                  const backup_trans_file_info_s *info) {
  const auto ctx = take_back<BackupContextPtr>(user_data);
  if (ctx == nullptr) {
    LOGE("_backup_context is NULL...");
    assert(user_data != nullptr);
    return;
  }
  if (error == BACKUP_TRANS_ERROR_NONE) {
    log_removed(info);
  } else {
    LOGE("__backup_trans_delete_pgk_cb error : %d!", error);
    ctx->cleanup_result = QUARN_LIST_CHECK_FAILED;
    log_not_removed(info);
  }
  --ctx->pkg_delete_pending;
}

void __backup_trans_delete_pgk_ver_cb(backup_trans_error_code error, void *user_data,
                                      const backup_trans_file_info_s *info) {
  const auto ctx = take_back<BackupContextPtr>(user_data);
  if (ctx == nullptr) {
    LOGE("_backup_context is NULL...");
    assert(user_data != nullptr);
    return;
  }
  if (error == BACKUP_TRANS_ERROR_NONE) {
    log_removed(info);
  } else {
    LOGE("__backup_trans_delete_pgk_ver_cb error : %d!", error);
    ctx->cleanup_result = QUARN_LIST_CHECK_FAILED;
    log_not_removed(info);
  }
  --ctx->version_delete_pending;
}

/** True for a direct child, so that no answer can lead out of the listed folder. */
bool is_child_of(const std::string &folder, const std::string &path) {
  return path.compare(0, folder.size(), folder) == 0 &&
         is_safe_path_component(path.substr(folder.size()));
}

void request_folder_deletion(backup_context *ctx, const cleanup_kind &kind,
                             const std::string &folder) {
  LOGI("request remove cloud folder [%s]", folder.c_str());
  ++(ctx->*kind.deletions_pending);
  BackupContextPtr held = share_backup_context(ctx);
  const int ret = hand_to_transport(held, [&folder, &kind](void *user_data) {
    return backup_trans_delete_folder_ors_async(cloud_handler(), folder.c_str(), user_data,
                                                kind.delete_callback);
  });
  if (ret == BACKUP_TRANS_ERROR_NONE) return;
  LOGE("backup_trans_delete_folder_ors_async failed... %d", ret);
  ctx->cleanup_result = QUARN_TRANSFER_FAILED;
  --(ctx->*kind.deletions_pending);
}

/** Request the next page; the record ends here when that is refused. @return false then */
bool request_listing(ListingPtr record, const cleanup_kind &kind) {
  backup_context *ctx = record->ctx.get();
  const int start = static_cast<int>(record->children.size());
  const char *const folder = record->folder.c_str();
  const int ret = hand_to_transport(record, [folder, start, &kind](void *user_data) {
    return backup_trans_get_folder_child_list_async(
        cloud_handler(), folder, start, BACKUP_TRANS_MAX_LIST_COUNT, BACKUP_TRANS_OPTION_NONE,
        user_data, kind.list_callback);
  });
  if (ret == BACKUP_TRANS_ERROR_NONE) return true;
  LOGE("backup_trans_get_folder_child_list_async failed... %d", ret);
  ctx->cleanup_result = QUARN_TRANSFER_FAILED;
  --(ctx->*kind.listings_pending);
  return false;
}

/** False for a package that a restore is to have, or that is there after all. */
bool may_remove(const cleanup_listing &record, const std::string &package) {
  if (claim_on_archive(record.ctx->serial_number, package) != archive_claim::none) {
    LOGI("(%s) stays in cloud : a restore is to have it", package.c_str());
    return false;
  }
  if (record.package.empty() && may_be_installed(package)) {
    LOGE("(%s) stays in cloud : it may be installed", package.c_str());
    return false;
  }
  return true;
}

/** Delete what does not stay. */
void delete_listed_folders(const cleanup_listing &record, const cleanup_kind &kind) {
  for (const folder_child &child : record.children) {
    if (child.is_file || record.keep.count(child.path) != 0) continue;
    if (!is_child_of(record.folder, child.path) || uploaded_by_single_request(child.path)) continue;
    const std::string name = child.path.substr(record.folder.size());
    if (!may_remove(record, record.package.empty() ? name : record.package)) continue;
    if (notes_of(record.ctx.get()).deletions++ >= kMaxDeletions) {
      LOGW("clean up of cloud folder [%s] goes on with the next backup", record.folder.c_str());
      return;
    }
    request_folder_deletion(record.ctx.get(), kind, child.path);
  }
}

/** Keep one page. @return true when there are more to be had */
bool collect_page(cleanup_listing *record, const backup_trans_child_list_s *list) {
  if (list == nullptr) return false;
  for (int i = 0; i < list->count; ++i) {
    const backup_trans_file_info_s &child = list->children[i];
    // an entry without a path still counts for where the next page starts
    std::string path = child.path != nullptr ? child.path : "";
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    record->children.push_back({std::move(path), child.is_file});
  }
  return list->more && list->count > 0 && record->children.size() < kMaxChildren;
}

void __backup_trans_serial_child_list_resp_cb(backup_trans_error_code error, void *user_data,
                                              const backup_trans_child_list_s *list);
void __backup_trans_pkg_child_list_resp_cb(backup_trans_error_code error, void *user_data,
                                           const backup_trans_child_list_s *list);

constexpr cleanup_kind kPackageCleanup = {
    &backup_context::serial_clean_pending, &backup_context::pkg_delete_pending,
    __backup_trans_serial_child_list_resp_cb, __backup_trans_delete_pgk_cb};
constexpr cleanup_kind kVersionCleanup = {
    &backup_context::version_list_pending, &backup_context::version_delete_pending,
    __backup_trans_pkg_child_list_resp_cb, __backup_trans_delete_pgk_ver_cb};

void __backup_trans_serial_child_list_resp_cb(backup_trans_error_code error, void *user_data,
                                              const backup_trans_child_list_s *list) {
  auto record = take_back<ListingPtr>(user_data);
  if (record == nullptr) {
    LOGE("_cloud_clean_info is NULL...");
    assert(user_data != nullptr);
    return;
  }
  backup_context *ctx = record->ctx.get();
  if (error != BACKUP_TRANS_ERROR_NONE) {
    LOGE("__backup_trans_serial_child_list_resp_cb error : %d!", error);
    ctx->cleanup_result = QUARN_LIST_CHECK_FAILED;
  } else if (!ctx->abandoned) {
    // a later run may have uploaded by now what an abandoned one would delete
    if (collect_page(record.get(), list)) {
      static_cast<void>(request_listing(std::move(record), kPackageCleanup));
      return;
    }
    LOGI("clean up cloud items start");
    delete_listed_folders(*record, kPackageCleanup);
    LOGI("clean up cloud items end");
  }
  --ctx->serial_clean_pending;
}

/** Begin the listing of the next uploaded package's versions, if one is left. Any thread. */
void list_next_versions(backup_context *ctx) {
  run_notes &notes = notes_of(ctx);
  while (true) {
    const std::size_t next = notes.versions_listed++;
    if (next >= notes.versions_to_list) return;
    const pkg_information &package = ctx->upload_list[next];
    const bool stands =
        !ctx->abandoned &&
        delete_other_version_in_cloud(ctx, ctx->serial_number, package.pkg_id, package.version);
    --ctx->version_list_pending;  // it was counted with all of them
    if (stands) return;
  }
}

void __backup_trans_pkg_child_list_resp_cb(backup_trans_error_code error, void *user_data,
                                           const backup_trans_child_list_s *list) {
  auto record = take_back<ListingPtr>(user_data);
  if (record == nullptr) {
    LOGE("_cloud_clean_info is NULL...");
    assert(user_data != nullptr);
    return;
  }
  const BackupContextPtr ctx = share_backup_context(record->ctx.get());
  if (error != BACKUP_TRANS_ERROR_NONE) {
    LOGE("__backup_trans_pkg_child_list_resp_cb error : %d!", error);
    ctx->cleanup_result = QUARN_LIST_CHECK_FAILED;
  } else if (!ctx->abandoned) {
    if (collect_page(record.get(), list)) {
      if (!request_listing(std::move(record), kVersionCleanup)) list_next_versions(ctx.get());
      return;
    }
    delete_listed_folders(*record, kVersionCleanup);
    LOGI("clean up cloud end");
  }
  list_next_versions(ctx.get());
  --ctx->version_list_pending;
}

}  // namespace

void delete_other_backup_items_in_cloud(backup_context *ctx) {
  if (!ctx->package_walk_complete) {
    LOGE("not every package could be examined, so no package is removed from cloud");
    return;
  }
  if (notes_of(ctx).keep_all_listed) {
    LOGI("no package is removed from cloud by an automatic backup of a device that was reset");
    return;
  }
  auto record = std::make_unique<cleanup_listing>();
  record->ctx = share_backup_context(ctx);
  record->folder = "/" + ctx->serial_number + "/";
  for (const pkg_information &package : ctx->current_pkg_list) {
    record->keep.insert(cloud_package_folder(ctx->serial_number, package.pkg_id));
  }
  for (const std::string &pkg_id : ctx->unexamined_pkg_ids) {
    record->keep.insert(cloud_package_folder(ctx->serial_number, pkg_id));
  }
  ++ctx->serial_clean_pending;
  static_cast<void>(request_listing(std::move(record), kPackageCleanup));
}

void delete_other_pkg_version_in_cloud(backup_context *ctx) {
  if (notes_of(ctx).keep_all_listed) return;
  run_notes &notes = notes_of(ctx);
  notes.versions_to_list = ctx->upload_list.size();
  ctx->version_list_pending += static_cast<std::int32_t>(notes.versions_to_list);
  for (int i = 0; i < kMaxListings; ++i) list_next_versions(ctx);
}

bool delete_other_version_in_cloud(backup_context *ctx, const std::string &serial,
                                   const std::string &pkg_id, const std::string &version) {
  auto record = std::make_unique<cleanup_listing>();
  record->ctx = share_backup_context(ctx);
  record->folder = cloud_package_folder(serial, pkg_id) + "/";
  record->package = pkg_id;
  record->keep.insert(cloud_version_folder(serial, pkg_id, version));
  ++ctx->version_list_pending;
  return request_listing(std::move(record), kVersionCleanup);
}
