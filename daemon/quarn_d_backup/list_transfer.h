/**
 * @file list_transfer.h
 * @brief The application list's way from the cloud and to it.
 */
#ifndef QUARN_D_BACKUP_LIST_TRANSFER_H
#define QUARN_D_BACKUP_LIST_TRANSFER_H

struct backup_context;

/**
 * Request the list's download.
 * @return QUARN_OK when app_list_downloading will be cleared, else QUARN_LIST_CHECK_FAILED
 */
[[nodiscard]] int get_app_list_from_cloud(backup_context *ctx);
/**
 * Download the list and wait for it. Any thread, also beside a run.
 * No part of the daemon calls it.
 * @param[out] text malloc'd and the caller's; null unless QUARN_OK is returned
 * @return QUARN_OK, BACKUP_TRANS_ERROR_NO_SUCH_OBJECT when there is none, another transport error,
 *   or QUARN_LIST_CHECK_FAILED when it could not be read
 */
[[nodiscard]] int download_app_list_info_from_cloud(char **text);
/** Upload the staged list; app_list_uploading is cleared with its answer. @return 1 */
int upload_app_list(backup_context *ctx);

#endif
