#include "quarn_d_backup/pipeline.h"

#include <cstdint>
#include <memory>
#include <utility>

#include "backup_transport.h"
#include "files/package_files.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/archive_upload.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/cancel.h"
#include "quarn_d_backup/changes.h"
#include "quarn_d_backup/cloud_cleanup.h"
#include "quarn_d_backup/list_transfer.h"
#include "quarn_d_backup/own_backup.h"
#include "quarn_d_backup/progress_report.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

namespace {

constexpr timespec kPollInterval = {0, 10'000'000};
constexpr int kRoundsPerMinute = 6000;
// Each keeps its file open until it is answered.
constexpr int kMaxRequestedUploads = 256;

void pause_once() { nanosleep(&kPollInterval, nullptr); }

void abandon(backup_context *ctx, std::int32_t result) {
  ctx->result = result;
  ctx->abandoned = true;
}

/**
 * The flag belongs to the latest start, so a run that was cancelled before that
 * has a mark of its own.
 */
bool was_cancelled(const backup_context *ctx) {
  return ctx->is_manual && (manual_backup_canceled || running_backup_cancelled());
}

void note_cancelled(backup_context *ctx) {
  if (ctx->cancel_noted) return;
  ctx->cancel_noted = true;
  LOGI("manual backup cancelled");
}

bool stop_when_cancelled(backup_context *ctx) {
  if (!was_cancelled(ctx)) return false;
  note_cancelled(ctx);
  abandon(ctx, QUARN_CANCELLED);
  return true;
}

enum class Transfers { kLeave, kCancel };

bool stop_without_wifi(backup_context *ctx, Transfers transfers) {
  if (wifi_connected() != 0) return false;
  LOGE("WIFI disconnected");
  note_cause(ctx, request_cause::wifi);
  if (transfers == Transfers::kCancel) backup_trans_cancel_request(cloud_handler());
  abandon(ctx, QUARN_TRANSFER_FAILED);
  return true;
}

bool must_stop(backup_context *ctx, Transfers transfers) {
  return stop_when_cancelled(ctx) || stop_without_wifi(ctx, transfers);
}

/**
 * Poll while @p pending; @p log_minute is told of every full minute.
 * @return false when the run was abandoned meanwhile
 */
template <typename Pending, typename LogMinute>
bool wait_while(backup_context *ctx, Pending pending, LogMinute log_minute) {
  pause_once();
  for (int rounds = 1; pending(); ++rounds) {
    if (must_stop(ctx, Transfers::kCancel)) return false;
    if (rounds % kRoundsPerMinute == 0) log_minute(rounds / kRoundsPerMinute);
    pause_once();
  }
  // The abort of its transfers may have ended the wait before the cancel was seen.
  return !stop_when_cancelled(ctx);
}

bool check_app_list(backup_context *ctx) {
  LOGI("=== checking app list from cloud ===");
  report_progress(ctx, backup_stage::checking);
  const int ret = get_app_list_from_cloud(ctx);
  if (ret != QUARN_OK) {
    if (ctx->abandoned) return false;
    ctx->result = ret;
    return false;
  }
  const bool answered = wait_while(
      ctx, [ctx] { return ctx->app_list_downloading.load(); },
      [](int minutes) { LOGI("[%d min] waiting for app list download completion...", minutes); });
  if (!answered) return false;
  if (!ctx->app_list_checked) {
    ctx->result = QUARN_LIST_CHECK_FAILED;
    return false;
  }
  return true;
}

bool make_items(backup_context *ctx) {
  LOGI("=== make backup items ===");
  report_progress(ctx, backup_stage::archiving);
  const int ret = make_backup_items(ctx);
  if (ctx->abandoned) return false;
  if (ret != QUARN_OK) {
    ctx->result = ret;
    return false;
  }
  return !must_stop(ctx, Transfers::kLeave);
}

/** Wait until at most @p count uploads are to be answered. */
bool wait_for_uploads(backup_context *ctx, int count) {
  return wait_while(
      ctx, [ctx, count] { return ctx->upload_remain > count; },
      [ctx](int minutes) {
        LOGI("[%d min] waiting for upload completion of app data.(remain num = %d)", minutes,
             ctx->upload_remain.load());
      });
}

bool upload_items(backup_context *ctx) {
  LOGI("=== upload all app data ===");
  ctx->uploads_total = static_cast<std::int32_t>(ctx->upload_list.size());
  report_progress(ctx, backup_stage::uploading);
  for (const pkg_information &package : ctx->upload_list) {
    if (ctx->upload_remain >= kMaxRequestedUploads &&
        !wait_for_uploads(ctx, kMaxRequestedUploads - 1)) {
      return false;
    }
    if (must_stop(ctx, Transfers::kCancel)) return false;
    ++ctx->uploads_requested;
    upload_app_data(ctx, package.pkg_id.c_str(), package.root_path.c_str(),
                    package.version.c_str());
  }
  if (ctx->upload_remain > 0) {
    LOGI("waiting for upload completion of app data.(remain num = %d)", ctx->upload_remain.load());
  } else {
    LOGI("no app data to upload");
  }
  return wait_for_uploads(ctx, 0);
}

bool upload_list_of_items(backup_context *ctx) {
  if (ctx->result != QUARN_OK) return false;
  LOGI("=== upload app list ===");
  report_progress(ctx, backup_stage::listing);
  upload_app_list(ctx);
  LOGI("waiting for upload completion of app list...");
  const bool answered = wait_while(
      ctx, [ctx] { return ctx->app_list_uploading.load(); },
      [](int minutes) { LOGI("[%d min] waiting for upload completion of app list...", minutes); });
  return answered && ctx->result == QUARN_OK;
}

/** A run that has no list to write sends nothing: it could not be restored. */
bool has_list(backup_context *ctx) {
  if (notes_of(ctx).list_staged) return true;
  LOGE("there is no app list to upload, so no app data is uploaded");
  ctx->result = QUARN_TRANSFER_FAILED;
  return false;
}

/** Stage the list @p text with what a restore is to have. @return false when that failed */
bool stage_claimed(backup_context *ctx, CString text) {
  if (!text || !add_claimed_packages_to_list(ctx, std::move(text))) {
    ctx->result = notes_of(ctx).list_too_large ? QUARN_FAILED : QUARN_TRANSFER_FAILED;
    return false;
  }
  return true;
}

/** Restore mode may have been switched on since the list was made. */
bool refresh_staged_list(backup_context *ctx) {
  if (ctx->result != QUARN_OK || !claimed_package_is_missing(ctx)) return true;
  CString text;
  static_cast<void>(read_data_from_file(kLocalAppListPath, out(text)));  // without a text it fails
  return stage_claimed(ctx, std::move(text));
}

/** Or while it was on its way: then it is written once more. */
bool write_missing_claims(backup_context *ctx) {
  while (claimed_package_is_missing(ctx)) {
    if (!check_app_list(ctx) || !stage_claimed(ctx, std::move(ctx->cloud_app_list_text)) ||
        !upload_list_of_items(ctx)) {
      return false;
    }
  }
  return true;
}

bool cleanup_pending(const backup_context *ctx) {
  return ctx->serial_clean_pending != 0 || ctx->pkg_delete_pending != 0 ||
         ctx->version_list_pending != 0 || ctx->version_delete_pending != 0;
}

void clean_up_cloud(backup_context *ctx) {
  LOGI("=== start : clean up cloud ===");
  report_progress(ctx, backup_stage::cleaning);
  delete_other_backup_items_in_cloud(ctx);
  delete_other_pkg_version_in_cloud(ctx);
  for (int rounds = 1; cleanup_pending(ctx); ++rounds) {
    pause_once();
    if (rounds % kRoundsPerMinute == 0) {
      LOGI("[%d min] waiting for clean up cloud completion...", rounds / kRoundsPerMinute);
    }
    if (must_stop(ctx, Transfers::kCancel)) return;
  }
  if (stop_when_cancelled(ctx)) return;
  if (ctx->cleanup_result != QUARN_OK) {
    LOGE("=== failed : clean up cloud ===");
  } else {
    LOGI("=== success : clean up cloud ===");
  }
}

/** The stages in order, to the first that fails. */
void run_stages(backup_context *ctx) {
  if (backup_context_init(ctx) != QUARN_OK) return;
  if (wifi_connected() == 0) {
    LOGE("WIFI disconnected");
    note_cause(ctx, request_cause::wifi);
    ctx->result = QUARN_TRANSFER_FAILED;
    return;
  }
  if (check_app_list(ctx) && make_items(ctx) && has_list(ctx) && upload_items(ctx) &&
      refresh_staged_list(ctx) && upload_list_of_items(ctx) && write_missing_claims(ctx)) {
    clean_up_cloud(ctx);
  }
}

/** Delete the archives that were never sent, and let others stage theirs. */
void drop_unsent_archives(backup_context *ctx) {
  for (std::size_t i = ctx->uploads_requested; i < ctx->upload_list.size(); ++i) {
    const pkg_information &package = ctx->upload_list[i];
    if (!holds_staged_archive(ctx, package.pkg_id)) continue;
    delete_staged_file(staged_archive_path(package.root_path, package.pkg_id));
    release_staged_archive(ctx, package.pkg_id);
  }
}

void report_to_client(backup_context *ctx, int status) {
  // before the status: with that a client stops listening
  report_progress(ctx, backup_stage::finished);
  // the final status deletes the record
  quarn_dbus_manual_backup_status(ctx->result, status, ctx->client.release());
}

void finish_manual_backup(backup_context *ctx) {
  int status = QUARN_BACKUP_FAILED;
  if (settle_running_backup() || manual_backup_canceled) {
    note_cancelled(ctx);
    ctx->result = QUARN_CANCELLED;
  } else if (ctx->result == QUARN_OK) {
    set_last_backup_time();
    note_own_backup(ctx->serial_number);
    LOGI("manual backup successful!");
    report_to_client(ctx, QUARN_BACKUP_SUCCEEDED);
    return;
  }
  if (ctx->result == QUARN_CANCELLED) status = QUARN_BACKUP_CANCELLED;
  LOGE("manual backup couldn't be completed... cause=%d", ctx->result.load());
  report_to_client(ctx, status);
}

void finish_auto_backup(backup_context *ctx) {
  if (ctx->result == QUARN_OK) {
    set_last_backup_time();
    if (!notes_of(ctx).keep_all_listed) note_own_backup(ctx->serial_number);
    LOGI("auto backup successful!");
  } else {
    LOGE("auto backup couldn't be completed... cause=%d", ctx->result.load());
  }
  report_progress(ctx, backup_stage::finished);
}

}  // namespace

