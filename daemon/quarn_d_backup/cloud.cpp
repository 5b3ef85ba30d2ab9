#include <glib.h>
#include <sys/stat.h>

#include <atomic>
#include <cassert>
#include <cerrno>
#include <cstdint>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include "backup_transport.h"
#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/list_bound.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_backup/single_upload.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

constexpr char kWaitedForSuffix[] = ".waited_for.";
/** How often an upload is begun again that was aborted for somebody else's sake. */
constexpr int kMaxTimesAborted = 8;
/**
 * Folders that one run deletes, and children that it takes from one listing: no device leaves more
 * behind between two runs, but a server may say so, and each request has its memory and time.
 */
constexpr unsigned int kMaxDeletions = 500;
constexpr std::size_t kMaxChildren = 10000;

/** A transfer of the application list. */
struct app_list_transfer {
  BackupContextPtr ctx;
  std::string local_path;
  std::string remote_path;
};

/** The upload of one archive. */
struct app_data_upload {
  BackupContextPtr ctx;
  std::string pkg_id;
  std::string local_path;
  std::string remote_path;
  std::uint64_t size = 0;
  int times_aborted = 0;
};

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

/** What differs between the clean-up of packages and that of versions. */
struct cleanup_kind {
  std::atomic<std::int32_t> backup_context::*listings_pending;
  std::atomic<std::int32_t> backup_context::*deletions_pending;
  backup_trans_child_list_cb list_callback;
  backup_trans_delete_cb delete_callback;
};

// Folders that per-application requests filled since the run looked at the
// packages: the run's list does not know them.
std::mutex single_uploads_mutex;
std::set<std::string> &single_uploads() {
  static auto *folders = new std::set<std::string>;
  return *folders;
}

void note_single_upload(const std::string &serial, const std::string &pkg_id,
                        const std::string &version) {
  const std::lock_guard<std::mutex> lock(single_uploads_mutex);
  single_uploads().insert(cloud_package_folder(serial, pkg_id));
  single_uploads().insert(cloud_version_folder(serial, pkg_id, version));
}

bool uploaded_by_single_request(const std::string &folder) {
  const std::lock_guard<std::mutex> lock(single_uploads_mutex);
  return single_uploads().count(folder) != 0;
}

/** The first failure stays: a cancelled run's late answers do not change its result. */
void set_result_once(backup_context *ctx, std::int32_t code) {
  std::int32_t expected = QUARN_OK;
  ctx->result.compare_exchange_strong(expected, code);
}

bool read_app_list_file(const std::string &path, CString *text) {
  if (staged_file_size(path) <= kMaxAppListSize && read_data_from_file(path.c_str(), out(*text))) {
    return true;
  }
  LOGE("cannot read app list file...");
  return false;
}

request_cause cause_of_unread_list(const std::string &path) {
  return staged_file_size(path) > kMaxAppListSize ? request_cause::list_too_large
                                                  : request_cause::list_unreadable;
}

/** A run of one package ends with its upload. */
void note_single_end(backup_context *ctx) {
  if (ctx->single_package) note_request_end(notes_of(ctx).cause);
}

void __get_app_list_from_cloud_cb(backup_trans_error_code error, void *user_data, char *) {
  const std::unique_ptr<app_list_transfer> record(static_cast<app_list_transfer *>(user_data));
  if (record == nullptr) {
    LOGE("cb user_data is NULL...");
    assert(user_data != nullptr);
    return;
  }
  backup_context *ctx = record->ctx.get();
  CString text;
  bool checked = false;
  if (error == BACKUP_TRANS_ERROR_NONE) {
    LOGI("success : get app list file from cloud");
    checked = read_app_list_file(record->local_path, &text);
    if (!checked) note_cause(ctx, cause_of_unread_list(record->local_path));
  } else if (error == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) {
    LOGI("app list file is not exist in cloud");
    checked = true;
  } else {
    LOGE("backup_trans_download_file_ors failed... %d", error);
    note_cause(ctx, error == BACKUP_TRANS_ERROR_TOO_LARGE
                        ? request_cause::list_too_large
                        : cause_of_transfer(error, record->local_path));
  }
  // nobody waits for an abandoned run's list
  if (!ctx->abandoned) ctx->cloud_app_list_text = std::move(text);
  ctx->app_list_checked = checked;
  delete_staged_file(record->local_path);
  ctx->app_list_downloading = false;
}

void __upload_app_data_resp_cb(backup_trans_error_code error, void *user_data,
                               const backup_trans_file_info_s *info);

