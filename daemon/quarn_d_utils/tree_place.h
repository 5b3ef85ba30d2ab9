/**
 * @file tree_place.h
 * @brief A walk that holds one descriptor, however deep it goes.
 */
#ifndef QUARN_D_UTILS_TREE_PLACE_H
#define QUARN_D_UTILS_TREE_PLACE_H

#include <sys/stat.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "quarn_d_utils/handles.h"

/** Whose rights a walk goes by. */
enum class TreeAccess {
  kDaemon, /**< its own folders, or those that are nobody's in particular */
  kPackage /**< the package's user first, see package_identity.h: an application's data */
};

/**
 * A directory that is open, and the way back to the one where the walk began.
 * No link is followed. Functions set errno and log nothing; one thread.
 */
class TreePlace {
 public:
  /** @param top the directory to begin in, open for reading; none makes a place that is nowhere */
  explicit TreePlace(UniqueFd top, TreeAccess access = TreeAccess::kDaemon);

  explicit operator bool() const { return static_cast<bool>(here_); }
  int fd() const { return here_.get(); }

  /** Go into the directory @p name. @return false, and nothing has changed, when it is none */
  [[nodiscard]] bool down(const char *name);
  /** Go back. @return false when the directory was moved meanwhile: the walk cannot go on then */
  [[nodiscard]] bool up();

 private:
  struct Identity {
    dev_t device;
    ino_t inode;
  };
  UniqueFd here_;
  const TreeAccess access_;
  Identity identity_ = {};
  std::vector<Identity> above_;
};

/** One name in a directory. */
struct TreeEntry {
  std::string name;
  unsigned char type; /**< as readdir() tells it: may be DT_UNKNOWN */
};

/** The entries of an open directory but "." and "..". @return false when it cannot be read */
[[nodiscard]] bool list_tree_entries(int dir, std::vector<TreeEntry> *entries);

/** What a removal does with what is neither file nor directory. */
enum class OtherTypes {
  kStay,   /**< refused, as everywhere in an application's data */
  kRemoved /**< in what is the daemon's own */
};

/** True where a walk's next step is the directory that was looked at. */
[[nodiscard]] inline bool is_same_object(const struct stat &a, const struct stat &b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

/**
 * Remove the directory @p name of @p parent with everything in it, without a
 * limit to its depth. @p path is its path, for messages.
 * @param looked_at when not null: only this very directory is removed
 * @return true when all of it is gone
 */
[[nodiscard]] bool delete_tree_at(int parent, const char *name, const std::string &path,
                                  OtherTypes others = OtherTypes::kStay,
                                  TreeAccess access = TreeAccess::kDaemon,
                                  const struct stat *looked_at = nullptr);

#endif
