/**
 * @file tree_depth.h
 * @brief How deep an application's data may be.
 */
#ifndef QUARN_TREE_DEPTH_H
#define QUARN_TREE_DEPTH_H

/**
 * Directories in one another, the data directory counted: some walks hold a descriptor for each. It
 * holds for every walk but deletion, and the search for what one has left: what is packed can be
 * copied aside, unpacked, given its attributes and put back, and no other walk looks at what an
 * application digs deeper meanwhile.
 */
inline constexpr int kMaxDirDepth = 400;

/** Whether a directory that is the @p directories'th of those in one another is beyond it. */
[[nodiscard]] constexpr bool is_too_deep(int directories) { return directories > kMaxDirDepth; }

#endif
