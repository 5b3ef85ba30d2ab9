/**
 * @file disk_sync.h
 * @brief Bringing onto the disk what was written, and nothing else.
 */
#ifndef QUARN_D_UTILS_DISK_SYNC_H
#define QUARN_D_UTILS_DISK_SYNC_H

#include <functional>
#include <string>

/**
 * Bring every file and directory below @p dir, itself included, onto the disk:
 * their content, attributes and names. What @p skipped takes by its path is
 * left out. Helper threads do the waiting; returns when all is done. Blocks.
 * @return false when anything could not be brought there
 */
bool sync_tree(const std::string &dir,
               const std::function<bool(const std::string &path)> &skipped = nullptr);

/** The same for the directory @p dir alone: which names it has. */
bool sync_directory(const std::string &dir);

#endif
