/**
 * @file clearing.h
 * @brief Making room for a snapshot that goes back.
 */
#ifndef QUARN_D_RESTORE_CLEARING_H
#define QUARN_D_RESTORE_CLEARING_H

#include <json-c/json.h>

#include <string>

#include "quarn_d_restore/restore_files.h"

/**
 * Empty the data directories of everything that the snapshot will not replace. Failures are logged.
 * The caller's thread, which holds the package's lock, the root and the snapshot.
 * @param table the snapshot's
 * @return true when no file is left that there was not
 */
[[nodiscard]] bool clear_for_rollback(const restore_files &files, const std::string &root,
                                      json_object *table);

#endif
