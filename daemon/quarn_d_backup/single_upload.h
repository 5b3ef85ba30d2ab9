/**
 * @file single_upload.h
 * @brief The upload of a per-application request.
 */
#ifndef QUARN_D_BACKUP_SINGLE_UPLOAD_H
#define QUARN_D_BACKUP_SINGLE_UPLOAD_H

struct backup_context;

/**
 * Nobody waits for the run of one package any more: its upload ends, and its
 * callback with it releases what it holds. Main thread.
 */
void abandon_single_upload(backup_context *ctx);

#endif
