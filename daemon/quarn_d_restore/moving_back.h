/**
 * @file moving_back.h
 * @brief Moving a snapshot's files back to where they were.
 */
#ifndef QUARN_D_RESTORE_MOVING_BACK_H
#define QUARN_D_RESTORE_MOVING_BACK_H

#include <json-c/json.h>

#include <string>

#include "quarn_d_restore/restore_files.h"

/**
 * Move what lies in the snapshot to its place; a name is replaced, so nothing needs space. Failures
 * are logged. The caller's thread, which holds the package's lock and root.
 * @param table the snapshot's, null where it cannot be read
 * @param dir   the snapshot, or a directory in it
 * @return true when everything below @p dir is in its place
 */
[[nodiscard]] bool move_back(const restore_files &files, const std::string &root,
                             json_object *table, const std::string &dir);

#endif
