/**
 * @file own_place.h
 * @brief The daemon's places in directories in which everybody may make files.
 *
 * Whoever comes first may lie there: a file, a directory, a link, a pipe. It is
 * neither used nor followed and stops nothing. It is set aside, which is
 * renamed to "NAME.aside.XXXXXX" in the same directory, as it is. Any thread.
 */
#ifndef QUARN_D_UTILS_OWN_PLACE_H
#define QUARN_D_UTILS_OWN_PLACE_H

#include <string>

/**
 * Make @p path a directory of this process's user, mode 0700: the one that is
 * there, if it is; what others may have put into it while it was open to them
 * is removed.
 * @return false, with errno set, when it cannot be had
 */
[[nodiscard]] bool make_own_directory(const std::string &path);

/**
 * Give the file @p source, which lies where nobody else can reach it, the name
 * @p target on the same file system. A file, link or pipe that lies there is
 * replaced, a directory set aside.
 * @return false, with errno set, when it still has its old name
 */
[[nodiscard]] bool move_to_own_place(const std::string &source, const std::string &target);

#endif
