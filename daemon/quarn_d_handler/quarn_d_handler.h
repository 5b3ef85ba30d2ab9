/**
 * @file quarn_d_handler.h
 * @brief What each method does.
 *
 * Main thread only. Each handler returns the status that becomes the method's
 * reply and takes ownership of @p record (a client_cb_data); outcomes follow
 * as callbacks to the client.
 */
#ifndef QUARN_D_HANDLER_H
#define QUARN_D_HANDLER_H

#include <string>
#include <vector>

/** Write the automatic-backup setting. @return 0 */
int quarnd_backup_enable(int on);
/** The present time, milliseconds since the Unix epoch. @return 0 */
int quarnd_get_last_backed_up_time(unsigned long long *timestamp);
/** Fetch (client 0) or build (client 1) the application list. */
int quarnd_get_app_list(int client, void *record);
/** Queue a manual backup. @return 0 */
int quarnd_manual_backup(void *record);
/** Cancel manual backups. @return 0 */
int quarnd_manual_backup_cancel(void *record);

/** Back one package up now; waits in a nested loop. @return 0, or 1: unknown package */
int quarnd_backup_app_data(const char *pkg_id, void *record);
/** Restore one package now; waits in a nested loop. @return 0, or 1: unknown package */
int quarnd_restore_app_data(const char *pkg_id, void *record);
/**
 * Pack one package's data as /tmp/PKGID_tmp.zip, mode 0600, in place of an earlier one; waits in
 * a nested loop for the thread that packs.
 * @param client_uid user that shall own the archive
 * @param client_label security label that it gets, for a user that is many callers; empty: the
 *        daemon's own
 * @return 0, 36 without a root path, 17 when the daemon ends, or what packing gave; with 36 the
 *         archive is there too, and lacks what could not be packed
 */
int quarnd_make_app_data(const char *pkg_id, unsigned int client_uid,
                         const std::string &client_label = "");

/** Restore mode of the phone-transfer companion is active. */
extern char pellix_restore_running;
/** Restore mode was enabled by the cloud client. */
extern char cloud_restore_running;

/**
 * Restore mode on or off. The record is kept while the mode lasts, for
 * "restore_stop"; the records of other calls are deleted.
 * @return 0 done, 1 bad client, 36 refused
 */
int quarnd_restore_enable(int on, int client, const char *serial_num, const char *pkg_list,
                          void *record);
/** Restore mode off, because its client does not want it any more: it was not used. */
void quarnd_withdraw_restore_mode();
/**
 * Replace the candidate list by a JSON array of package ids. Anything else
 * than an array of texts is an empty list; impossible ids are left out.
 * @return length of the list
 */
int init_package_list_to_be_restored(const char *pkg_list_json);

#endif
