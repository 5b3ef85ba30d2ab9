/**
 * @file file_bytes.h
 * @brief All the bytes of a file, however often the kernel has to be asked. Any thread.
 */
#ifndef QUARN_D_UTILS_FILE_BYTES_H
#define QUARN_D_UTILS_FILE_BYTES_H

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>

#include "quarn_d_utils/handles.h"

/**
 * Open a regular file for reading, as safe_open() does; never blocks on anything else.
 * @param[out] status of what was opened
 */
[[nodiscard]] UniqueFd open_regular(const char *path, struct stat *status);
/** read(), again after a signal. @return as read() */
[[nodiscard]] ssize_t read_some(int fd, void *data, std::size_t size);
/** Write everything. @return false, with errno, when that failed */
[[nodiscard]] bool write_all(int fd, const void *data, std::size_t size);

#endif
