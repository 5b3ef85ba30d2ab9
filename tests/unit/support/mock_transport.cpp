#include "mock_transport.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

using ::testing::_;
using ::testing::Return;

namespace {
MockTransport *current_mock = nullptr;
}

MockTransport::MockTransport() { current_mock = this; }

MockTransport::~MockTransport() { current_mock = nullptr; }

MockTransport &MockTransport::current() {
  if (current_mock == nullptr) {
    std::fputs("no MockTransport lives\n", stderr);
    std::abort();
  }
  return *current_mock;
}

extern "C" {

int backup_trans_init(void *user_data, backup_trans_init_cb callback) {
  return MockTransport::current().backup_trans_init(user_data, callback);
}

void backup_trans_deinit() { return MockTransport::current().backup_trans_deinit(); }

backup_trans_handle_h backup_trans_create_handle() {
  return MockTransport::current().backup_trans_create_handle();
}

int backup_trans_download_file_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                         const char *local_path, void *user_data,
                                         backup_trans_download_cb callback, int options) {
  return MockTransport::current().backup_trans_download_file_ors_async(
      handle, remote_path, local_path, user_data, callback, options);
}

int backup_trans_download_file_ors(backup_trans_handle_h handle, const char *remote_path,
                                   const char *local_path, int options) {
  return MockTransport::current().backup_trans_download_file_ors(handle, remote_path, local_path,
                                                                 options);
}

int backup_trans_download_limited_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                            const char *local_path, void *user_data,
                                            backup_trans_download_cb callback, int options,
                                            uint64_t max_size) {
  MockTransport::current().last_max_size = max_size;
  return backup_trans_download_file_ors_async(handle, remote_path, local_path, user_data, callback,
                                              options);
}

int backup_trans_download_limited_ors(backup_trans_handle_h handle, const char *remote_path,
                                      const char *local_path, int options, uint64_t max_size) {
  MockTransport::current().last_max_size = max_size;
  return backup_trans_download_file_ors(handle, remote_path, local_path, options);
}

int backup_trans_upload_file_ors_async(backup_trans_handle_h handle, const char *local_path,
                                       const char *remote_path, backup_trans_upload_cb callback,
                                       int64_t timestamp_ms, int options, void *user_data,
                                       const char *content_type) {
  return MockTransport::current().backup_trans_upload_file_ors_async(
      handle, local_path, remote_path, callback, timestamp_ms, options, user_data, content_type);
}

int backup_trans_get_folder_child_list_async(backup_trans_handle_h handle, const char *folder_path,
                                             int start, int count, int options, void *user_data,
                                             backup_trans_child_list_cb callback) {
  return MockTransport::current().backup_trans_get_folder_child_list_async(
      handle, folder_path, start, count, options, user_data, callback);
}

int backup_trans_delete_folder_ors_async(backup_trans_handle_h handle, const char *folder_path,
                                         void *user_data, backup_trans_delete_cb callback) {
  return MockTransport::current().backup_trans_delete_folder_ors_async(handle, folder_path,
                                                                       user_data, callback);
}

backup_trans_cause backup_trans_last_cause(void) {
  return MockTransport::current().backup_trans_last_cause();
}

const char *backup_trans_cause_word(backup_trans_cause cause) {
  return MockTransport::current().backup_trans_cause_word(cause);
}

void backup_trans_cancel_request(backup_trans_handle_h handle) {
  return MockTransport::current().backup_trans_cancel_request(handle);
}

int backup_trans_abort_request(backup_trans_handle_h handle, void *user_data) {
  return MockTransport::current().backup_trans_abort_request(handle, user_data);
}

}  // extern "C"
