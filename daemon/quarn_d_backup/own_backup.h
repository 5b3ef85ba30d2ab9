/**
 * @file own_backup.h
 * @brief Whether this device has made its backup in the cloud itself.
 *
 * A device that was reset finds a backup of its own serial that it knows
 * nothing of: what is not installed on it was not removed by its user, but is
 * still to come back. The knowledge is a setting, so it survives the daemon
 * and goes with a reset; it is that of one serial, so it does not go over to
 * another device's. Any thread.
 */
#ifndef QUARN_D_BACKUP_OWN_BACKUP_H
#define QUARN_D_BACKUP_OWN_BACKUP_H

#include <string>

/** Setting: the CRC-32 of the serial number whose backup is this device's own, an integer; -1
 * while a backup that was found is undecided on, -2 while restore mode waits for packages of it. */
inline constexpr char kOwnBackupKey[] = "db/private/quarn/own_backup";

/**
 * True when the device knows of an earlier run of its own, or its user has
 * decided on the backup that it found: by a manual run, or by restore mode.
 */
[[nodiscard]] bool knows_own_backup(const std::string &serial);
/** Remember it. */
void note_own_backup(const std::string &serial);
/** A run keeps a backup that it found: the time of that run, too, tells of no decision. */
void note_found_backup();
/** The time of the last backup is about to be forgotten; what it tells of is not. */
void keep_knowledge_of_last_backup();
/**
 * Restore mode waits for packages of the device @p serial. When that is this
 * device, and the daemon ends before the mode does, nothing of the backup is
 * known to be superfluous by then.
 */
void note_restore_mode_waits(const std::string &serial);
/** It waits no more, and was not used: as if the daemon had ended before the mode. */
void note_restore_mode_withdrawn();
/** Restore mode was used to its end: the user had what was wanted of the backup. */
void note_restore_mode_used();

#endif
