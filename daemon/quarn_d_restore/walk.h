/**
 * @file walk.h
 * @brief Attributes and links of all that has come out of a package's archive.
 *
 * Main thread; the caller holds the PackageDataLock. Failures are logged.
 */
#ifndef QUARN_D_RESTORE_WALK_H
#define QUARN_D_RESTORE_WALK_H

struct json_object;

/** Modes, owners and labels of the whole package from the unpacked table. @return 1, 0 */
[[nodiscard]] int restore_app_info(const char *pkgid, const char *root);
/** One directory of it and everything below. @return 1 when every entry was restored, else 0 */
[[nodiscard]] int parse_app_dir_for_restore(const char *dir, const char *pkgid, const char *root,
                                            json_object *table);
/**
 * Make the links that the table lists. No restore calls it: links are only recorded.
 * No part of the daemon calls it.
 * @return 1
 */
int restore_symlnk(const char *pkgid, const char *root, json_object *table);
/**
 * Empty the three data directories but for the snapshot. The engine itself does not call it.
 * No part of the daemon calls it.
 */
void clear_app_dir(const char *pkgid, const char *root);

#endif
