/**
 * @file archive_check.h
 * @brief Unpacking for those who cannot undo it: nothing is written before the table was read.
 */
#ifndef QUARN_D_UTILS_ARCHIVE_CHECK_H
#define QUARN_D_UTILS_ARCHIVE_CHECK_H

struct unzip_report;

/** The file-info table of an archive, of which the last counts where there are several. */
enum class archived_table {
  none,      /**< there is no such entry */
  malformed, /**< it is corrupt, or no JSON object */
  whole
};

/**
 * unzip_data() of archive.h, for an archive whose table is whole; of any
 * other nothing is unpacked.
 * @param[out] table what was found, where the archive is within its bounds
 * @return the same, and #QUARN_NO_FILE_INFO when the table is not whole
 */
[[nodiscard]] int unzip_data_with_table(const char *pkg_id, const char *destination,
                                        const char *zip_path, unzip_report *report,
                                        archived_table *table);

#endif
