#include "quarn_d_backup/list_transfer.h"

#include <atomic>
#include <cassert>
#include <memory>
#include <string>

#include "backup_transport.h"
#include "files/package_files.h"
#include "quarn_common.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/list_bound.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_backup/transport_record.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

constexpr char kWaitedForSuffix[] = ".waited_for.";

/** A transfer of the application list. */
struct app_list_transfer {
  BackupContextPtr ctx;
  std::string local_path;
};
using TransferPtr = std::unique_ptr<app_list_transfer>;

/** A transfer of the run's staged list. */
TransferPtr new_transfer(backup_context *ctx) {
  auto record = std::make_unique<app_list_transfer>();
  record->ctx = share_backup_context(ctx);
  record->local_path = kLocalAppListPath;
  return record;
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

void __get_app_list_from_cloud_cb(backup_trans_error_code error, void *user_data, char *) {
  const auto record = take_back<TransferPtr>(user_data);
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

void __upload_app_list_resp_cb(backup_trans_error_code error, void *user_data,
                               const backup_trans_file_info_s *) {
  const auto record = take_back<TransferPtr>(user_data);
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

}  // namespace

int get_app_list_from_cloud(backup_context *ctx) {
  // Held to the run's last callback: a list or a deletion of an abandoned run
  // must not come in between.
  if (!acquire_staged_archive(ctx, kStagedListLease)) return QUARN_LIST_CHECK_FAILED;
  if (!prepare_staging_directory()) {
    note_cause(ctx, cause_of_local_file(kLocalAppListPath));
    return QUARN_LIST_CHECK_FAILED;
  }
  TransferPtr record = new_transfer(ctx);
  ctx->app_list_downloading = true;
  const int ret = hand_to_transport(record, [](void *user_data) {
    return download_bounded_async(kCloudAppListPath, kLocalAppListPath, user_data,
                                  __get_app_list_from_cloud_cb, BACKUP_TRANS_OPTION_BASIS,
                                  kMaxAppListSize);
  });
  if (ret == BACKUP_TRANS_ERROR_NONE) return QUARN_OK;
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

int upload_app_list(backup_context *ctx) {
  TransferPtr record = new_transfer(ctx);
  // before the request: its answer may be here first
  ctx->app_list_uploading = true;
  const int ret = hand_to_transport(record, [](void *user_data) {
    return backup_trans_upload_file_ors_async(cloud_handler(), kLocalAppListPath, kCloudAppListPath,
                                              __upload_app_list_resp_cb, _get_current_timestamp(),
                                              BACKUP_TRANS_OPTION_NONE, user_data, nullptr);
  });
  if (ret == BACKUP_TRANS_ERROR_NONE) return 1;
  LOGE("backup_trans_upload_file_ors_async failed... %d", ret);
  note_cause(ctx, cause_of_transfer(ret, record->local_path));
  delete_staged_file(record->local_path);
  set_result_once(ctx, QUARN_TRANSFER_FAILED);
  ctx->app_list_uploading = false;
  return 1;
}