/** Hand the upload to the transport, which has the record then. */
int request_upload(std::unique_ptr<app_data_upload> &record) {
  // The archive lies in its application's folder. The transport opens it while it is held here.
  const UniqueFd archive = open_working_file(record->local_path);
  struct stat status = {};
  if (!archive || fstat(archive.get(), &status) != 0) {
    if (errno == ESTALE) {
      LOGE("archive of (%s) was exchanged, so it is not sent", record->pkg_id.c_str());
    }
    return BACKUP_TRANS_ERROR_LOCAL_FILE;
  }
  record->size = static_cast<std::uint64_t>(status.st_size);
  const std::string held = own_fd_path(archive.get());
  // before the request: on the worker its answer may be here first
  backup_context *const single = record->ctx->single_package ? record->ctx.get() : nullptr;
  if (single != nullptr) notes_of(single).single_upload = record.get();
  const int ret = backup_trans_upload_file_ors_async(
      cloud_handler(), held.c_str(), record->remote_path.c_str(), __upload_app_data_resp_cb,
      _get_current_timestamp(), BACKUP_TRANS_OPTION_NONE, record.get(), nullptr);
  if (ret == BACKUP_TRANS_ERROR_NONE) {
    static_cast<void>(record.release());
  } else if (single != nullptr) {
    notes_of(single).single_upload = nullptr;
  }
  return ret;
}

/**
 * The transport aborts everything at once, also what others wait for: the
 * upload of a request that still stands is begun again.
 */
bool begin_upload_again(std::unique_ptr<app_data_upload> &record) {
  const backup_context *ctx = record->ctx.get();
  if (!ctx->single_package || ctx->abandoned || wifi_connected() == 0) return false;
  if (++record->times_aborted > kMaxTimesAborted) return false;
  const std::string pkg_id = record->pkg_id;
  if (request_upload(record) != BACKUP_TRANS_ERROR_NONE) return false;
  LOGI("upload of (%s) was aborted with others, so it is requested again", pkg_id.c_str());
  return true;
}

void __upload_app_data_resp_cb(backup_trans_error_code error, void *user_data,
                               const backup_trans_file_info_s *) {
  std::unique_ptr<app_data_upload> record(static_cast<app_data_upload *>(user_data));
  if (record == nullptr) {
    LOGE("cb user_data is NULL...");
    assert(user_data != nullptr);
    return;
  }
  if (error == BACKUP_TRANS_ERROR_CANCELLED && begin_upload_again(record)) return;
  backup_context *ctx = record->ctx.get();
  if (ctx->single_package) notes_of(ctx).single_upload = nullptr;
  backup_outcome outcome = backup_outcome::uploaded;
  if (error == BACKUP_TRANS_ERROR_NONE) {
    LOGI("backup trans success : upload for (%s)", record->pkg_id.c_str());
    ctx->bytes_uploaded += record->size;
  } else {
    LOGE("upload app data of (%s) failed...err_code[%d]", record->pkg_id.c_str(), error);
    outcome = backup_outcome::upload_failed;
    note_cause(ctx, cause_of_transfer(error, record->local_path));
    set_result_once(ctx, QUARN_TRANSFER_FAILED);
  }
  note_single_end(ctx);
  ++ctx->uploads_answered;
  report_progress(ctx, backup_stage::uploading, record->pkg_id.c_str(), outcome, record->size);
  delete_staged_file(record->local_path);
  release_staged_archive(ctx, record->pkg_id);
  if (--ctx->upload_remain == 0 && ctx->single_package) {
    GMainLoop *loop = ctx->wait_loop.exchange(nullptr);
    if (loop != nullptr) {
      g_main_loop_quit(loop);
      g_main_loop_unref(loop);
    }
  }
}

void __upload_app_list_resp_cb(backup_trans_error_code error, void *user_data,
                               const backup_trans_file_info_s *) {
  const std::unique_ptr<app_list_transfer> record(static_cast<app_list_transfer *>(user_data));
  if (record == nullptr) {
    LOGE("cb user_data is NULL...");
    assert(user_data != nullptr);
    return;
  }
  backup_context *ctx = record->ctx.get();
  if (error == BACKUP_TRANS_ERROR_NONE) {
    LOGI("backup trans success : app list upload");
    notes_of(ctx).list_written = true;
  } else {
    LOGE("__upload_app_list_resp_cb failed...err_code[%d]", error);
    note_cause(ctx, cause_of_transfer(error, record->local_path));
    set_result_once(ctx, QUARN_TRANSFER_FAILED);
  }
  delete_staged_file(record->local_path);
  ctx->app_list_uploading = false;
}

// The callbacks' own names are in their messages, so each is spelled out.

void log_removed(const backup_trans_file_info_s *info) {
  if (info != nullptr && info->path != nullptr) LOGI("[%s] was removed from cloud", info->path);
}

void log_not_removed(const backup_trans_file_info_s *info) {
  if (info != nullptr && info->path != nullptr) LOGE("fail to remove [%s] from cloud", info->path);
}

