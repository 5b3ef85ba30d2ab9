#include "quarn_d_restore/archive_download.h"

#include <glib.h>
#include <sys/stat.h>

#include <algorithm>
#include <utility>
#include <vector>

#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/request_cause.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

/** How often a download is begun again that was aborted for somebody else's sake. */
constexpr int kMaxTimesAborted = 8;

/** Downloads that the transport has. */
std::vector<archive_download *> transferring;

void __app_data_download_resp_cb(backup_trans_error_code error, void *user_data, char *unused);

/** The transport has the download then, where it takes it. */
int request_download(ArchiveDownloadPtr &download) {
  const int result = download_bounded_async(
      download->cloud_path.c_str(), download->local_path.c_str(), download.get(),
      __app_data_download_resp_cb, BACKUP_TRANS_OPTION_NONE, kMaxArchiveFileSize);
  if (result == BACKUP_TRANS_ERROR_NONE) transferring.push_back(download.release());
  return result;
}

/**
 * The transport aborts everything at once, also what others wait for: the
 * download of a restore that is still wanted is begun again.
 */
bool begin_download_again(ArchiveDownloadPtr &download) {
  if (is_abandoned(*download->ctx) || download->withdrawn || !wifi_connected()) return false;
  if (++download->times_aborted > kMaxTimesAborted) return false;
  const std::string pkgid = download->ctx->pkgid;
  if (request_download(download) != BACKUP_TRANS_ERROR_NONE) return false;
  LOGI("download of (%s) was aborted with others, so it is requested again", pkgid.c_str());
  return true;
}

void __app_data_download_resp_cb(backup_trans_error_code error, void *user_data,
                                 char * /*unused*/) {
  if (user_data == nullptr) LOGE("cb user_data is NULL...");
  g_assert(user_data != nullptr);
  ArchiveDownloadPtr download(static_cast<archive_download *>(user_data));
  const auto known = std::find(transferring.begin(), transferring.end(), download.get());
  if (known != transferring.end()) transferring.erase(known);
  if (error == BACKUP_TRANS_ERROR_CANCELLED && begin_download_again(download)) return;
  const auto done = download->done;
  done(std::move(download), error);
}

}  // namespace

bool begin_archive_download(ArchiveDownloadPtr download) {
  claim_working_file(download->local_path);
  const int result = request_download(download);
  if (result == BACKUP_TRANS_ERROR_NONE) return true;
  LOGE("backup_trans_download_file_ors_async failed... %d", result);
  note_request_end(cause_of_transfer(result, download->local_path));
  download->ctx->result = QUARN_LIST_CHECK_FAILED;
  remove_download(download->local_path);
  return false;
}

void remove_download(const std::string &path) {
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0 || !is_own_file(status)) return;
  if (S_ISREG(status.st_mode)) delete_file(path.c_str());
}

void abort_download_of(const pkg_restore_context *ctx) {
  const auto download =
      std::find_if(transferring.begin(), transferring.end(),
                   [ctx](const archive_download *one) { return one->ctx == ctx; });
  // One that cannot be ended has its answer, which nobody waits for.
  if (download != transferring.end()) static_cast<void>(abort_transfer(*download));
}

void abort_monitored_downloads() {
  const std::vector<archive_download *> all = transferring;
  for (archive_download *download : all) {
    if (download->ctx->wait_for_result) continue;
    download->withdrawn = true;
    static_cast<void>(abort_transfer(download));  // else it ends by itself, and is not wanted
  }
}
