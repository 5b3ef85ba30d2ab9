/**
 * @file kept_packages.h
 * @brief Whose backups a run keeps as they are: what it cannot examine, and what is to come back.
 */
#ifndef QUARN_D_BACKUP_KEPT_PACKAGES_H
#define QUARN_D_BACKUP_KEPT_PACKAGES_H

#include <string>

struct backup_context;

/** True unless the package manager says that there is no such package, or a preloaded one. */
[[nodiscard]] bool may_be_installed(const std::string &pkg_id);
/**
 * A package that is installed but cannot be examined now: its backup stays as it is.
 * @param pkg_id null when not even that is known, then every package's stays
 */
void keep_unexamined(backup_context *ctx, const char *pkg_id);
/** Whether the backup in the cloud is this device's own, as far as it knows. */
void look_for_unknown_backup(backup_context *ctx);
/** A package whose archive a restore is still to have is not backed up over it. */
[[nodiscard]] bool leave_to_restore(backup_context *ctx);
/**
 * What stays in the cloud stays in the list: the last list's entries of
 * packages that could not be examined, and of those that are to come back.
 */
void list_kept_packages(backup_context *ctx);

#endif
