/**
 * @file own_file.h
 * @brief Telling the daemon's files among an application's data from those of the application.
 */
#ifndef QUARN_D_UTILS_OWN_FILE_H
#define QUARN_D_UTILS_OWN_FILE_H

#include <sys/stat.h>
#include <unistd.h>

/**
 * True for what this daemon, or an earlier one, made: an application may give a file of its own any
 * name, but cannot give it away. Any thread.
 */
inline bool is_own_file(const struct stat &status) { return status.st_uid == geteuid(); }

#endif
