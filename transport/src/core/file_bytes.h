/**
 * @file file_bytes.h
 * @brief Bytes of files, whatever signals come.
 *
 * Functions set errno. Any thread.
 */
#ifndef BACKUP_TRANSPORT_FILE_BYTES_H
#define BACKUP_TRANSPORT_FILE_BYTES_H

#include <sys/types.h>

#include <cstddef>

namespace transport {

/** pread(). @return bytes read, 0 at the end, -1 on an error */
[[nodiscard]] ssize_t read_at(int fd, char *buffer, std::size_t size, off_t offset);

/** write() until all of it is written. @return false on an error */
[[nodiscard]] bool write_all(int fd, const char *data, std::size_t size);

}  // namespace transport

#endif
