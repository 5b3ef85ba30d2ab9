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

#endif
