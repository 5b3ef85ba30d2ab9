/**
 * @file cloud_restore.h
 * @brief Restores from the cloud: in which order, and with what they end. Main thread only.
 */
#ifndef QUARN_D_RESTORE_CLOUD_RESTORE_H
#define QUARN_D_RESTORE_CLOUD_RESTORE_H

struct pkg_restore_context;

/**
 * Request the package's archive, from which it is restored when it has come. A
 * further restore of a package waits for the earlier one.
 * @param ctx lent until the restore has ended, where it was accepted
 * @return #QUARN_OK, or #QUARN_FAILED with the reason as the context's result
 */
int restore_from_cloud(pkg_restore_context *ctx);

#endif
