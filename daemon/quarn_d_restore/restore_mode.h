/**
 * @file restore_mode.h
 * @brief Restore mode, as the engine itself sees it. Main thread only.
 *
 * The mode is off, or on for one client, its candidates and its record. A candidate is taken when
 * it has been installed; with the last one the mode ends. Its client hears "restore_stop" once,
 * when the mode is over and no restore that it began is outstanding any more.
 */
#ifndef QUARN_D_RESTORE_RESTORE_MODE_H
#define QUARN_D_RESTORE_RESTORE_MODE_H

#include <memory>
#include <string>
#include <vector>

#include "quarn_common.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_dbus_client.h"

/** Restore candidates still expected, in the order given; stays when the mode is switched off. */
extern std::vector<std::string> pkg_list_to_be_restored;
/** Client of the current restore mode; the cloud's while there is none. */
extern quarn_client_kind current_restore_client;
/** Backup set chosen by the user. */
extern std::string serial_num_user_select;
/** Record of the client that switched restore mode on; null when nobody is to be told. */
extern std::unique_ptr<client_cb_data> g_restore_cb_data;

/**
 * Replace the candidate list by a JSON array of package ids. Anything else
 * than an array of texts is an empty list; impossible ids are left out. The
 * mode itself takes a list only when it is switched on.
 * No part of the daemon calls it.
 * @return length of the list
 */
[[nodiscard]] int init_package_list_to_be_restored(const char *pkg_list_json);
/** Take a package off the candidate list. @return 1 when it was on it, else 0 */
[[nodiscard]] int package_to_be_restored(const char *pkgid);

/** Keep the record of the client that switched restore mode on, in place of an earlier one. */
void keep_restore_record(std::unique_ptr<client_cb_data> record);
/** Whether the client that is kept for "restore_stop" is @p sender, a unique bus name. */
[[nodiscard]] bool restore_record_is_of(const std::string &sender);
/** The "restore_stop" of the kept client will carry @p result in place of #QUARN_OK. */
void set_restore_stop_result(int result);
/**
 * Restore mode is over: the kept client gets "restore_stop", from the main
 * loop, as soon as no restore of an installed package is outstanding.
 */
void end_restore_report();
/** True while a "restore_stop" is about to be sent. */
[[nodiscard]] bool restore_report_pending();
/** A restore of an installed package began (1) or ended (-1). */
void count_outstanding_restore(int change);

#endif
