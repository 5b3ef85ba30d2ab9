#include "quarn_d_utils/cloud_transfer.h"

#include <cstdint>

#include "backup_transport.h"
#include "quarn_d_utils/cloud_session.h"

extern "C" {
#define QUARN_MAY_BE_MISSING __attribute__((weak))
int backup_trans_download_limited_ors_async(backup_trans_handle_h, const char *, const char *,
                                            void *, backup_trans_download_cb, int,
                                            uint64_t) QUARN_MAY_BE_MISSING;
int backup_trans_download_limited_ors(backup_trans_handle_h, const char *, const char *, int,
                                      uint64_t) QUARN_MAY_BE_MISSING;
int backup_trans_abort_request(backup_trans_handle_h, void *) QUARN_MAY_BE_MISSING;
}

int download_bounded_async(const char *cloud_path, const char *local_path, void *user_data,
                           backup_trans_download_cb callback, int options, std::uint64_t max_size) {
  if (backup_trans_download_limited_ors_async == nullptr) {
    return backup_trans_download_file_ors_async(cloud_handler(), cloud_path, local_path, user_data,
                                                callback, options);
  }
  return backup_trans_download_limited_ors_async(cloud_handler(), cloud_path, local_path, user_data,
                                                 callback, options, max_size);
}

int download_bounded(const char *cloud_path, const char *local_path, int options,
                     std::uint64_t max_size) {
  if (backup_trans_download_limited_ors == nullptr) {
    return backup_trans_download_file_ors(cloud_handler(), cloud_path, local_path, options);
  }
  return backup_trans_download_limited_ors(cloud_handler(), cloud_path, local_path, options,
                                           max_size);
}

bool abort_transfer(void *user_data) {
  return backup_trans_abort_request != nullptr &&
         backup_trans_abort_request(cloud_handler(), user_data) == BACKUP_TRANS_ERROR_NONE;
}
