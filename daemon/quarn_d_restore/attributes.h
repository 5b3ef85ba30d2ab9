/**
 * @file attributes.h
 * @brief What a file-info table says of one object, and how the object gets it.
 *
 * Main thread, with the rights of whoever calls. Failures are logged.
 */
#ifndef QUARN_D_RESTORE_ATTRIBUTES_H
#define QUARN_D_RESTORE_ATTRIBUTES_H

#include <sys/stat.h>
#include <sys/types.h>

struct json_object;

/**
 * Look one path up in a file-info table. @p path begins with @p root and "/".
 * @param[out] label points into the table
 * @return #QUARN_OK, #QUARN_NO_FILE_INFO without a table, #QUARN_UNREADABLE when the entry or a
 *         member of it is missing
 */
[[nodiscard]] int get_file_info_from_backup(json_object *table, const char *pkgid, const char *root,
                                            const char *path, int *mode, unsigned int *uid,
                                            unsigned int *gid, char **label);
/**
 * Give a directory or regular file its mode, the application owner and its label. The engine itself
 * calls restore_object_info(). @return 1, 0
 * No part of the daemon calls it.
 */
[[nodiscard]] int restore_file_info(const char *path, const char *pkgid, const char *root,
                                    json_object *table);
/**
 * The same for an object that is open already (as a rule by O_PATH), so that what
 * is changed is what was looked at; @p path names it in messages and the table.
 */
[[nodiscard]] int restore_object_info(int fd, const struct stat &status, const char *path,
                                      const char *pkgid, const char *root, json_object *table);
/** True for the labels that a restore may write itself. @p path is for messages. */
[[nodiscard]] int is_known_exception_label(const char *path, const char *label, const char *pkgid);
/** chmod() of an open object; a link has no mode of its own. @return 0, or -1 with errno */
[[nodiscard]] int change_object_mode(int fd, const struct stat &status, mode_t mode);
/** chown() of an open object, a link itself included. @return 0, or -1 with errno */
[[nodiscard]] int change_object_owner(int fd, uid_t uid, gid_t gid);

#endif
