/**
 * @file unpacked_file.h
 * @brief How a file looks that an unpacking has made, before it has its attributes.
 */
#ifndef QUARN_D_UTILS_UNPACKED_FILE_H
#define QUARN_D_UTILS_UNPACKED_FILE_H

#include <sys/stat.h>

/**
 * It is the package's from the beginning, and has a mode that no application's
 * file has: nobody may open it, and a bit is set that means nothing for a file.
 * So a recovery tells what a killed restore has made from what the application
 * has written since; an application that wants to write to such a file has to
 * change its mode, and one that makes some of that mode loses only these.
 */
inline constexpr mode_t kUnpackedMode = S_ISVTX;

/** True for a file of that mode. */
[[nodiscard]] inline bool is_being_unpacked(const struct stat &status) {
  return S_ISREG(status.st_mode) && (status.st_mode & ALLPERMS) == kUnpackedMode;
}

#endif
