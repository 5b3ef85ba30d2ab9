/**
 * @file pipeline.h
 * @brief One run, from the cloud's list to its clean-up. On the worker.
 */
#ifndef QUARN_D_BACKUP_PIPELINE_H
#define QUARN_D_BACKUP_PIPELINE_H

#include <memory>

struct backup_context;
struct client_cb_data;

/**
 * One complete run. @p client is told of its outcome.
 * @param client of a manual run; null for an automatic one
 */
void do_backup(bool is_manual, std::unique_ptr<client_cb_data> client);
/** Report the outcome and delete staged files. */
void finish_backup(backup_context *ctx);
/** Delete the staged archives and list that are the run's. */
void delete_backup_items(backup_context *ctx);
/**
 * Whether the run is to stop, for it was cancelled or Wi-Fi is gone. It is
 * abandoned then, with its result, and its transfers are ended.
 */
[[nodiscard]] bool backup_must_stop(backup_context *ctx);

#endif
