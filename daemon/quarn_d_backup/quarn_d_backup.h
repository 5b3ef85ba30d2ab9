/**
 * @file quarn_d_backup.h
 * @brief The backup engine: requests and their cancel, the time of the last backup, staging.
 *
 * What belongs to one matter only has a header of its own: backup_progress.h what runs tell of
 * their steps, single_backup.h a request for one package, archive_hold.h and its neighbours what
 * stays in the cloud, cancel.h one client's requests.
 */
#ifndef QUARN_D_BACKUP_H
#define QUARN_D_BACKUP_H

#include <atomic>
#include <cstdint>
#include <string>

using backup_end_observer = void (*)();
/** Follow the ends of requests: called on the worker when nothing of one is left; null ends it. */
void set_backup_end_observer(backup_end_observer observer);

/**
 * A manual backup was cancelled; cleared by the next manual request. A run that
 * stood when the cancel came stays cancelled.
 */
extern std::atomic<bool> manual_backup_canceled;
/** The worker runs a request. */
extern std::atomic<bool> g_is_backing_up;

/** Start the worker; once, on the main thread. */
void init_backup_req_dispatch_thread();
/**
 * Queue a request. Any thread.
 * @param client a client_cb_data, which belongs to the request from now on and is deleted with its
 *   final status; null is an automatic backup, of which one at a time is enough
 */
void request_backup(void *client);
/**
 * Abort transfers and drop every queued manual request. Each dropped client is
 * sent the final status cancelled, by the worker. Any thread.
 * @param client not used: who cancels is told by its caller
 */
void cancel_backup(void *client);
/**
 * Whether somebody else's request than those of @p sender, a unique bus name, was held up by
 * clients that do not answer for as long as they may all together: a minute. Any thread.
 */
[[nodiscard]] bool others_held_up(const std::string &sender);
/** True from request_backup() until the worker has finished everything queued. */
[[nodiscard]] bool backup_request_outstanding();

/** Make the directory of staged lists, whatever lies there; false when it cannot be had. */
[[nodiscard]] bool prepare_staging_directory();
/** Remove what an ended process has left there, all but @p keep. Before anything is staged. */
void sweep_staging_directory(const char *keep);

/**
 * Build the companion's list and archives. Main thread.
 * @return malloc'd text, the caller's; null on failure, which is logged
 */
[[nodiscard]] char *get_app_list_for_pellix();

/* The time of the last backup, a setting; any thread. */

/** Store 0: never backed up. */
void init_last_backup_time();
/** Store the present time. */
void set_last_backup_time();
/** The stored time, milliseconds since the Unix epoch, without a log line; false: unreadable. */
[[nodiscard]] bool read_last_backup_time(std::uint64_t *time);
/** The stored time, milliseconds since the Unix epoch; all ones when it cannot be read. */
[[nodiscard]] std::uint64_t get_last_backup_time();

#endif
