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

/** Write the automatic-backup setting. @return #QUARN_OK */
int quarnd_backup_enable(int on);
/** The present time, milliseconds since the Unix epoch. @return #QUARN_OK */
int quarnd_get_last_backed_up_time(unsigned long long *timestamp);
/**
 * Fetch (for the cloud) or build (for the companion) the application list.
 * @param client a #quarn_client_kind
 * @return #QUARN_OK, #QUARN_BAD_ARGUMENT for another client, #QUARN_NO_SESSION, #QUARN_CANCELLED
 * when it was withdrawn, or #QUARN_FAILED
 */
int quarnd_get_app_list(int client, void *record);
/** Queue a manual backup. @return #QUARN_OK */
int quarnd_manual_backup(void *record);
/** Cancel manual backups. @return #QUARN_OK */
int quarnd_manual_backup_cancel(void *record);

/** Back one package up now; waits in a nested loop. @return #QUARN_OK, or #QUARN_BAD_ARGUMENT:
 * unknown package */
int quarnd_backup_app_data(const char *pkg_id, void *record);
/** Restore one package now; waits in a nested loop. @return #QUARN_OK, or #QUARN_BAD_ARGUMENT:
 * unknown package */
int quarnd_restore_app_data(const char *pkg_id, void *record);
/**
 * Pack one package's data as /tmp/PKGID_tmp.zip, mode 0600, in place of an earlier one; waits in
 * a nested loop for the thread that packs.
 * @param client_uid user that shall own the archive
 * @param client_label security label that it gets, for a user that is many callers; empty: the
 *        daemon's own
 * @return #QUARN_OK, #QUARN_REFUSED without a root path, #QUARN_CANCELLED when the daemon ends, or
 *         what packing gave; with #QUARN_REFUSED from that the archive is there too, and lacks what
 *         could not be packed
 */
int quarnd_make_app_data(const char *pkg_id, unsigned int client_uid,
                         const std::string &client_label = "");

/**
 * Restore mode on or off. The record is kept while the mode lasts, for
 * "restore_stop"; the records of other calls are deleted.
 * @param client a #quarn_client_kind
 * @return #QUARN_OK, #QUARN_BAD_ARGUMENT for another client, #QUARN_REFUSED, #QUARN_CANCELLED when
 *         it was withdrawn meanwhile
 */
int quarnd_restore_enable(int on, int client, const char *serial_num, const char *pkg_list,
                          void *record);

#endif
