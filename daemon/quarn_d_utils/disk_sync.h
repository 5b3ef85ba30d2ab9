/**
 * @file disk_sync.h
 * @brief Bringing onto the disk what was written.
 */
#ifndef QUARN_D_UTILS_DISK_SYNC_H
#define QUARN_D_UTILS_DISK_SYNC_H

#include <functional>
#include <string>

/**
 * Bring every file and directory below @p dir, itself included, onto the disk:
 * their content, attributes and names. What @p skipped takes by its path need
 * not be there. A few files are synced by themselves, in threads; with more
 * than 64 the file system's own sync costs less than their flushes. Blocks.
 * @return false when anything could not be brought there; kernels before 5.8
 * do not tell that of many files
 */
[[nodiscard]] bool sync_tree(const std::string &dir,
                             const std::function<bool(const std::string &path)> &skipped = nullptr);

/** The same for the directory @p dir alone: which names it has. */
[[nodiscard]] bool sync_directory(const std::string &dir);

#endif
