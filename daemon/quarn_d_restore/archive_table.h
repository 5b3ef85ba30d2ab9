/**
 * @file archive_table.h
 * @brief The table that came out of an archive.
 */
#ifndef QUARN_D_RESTORE_ARCHIVE_TABLE_H
#define QUARN_D_RESTORE_ARCHIVE_TABLE_H

#include "json_ptr.h"

struct archive_table {
  bool readable = false; /**< the file could be read to its end, or as far as its bounds go */
  JsonPtr table;         /**< null for no JSON object, or one beyond kArchiveTableBounds */
};

/**
 * Read a table, piece by piece: what is in memory is what it says of objects,
 * to be looked up with get_file_info_from_backup(), never its text.
 */
[[nodiscard]] archive_table read_archive_table(const char *path);

/**
 * The table of a JSON text, the caller's; null when the text is no JSON
 * object. Entries with equal attributes share them: what is read is not to be
 * changed.
 */
[[nodiscard]] json_object *parse_file_info_table(const char *text);

#endif
