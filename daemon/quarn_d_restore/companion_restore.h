/**
 * @file companion_restore.h
 * @brief The restore from an archive that the phone-transfer companion holds ready.
 *
 * Main thread only. No snapshot is taken, so nothing is put back: what could be
 * unpacked is the application's.
 */
#ifndef QUARN_D_RESTORE_COMPANION_RESTORE_H
#define QUARN_D_RESTORE_COMPANION_RESTORE_H

struct pkg_restore_context;

/**
 * Restore the package at once.
 * @param ctx lent for the call; it stays the caller's
 * @return what the unpacking gave, which is the context's result too where it failed
 */
int restore_from_companion(pkg_restore_context *ctx);

#endif
