/**
 * @file recovery.h
 * @brief What an ended daemon, or a device that lost power, has left half done.
 */
#ifndef QUARN_D_RESTORE_RECOVERY_H
#define QUARN_D_RESTORE_RECOVERY_H

enum class recovery_result {
  nothing,  /**< no restore was interrupted */
  put_back, /**< the data is what it was before the restore */
  told,     /**< the application has gone on with its data, which stays; the snapshot is kept */
  kept      /**< not all could be put back yet: the snapshot still counts */
};
/** Mend one package. The caller holds its PackageDataLock. */
[[nodiscard]] recovery_result recover_package_data(const char *pkgid, const char *root);

/**
 * Undo what a daemon that died in a restore of the package left: a complete
 * snapshot is put back, an incomplete one removed. Where the application has
 * written since, its data stays and the snapshot is kept. Takes the
 * PackageDataLock; a package that is packed at the moment was found whole.
 * @return true when all data was put back
 */
bool recover_interrupted_restore(const char *pkgid, const char *root);
/** The same for every installed package. */
void recover_interrupted_restores();

/**
 * Everything for every installed package: interrupted restores, working files,
 * icons that were hidden. For a process that does nothing else, or before
 * anything else; needs neither account nor bus. Waits for each PackageDataLock.
 */
void recover_device();

#endif
