/**
 * @file tree_depth.h
 * @brief How deep an application's data may be.
 */
#ifndef QUARN_TREE_DEPTH_H
#define QUARN_TREE_DEPTH_H

/**
 * Directories in one another, the data directory counted: walks hold a descriptor for each. It
 * holds for whatever takes a tree: what is packed can be copied aside, unpacked and put back.
 * Deletion has no bound, nor have the walks that only look after what one of these has taken: an
 * application may dig deeper meanwhile, and they hold one descriptor.
 */
inline constexpr int kMaxDirDepth = 400;

/** Whether a directory that is the @p directories'th of those in one another is beyond it. */
constexpr bool is_too_deep(int directories) { return directories > kMaxDirDepth; }

#endif
