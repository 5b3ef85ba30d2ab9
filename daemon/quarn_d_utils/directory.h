/**
 * @file directory.h
 * @brief What lies in a directory: looking for files, and removing them.
 *
 * Every function logs its failures and reports them by its result only. Paths are absolute, and
 * links are followed nowhere. Trees of any depth. Any thread.
 */
#ifndef QUARN_D_UTILS_DIRECTORY_H
#define QUARN_D_UTILS_DIRECTORY_H

/** True when a regular file lies anywhere below @p dir. */
[[nodiscard]] bool file_exist_in_directory(const char *dir);
/** The negation of file_exist_in_directory(). */
[[nodiscard]] bool is_empty_directory(const char *dir);
/** Remove a directory with everything in it; links are refused and stay. */
bool delete_directory_util(const char *dir);
/** Empty a directory, and remove it too when @p remove_directory is set. */
bool clear_directory(const char *dir, bool remove_directory);
/** Empty a directory but for the entry whose full path is @p keep. */
bool clear_shared_data_dir_except_temp_backup(const char *dir, const char *keep);

#endif
