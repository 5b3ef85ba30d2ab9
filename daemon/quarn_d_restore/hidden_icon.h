/**
 * @file hidden_icon.h
 * @brief Icons that are hidden for a restore are known to the next daemon as well.
 *
 * The note is an empty file of the daemon's beside the package's working files;
 * it stands before the icon is hidden and goes when it was shown.
 */
#ifndef QUARN_D_RESTORE_HIDDEN_ICON_H
#define QUARN_D_RESTORE_HIDDEN_ICON_H

/**
 * Note that the package's icon is about to be hidden. Main thread.
 * @return false when it could not be noted durably
 */
[[nodiscard]] bool note_hidden_icon(const char *pkgid, const char *root);
/** The icon was shown again. Main thread. */
void forget_hidden_icon(const char *pkgid, const char *root);
/** Show the icon of a package that an ended process has hidden. Any thread. */
void show_hidden_icon(const char *pkgid, const char *root);

#endif
