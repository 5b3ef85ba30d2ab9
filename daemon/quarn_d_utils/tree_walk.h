/**
 * @file tree_walk.h
 * @brief The descent through a tree that the walks have in common.
 */
#ifndef QUARN_D_UTILS_TREE_WALK_H
#define QUARN_D_UTILS_TREE_WALK_H

#include <string>
#include <utility>
#include <vector>

#include "quarn_d_utils/tree_place.h"

/** Names of the folders of one directory that a walk is to go into, the last one first. */
using TreeFolders = std::vector<std::string>;

/**
 * Visit a directory and everything below it, each folder before what it holds.
 * @param place where to begin; nothing is visited when it is nowhere
 * @param path  its path, and during each visit that of the directory visited
 * @param scan  called as scan(fd, path, TreeFolders *), which it fills; false ends the walk
 * @return false when @p scan ended the walk, or a folder was moved meanwhile
 */
template <typename Scan>
bool walk_tree(TreePlace place, std::string path, Scan scan) {
  std::vector<TreeFolders> pending(1);
  if (!place || !scan(place.fd(), path, &pending.back())) return false;
  while (true) {
    if (pending.back().empty()) {
      pending.pop_back();
      if (pending.empty()) return true;
      if (!place.up()) return false;
      path.resize(path.rfind('/'));
      continue;
    }
    const std::string name = std::move(pending.back().back());
    pending.back().pop_back();
    if (!place.down(name.c_str())) continue;
    path += "/" + name;
    pending.emplace_back();
    if (!scan(place.fd(), path, &pending.back())) return false;
  }
}

#endif
