/**
 * @file archive_entry.h
 * @brief Single entries of an archive, by the handles of the library that writes and reads it.
 *
 * Every function logs its failures and reports them by its result only.
 */
#ifndef QUARN_D_UTILS_ARCHIVE_ENTRY_H
#define QUARN_D_UTILS_ARCHIVE_ENTRY_H

#include <unzip.h>
#include <zip.h>

#include "quarn_d_utils/file_info_table.h"

/** Walk one directory into the archive. @return true when anything was recorded */
[[nodiscard]] bool parse_app_dir_for_zip(const char *pkg_id, const char *root, zipFile zip,
                                         const char *dir, file_info_table_h *table, int *error);
/** Add one file's bytes as one entry. No part of the daemon calls it. */
[[nodiscard]] bool add_file_to_zip(const char *root, zipFile zip, const char *file, int *error);
/** Add the table's text as the last entry. */
void insert_file_info_table_to_zip(file_info_table_h *table, zipFile zip, const char *pkg_id,
                                   const char *root, int *error);
/**
 * Write the archive's current entry, opened raw, below @p destination.
 * No part of the daemon calls it.
 */
[[nodiscard]] bool extract_file_from_zip(const char *pkg_id, const char *destination,
                                         unzFile archive, const char *name);

#endif
