#include <algorithm>
#include <list>
#include <memory>
#include <optional>

#include "files/held_folder.h"
#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_restore/hidden_icon.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/settle.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_restore/withdrawal.h"
#include "quarn_d_setting/quarn_d_setting.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/icon.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/power.h"
#include "quarn_d_utils/request_cause.h"
#include "quarn_log.h"

std::vector<std::string> pkg_list_to_be_restored;
int current_restore_client = 0;
std::string serial_num_user_select;

namespace {

constexpr int kCloudClient = 0;
/** How often a download is begun again that was aborted for somebody else's sake. */
constexpr int kMaxTimesAborted = 8;
/** Milliseconds between two looks at whether a package is packed still. */
constexpr guint kPackedCheckMs = 50;

/** One download, from its request to its answer. */
struct download_request {
  std::string local_path;
  std::string cloud_path;
  pkg_restore_context *ctx;
  int times_aborted = 0;
  bool withdrawn = false; /**< nobody waits for it any more */
};
using RequestPtr = std::unique_ptr<download_request>;

/** Downloads that the transport has. */
std::vector<download_request *> transferring;
/** Packages whose archive is on its way. */
std::vector<std::string> running;
/** Further restores of such a package: they use the same files, so they wait. */
std::list<RequestPtr> waiting;

bool is_running(const std::string &pkgid) {
  return std::find(running.begin(), running.end(), pkgid) != running.end();
}

std::uint64_t archive_size(const std::string &path) {
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 ? static_cast<std::uint64_t>(status.st_size) : 0;
}

void remove_download(const std::string &path) {
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0 || !is_own_file(status)) return;
  if (S_ISREG(status.st_mode)) delete_file(path.c_str());
}

/** The application's own file of the table's name is not in the way while this lives. */
class OwnTableAside {
 public:
  explicit OwnTableAside(const restore_files &files)
      : files_(files), done_(set_own_table_aside(files)) {}
  ~OwnTableAside() { put_own_table_back(files_); }
  OwnTableAside(const OwnTableAside &) = delete;
  OwnTableAside &operator=(const OwnTableAside &) = delete;
  explicit operator bool() const { return done_; }

 private:
  const restore_files &files_;
  const bool done_;
};

gboolean terminate_when_idle(gpointer /*data*/) {
  // The client that waits for the end hears of it first.
  if (restore_report_pending()) return G_SOURCE_CONTINUE;
  request_quarn_terminate(0.0, false);
  return G_SOURCE_REMOVE;
}

/**
 * What the restore works with must be where it was at its end too: else it would tell of success
 * for a package that has gone, or that the application has kept its own folder in the place of
 * the snapshot for.
 */
bool is_undisturbed(const char *pkgid, const HeldFolder &package, const HeldFolder &snapshot) {
  if (!package.is_in_place()) {
    LOGE("package (%s) was removed during its restore", pkgid);
    return false;
  }
  if (!snapshot.is_in_place()) {
    LOGE("snapshot of (%s) was moved during its restore", pkgid);
    return false;
  }
  return true;
}

/** False for an archive that the application has put in the place of the downloaded one. */
bool is_own_archive(const std::string &path) {
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0) return true;  // the unpacking tells of it
  return S_ISREG(status.st_mode) && is_own_file(status) && status.st_nlink == 1;
}

/** 0, or a code when the archive, or only a part of it, could not be unpacked. */
int unpack(const pkg_restore_context &ctx, const std::string &archive) {
  unzip_report report;
  const int result = unzip_data(ctx.pkgid.c_str(), ctx.root.c_str(), archive.c_str(), &report);
  if (result == QUARN_OK && !report.complete()) return QUARN_UNREADABLE;
  return result;
}

/** End a restore that failed after the snapshot was made: with what became of the data. */
restore_outcome roll_back(pkg_restore_context *ctx, int result) {
  ctx->result = result;
  switch (put_snapshot_back(ctx->pkgid.c_str(), ctx->root.c_str())) {
    case rollback_result::whole:
      return restore_outcome::rolled_back;
    case rollback_result::kept:
    case rollback_result::none:
      break;
  }
  return restore_outcome::incomplete;
}

