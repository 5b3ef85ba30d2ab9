/**
 * @file file_at.h
 * @brief A file by its name in a directory that is open. Any thread.
 */
#ifndef QUARN_D_UTILS_FILE_AT_H
#define QUARN_D_UTILS_FILE_AT_H

/** delete_file() of file.h, for the file @p name of the directory @p dir; messages too. */
bool delete_file_at(int dir, const char *name);

#endif