void __backup_trans_delete_pgk_cb(backup_trans_error_code error, void *user_data,
                                  const backup_trans_file_info_s *info) {
  const BackupContextPtr ctx(static_cast<backup_context *>(user_data));
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
  const BackupContextPtr ctx(static_cast<backup_context *>(user_data));
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
  const int ret = backup_trans_delete_folder_ors_async(cloud_handler(), folder.c_str(), held.get(),
                                                       kind.delete_callback);
  if (ret == BACKUP_TRANS_ERROR_NONE) {
    static_cast<void>(held.release());
    return;
  }
  LOGE("backup_trans_delete_folder_ors_async failed... %d", ret);
  ctx->cleanup_result = QUARN_TRANSFER_FAILED;
  --(ctx->*kind.deletions_pending);
}

/** Request the next page; the record ends here when that is refused. */
void request_listing(std::unique_ptr<cleanup_listing> record, const cleanup_kind &kind) {
  backup_context *ctx = record->ctx.get();
  const int start = static_cast<int>(record->children.size());
  const int ret = backup_trans_get_folder_child_list_async(
      cloud_handler(), record->folder.c_str(), start, BACKUP_TRANS_MAX_LIST_COUNT,
      BACKUP_TRANS_OPTION_NONE, record.get(), kind.list_callback);
  if (ret == BACKUP_TRANS_ERROR_NONE) {
    static_cast<void>(record.release());
    return;
  }
  LOGE("backup_trans_get_folder_child_list_async failed... %d", ret);
  ctx->cleanup_result = QUARN_TRANSFER_FAILED;
  --(ctx->*kind.listings_pending);
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
  std::unique_ptr<cleanup_listing> record(static_cast<cleanup_listing *>(user_data));
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
      request_listing(std::move(record), kPackageCleanup);
      return;
    }
    LOGI("clean up cloud items start");
    delete_listed_folders(*record, kPackageCleanup);
    LOGI("clean up cloud items end");
  }
  --ctx->serial_clean_pending;
}

void __backup_trans_pkg_child_list_resp_cb(backup_trans_error_code error, void *user_data,
                                           const backup_trans_child_list_s *list) {
  std::unique_ptr<cleanup_listing> record(static_cast<cleanup_listing *>(user_data));
  if (record == nullptr) {
    LOGE("_cloud_clean_info is NULL...");
    assert(user_data != nullptr);
    return;
  }
  backup_context *ctx = record->ctx.get();
  if (error != BACKUP_TRANS_ERROR_NONE) {
    LOGE("__backup_trans_pkg_child_list_resp_cb error : %d!", error);
    ctx->cleanup_result = QUARN_LIST_CHECK_FAILED;
  } else if (!ctx->abandoned) {
    if (collect_page(record.get(), list)) {
      request_listing(std::move(record), kVersionCleanup);
      return;
    }
    delete_listed_folders(*record, kVersionCleanup);
    LOGI("clean up cloud end");
  }
  --ctx->version_list_pending;
}

}  // namespace

void abandon_single_upload(backup_context *ctx) {
  ctx->abandoned = true;
  void *const upload = notes_of(ctx).single_upload;
  if (upload != nullptr && abort_transfer(upload)) {
    LOGI("upload of (%s) is ended, for nobody waits for it", ctx->cur_pkg_id.c_str());
  }
}

void forget_single_uploads() {
  const std::lock_guard<std::mutex> lock(single_uploads_mutex);
  single_uploads().clear();
}

int get_app_list_from_cloud(backup_context *ctx) {
  // Held to the run's last callback: a list or a deletion of an abandoned run
  // must not come in between.
  if (!acquire_staged_archive(ctx, kStagedListLease)) return QUARN_LIST_CHECK_FAILED;
  if (!prepare_staging_directory()) {
    note_cause(ctx, cause_of_local_file(kLocalAppListPath));
    return QUARN_LIST_CHECK_FAILED;
  }
  auto record = std::make_unique<app_list_transfer>();
  record->ctx = share_backup_context(ctx);
  record->local_path = kLocalAppListPath;
  record->remote_path = kCloudAppListPath;
  ctx->app_list_downloading = true;
  const int ret = download_bounded_async(record->remote_path.c_str(), record->local_path.c_str(),
                                         record.get(), __get_app_list_from_cloud_cb,
                                         BACKUP_TRANS_OPTION_BASIS, kMaxAppListSize);
  if (ret == BACKUP_TRANS_ERROR_NONE) {
    static_cast<void>(record.release());
    return QUARN_OK;
  }
  LOGE("backup_trans_download_file_ors_async failed... %d", ret);
  note_cause(ctx, cause_of_transfer(ret, record->local_path));
  ctx->app_list_downloading = false;
  if (ctx->cloud_app_list_text) ctx->cloud_app_list_text.get()[0] = '\0';
  delete_staged_file(record->local_path);
  return QUARN_LIST_CHECK_FAILED;
}

