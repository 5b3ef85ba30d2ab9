/**
 * @file snapshot_copy.h
 * @brief Copying a package's data aside: what is copied, what is kept by another name, and the
 * table of both.
 */
#ifndef QUARN_D_RESTORE_SNAPSHOT_COPY_H
#define QUARN_D_RESTORE_SNAPSHOT_COPY_H

#include <string>
#include <vector>

#include "quarn_d_utils/file_info_table.h"

class StampWriter;

/** Where copies go, and who is told of them. */
struct snapshot_copies {
  std::string snapshot;     /**< the snapshot's folder, which there is */
  file_info_table_h *table; /**< gets everything that is copied */
  StampWriter *stamps;      /**< gets each file and its copy; may be null */
};

/**
 * Copy what lies below @p dirs, directories of a package's data, one after the other until one
 * cannot be copied whole. Failures are logged. The caller's thread, which holds the package's lock.
 * @return how many of them were
 */
[[nodiscard]] std::size_t copy_aside(const char *pkgid, const char *root,
                                     const std::vector<std::string> &dirs,
                                     const snapshot_copies &copies);

#endif