/** Replace the package's data by the archive's, or leave it as it is. The caller holds its lock. */
restore_outcome restore_from_archive(pkg_restore_context *ctx, const HeldFolder &package,
                                     const std::string &archive, std::uint64_t size) {
  const char *pkgid = ctx->pkgid.c_str();
  const char *root = ctx->root.c_str();
  report_restore_step(ctx->pkgid, restore_stage::snapshot, size);
  if (!is_own_archive(archive)) {
    LOGE("archive of (%s) was exchanged", pkgid);
    ctx->result = QUARN_UNREADABLE;
    return restore_outcome::failed;
  }
  if (recover_package_data(pkgid, root) == recovery_result::kept) {
    // A further snapshot would take the place of what is still to be put back.
    LOGE("fail to make backup for (%s) before restore. err : %d", pkgid, QUARN_REFUSED);
    ctx->result = QUARN_REFUSED;
    return restore_outcome::incomplete;
  }
  const restore_files files(pkgid, root);
  const OwnTableAside own_table(files);
  std::optional<HeldFolder> snapshot;
  int result = own_table ? take_snapshot(pkgid, root, &snapshot) : QUARN_REFUSED;
  if (result != QUARN_OK) {
    LOGE("fail to make backup for (%s) before restore. err : %d", pkgid, result);
    ctx->result = result;
    discard_snapshot(pkgid, root);
    return restore_outcome::failed;
  }
  report_restore_step(ctx->pkgid, restore_stage::unpacking, size);
  restore_step("unpack");
  result = unpack(*ctx, archive);
  if (result != QUARN_OK) {
    LOGE("fail to restore app info for (%s) err : %d", pkgid, result);
    return roll_back(ctx, result);
  }
  restore_step("unpacked");
  report_restore_step(ctx->pkgid, restore_stage::attributes, size);
  const bool noted = note_unpacked_files(pkgid, root);
  if (!noted) LOGE("unpacked files of (%s) cannot be noted", pkgid);
  const bool restored = noted && restore_app_info(pkgid, root) != 0;
  if (restored) restore_step("restored");
  if (!restored || !is_undisturbed(pkgid, package, *snapshot) || !discard_snapshot(pkgid, root)) {
    LOGE("fail to restore for (%s)", pkgid);
    return roll_back(ctx, QUARN_REFUSED);
  }
  forget_told_snapshot(restore_files(ctx->pkgid, ctx->root));
  LOGI("restore successfully completed for (%s)", pkgid);
  return restore_outcome::restored;
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

void __app_data_download_resp_cb(backup_trans_error_code error, void *user_data, char *unused);
void finish_download(RequestPtr request, backup_trans_error_code error);

/** Hand the request to the transport, which has it then. */
int request_download(RequestPtr &request) {
  const int result = download_bounded_async(
      request->cloud_path.c_str(), request->local_path.c_str(), request.get(),
      __app_data_download_resp_cb, BACKUP_TRANS_OPTION_NONE, kMaxArchiveFileSize);
  if (result == BACKUP_TRANS_ERROR_NONE) transferring.push_back(request.release());
  return result;
}

/**
 * The transport aborts everything at once, also what others wait for: the
 * download of a restore that is still wanted is begun again.
 */
bool begin_download_again(RequestPtr &request) {
  if (request->ctx->abandoned || request->withdrawn || !wifi_connected()) return false;
  if (++request->times_aborted > kMaxTimesAborted) return false;
  const std::string pkgid = request->ctx->pkgid;
  if (request_download(request) != BACKUP_TRANS_ERROR_NONE) return false;
  LOGI("download of (%s) was aborted with others, so it is requested again", pkgid.c_str());
  return true;
}

void __app_data_download_resp_cb(backup_trans_error_code error, void *user_data,
                                 char * /*unused*/) {
  if (user_data == nullptr) LOGE("cb user_data is NULL...");
  g_assert(user_data != nullptr);
  RequestPtr request(static_cast<download_request *>(user_data));
  const auto known = std::find(transferring.begin(), transferring.end(), request.get());
  if (known != transferring.end()) transferring.erase(known);
  if (error == BACKUP_TRANS_ERROR_CANCELLED && begin_download_again(request)) return;
  finish_download(std::move(request), error);
}

gboolean finish_delayed_download(gpointer data) {
  finish_download(RequestPtr(static_cast<download_request *>(data)), BACKUP_TRANS_ERROR_NONE);
  return G_SOURCE_REMOVE;
}

void finish_download(RequestPtr request, backup_trans_error_code error) {
  pkg_restore_context *ctx = request->ctx;
  const bool wanted = error == BACKUP_TRANS_ERROR_NONE && !ctx->abandoned;
  std::optional<PackageDataLock> lock;
  if (wanted && !lock.emplace(ctx->pkgid, PackageUse::kChangeUnlessPacked)) {
    // An export of the package may last, and nobody would be served meanwhile.
    g_timeout_add(kPackedCheckMs, finish_delayed_download, request.release());
    return;
  }
  running.erase(std::find(running.begin(), running.end(), ctx->pkgid));
  restore_outcome outcome = restore_outcome::failed;
  std::uint64_t size = 0;
  const bool given_up = ctx->abandoned && error == BACKUP_TRANS_ERROR_CANCELLED;
  if (error != BACKUP_TRANS_ERROR_NONE && !given_up) {
    LOGE("download app data of (%s) failed...err_code[%d]", ctx->pkgid.c_str(), error);
    note_request_end(cause_of_transfer(error, request->local_path));
    ctx->result = QUARN_TRANSFER_FAILED;
    if (error == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) {
      owe_other_versions(ctx->serial, ctx->pkgid, ctx->root);
    }
  } else if (ctx->abandoned) {
    LOGI("restore of (%s) was cancelled", ctx->pkgid.c_str());
    ctx->result = QUARN_CANCELLED;
  } else {
    LOGI("backup trans success : download for (%s)", ctx->pkgid.c_str());
    const HeldFolder package(ctx->root);
    const HeldFile archive(request->local_path);
    size = archive_size(request->local_path);
    outcome = restore_from_archive(ctx, package, request->local_path, size);
  }
  lock.reset();
  remove_download(request->local_path);
  finish_restore(ctx, outcome, size);
}

/** Hand the request to the transport, or tell its context that it was refused. */
bool start_download(RequestPtr request) {
  pkg_restore_context *ctx = request->ctx;
  claim_working_file(request->local_path);
  const int result = request_download(request);
  if (result != BACKUP_TRANS_ERROR_NONE) {
    LOGE("backup_trans_download_file_ors_async failed... %d", result);
    note_request_end(cause_of_transfer(result, request->local_path));
    ctx->result = QUARN_LIST_CHECK_FAILED;
    remove_download(request->local_path);
    return false;
  }
  running.push_back(ctx->pkgid);
  return true;
}

void start_next(const std::string &pkgid) {
  const auto next = std::find_if(waiting.begin(), waiting.end(), [&](const RequestPtr &request) {
    return request->ctx->pkgid == pkgid;
  });
  if (next == waiting.end()) return;
  RequestPtr request = std::move(*next);
  waiting.erase(next);
  pkg_restore_context *ctx = request->ctx;
  if (ctx->abandoned) {
    ctx->result = QUARN_CANCELLED;
    finish_restore(ctx, restore_outcome::failed);
  } else if (!start_download(std::move(request))) {
    finish_restore(ctx, restore_outcome::failed);
  }
}

int restore_from_cloud(pkg_restore_context *ctx) {
  if (!is_safe_path_component(ctx->serial) || !is_safe_path_component(ctx->pkgid) ||
      !is_safe_path_component(ctx->version)) {
    LOGE("refused : not a cloud path (%s, %s, %s)", ctx->serial.c_str(), ctx->pkgid.c_str(),
         ctx->version.c_str());
    ctx->result = QUARN_LIST_CHECK_FAILED;
    return QUARN_FAILED;
  }
  auto request = std::make_unique<download_request>();
  request->cloud_path = cloud_archive(ctx->serial, ctx->pkgid, ctx->version);
  request->local_path = WorkingFiles(ctx->pkgid, ctx->root).download_place();
  if (request->local_path.empty()) {
    LOGE("there is no place for the archive of (%s)", ctx->pkgid.c_str());
    ctx->result = QUARN_LIST_CHECK_FAILED;
    return QUARN_FAILED;
  }
  request->ctx = ctx;
  ctx->archive = archive_hold(ctx->serial, ctx->pkgid);
  LOGI("request download for (%s)", ctx->pkgid.c_str());
  if (is_running(ctx->pkgid)) {
    waiting.push_back(std::move(request));
  } else if (!start_download(std::move(request))) {
    return QUARN_FAILED;
  }
  accept_restore(ctx);
  return QUARN_OK;
}

std::string companion_archive(const pkg_restore_context &ctx) {
  return companion_folder() + companion_archive_name(ctx.pkgid, ctx.version);
}

/** What a restore from the companion came to. */
struct companion_restore {
  int unpacked = QUARN_OK; /**< what the unpacking gave: 0 also when entries are missing */
  bool begun = false;      /**< something may have been unpacked */
  bool whole = false;      /**< every entry was unpacked */
  bool attributes = false; /**< everything that was unpacked has its attributes */
  std::uint64_t size = 0;
};

companion_restore unpack_from_companion(const pkg_restore_context &ctx) {
  const char *pkgid = ctx.pkgid.c_str();
  companion_restore done;
  if (!is_safe_path_component(ctx.pkgid) || !is_safe_path_component(ctx.version)) {
    LOGE("refused : not an archive name (%s, %s)", pkgid, ctx.version.c_str());
    done.unpacked = QUARN_REFUSED;
    return done;
  }
  const std::string archive = companion_archive(ctx);
  const PackageDataLock lock(ctx.pkgid, PackageUse::kChange);
  const HeldFolder package(ctx.root);
  if (recover_package_data(pkgid, ctx.root.c_str()) == recovery_result::kept) {
    // What is still to be put back would go over what is unpacked now.
    LOGE("fail to restore for (%s)", pkgid);
    done.unpacked = QUARN_REFUSED;
    return done;
  }
  const restore_files files(ctx.pkgid, ctx.root);
  const OwnTableAside own_table(files);
  if (!own_table) {
    LOGE("fail to restore for (%s)", pkgid);
    done.unpacked = QUARN_REFUSED;
    return done;
  }
  done.size = archive_size(archive);
  report_restore_step(ctx.pkgid, restore_stage::unpacking, done.size);
  const UnpackingNote note(files);
  unzip_report report;
  archived_table table = archived_table::none;
  done.unpacked = unzip_data_with_table(pkgid, ctx.root.c_str(), archive.c_str(), &report, &table);
  if (done.unpacked == QUARN_NO_FILE_INFO) {
    // Nothing could undo an unpacking whose files then have no attributes: it is not begun.
    if (table == archived_table::none) {
      LOGE("there isn't file-info file...");
    } else {
      LOGE("cannot read json info...");
    }
    LOGE("app data restore failed, so will be cleared");
    LOGE("fail to restore for (%s)", pkgid);
    done.unpacked = QUARN_OK;
    return done;
  }
  done.begun = done.unpacked == QUARN_OK || report.extracted > 0;
  if (done.unpacked != QUARN_OK) {
    settle_unpacked_files(pkgid, ctx.root.c_str());
    return done;
  }
  done.whole = report.complete();
  if (!done.whole) {
    LOGE("%u entries of (%s) were not restored", report.refused + report.failed, pkgid);
  }
  // There is nothing to roll back to: what could be unpacked is the application's.
  report_restore_step(ctx.pkgid, restore_stage::attributes, done.size);
  done.attributes = restore_app_info(pkgid, ctx.root.c_str()) != 0;
  if (!done.attributes) settle_unpacked_files(pkgid, ctx.root.c_str());
  if (done.attributes) {
    LOGI("restore completed for (%s)", pkgid);
  } else {
    LOGE("fail to restore for (%s)", pkgid);
  }
  return done;
}

/**
 * The companion's archive is at hand, so everything happens at once. The
 * pending count goes to -1: such a restore is not waited for, and its icon is
 * not the engine's to show.
 */
int restore_from_companion(pkg_restore_context *ctx) {
  const companion_restore done = unpack_from_companion(*ctx);
  if (done.unpacked != QUARN_OK) ctx->result = done.unpacked;
  LOGI("restore_app_data for %s complete", ctx->pkgid.c_str());
  int reported = done.unpacked;
  if (reported == QUARN_OK && done.begun && !done.whole) reported = QUARN_UNREADABLE;
  if (reported == QUARN_OK && !done.attributes) reported = QUARN_REFUSED;
  report_restore_end(ctx->pkgid,
                     reported == QUARN_OK ? restore_outcome::restored
                     : done.begun         ? restore_outcome::incomplete
                                          : restore_outcome::failed,
                     reported, done.begun ? done.size : 0);
  check_package_restore_complete(ctx);
  return done.unpacked;
}

}  // namespace

