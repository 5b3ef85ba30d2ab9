/**
 * @file tree_depth.h
 * @brief How deep an application's data may be.
 */
#ifndef QUARN_TREE_DEPTH_H
#define QUARN_TREE_DEPTH_H

/**
 * Directories in one another, the data directory counted: walks hold a descriptor for each. It
 * holds for every walk but deletion, which has no bound: what is packed can be copied aside,
 * unpacked and put back.
 */
inline constexpr int kMaxDirDepth = 400;

/** Whether a directory that is the @p directories'th of those in one another is beyond it. */
constexpr bool is_too_deep(int directories) { return directories > kMaxDirDepth; }

#endif
