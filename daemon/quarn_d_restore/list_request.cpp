#include <algorithm>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_backup/list_bound.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/cloud_transfer.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/power.h"
#include "quarn_d_utils/request_cause.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

namespace {

constexpr char kFailed[] = "failed";
constexpr char kNone[] = "none";
/** How often a download is begun again that was aborted for somebody else's sake. */
constexpr int kMaxTimesAborted = 8;

/** One request for the list in the cloud. */
struct list_request {
  std::string local_path;
  std::string cloud_path;
  std::unique_ptr<client_cb_data> record; /**< whom the list is for */
  int times_aborted = 0;
  bool withdrawn = false; /**< its client wants it no more */
};
using RequestPtr = std::unique_ptr<list_request>;

/** Downloads that the transport has. */
std::vector<list_request *> transferring;

/**
 * A file of the request's own beside the staged list: the staged one is a
 * backup run's, which would upload what another download put in its place.
 */
std::string next_local_path() {
  static unsigned int number = 0;
  return std::string(kLocalAppListPath) + "." + std::to_string(++number);
}

void remove_list(const std::string &path) {
  if (file_exist(path.c_str())) delete_file(path.c_str());
}

/** The downloaded list, malloc'd; null with the reason logged. */
CString read_list(const std::string &path, request_cause *cause) {
  *cause = request_cause::list_unreadable;
  struct stat status = {};
  if (!file_exist(path.c_str())) {
    LOGE("there isn't app list file...");
    return nullptr;
  }
  if (safe_lstat(path.c_str(), &status) == 0 &&
      static_cast<std::uint64_t>(status.st_size) > kMaxAppListSize) {
    *cause = request_cause::list_too_large;
    LOGE("couldn't read app list...");
    return nullptr;
  }
  char *raw = nullptr;
  const bool read = read_data_from_file(path.c_str(), &raw);
  CString text(raw);
  if (!read) {
    LOGE("couldn't read app list...");
    return nullptr;
  }
  if (g_utf8_validate(text.get(), -1, nullptr) == FALSE) {
    // no list, and nothing that the bus could carry
    LOGE("couldn't read app list...");
    return nullptr;
  }
  LOGI("app list : %s", text.get());
  *cause = request_cause::none;
  return text;
}

void __get_app_list_resp_cb(backup_trans_error_code error, void *user_data, char *unused);

/** Hand the request to the transport, which has it then. */
int request_list(RequestPtr &request) {
  const int result = download_bounded_async(
      request->cloud_path.c_str(), request->local_path.c_str(), request.get(),
      __get_app_list_resp_cb, BACKUP_TRANS_OPTION_NONE, kMaxAppListSize);
  if (result == BACKUP_TRANS_ERROR_NONE) transferring.push_back(request.release());
  return result;
}

/** The transport aborts everything at once, also what others wait for. */
bool begin_list_again(RequestPtr &request) {
  if (request->withdrawn || waits_are_ended() || !wifi_connected()) return false;
  if (++request->times_aborted > kMaxTimesAborted) return false;
  if (request_list(request) != BACKUP_TRANS_ERROR_NONE) return false;
  LOGI("download of app list was aborted with others, so it is requested again");
  return true;
}

void __get_app_list_resp_cb(backup_trans_error_code error, void *user_data, char * /*unused*/) {
  if (user_data == nullptr) LOGE("cb user_data is NULL...");
  g_assert(user_data != nullptr);
  RequestPtr request(static_cast<list_request *>(user_data));
  const auto known = std::find(transferring.begin(), transferring.end(), request.get());
  if (known != transferring.end()) transferring.erase(known);
  if (error == BACKUP_TRANS_ERROR_CANCELLED && begin_list_again(request)) return;
  CString text;
  request_cause cause = cause_of_transfer(error, request->local_path);
  if (error != BACKUP_TRANS_ERROR_NONE) {
    LOGE("__get_app_list_resp_cb failed...err_code[%d]", error);
    if (error == BACKUP_TRANS_ERROR_TOO_LARGE) cause = request_cause::list_too_large;
  } else {
    LOGI("backup trans success : app list download");
    text = read_list(request->local_path, &cause);
  }
  // before the answer: the client asks for it then
  note_request_end(cause);
  remove_list(request->local_path);
  if (text == nullptr && request->withdrawn) {
    quarn_dbus_get_app_list_cb(QUARN_CANCELLED, kFailed, request->record.release());
  } else if (text == nullptr) {
    quarn_dbus_get_app_list_cb(QUARN_BAD_ARGUMENT, kNone, request->record.release());
  } else {
    quarn_dbus_get_app_list_cb(QUARN_OK, text.get(), request->record.release());
  }
  request_power_lock(false);
}

int get_pellix_list(std::unique_ptr<client_cb_data> record) {
  const CString text(get_app_list_for_pellix());
  if (text == nullptr) {
    quarn_dbus_get_app_list_cb(QUARN_FAILED, kFailed, record.release());
    return QUARN_FAILED;
  }
  quarn_dbus_get_app_list_cb(QUARN_OK, text.get(), record.release());
  return QUARN_OK;
}

}  // namespace

int get_app_list(quarn_client_kind client, std::unique_ptr<client_cb_data> record) {
  if (client == QUARN_CLIENT_COMPANION) return get_pellix_list(std::move(record));
  auto request = std::make_unique<list_request>();
  request->local_path = next_local_path();
  request->cloud_path = kCloudAppListPath;
  request->record = std::move(record);
  int result = BACKUP_TRANS_ERROR_LOCAL_FILE;
  if (prepare_staging_directory()) result = request_list(request);
  if (result != BACKUP_TRANS_ERROR_NONE) {
    LOGE("backup_trans_download_file_ors_async failed... %d", result);
    note_request_end(cause_of_transfer(result, request->local_path));
    remove_list(request->local_path);
    quarn_dbus_get_app_list_cb(QUARN_TRANSFER_FAILED, kNone, request->record.release());
    return QUARN_FAILED;
  }
  // Until the client has its answer the daemon is not idle.
  request_power_lock(true);
  return QUARN_OK;
}

std::uint32_t withdraw_app_lists(const std::string &sender) {
  std::uint32_t count = 0;
  const std::vector<list_request *> all = transferring;
  for (list_request *request : all) {
    const client_cb_data *client = request->record.get();
    if (request->withdrawn || client == nullptr || client->sender != sender) continue;
    request->withdrawn = true;
    static_cast<void>(abort_transfer(request));  // else its answer comes, and is not wanted
    ++count;
  }
  return count;
}
