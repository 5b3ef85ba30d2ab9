/**
 * @file file.h
 * @brief Files by their paths.
 *
 * Every function logs its failures and reports them by its result only.
 * Paths are absolute. Whatever lies below a package root is reached without following a
 * symbolic link that an application could have made. Any thread.
 */
#ifndef QUARN_D_UTILS_FILE_H
#define QUARN_D_UTILS_FILE_H

#include <cstdint>
#include <string>

/** True for a regular file; a link is neither file nor directory. */
[[nodiscard]] bool file_exist(const char *path);
/** True for a directory. */
[[nodiscard]] bool is_directory(const char *path);
/** Size in bytes, -1 on failure. No part of the daemon calls it. */
[[nodiscard]] int get_file_size(const char *path);
/** Read a whole file; @p buffer is malloc'd, NUL-terminated and the caller's. */
[[nodiscard]] bool read_data_from_file(const char *path, char **buffer);
/** CRC-32 (IEEE 802.3) of the content; 0 on failure. No part of the daemon calls it. */
[[nodiscard]] std::uint32_t get_file_crc(const char *path);
/** Remove a regular file. */
bool delete_file(const char *path);
/** Free bytes of the file system, those reserved for the super-user included; 0 on failure. */
[[nodiscard]] std::uint64_t get_dir_available_size(const char *path);
/** Make the parent directory of a file, with its ancestors. */
[[nodiscard]] bool create_directory_of_file(const char *file);
/** Replace a file's content. @return as write_text_to_file() of write_text.h */
[[nodiscard]] int write_string_to_file(std::string data, std::string path);
/** Copy a regular file's content. */
[[nodiscard]] bool copy_file(const char *src, const char *dst);

#endif
