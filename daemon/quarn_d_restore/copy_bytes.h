/**
 * @file copy_bytes.h
 * @brief A file's content, into a snapshot and out of it.
 */
#ifndef QUARN_D_RESTORE_COPY_BYTES_H
#define QUARN_D_RESTORE_COPY_BYTES_H

#include <sys/types.h>

/**
 * Copy all of a file's bytes, as long as it is by now, into an empty one: what grows meanwhile may
 * grow for ever. Its holes, which an application may make as large as it likes, stay holes and take
 * neither time nor room.
 * @param size that it had when it was looked at; it may have another by now
 * @return false when it could not be copied. Any thread
 */
[[nodiscard]] bool copy_bytes(int from, int to, off_t size);

#endif
