#include "backup_transport.h"

#include <algorithm>
#include <memory>
#include <string>
#include <utility>

#include "core/remote_path.h"
#include "session/requests.h"
#include "session/session.h"

namespace transport {
namespace {

constexpr char kDefaultContentType[] = "application/octet-stream";
constexpr std::size_t kMaxContentTypeBytes = 255;

bool is_content_type(const std::string &text) {
  return text.size() <= kMaxContentTypeBytes &&
         std::all_of(text.begin(), text.end(), [](char c) { return c >= ' ' && c <= '~'; });
}

int new_download(backup_trans_handle_h handle, const char *remote_path, const char *local_path,
                 int options, void *user_data, std::shared_ptr<DownloadRequest> *request) {
  int code = BACKUP_TRANS_ERROR_NONE;
  std::shared_ptr<Backend> backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  const bool options_known =
      options == BACKUP_TRANS_OPTION_NONE || options == BACKUP_TRANS_OPTION_BASIS;
  if (!is_object_path(remote_path) || local_path == nullptr || local_path[0] == '\0' ||
      !options_known)
    return BACKUP_TRANS_ERROR_ARGUMENT;
  *request = std::make_shared<DownloadRequest>(handle, std::move(backend), user_data);
  (*request)->path = remote_path;
  (*request)->basis = options == BACKUP_TRANS_OPTION_BASIS;
  if (!(*request)->target.open(local_path)) return BACKUP_TRANS_ERROR_LOCAL_FILE;
  return BACKUP_TRANS_ERROR_NONE;
}

}  // namespace
}  // namespace transport

using namespace transport;

extern "C" {

int backup_trans_init(void *user_data, backup_trans_init_cb callback) {
  return Session::get().init(user_data, callback);
}

void backup_trans_deinit(void) { Session::get().deinit(); }

backup_trans_handle_h backup_trans_create_handle(void) { return Session::get().create_handle(); }

int backup_trans_download_file_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                         const char *local_path, void *user_data,
                                         backup_trans_download_cb callback, int options) {
  return backup_trans_download_limited_ors_async(handle, remote_path, local_path, user_data,
                                                 callback, options, 0);
}

int backup_trans_download_limited_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                            const char *local_path, void *user_data,
                                            backup_trans_download_cb callback, int options,
                                            uint64_t max_size) {
  std::shared_ptr<DownloadRequest> request;
  const int code = new_download(handle, remote_path, local_path, options, user_data, &request);
  if (code != BACKUP_TRANS_ERROR_NONE) return code;
  if (callback == nullptr) return BACKUP_TRANS_ERROR_ARGUMENT;
  request->callback = callback;
  request->target.set_limit(max_size);
  return Session::get().accept(request);
}

int backup_trans_download_file_ors(backup_trans_handle_h handle, const char *remote_path,
                                   const char *local_path, int options) {
  return backup_trans_download_limited_ors(handle, remote_path, local_path, options, 0);
}

int backup_trans_download_limited_ors(backup_trans_handle_h handle, const char *remote_path,
                                      const char *local_path, int options, uint64_t max_size) {
  std::shared_ptr<DownloadRequest> request;
  int code = new_download(handle, remote_path, local_path, options, nullptr, &request);
  if (code != BACKUP_TRANS_ERROR_NONE) return code;
  request->waited_for = true;
  request->target.set_limit(max_size);
  code = Session::get().accept(request);
  return code == BACKUP_TRANS_ERROR_NONE ? Session::get().wait_for(request) : code;
}

int backup_trans_upload_file_ors_async(backup_trans_handle_h handle, const char *local_path,
                                       const char *remote_path, backup_trans_upload_cb callback,
                                       int64_t timestamp_ms, int options, void *user_data,
                                       const char *content_type) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  const std::string type = content_type == nullptr ? kDefaultContentType : content_type;
  if (callback == nullptr || local_path == nullptr || local_path[0] == '\0' || timestamp_ms < 0 ||
      options != BACKUP_TRANS_OPTION_NONE || !is_object_path(remote_path) || !is_content_type(type))
    return BACKUP_TRANS_ERROR_ARGUMENT;
  const auto request = std::make_shared<UploadRequest>(handle, std::move(backend), user_data);
  request->path = remote_path;
  request->callback = callback;
  request->timestamp_ms = timestamp_ms;
  request->content_type = type;
  if (!request->source.open(local_path)) return BACKUP_TRANS_ERROR_LOCAL_FILE;
  return Session::get().accept(request);
}

int backup_trans_get_folder_child_list_async(backup_trans_handle_h handle, const char *folder_path,
                                             int start, int count, int options, void *user_data,
                                             backup_trans_child_list_cb callback) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  std::string folder;
  if (callback == nullptr || start < 0 || count < 1 || count > BACKUP_TRANS_MAX_LIST_COUNT ||
      options != BACKUP_TRANS_OPTION_NONE || !parse_folder_path(folder_path, &folder))
    return BACKUP_TRANS_ERROR_ARGUMENT;
  const auto request = std::make_shared<ListRequest>(handle, std::move(backend), user_data);
  request->folder = std::move(folder);
  request->callback = callback;
  request->start = start;
  request->count = count;
  return Session::get().accept(request);
}

int backup_trans_delete_folder_ors_async(backup_trans_handle_h handle, const char *folder_path,
                                         void *user_data, backup_trans_delete_cb callback) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  std::string folder;
  if (callback == nullptr || !parse_folder_path(folder_path, &folder) || folder.empty())
    return BACKUP_TRANS_ERROR_ARGUMENT;
  const auto request = std::make_shared<RemoveRequest>(handle, std::move(backend), user_data);
  request->folder = std::move(folder);
  request->callback = callback;
  return Session::get().accept(request);
}

int backup_trans_check_async(backup_trans_handle_h handle, void *user_data,
                             backup_trans_check_cb callback) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  if (callback == nullptr) return BACKUP_TRANS_ERROR_ARGUMENT;
  const auto request = std::make_shared<CheckRequest>(handle, std::move(backend), user_data);
  request->callback = callback;
  return Session::get().accept(request);
}

backup_trans_cause backup_trans_last_cause(void) { return Session::get().last_cause(); }

void backup_trans_cancel_request(backup_trans_handle_h handle) { Session::get().cancel(handle); }

int backup_trans_abort_request(backup_trans_handle_h handle, void *user_data) {
  return Session::get().abort(handle, user_data) ? BACKUP_TRANS_ERROR_NONE
                                                 : BACKUP_TRANS_ERROR_ARGUMENT;
}

}  // extern "C"
