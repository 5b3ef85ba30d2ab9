/**
 * @file settle.h
 * @brief What becomes of unpacked files whose attributes could not be had.
 */
#ifndef QUARN_D_RESTORE_SETTLE_H
#define QUARN_D_RESTORE_SETTLE_H

/**
 * Make what was unpacked and has no attributes yet an ordinary file of the application: mode 0600,
 * with the label of its data directory. For a restore that is not rolled back. The caller holds
 * the PackageDataLock; failures are logged.
 */
void settle_unpacked_files(const char *pkgid, const char *root);

#endif