int download_app_list_info_from_cloud(char **text) {
  static std::atomic<unsigned int> requests{0};
  *text = nullptr;
  if (!prepare_staging_directory()) return QUARN_LIST_CHECK_FAILED;
  // a run may have its own list staged at this very moment
  const std::string path =
      std::string(kLocalAppListPath) + kWaitedForSuffix + std::to_string(++requests);
  int ret =
      download_bounded(kCloudAppListPath, path.c_str(), BACKUP_TRANS_OPTION_NONE, kMaxAppListSize);
  if (ret == BACKUP_TRANS_ERROR_NONE) {
    CString content;
    if (read_app_list_file(path, &content)) {
      *text = content.release();
    } else {
      ret = QUARN_LIST_CHECK_FAILED;
    }
  } else if (ret == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) {
    LOGI("app list file is not exist in cloud");
  } else {
    LOGE("backup_trans_download_file_ors failed... %d", ret);
  }
  delete_staged_file(path);
  return ret;
}

void upload_app_data(backup_context *ctx, const char *pkg_id, const char *root_path,
                     const char *version) {
  auto record = std::make_unique<app_data_upload>();
  record->ctx = share_backup_context(ctx);
  record->pkg_id = pkg_id;
  record->local_path = staged_archive_path(root_path, pkg_id);
  record->remote_path = cloud_archive(ctx->serial_number, pkg_id, version);
  record->size = staged_file_size(record->local_path);
  if (ctx->single_package) {
    note_single_upload(ctx->serial_number, pkg_id, version);
    ++ctx->uploads_total;
  }
  LOGI("request upload for (%s)", pkg_id);
  ++ctx->upload_remain;
  // all three become names in the cloud
  const bool nameable = is_safe_path_component(ctx->serial_number) &&
                        is_safe_path_component(record->pkg_id) && is_safe_path_component(version);
  const int ret = nameable ? request_upload(record) : BACKUP_TRANS_ERROR_ARGUMENT;
  if (ret == BACKUP_TRANS_ERROR_NONE) return;
  LOGE("backup_trans_upload_file_ors_async failed... %d", ret);
  // with the package its staged archive goes
  const bool removed = !is_directory(root_path);
  note_cause(ctx, removed ? request_cause::removed : cause_of_transfer(ret, record->local_path));
  delete_staged_file(record->local_path);
  set_result_once(ctx, QUARN_TRANSFER_FAILED);
  note_single_end(ctx);
  release_staged_archive(ctx, record->pkg_id);
  ++ctx->uploads_answered;
  report_progress(ctx, backup_stage::uploading, pkg_id,
                  removed ? backup_outcome::removed : backup_outcome::upload_failed, record->size);
  --ctx->upload_remain;
}

int upload_app_list(backup_context *ctx) {
  auto record = std::make_unique<app_list_transfer>();
  record->ctx = share_backup_context(ctx);
  record->local_path = kLocalAppListPath;
  record->remote_path = kCloudAppListPath;
  // before the request: its answer may be here first
  ctx->app_list_uploading = true;
  const int ret = backup_trans_upload_file_ors_async(
      cloud_handler(), record->local_path.c_str(), record->remote_path.c_str(),
      __upload_app_list_resp_cb, _get_current_timestamp(), BACKUP_TRANS_OPTION_NONE, record.get(),
      nullptr);
  if (ret == BACKUP_TRANS_ERROR_NONE) {
    static_cast<void>(record.release());
    return 1;
  }
  LOGE("backup_trans_upload_file_ors_async failed... %d", ret);
  note_cause(ctx, cause_of_transfer(ret, record->local_path));
  delete_staged_file(record->local_path);
  set_result_once(ctx, QUARN_TRANSFER_FAILED);
  ctx->app_list_uploading = false;
  return 1;
}

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
  request_listing(std::move(record), kPackageCleanup);
}

void delete_other_pkg_version_in_cloud(backup_context *ctx) {
  if (notes_of(ctx).keep_all_listed) return;
  for (const pkg_information &package : ctx->upload_list) {
    delete_other_version_in_cloud(ctx, ctx->serial_number, package.pkg_id, package.version);
  }
}

void delete_other_version_in_cloud(backup_context *ctx, const std::string &serial,
                                   const std::string &pkg_id, const std::string &version) {
  auto record = std::make_unique<cleanup_listing>();
  record->ctx = share_backup_context(ctx);
  record->folder = cloud_package_folder(serial, pkg_id) + "/";
  record->package = pkg_id;
  record->keep.insert(cloud_version_folder(serial, pkg_id, version));
  ++ctx->version_list_pending;
  request_listing(std::move(record), kVersionCleanup);
}
