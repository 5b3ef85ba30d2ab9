/**
 * @file platform_package_client.h
 * @brief Show or hide the launcher icons of a package.
 *
 * Main thread. Functions return #PKGMGR_R_OK or a negative error.
 */
#ifndef QUARN_PLATFORM_PACKAGE_CLIENT_H
#define QUARN_PLATFORM_PACKAGE_CLIENT_H

#ifdef __cplusplus
extern "C" {
#endif

#define PKGMGR_R_OK 0
#define PKGMGR_R_EINVAL (-2)
#define PKGMGR_R_ERROR (-1)

typedef void pkgmgr_client;
typedef enum { PC_REQUEST = 0, PC_LISTENING = 1, PC_BROADCAST = 2 } pkgmgr_client_type;

/** Make a client; NULL on failure. Released with pkgmgr_client_free(). */
pkgmgr_client *pkgmgr_client_new(pkgmgr_client_type type);
int pkgmgr_client_free(pkgmgr_client *pc);
/** Make the package's applications visible. @p pkg_type may be NULL. */
int pkgmgr_client_activate(pkgmgr_client *pc, const char *pkg_type, const char *pkgid);
/** Hide the package's applications. @p pkg_type may be NULL. */
int pkgmgr_client_deactivate(pkgmgr_client *pc, const char *pkg_type, const char *pkgid);

#ifdef __cplusplus
}
#endif
#endif
