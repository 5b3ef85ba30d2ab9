#include "quarn_d_backup/archive_upload.h"

#include <glib.h>
#include <sys/stat.h>

#include <cassert>
#include <cerrno>
#include <cstdint>
#include <memory>
#include <string>

#include "backup_transport.h"
#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/progress_report.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/single_folders.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_backup/transport_record.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

/** How often an upload is begun again that was aborted for somebody else's sake. */
constexpr int kMaxTimesAborted = 8;

/** The upload of one archive. */
struct app_data_upload {
  BackupContextPtr ctx;
  std::string pkg_id;
  std::string local_path;
  std::string remote_path;
  std::uint64_t size = 0;
  int times_aborted = 0;
};
using UploadPtr = std::unique_ptr<app_data_upload>;

/** A run of one package ends with its upload. */
void note_single_end(backup_context *ctx) {
  if (ctx->single_package) note_request_end(notes_of(ctx).cause);
}

void __upload_app_data_resp_cb(backup_trans_error_code error, void *user_data,
                               const backup_trans_file_info_s *info);

/** Hand the upload to the transport, which has the record then. */
int request_upload(UploadPtr &record) {
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
  const char *const remote = record->remote_path.c_str();
  const int ret = hand_to_transport(record, [&held, remote](void *user_data) {
    return backup_trans_upload_file_ors_async(cloud_handler(), held.c_str(), remote,
                                              __upload_app_data_resp_cb, _get_current_timestamp(),
                                              BACKUP_TRANS_OPTION_NONE, user_data, nullptr);
  });
  if (ret != BACKUP_TRANS_ERROR_NONE && single != nullptr) {
    notes_of(single).single_upload = nullptr;
  }
  return ret;
}

/**
 * The transport aborts everything at once, also what others wait for: the
 * upload of a request that still stands is begun again.
 */
bool begin_upload_again(UploadPtr &record) {
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
  auto record = take_back<UploadPtr>(user_data);
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

}  // namespace

void abandon_single_upload(backup_context *ctx) {
  ctx->abandoned = true;
  void *const upload = notes_of(ctx).single_upload;
  if (upload != nullptr && abort_transfer(upload)) {
    LOGI("upload of (%s) is ended, for nobody waits for it", ctx->cur_pkg_id.c_str());
  }
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
