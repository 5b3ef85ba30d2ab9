/**
 * @file entry_writer.h
 * @brief Writing one entry after the other into the archive that a thread is making.
 *
 * Failures are logged. A thread's entries share the memory of one codec.
 */
#ifndef QUARN_D_UTILS_ENTRY_WRITER_H
#define QUARN_D_UTILS_ENTRY_WRITER_H

#include <sys/stat.h>
#include <zip.h>

/**
 * One open file's bytes, as many as it had when it was opened, as the entry @p name.
 * @param path   for messages
 * @param fd     borrowed, at its beginning
 * @param status of @p fd
 * @param[out] error becomes #QUARN_REFUSED on failure, else stays
 */
[[nodiscard]] bool add_open_file(zipFile zip, const char *path, const char *name, int fd,
                                 const struct stat &status, int *error);

/** Give back the memory that the calling thread's entries have shared. */
void release_entry_codec();

#endif
