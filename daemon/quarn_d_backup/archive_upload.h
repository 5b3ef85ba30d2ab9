/**
 * @file archive_upload.h
 * @brief The upload of staged archives.
 */
#ifndef QUARN_D_BACKUP_ARCHIVE_UPLOAD_H
#define QUARN_D_BACKUP_ARCHIVE_UPLOAD_H

struct backup_context;

/** Upload a staged archive; refused, result is QUARN_TRANSFER_FAILED and the archive is gone. */
void upload_app_data(backup_context *ctx, const char *pkg_id, const char *root_path,
                     const char *version);
/**
 * Nobody waits for the run of one package any more: its upload ends, and its
 * callback with it releases what it holds. Main thread.
 */
void abandon_single_upload(backup_context *ctx);

#endif
