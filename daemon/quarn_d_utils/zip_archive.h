/**
 * @file zip_archive.h
 * @brief Archives by their descriptors: what was made is what is handed on, whatever lies by then
 * under the name that it was made at.
 */
#ifndef QUARN_D_UTILS_ZIP_ARCHIVE_H
#define QUARN_D_UTILS_ZIP_ARCHIVE_H

#include <atomic>

#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/handles.h"

/**
 * make_zip_data(), with the archive, open for reading and writing; none where none was begun. It is
 * new and root's alone, mode 0600.
 */
[[nodiscard]] UniqueFd make_archive(const char *pkg_id, const char *root, const char *zip_path,
                                    int *error, const archive_bounds &bounds,
                                    archive_excess *excess = nullptr,
                                    const std::atomic<bool> *stop = nullptr);

/** The same into a file of the caller's that is empty, and has no name among the data. */
void fill_archive(const char *pkg_id, const char *root, UniqueFd *archive, int *error,
                  const archive_bounds &bounds, archive_excess *excess = nullptr);

#endif
