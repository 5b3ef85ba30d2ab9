/**
 * @file platform_security_server.h
 * @brief The service that may write security labels of applications' files.
 *
 * Functions return #SECURITY_SERVER_SUCCESS or another value on failure. Main
 * thread.
 */
#ifndef QUARN_PLATFORM_SECURITY_SERVER_H
#define QUARN_PLATFORM_SECURITY_SERVER_H

#ifdef __cplusplus
extern "C" {
#endif

#define SECURITY_SERVER_SUCCESS 0
#define SECURITY_SERVER_ERROR_INPUT_PARAM (-1)
#define SECURITY_SERVER_ERROR_SERVER (-2)

/** Kind of path of security_server_perm_app_setup_path(): every object below takes one label. */
#define SECURITY_SERVER_PATH_ANY_LABEL 5

/** A transaction; nothing changes before its commit. */
typedef struct security_server_transaction *security_server_perm_h;

/**
 * Set the access label of the object at @p path.
 *
 * The daemon names the object by a descriptor it holds, "/proc/PID/fd/N", so
 * that what is labelled is what was checked; the service follows that name.
 */
int security_server_label_access(const char *path, const char *label);
/** Open a transaction. It ends with the commit, also with one that fails. */
int security_server_perm_begin(security_server_perm_h *handle);
/**
 * Ask that the directory @p path and everything under it take a label.
 *
 * The daemon names the directory as above, by a descriptor that it holds until
 * after the commit; the service follows that name, and no link below it.
 *
 * @param path_type #SECURITY_SERVER_PATH_ANY_LABEL, which takes one more
 *                  argument: const char *label
 */
int security_server_perm_app_setup_path(security_server_perm_h handle, const char *pkg_id,
                                        const char *path, int path_type, ...);
/** Carry the transaction out and release it. */
int security_server_perm_commit(security_server_perm_h handle);
/** Release a transaction that is not to be carried out. NULL is accepted. */
void security_server_perm_abort(security_server_perm_h handle);

#ifdef __cplusplus
}
#endif
#endif
