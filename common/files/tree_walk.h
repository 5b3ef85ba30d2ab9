/**
 * @file tree_walk.h
 * @brief The way through a directory tree, for whoever has something to do in each of its places.
 *
 * walk_tree() holds one descriptor however deep it is: it hands a whole folder to its visitor,
 * and goes then into those of its folders that the visitor names. walk_in_order() hands over one
 * entry after the other and goes into a folder where it meets it, so it holds a descriptor for each
 * directory on its way. Neither goes deeper than tree_depth.h has it, but for a visitor of
 * walk_tree() that says so.
 *
 * Visitors are called directly: a walk costs what the same loop written out would. Neither follows
 * a link or logs anything by itself; both are one thread's.
 */
#ifndef QUARN_TREE_WALK_H
#define QUARN_TREE_WALK_H

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "files/safe_path.h"
#include "files/tree_depth.h"
#include "quarn_handles.h"

/** What became of the step into a folder. */
enum class TreeStep {
  entered, /**< what it holds is next */
  passed,  /**< it was not entered, and the walk goes on beside it */
  ended    /**< and so is the walk */
};

/** What a visitor of walk_tree() does unless it says otherwise; it adds scan() at least. */
struct TreeVisitor {
  /** What it keeps of a folder that is to be entered; name_of() tells the name. */
  using Folder = std::string;
  /** Directories in one another down to the one where the walk begins: as a rule a package's own.
   */
  static constexpr int kTopDepth = 1;
  static const std::string &name_of(const std::string &folder) { return folder; }

  /** Go into a folder; the walk's path is the folder's already. */
  template <typename Place>
  TreeStep enter(Place *place, const std::string &name) {
    return place->down(name.c_str()) ? TreeStep::entered : TreeStep::passed;
  }
  /** In place of enter(), for a folder that is deeper than any that is backed up. */
  template <typename Place, typename Folder>
  TreeStep too_deep(Place * /*place*/, const Folder & /*folder*/) {
    return TreeStep::passed;
  }
  /** Everything below the walk's path has been visited, which is still where the walk is. */
  void finish() {}
  /** The walk is back in the folder that holds @p name, which is still the last of its path. */
  template <typename Place>
  void left(const Place & /*place*/, const char * /*name*/) {}
};

/**
 * Visit a directory and everything below it, each folder before what lies deeper, and those of one
 * folder from the last that was named to the first.
 * @param place   where it begins; up() leads back out of each folder that was entered
 * @param path    its path, and during each visit that of the directory visited
 * @param visitor a TreeVisitor with scan(place, &folders), which does its work in a directory and
 *                names the folders to be entered; false ends the walk
 * @return false when the visitor ended the walk, or no way led back because a folder was moved;
 *         @p path is then where that was
 */
template <typename Place, typename Visitor>
[[nodiscard]] bool walk_tree(Place *place, std::string *path, Visitor *visitor) {
  using Folder = typename Visitor::Folder;
  std::vector<std::vector<Folder>> pending(1);
  if (!visitor->scan(*place, &pending.back())) return false;
  while (true) {
    if (pending.back().empty()) {
      pending.pop_back();
      visitor->finish();
      if (pending.empty()) return true;
      if (!place->up()) return false;
      const std::size_t slash = path->rfind('/');
      visitor->left(*place, path->c_str() + slash + 1);
      path->resize(slash);
      continue;
    }
    const Folder folder = std::move(pending.back().back());
    pending.back().pop_back();
    const std::size_t length = path->size();
    path->append(1, '/').append(Visitor::name_of(folder));
    const bool deeper = is_too_deep(Visitor::kTopDepth + static_cast<int>(pending.size()));
    switch (deeper ? visitor->too_deep(place, folder) : visitor->enter(place, folder)) {
      case TreeStep::entered:
        pending.emplace_back();
        if (!visitor->scan(*place, &pending.back())) return false;
        break;
      case TreeStep::passed:
        path->resize(length);
        break;
      case TreeStep::ended:
        return false;
    }
  }
}

/** One name in a directory that is read; the name is valid until the next one is. */
struct WalkEntry {
  const char *name;
  unsigned char type; /**< as readdir() tells it: may be DT_UNKNOWN */
};

/** A directory's entries but "." and "..", in the order in which the file system tells them. */
class EntriesAsTheyCome {
 public:
  explicit EntriesAsTheyCome(DIR *dir) : dir_(dir) {}
  bool next(WalkEntry *entry) {
    while (const dirent *read = readdir(dir_)) {
      if (is_dot_entry(read->d_name)) continue;
      *entry = {read->d_name, read->d_type};
      return true;
    }
    return false;
  }

 private:
  DIR *dir_;
};

/** The same in the order of their names. */
class EntriesByName {
 public:
  explicit EntriesByName(DIR *dir) {
    EntriesAsTheyCome entries(dir);
    for (WalkEntry entry = {}; entries.next(&entry);) found_.emplace_back(entry.name, entry.type);
    std::sort(found_.begin(), found_.end());
  }
  bool next(WalkEntry *entry) {
    if (at_ == found_.size()) return false;
    *entry = {found_[at_].first.c_str(), found_[at_].second};
    ++at_;
    return true;
  }

 private:
  std::vector<std::pair<std::string, unsigned char>> found_;
  std::size_t at_ = 0;
};

/** What a visitor of walk_in_order() has found under one name. */
enum class EntryVisit {
  passed,  /**< nothing for this walk */
  counted, /**< the directory holds something for it */
  folder   /**< a directory, which is next */
};

template <typename Visitor>
bool walk_in_order(DIR *dir, std::string *path, Visitor *visitor, int depth = 1);

/** The directory @p name of @p parent; for walk_in_order() alone. */
template <typename Visitor>
bool walk_folder_in_order(int parent, const char *name, std::string *path, Visitor *visitor,
                          int depth) {
  struct stat status = {};
  const DirPtr dir = is_too_deep(depth) ? nullptr : visitor->open(parent, name, &status);
  if (dir == nullptr) {
    visitor->missed(*path, depth);
    return false;
  }
  const bool counted = walk_in_order(dir.get(), path, visitor, depth);
  return visitor->left(dirfd(dir.get()), status, *path, counted);
}

/**
 * Visit everything below a directory, each folder where its name comes.
 * @param path    its path, and during each visit that of the entry visited
 * @param visitor has Entries, which is one of the two classes above, and
 *   - ended(): nothing further is visited
 *   - visit(dir, entry, path): an EntryVisit; @c dir is the open directory that holds it
 *   - open(dir, name, &status): a folder, for reading; null where that is refused
 *   - missed(path, depth): a folder was not opened, or is too deep
 *   - left(fd, status, path, counted): a folder was walked, and whether anything in it counted;
 *     the answer is whether it counts itself
 * @param depth   directories in one another, @p dir itself counted
 * @return whether anything counted
 */
template <typename Visitor>
bool walk_in_order(DIR *dir, std::string *path, Visitor *visitor, int depth) {
  bool counted = false;
  typename Visitor::Entries entries(dir);
  for (WalkEntry entry = {}; entries.next(&entry) && !visitor->ended();) {
    const PathStep step(path, entry.name);
    switch (visitor->visit(dirfd(dir), entry, *path)) {
      case EntryVisit::passed:
        break;
      case EntryVisit::counted:
        counted = true;
        break;
      case EntryVisit::folder:
        if (walk_folder_in_order(dirfd(dir), entry.name, path, visitor, depth + 1)) counted = true;
        break;
    }
  }
  return counted;
}

#endif
