/**
 * @file app_restore.h
 * @brief The beginning and the end of one package's restore. Main thread only.
 */
#ifndef QUARN_D_RESTORE_APP_RESTORE_H
#define QUARN_D_RESTORE_APP_RESTORE_H

struct pkg_restore_context;

/**
 * Restore one installed package: from the cloud later, by a download, or from
 * the phone-transfer companion at once.
 * @param ctx lent; with its pending count above 0 afterwards until that restore has ended
 * @return #QUARN_OK, #QUARN_FAILED when the download was refused, from the companion the
 *         unpacking's result
 */
int restore_app_data(const char *appid, pkg_restore_context *ctx);
/**
 * Count one restore as ended. With none left a waiting request's loop is quit, or else the
 * package's icon is shown; a context that was left to the engine is deleted.
 */
void check_package_restore_complete(pkg_restore_context *ctx);

#endif
