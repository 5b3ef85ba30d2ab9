/**
 * @file store_folder.h
 * @brief The folders of a store that is one, reached without following links.
 *
 * Functions set errno. Any thread; an object is one thread's.
 */
#ifndef BACKUP_TRANSPORT_STORE_FOLDER_H
#define BACKUP_TRANSPORT_STORE_FOLDER_H

#include <dirent.h>
#include <fcntl.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "unique_fd.h"

namespace transport {

constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

struct DirCloser {
  void operator()(DIR *directory) const { closedir(directory); }
};
using Directory = std::unique_ptr<DIR, DirCloser>;

/** A directory stream of its own on the folder @p fd; null with errno. */
Directory open_directory(int fd);

/** The store's folder. @param create also when it is missing, with the folders that it lies in */
UniqueFd open_root(const std::string &root, bool create);

enum class EntryKind { object, folder };

/**
 * Call @p visit with what may be shown of a folder until it answers false.
 * @return whether the folder could be read
 */
[[nodiscard]] bool for_each_entry(
    int folder, const std::function<bool(const char *name, EntryKind kind)> &visit);

/** A folder is one only through the objects in it, as in a store that knows objects alone. */
[[nodiscard]] bool holds_object(int parent, const char *name);

/** Delete a file, or a folder with everything in it, as far as that goes. */
void remove_tree(int parent, const char *name);

/** The folders from the root to the one that holds an object. */
class FolderChain {
 public:
  explicit FolderChain(int root);

  /**
   * Go the first @p count of @p components down.
   * @param create make those that are missing
   * @return false with errno
   */
  [[nodiscard]] bool enter(const std::vector<std::string> &components, std::size_t count,
                           bool create);

  int innermost() const { return folders_.back().fd.get(); }

  /** Folders that hold nothing vanish, from the innermost outwards. */
  void prune();

  /** Bring what enter() made, and the innermost folder, onto the disk. */
  void sync();

 private:
  struct Folder {
    std::string name;
    UniqueFd fd;
  };
  std::vector<Folder> folders_;
  std::size_t first_new_ = 0;  // 0: none; the root is never new here
};

}  // namespace transport

#endif