bool backup_must_stop(backup_context *ctx) { return must_stop(ctx, Transfers::kCancel); }

void do_backup(bool is_manual, std::unique_ptr<client_cb_data> client) {
  const BackupContextPtr ctx(new backup_context);
  if (is_manual && (manual_backup_canceled || running_backup_cancelled())) {
    LOGE("manual backup was cancelled");
    quarn_dbus_manual_backup_status(QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, client.release());
    return;
  }
  ctx->is_manual = is_manual;
  ctx->client = std::move(client);
  run_stages(ctx.get());
  finish_backup(ctx.get());
}

void finish_backup(backup_context *ctx) {
  // before the client is told: its answer may take long
  drop_unsent_archives(ctx);
  note_request_end(ctx->result == QUARN_OK ? request_cause::none : notes_of(ctx).cause.load());
  if (ctx->is_manual) {
    finish_manual_backup(ctx);
  } else {
    finish_auto_backup(ctx);
  }
  delete_backup_items(ctx);
  ctx->finished = true;
}

void delete_backup_items(backup_context *ctx) {
  drop_unsent_archives(ctx);
  for (const pkg_information &package : ctx->upload_list) {
    if (!holds_staged_archive(ctx, package.pkg_id)) continue;
    delete_staged_file(staged_archive_path(package.root_path, package.pkg_id));
  }
  if (holds_staged_archive(ctx, kStagedListLease)) delete_staged_file(kLocalAppListPath);
}
