/**
 * @file archive_table.h
 * @brief The table that came out of an archive.
 */
#ifndef QUARN_D_RESTORE_ARCHIVE_TABLE_H
#define QUARN_D_RESTORE_ARCHIVE_TABLE_H

#include "quarn_d_utils/handles.h"

struct archive_table {
  bool readable = false; /**< the file could be read to its end, or as far as its bounds go */
  JsonPtr table;         /**< null for no JSON object, or one beyond kArchiveTableBounds */
};

/** Read a table, piece by piece: what is in memory is what it says, never its text. */
archive_table read_archive_table(const char *path);

#endif