int restore_app_data(const char * /*appid*/, pkg_restore_context *ctx) {
  recover_interrupted_restore(ctx->pkgid.c_str(), ctx->root.c_str());
  return current_restore_client == kCloudClient ? restore_from_cloud(ctx)
                                                : restore_from_companion(ctx);
}

void abandon_restore(pkg_restore_context *ctx) {
  ctx->abandoned = true;
  const auto request = std::find_if(transferring.begin(), transferring.end(),
                                    [ctx](const download_request *one) { return one->ctx == ctx; });
  if (request != transferring.end()) abort_transfer(*request);
}

void abort_monitored_downloads() {
  const std::vector<download_request *> all = transferring;
  for (download_request *request : all) {
    if (request->ctx->wait_for_result) continue;
    request->withdrawn = true;
    abort_transfer(request);
  }
}

void check_package_restore_complete(pkg_restore_context *ctx) {
  if (--ctx->pending != 0) return;
  if (ctx->abandoned) {
    delete ctx;
  } else if (!ctx->wait_for_result) {
    appear_app_icon(ctx->pkgid.c_str(), true, 0.0);
    forget_hidden_icon(ctx->pkgid.c_str(), ctx->root.c_str());
    delete ctx;
  } else if (ctx->main_loop != nullptr) {
    GMainLoop *loop = ctx->main_loop;
    ctx->main_loop = nullptr;
    g_main_loop_unref(loop);
    g_main_loop_quit(loop);
  }
}
