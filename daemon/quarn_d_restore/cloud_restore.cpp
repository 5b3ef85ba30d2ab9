#include "quarn_d_restore/cloud_restore.h"

#include <glib.h>

#include <algorithm>
#include <cstdint>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "files/held_folder.h"
#include "files/package_files.h"
#include "quarn_common.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_restore/app_restore.h"
#include "quarn_d_restore/archive_download.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_restore/restore_mode.h"
#include "quarn_d_restore/restore_progress.h"
#include "quarn_d_restore/restore_steps.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/power.h"
#include "quarn_d_utils/request_cause.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

/** Milliseconds between two looks at whether a package is packed still. */
constexpr guint kPackedCheckMs = 50;

/** Packages whose archive is on its way. */
std::vector<std::string> running;
/** Further restores of such a package: they use the same files, so they wait. */
std::list<ArchiveDownloadPtr> waiting;

bool is_running(const std::string &pkgid) {
  return std::find(running.begin(), running.end(), pkgid) != running.end();
}

gboolean terminate_when_idle(gpointer /*data*/) {
  // The client that waits for the end hears of it first.
  if (restore_report_pending()) return G_SOURCE_CONTINUE;
  request_quarn_terminate(0.0, false);
  return G_SOURCE_REMOVE;
}

/** Count one accepted restore; finish_restore() ends what begins here. */
void accept_restore(pkg_restore_context *ctx) {
  ++ctx->pending;
  // The daemon is not idle before the last restore has ended.
  request_power_lock(true);
  if (ctx->wait_for_result) {
    begin_requested_restore(ctx->pkgid);
  } else {
    count_outstanding_restore(1);
  }
  report_restore_step(ctx->pkgid, restore_stage::downloading);
}

void start_next(const std::string &pkgid);

void finish_restore(pkg_restore_context *ctx, restore_outcome outcome, std::uint64_t size = 0) {
  const std::string pkgid = ctx->pkgid;
  const bool monitored = !ctx->wait_for_result;
  if (outcome == restore_outcome::restored) forget_owed_archive(ctx->serial, pkgid, ctx->root);
  report_restore_end(pkgid, outcome, ctx->result, size);
  check_package_restore_complete(ctx);
  if (monitored) count_outstanding_restore(-1);
  start_next(pkgid);
  request_power_lock(false);
  if (pkg_list_to_be_restored.empty()) g_idle_add(terminate_when_idle, nullptr);
}

void finish_download(ArchiveDownloadPtr download, backup_trans_error_code error);

gboolean finish_delayed_download(gpointer data) {
  finish_download(ArchiveDownloadPtr(static_cast<archive_download *>(data)),
                  BACKUP_TRANS_ERROR_NONE);
  return G_SOURCE_REMOVE;
}

/** What became of a package whose archive did not come. */
void fail_download(const archive_download &download, backup_trans_error_code error) {
  pkg_restore_context *ctx = download.ctx;
  LOGE("download app data of (%s) failed...err_code[%d]", ctx->pkgid.c_str(), error);
  note_request_end(cause_of_transfer(error, download.local_path));
  ctx->result = QUARN_TRANSFER_FAILED;
  if (error == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) {
    owe_other_versions(ctx->serial, ctx->pkgid, ctx->root);
  }
}

void finish_download(ArchiveDownloadPtr download, backup_trans_error_code error) {
  pkg_restore_context *ctx = download->ctx;
  const bool abandoned = is_abandoned(*ctx);
  const bool wanted = error == BACKUP_TRANS_ERROR_NONE && !abandoned;
  std::optional<PackageDataLock> lock;
  if (wanted && !lock.emplace(ctx->pkgid, PackageUse::kChangeUnlessPacked)) {
    // An export of the package may last, and nobody would be served meanwhile.
    g_timeout_add(kPackedCheckMs, finish_delayed_download, download.release());
    return;
  }
  running.erase(std::find(running.begin(), running.end(), ctx->pkgid));
  restore_outcome outcome = restore_outcome::failed;
  std::uint64_t size = 0;
  const bool given_up = abandoned && error == BACKUP_TRANS_ERROR_CANCELLED;
  if (error != BACKUP_TRANS_ERROR_NONE && !given_up) {
    fail_download(*download, error);
  } else if (abandoned) {
    LOGI("restore of (%s) was cancelled", ctx->pkgid.c_str());
    ctx->result = QUARN_CANCELLED;
  } else {
    LOGI("backup trans success : download for (%s)", ctx->pkgid.c_str());
    const HeldFolder package(ctx->root);
    const HeldFile archive(download->local_path);
    size = archive_size(download->local_path);
    outcome = restore_from_archive(ctx, package, download->local_path, size);
  }
  lock.reset();
  remove_download(download->local_path);
  finish_restore(ctx, outcome, size);
}

/** Request it, or tell its context that it was refused. */
bool start_download(ArchiveDownloadPtr download) {
  const std::string pkgid = download->ctx->pkgid;
  if (!begin_archive_download(std::move(download))) return false;
  running.push_back(pkgid);
  return true;
}

void start_next(const std::string &pkgid) {
  const auto next = std::find_if(
      waiting.begin(), waiting.end(),
      [&](const ArchiveDownloadPtr &download) { return download->ctx->pkgid == pkgid; });
  if (next == waiting.end()) return;
  ArchiveDownloadPtr download = std::move(*next);
  waiting.erase(next);
  pkg_restore_context *ctx = download->ctx;
  if (is_abandoned(*ctx)) {
    ctx->result = QUARN_CANCELLED;
    finish_restore(ctx, restore_outcome::failed);
  } else if (!start_download(std::move(download))) {
    finish_restore(ctx, restore_outcome::failed);
  }
}

}  // namespace

int restore_from_cloud(pkg_restore_context *ctx) {
  if (!is_safe_path_component(ctx->serial) || !is_safe_path_component(ctx->pkgid) ||
      !is_safe_path_component(ctx->version)) {
    LOGE("refused : not a cloud path (%s, %s, %s)", ctx->serial.c_str(), ctx->pkgid.c_str(),
         ctx->version.c_str());
    ctx->result = QUARN_LIST_CHECK_FAILED;
    return QUARN_FAILED;
  }
  auto download = std::make_unique<archive_download>();
  download->cloud_path = cloud_archive(ctx->serial, ctx->pkgid, ctx->version);
  download->local_path = WorkingFiles(ctx->pkgid, ctx->root).download_place();
  if (download->local_path.empty()) {
    LOGE("there is no place for the archive of (%s)", ctx->pkgid.c_str());
    ctx->result = QUARN_LIST_CHECK_FAILED;
    return QUARN_FAILED;
  }
  download->ctx = ctx;
  download->done = finish_download;
  ctx->archive = archive_hold(ctx->serial, ctx->pkgid);
  LOGI("request download for (%s)", ctx->pkgid.c_str());
  if (is_running(ctx->pkgid)) {
    waiting.push_back(std::move(download));
  } else if (!start_download(std::move(download))) {
    return QUARN_FAILED;
  }
  accept_restore(ctx);
  return QUARN_OK;
}
